#pragma once

// RequestMetrics: the page requests the analyzer has counted since the process started, per
// application and transaction, as /metrics exposes them: requests by outcome, a response-time
// histogram, the server, network and client time sums, status classes and the apdex counts at
// each series' threshold. Counters only grow, so Prometheus can take rates of them.
//
// The histogram's buckets are a fixed ladder (5 ms to 60 s) and every threshold T and 4T seen:
// apdex = (le=T + le=4T) / 2 / count holds for each series. A threshold first seen after a
// series has counted requests adds its bounds with the earlier requests above them.
//
// Cardinality: at most maxSeries series. A new transaction gets its own series while there is
// room; beyond, it counts under its application's transaction "_other", and a new application
// that finds no room under application "_other" as well. Room is kept so that every application
// with a series can have its "_other" series, and for the one "_other"/"_other" series.
//
// Thread safety: none of its own; the analyzer's tree lock guards it. Copy it under the lock
// and write the copy without.

#include <array>
#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "core/analyzer/analysis/latency_book.h"

namespace fw {
class PrometheusText;
}

class RequestMetrics {
 public:
  static constexpr char kOther[] = "_other";
  static constexpr size_t kDefaultMaxSeries = 2000;

  struct Request {
    int32_t thresholdMillis = 0;
    int64_t responseMillis = 0;
    int64_t serverMillis = 0;
    int64_t networkMillis = 0;
    int64_t clientMillis = 0;
    bool failed = false;  // a bad status
    int status = 0;       // HTTP status code
  };

  explicit RequestMetrics(size_t maxSeries = kDefaultMaxSeries);

  // A cached series for a key: kUnresolved until the first add finds it.
  static constexpr int32_t kUnresolved = -1;

  void add(std::string_view application, std::string_view transaction, const Request& request);
  // The same, with *series caching the key's series between calls (start at kUnresolved; the
  // cache stays valid for the life of this object).
  void add(std::string_view application, std::string_view transaction, const Request& request,
           int32_t* series);

  size_t series() const { return series_.size(); }
  size_t maxSeries() const { return maxSeries_; }
  // Requests counted under an "_other" series.
  uint64_t overflowRequests() const { return overflowRequests_; }
  // Histogram bounds in milliseconds, ascending.
  const std::vector<int32_t>& bounds() const { return bounds_; }

  // The q7_requests_total, q7_response_time_seconds, time sums, status and apdex families.
  void write(fw::PrometheusText& out) const;

  struct Series {
    std::string application;
    std::string transaction;
    uint64_t good = 0;
    uint64_t slow = 0;
    uint64_t failed = 0;
    std::vector<uint64_t> buckets;  // requests per bucket (not cumulative); last one +Inf
    uint64_t responseMillis = 0;
    uint64_t serverMillis = 0;
    uint64_t networkMillis = 0;
    uint64_t clientMillis = 0;
    std::array<uint64_t, 6> statusClasses{};  // 1xx..5xx, other
    uint64_t satisfied = 0;
    uint64_t tolerating = 0;
    int32_t thresholdMillis = 0;
    uint64_t requests() const { return good + slow + failed; }
  };
  const std::vector<Series>& all() const { return series_; }

 private:
  // The series a request of application and transaction counts under; *overflow when it is
  // an "_other" series standing in for it.
  Series& seriesFor(std::string_view application, std::string_view transaction, bool* overflow);
  Series& create(std::string_view application, std::string_view transaction, std::string key);
  void addBound(int32_t millis);

  size_t maxSeries_;
  std::vector<int32_t> bounds_;
  std::vector<Series> series_;
  // Series by application NUL transaction.
  std::unordered_map<std::string, size_t, LatencyBook::KeyHash, std::equal_to<>> index_;
  // Each application with a series of its own: the index of its "_other" series, or -1 while
  // it holds a slot for one.
  std::unordered_map<std::string, int32_t, LatencyBook::KeyHash, std::equal_to<>> others_;
  size_t reservedOthers_ = 0;  // applications holding a slot
  int32_t catchAll_ = -1;      // the "_other"/"_other" series, once made
  uint64_t overflowRequests_ = 0;
  int32_t lastThreshold_ = -1;  // bounds are in place for it
};
