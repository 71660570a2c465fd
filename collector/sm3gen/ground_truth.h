#pragma once

// GroundTruth: what an agent reading the generated data must find, accumulated record by
// record: counts per kind, and per application and transaction name the count, response-time
// sum, minimum and maximum and the status buckets, separately for pages and for objects. Only
// records written completely are added; junk blocks and a cut-off last record are noted but
// never counted as records.
//
// Thread safety: none.

#include <cstdint>
#include <map>
#include <nlohmann/json.hpp>
#include <string>

#include "collector/sm3gen/record.h"

namespace sm3gen {

// The agent's application name: the URL host field cut to 127 characters, or, when it is
// empty (always for audio and video, whose layout has no host), the server address cut to 127.
std::string ApplicationName(const Record& record);

// The agent's transaction name: the URL as its 254-character field holds it, cut to 127.
std::string TransactionName(const Record& record);

// Response-time statistics and status buckets over a set of records.
struct Tally {
  int64_t count = 0;
  int64_t rt_sum = 0;  // ms
  int32_t rt_min = 0;  // ms, 0 while count is 0
  int32_t rt_max = 0;  // ms
  // Buckets by hundreds (codes outside 100-599 fall in none), three codes of their own, and
  // "bad": every status from 401 up.
  int64_t status_1xx = 0, status_2xx = 0, status_3xx = 0, status_4xx = 0, status_5xx = 0;
  int64_t status_403 = 0, status_404 = 0, status_500 = 0, status_bad = 0;

  void Add(int32_t response_ms, int32_t status);
  nlohmann::json ToJson() const;
};

struct UrlTruth {
  Tally pages;
  Tally objects;  // kinds 2, 3 and 4
};

struct ApplicationTruth {
  Tally pages;
  Tally objects;
  std::map<std::string, UrlTruth> urls;  // by transaction name
};

class GroundTruth {
 public:
  explicit GroundTruth(uint64_t seed) : seed_(seed) {}

  // A record written completely.
  void AddRecord(const Record& record);
  // A junk block written before a record.
  void AddJunkBlock() { ++junk_blocks_; }
  // Bytes written, whatever they held.
  void AddBytes(uint64_t count) { bytes_ += count; }
  // A cut-off record ends the output.
  void SetTruncatedTail() { truncated_tail_ = true; }

  int64_t records() const { return records_; }
  const std::map<std::string, ApplicationTruth>& applications() const { return applications_; }

  // The truth as a JSON document; first_time and last_time are 0 when there are no records.
  nlohmann::json ToJson() const;

 private:
  uint64_t seed_;
  int64_t records_ = 0;
  uint64_t bytes_ = 0;
  int64_t first_time_ = 0;
  int64_t last_time_ = 0;
  int64_t by_kind_[4] = {0, 0, 0, 0};  // indexed by kind - 1
  int64_t junk_blocks_ = 0;
  bool truncated_tail_ = false;
  std::map<std::string, ApplicationTruth> applications_;
};

}  // namespace sm3gen
