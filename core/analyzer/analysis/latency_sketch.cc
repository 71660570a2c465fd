#include "core/analyzer/analysis/latency_sketch.h"

#include <algorithm>
#include <cmath>
#include <cstring>
#include <vector>

#include "core/analyzer/analysis/byte_codec.h"

namespace {

using bytecodec::Put;
using bytecodec::Take;

constexpr double kGamma =
    (1 + LatencySketch::kRelativeAccuracy) / (1 - LatencySketch::kRelativeAccuracy);
const double kLogGamma = std::log(kGamma);
// Below a microsecond a request counts as taking no time.
constexpr double kSmallest = 1e-3;
// Buckets past an hour's worth answer as an hour would: a bucket index must stay small.
constexpr double kLargest = 3.6e6;

constexpr char kMagic[] = {'q', '7', 's', 'k', 1};

}  // namespace

namespace {

int32_t ComputeIndex(double millis) {
  return static_cast<int32_t>(std::ceil(std::log(std::min(millis, kLargest)) / kLogGamma));
}

// Response times arrive in whole milliseconds: their indexes come from a table (128 KiB) instead
// of a logarithm per request, computed by the same function so both ways agree exactly.
constexpr int kTabled = 1 << 16;

const std::vector<int16_t>& IndexTable() {
  static const std::vector<int16_t> table = [] {
    std::vector<int16_t> t(kTabled);
    for (int ms = 1; ms < kTabled; ++ms) {
      t[ms] = static_cast<int16_t>(ComputeIndex(ms));
    }
    return t;
  }();
  return table;
}

}  // namespace

int32_t LatencySketch::indexOf(double millis) {
  if (millis >= 1 && millis < kTabled) {
    const auto whole = static_cast<int>(millis);
    if (whole == millis) {
      return IndexTable()[whole];
    }
  }
  return ComputeIndex(millis);
}

double LatencySketch::valueOf(int32_t index) {
  return 2 * std::pow(kGamma, index) / (kGamma + 1);
}

void LatencySketch::add(double millis, uint64_t count) {
  if (count == 0 || std::isnan(millis)) {
    return;
  }
  millis = std::max(millis, 0.0);
  min_ = count_ == 0 ? millis : std::min(min_, millis);
  max_ = count_ == 0 ? millis : std::max(max_, millis);
  count_ += count;
  if (millis < kSmallest) {
    zeros_ += count;
    return;
  }
  const int32_t index = indexOf(millis);
  const auto at = std::lower_bound(
      buckets_.begin(), buckets_.end(), index,
      [](const std::pair<int32_t, uint64_t>& bucket, int32_t i) { return bucket.first < i; });
  if (at != buckets_.end() && at->first == index) {
    at->second += count;
  } else {
    buckets_.insert(at, {index, count});
  }
}

void LatencySketch::merge(const LatencySketch& other) {
  if (other.count_ == 0) {
    return;
  }
  min_ = count_ == 0 ? other.min_ : std::min(min_, other.min_);
  max_ = count_ == 0 ? other.max_ : std::max(max_, other.max_);
  count_ += other.count_;
  zeros_ += other.zeros_;
  std::vector<std::pair<int32_t, uint64_t>> merged;
  merged.reserve(buckets_.size() + other.buckets_.size());
  auto a = buckets_.begin();
  auto b = other.buckets_.begin();
  while (a != buckets_.end() || b != other.buckets_.end()) {
    if (b == other.buckets_.end() || (a != buckets_.end() && a->first < b->first)) {
      merged.push_back(*a++);
    } else if (a == buckets_.end() || b->first < a->first) {
      merged.push_back(*b++);
    } else {
      merged.emplace_back(a->first, a->second + b->second);
      ++a;
      ++b;
    }
  }
  buckets_ = std::move(merged);
}

double LatencySketch::quantile(double q) const {
  if (count_ == 0) {
    return 0;
  }
  if (q >= 1) {
    return max_;
  }
  if (q <= 0) {
    return min_;
  }
  const uint64_t rank = static_cast<uint64_t>(q * static_cast<double>(count_ - 1));
  if (rank < zeros_) {
    return 0;
  }
  uint64_t seen = zeros_;
  for (const auto& [index, requests] : buckets_) {
    seen += requests;
    if (rank < seen) {
      // Never past the largest value seen: the top bucket's answer may be.
      return std::clamp(valueOf(index), min_, max_);
    }
  }
  return max_;
}

std::string LatencySketch::encode() const {
  std::string out(kMagic, sizeof(kMagic));
  Put(&out, count_);
  Put(&out, zeros_);
  Put(&out, min_);
  Put(&out, max_);
  Put(&out, static_cast<uint32_t>(buckets_.size()));
  for (const auto& [index, requests] : buckets_) {
    Put(&out, index);
    Put(&out, requests);
  }
  return out;
}

bool LatencySketch::decode(std::string_view bytes, LatencySketch* sketch) {
  if (bytes.substr(0, sizeof(kMagic)) != std::string_view(kMagic, sizeof(kMagic))) {
    return false;
  }
  bytes.remove_prefix(sizeof(kMagic));
  LatencySketch read;
  uint32_t n = 0;
  if (!Take(&bytes, &read.count_) || !Take(&bytes, &read.zeros_) || !Take(&bytes, &read.min_) ||
      !Take(&bytes, &read.max_) || !Take(&bytes, &n) ||
      bytes.size() != n * (sizeof(int32_t) + sizeof(uint64_t))) {
    return false;
  }
  uint64_t total = read.zeros_;
  read.buckets_.reserve(n);
  for (uint32_t i = 0; i < n; ++i) {
    int32_t index = 0;
    uint64_t requests = 0;
    Take(&bytes, &index);
    Take(&bytes, &requests);
    // In order, none empty, and adding up: anything else is not a sketch this wrote.
    if (requests == 0 || (!read.buckets_.empty() && index <= read.buckets_.back().first) ||
        total + requests < total) {
      return false;
    }
    total += requests;
    read.buckets_.emplace_back(index, requests);
  }
  if (total != read.count_ || !(read.min_ <= read.max_) || read.min_ < 0) {
    return false;
  }
  *sketch = std::move(read);
  return true;
}
