#pragma once

// LatencyBook: the response-time sketches of one interval (or of a window of intervals), one per
// application and transaction, with the apdex counts at each one's threshold. It sits beside the
// interval's over-time trees, is updated by the same page transactions as the application and
// transaction rows, and is saved, loaded and checkpointed with them as one more history stem.
// Merging the books of a day's intervals gives the day's percentiles to the sketch's accuracy.
// An application's figures are its transactions' merged when asked for: one lookup per request.
//
// A transaction's threshold T is the one of its first request, as its rows keep theirs; an
// application's is the one of its first transaction. Apdex counts requests by response time
// alone, as the histogram in /metrics does: satisfied at most T, tolerating at most 4T, each
// transaction at its own T.
//
// Thread safety: none of its own; the analyzer's tree lock guards the book of its trees.

#include <cstdint>
#include <functional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "core/analyzer/analysis/latency_sketch.h"

namespace history {
class HistoryStore;
struct LoadedSection;
struct RecordSection;
}  // namespace history

struct LatencyEntry {
  LatencySketch sketch;
  uint64_t satisfied = 0;   // at most the threshold
  uint64_t tolerating = 0;  // over the threshold, at most four times it
  int32_t thresholdMillis = 0;
  // Not part of the figures: the request-metrics series this key counts under, found once per
  // interval instead of once per request (RequestMetrics::kUnresolved until then).
  mutable int32_t metricsSeries = -1;

  void add(double millis);
  // Adds other's requests; the threshold becomes other's when other has requests, so that
  // merging intervals oldest first ends with the latest threshold.
  void merge(const LatencyEntry& other);
  // (satisfied + tolerating / 2) / requests; 1 with no requests.
  double apdex() const;
  bool operator==(const LatencyEntry& other) const {
    return sketch == other.sketch && satisfied == other.satisfied &&
           tolerating == other.tolerating && thresholdMillis == other.thresholdMillis;
  }
};

class LatencyBook {
 public:
  // The history stem of the books' files and checkpoint sections.
  static constexpr char kStem[] = "q7latency";

  // Keyed by name; a transaction's key is its application, a NUL and its transaction.
  struct KeyHash {
    using is_transparent = void;
    size_t operator()(std::string_view key) const { return std::hash<std::string_view>{}(key); }
  };
  using Entries = std::unordered_map<std::string, LatencyEntry, KeyHash, std::equal_to<>>;

  // One page request of application and transaction that took millis, under threshold; the
  // transaction's entry.
  const LatencyEntry& add(std::string_view application, std::string_view transaction,
                          int32_t thresholdMillis, double millis);
  void merge(const LatencyBook& other);
  void clear();
  bool empty() const { return transactions_.empty(); }

  // By application: its transactions merged, under its threshold.
  Entries applications() const;
  const Entries& transactions() const { return transactions_; }
  static std::string transactionKey(std::string_view application, std::string_view transaction);
  // Splits a transactions() key into its application and transaction.
  static std::pair<std::string_view, std::string_view> splitKey(std::string_view key);

  // A byte string decode() reads back (host byte order: files never leave the host).
  std::string encode() const;
  // False, with *book untouched, when bytes are not an encoded book.
  static bool decode(std::string_view bytes, LatencyBook* book);

  // Writes the book as interval's file of kStem (none when empty). False when it could not be
  // written (traced by the store).
  bool save(history::HistoryStore& store, long interval) const;
  // Merges interval's saved book into this one. A file that does not decode is traced and
  // adds nothing.
  void load(const history::HistoryStore& store, long interval);
  // The book as a checkpoint section (a copy: the section does not follow later changes).
  history::RecordSection section() const;
  // Merges a section saved by section(); false when it does not decode.
  bool loadSection(const history::LoadedSection& section);

  bool operator==(const LatencyBook& other) const = default;

 private:
  // Each application's threshold: its first transaction's, or the latest merged in.
  std::unordered_map<std::string, int32_t, KeyHash, std::equal_to<>> thresholds_;
  Entries transactions_;
};
