#pragma once

// A summary query folds over-time rows by the summary's key: the current interval's rows first,
// then the summary period's history, newest interval first. A key's first row gives the summary
// row its identity and the rest are added to it in that order.
//
// The history part changes only when its files do (a rollover, a cached past interval saved
// back, a cleanup), yet it is most of the rows. So it is folded once (HistoryFold) and each
// query merges the current interval's rows into that fold. The merge gives what folding every
// row in order gives, because of how a summary row adds a row: sums add, the maximum is a
// maximum, and under the minimum rule (the incoming minrtt wins unless the running one is
// non-zero and not above it) a running minimum r comes out of history rows y1..yn as r when
// r != 0 and r <= min(y), and otherwise as the history rows' own fold of them.
//
// Thread safety: a HistoryFold is not changed once built, so threads may share it;
// SummaryFoldCache locks itself.

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <memory>
#include <string>
#include <string_view>
#include <type_traits>
#include <utility>
#include <vector>

#include "core/analyzer/analysis/latency_book.h"
#include "core/analyzer/rows/base_table.h"
#include "core/analyzer/rows/rows.h"
#include "framework/mutex.h"

// Rows' keys in SummaryRow's order (TKeyedRow::appendSortKey), back to back.
template <class SummaryRow>
class SummaryKeys {
 public:
  SummaryKeys() = default;
  // The keys of count rows: layout rows, or pointers to rows of the summary's over-time class.
  template <class Source>
  SummaryKeys(const Source* rows, std::size_t count) {
    ends_.reserve(count);
    for (std::size_t i = 0; i < count; ++i) {
      if constexpr (std::is_pointer_v<Source>) {
        SummaryRow::appendSortKey(*rows[i], &bytes_);
      } else {
        SummaryRow::appendSortKey(rows[i], &bytes_);
      }
      ends_.push_back(bytes_.size());
      if (i == 0) {
        bytes_.reserve(bytes_.size() * count * 2);  // keys are alike in length
      }
    }
  }

  void add(std::string_view key) {
    bytes_.append(key);
    ends_.push_back(bytes_.size());
  }
  std::size_t size() const { return ends_.size(); }
  std::string_view operator[](std::size_t i) const {
    const std::size_t begin = i == 0 ? 0 : ends_[i - 1];
    return std::string_view(bytes_).substr(begin, ends_[i] - begin);
  }

  // Indexes by key; those of one key keep their order, which decides the key's identity.
  std::vector<std::uint32_t> order() const {
    std::vector<std::pair<std::string_view, std::uint32_t>> items(ends_.size());
    for (std::uint32_t i = 0; i < items.size(); ++i) {
      items[i] = {(*this)[i], i};
    }
    std::stable_sort(items.begin(), items.end(),
                     [](const auto& a, const auto& b) { return a.first < b.first; });
    std::vector<std::uint32_t> order(items.size());
    for (std::size_t i = 0; i < items.size(); ++i) {
      order[i] = items[i].second;
    }
    return order;
  }

 private:
  std::string bytes_;
  std::vector<std::size_t> ends_;
};

template <class SummaryRow>
class HistoryFold {
 public:
  using Layout = typename SummaryRow::LayoutType;
  using OverTimeLayout = typename SummaryRow::OverTimeLayoutType;
  using Keys = SummaryKeys<SummaryRow>;

  // Folds count history rows, in the order the query reads them.
  HistoryFold(const OverTimeLayout* rows, std::size_t count) {
    const Keys keys(rows, count);
    const std::vector<std::uint32_t> order = keys.order();
    entries_.reserve(count);
    for (std::size_t next = 0; next < count;) {
      const std::uint32_t first = order[next];
      SummaryRow row(rows[first]);
      std::int32_t lowest = rows[first].minrtt;
      for (++next; next < count && keys[order[next]] == keys[first]; ++next) {
        row.Update(rows[order[next]]);
        lowest = std::min(lowest, rows[order[next]].minrtt);
      }
      Entry& entry = entries_.emplace_back();
      row.getQ7Struct(entry.row);
      entry.common = row.getCommon();
      entry.dpx = row.getDPXData();
      entry.lowestMinimum = lowest;
      keys_.add(keys[first]);
    }
    entries_.shrink_to_fit();
  }

  // Summary rows of the history alone.
  std::size_t size() const { return entries_.size(); }

