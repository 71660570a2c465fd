#pragma once

// The hook through which a row table gets its rows: the agent process registers, per row type,
// a query that the table's agent object calls on every sample.
//
//   q7tema::SetRowQuery<kq7_q7txsm_data_t>([](int sample_type, int* count) { ... });
//
// The query answers an array allocated with new Row[*count], or null with *count 0; the caller
// releases it with delete[]. It may be called from any framework thread, several at once.
//
// Thread safety: SetRowQuery and RowQueryFor may be called from any thread. A query being
// replaced may still be running on another thread until that call returns.

#include <functional>
#include <utility>

#include "framework/mutex.h"

namespace q7tema {

template <typename Row>
using RowQuery = std::function<Row*(int sample_type, int* count)>;

namespace internal {

template <typename Row>
struct RowQuerySlot {
  fw::Mutex mutex;
  RowQuery<Row> query GUARDED_BY(mutex);
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
void SetRowQuery(RowQuery<Row> query) {
  internal::RowQuerySlot<Row>& slot = internal::SlotFor<Row>();
  fw::MutexLock lock(slot.mutex);
  slot.query = std::move(query);
}

// A copy of the registered query (empty when none), so callers run it without the lock.
template <typename Row>
RowQuery<Row> RowQueryFor() {
  internal::RowQuerySlot<Row>& slot = internal::SlotFor<Row>();
  fw::MutexLock lock(slot.mutex);
  return slot.query;
}

}  // namespace q7tema
