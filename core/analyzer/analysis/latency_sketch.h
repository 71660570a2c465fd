#pragma once

// LatencySketch: response times (milliseconds) as a sparse histogram of logarithmic buckets,
// from which any quantile comes within 1 % of the true value, and which merges exactly: the
// sketch of two sets of requests is the sum of their sketches, whatever the order. That is
// what lets a day's percentiles come from one sketch per interval, and a fleet's from its
// agents'.
//
// Bucket i holds the values in (gamma^(i-1), gamma^i] with gamma = (1 + a) / (1 - a), a = 0.01,
// and answers for them 2 gamma^i / (gamma + 1), which is within a of each. Zero (and anything
// below a microsecond) has a bucket of its own and answers 0. Only buckets that hold requests
// are kept, so a key with a handful of requests costs a handful of entries: 60 s at 1 % needs
// at most about 900 buckets, a usual page far fewer.
//
// Thread safety: none; the analyzer's tree lock guards the sketches beside its rows.

#include <cstdint>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

class LatencySketch {
 public:
  static constexpr double kRelativeAccuracy = 0.01;

  // Adds count requests that took millis (negative counts as 0).
  void add(double millis, uint64_t count = 1);
  // Adds every request of other.
  void merge(const LatencySketch& other);

  uint64_t count() const { return count_; }
  bool empty() const { return count_ == 0; }
  // Exact, as added; 0 when empty.
  double max() const { return max_; }
  double min() const { return min_; }
  // The value at rank q (0..1) of the requests in order, lowest rank 0 and highest count-1,
  // within 1 % (max() for q = 1); 0 when empty.
  double quantile(double q) const;

  // Buckets held: the sketch's size.
  size_t buckets() const { return buckets_.size() + (zeros_ > 0 ? 1 : 0); }

  // A byte string that decode() reads back (host byte order: files never leave the host).
  std::string encode() const;
  // False, with *sketch untouched, when bytes are not an encoded sketch.
  static bool decode(std::string_view bytes, LatencySketch* sketch);

  bool operator==(const LatencySketch& other) const = default;

 private:
  static int32_t indexOf(double millis);
  static double valueOf(int32_t index);

  uint64_t count_ = 0;
  uint64_t zeros_ = 0;  // requests under the smallest bucket
  double min_ = 0;
  double max_ = 0;
  std::vector<std::pair<int32_t, uint64_t>> buckets_;  // (index, requests), by index
};