  // The first (at most) limit rows of the fold of the current interval's rows followed by this
  // history, into out, which has room for them (at most current rows + size()). current holds
  // the rows in the query's order, keys their keys and order their indexes by key. Returns how
  // many rows were written; sampletime is left blank.
  std::size_t merge(const OverTimeLayout* current, const Keys& keys,
                    const std::vector<std::uint32_t>& order, std::size_t limit, Layout* out) const {
    const std::size_t count = order.size();
    std::size_t written = 0;
    std::size_t h = 0;
    std::size_t c = 0;
    while (written < limit && (h < entries_.size() || c < count)) {
      const int side = h == entries_.size() ? -1
                       : c == count         ? 1
                                            : keys[order[c]].compare(keys_[h]);
      if (side > 0) {
        std::memcpy(&out[written++], &entries_[h++].row, sizeof(Layout));
        continue;
      }
      const std::uint32_t first = order[c];
      SummaryRow row(current[first]);
      for (++c; c < count && keys[order[c]] == keys[first]; ++c) {
        row.Update(current[order[c]]);
      }
      if (side == 0) {
        AddHistory(entries_[h++], &row);
      }
      row.getQ7Struct(out[written++]);
    }
    return written;
  }

 private:
  struct Entry {
    Layout row;            // as the query answers it
    common_data_t common;  // its sums, for merging current rows in
    dpx_data_t dpx;
    std::int32_t lowestMinimum;  // the lowest minrtt of the rows folded
  };

  // What adding the history's rows one by one to *row would do (see the file comment).
  static void AddHistory(const Entry& history, SummaryRow* row) {
    common_data_t& sums = row->getCommon();
    const common_data_t& h = history.common;
    const std::int32_t running = sums.minrtt;
    reaggregateCommonData(sums, h.totreq, h.failreq, h.slowreq, h.succreq, 0, h.oatime,
                          h.clienttime, h.servtime, h.netwtime, h.minrtt, h.mmaxrtt, 0);
    sums.minrtt = running != 0 && running <= history.lowestMinimum ? running : h.minrtt;
    reaggregateDPXData(row->getDPXData(), history.dpx);
  }

  std::vector<Entry> entries_;
  Keys keys_;  // of entries_
};

// What was last derived from the summary period's history (a summary's fold, the latency
// books merged), with what it was derived from: the window and the history store's generation
// (history::HistoryStore::generation) when its files were read.
template <class Value>
class HistoryCache {
 public:
  struct Key {
    long from = 0;  // newest interval of the window
    long length = 0;
    int intervals = 0;
    std::uint64_t generation = 0;
    bool operator==(const Key&) const = default;
  };

  // The value of exactly key's history, or null.
  std::shared_ptr<const Value> find(const Key& key) {
    fw::MutexLock lock(mutex_);
    return value_ != nullptr && key_ == key ? value_ : nullptr;
  }
  // Keeps value as key's, unless a value of later history is kept already (two queries may
  // derive at once).
  void store(const Key& key, std::shared_ptr<const Value> value) {
    fw::MutexLock lock(mutex_);
    if (value_ == nullptr || key_.generation <= key.generation) {
      key_ = key;
      value_ = std::move(value);
    }
  }
  // Lets go of the value (its memory), as at a rollover, which makes it stale anyway.
  void clear() {
    fw::MutexLock lock(mutex_);
    value_.reset();
  }

 private:
  fw::Mutex mutex_;
  Key key_ GUARDED_BY(mutex_);
  std::shared_ptr<const Value> value_ GUARDED_BY(mutex_);
};

template <class SummaryRow>
using SummaryFoldCache = HistoryCache<HistoryFold<SummaryRow>>;

// The analyzer's cache of each summary's history fold.
struct SummaryFolds {
#define Q7_SUMMARY_FOLD(name, Row, keys, overTime) SummaryFoldCache<Row> name;
  Q7_ANALYZER_TABLES(Q7_NO_OVER_TIME, Q7_SUMMARY_FOLD, Q7_NO_CURRENT, Q7_NO_INSTANCE)
#undef Q7_SUMMARY_FOLD
  // The latency books of the summary period's saved intervals, merged.
  HistoryCache<LatencyBook> latency;

  void clear() {
    latency.clear();
#define Q7_CLEAR_SUMMARY_FOLD(name, Row, keys, overTime) name.clear();
    Q7_ANALYZER_TABLES(Q7_NO_OVER_TIME, Q7_CLEAR_SUMMARY_FOLD, Q7_NO_CURRENT, Q7_NO_INSTANCE)
#undef Q7_CLEAR_SUMMARY_FOLD
  }
};
