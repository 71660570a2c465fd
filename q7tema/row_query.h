#pragma once

// The hook through which a row table gets its rows: the agent process registers, per row type,
// a query that the table's agent object calls on every sample.
//
//   q7tema::SetRowQuery<kq7_q7txsm_data_t>([](int sample_type, int* count) { ... });
//
// The query answers an array allocated with new Row[*count], or null with *count 0; the caller
// releases it with delete[]. It may be called from any framework thread, several at once.
//
// A query registered with SetLimitedRowQuery is also told how many rows are wanted: it may
// answer only the first limit rows of its full answer (fw::kNoRowLimit: all of them).
//
// Thread safety: the setters and getters may be called from any thread. A query being
// replaced may still be running on another thread until that call returns.

#include <cstddef>
#include <functional>
#include <utility>

#include "framework/mutex.h"
#include "framework/request.h"

namespace q7tema {

template <typename Row>
using RowQuery = std::function<Row*(int sample_type, int* count)>;
template <typename Row>
using LimitedRowQuery = std::function<Row*(int sample_type, std::size_t limit, int* count)>;

namespace internal {

template <typename Row>
struct RowQuerySlot {
  fw::Mutex mutex;
  LimitedRowQuery<Row> query GUARDED_BY(mutex);  // a plain query ignores the limit
};

// A function-local static, so a query may be set during static initialisation too.
template <typename Row>
RowQuerySlot<Row>& SlotFor() {
  static RowQuerySlot<Row> slot;
  return slot;
}

}  // namespace internal

// Registers the query for Row's table, replacing any earlier one; an empty query unregisters.
template <typename Row>
void SetLimitedRowQuery(LimitedRowQuery<Row> query) {
  internal::RowQuerySlot<Row>& slot = internal::SlotFor<Row>();
  fw::MutexLock lock(slot.mutex);
  slot.query = std::move(query);
}
template <typename Row>
void SetRowQuery(RowQuery<Row> query) {
  LimitedRowQuery<Row> limited;
  if (query) {
    limited = [query = std::move(query)](int sample_type, std::size_t, int* count) {
      return query(sample_type, count);
    };
  }
  SetLimitedRowQuery<Row>(std::move(limited));
}

// A copy of the registered query (empty when none), so callers run it without the lock: as it
// was registered, or asking for every row.
template <typename Row>
LimitedRowQuery<Row> LimitedRowQueryFor() {
  internal::RowQuerySlot<Row>& slot = internal::SlotFor<Row>();
  fw::MutexLock lock(slot.mutex);
  return slot.query;
}
template <typename Row>
RowQuery<Row> RowQueryFor() {
  LimitedRowQuery<Row> limited = LimitedRowQueryFor<Row>();
  if (!limited) {
    return {};
  }
  return [limited = std::move(limited)](int sample_type, int* count) {
    return limited(sample_type, fw::kNoRowLimit, count);
  };
}

}  // namespace q7tema
