#pragma once

// Random: the generator's only source of randomness. The raw bits come from std::mt19937_64,
// whose sequence the C++ standard fixes; every distribution is written here rather than taken
// from <random>, whose distributions differ between standard libraries. So a seed gives the
// same data on every platform with the same floating-point behaviour.
//
// Thread safety: none; each user owns its instance.

#include <cstdint>
#include <random>
#include <span>
#include <string_view>

namespace sm3gen {

// A 64-bit mix of value (the splitmix64 finaliser). It is a bijection, so distinct inputs give
// distinct outputs; used to derive independent seeds and unique identifiers.
uint64_t Mix64(uint64_t value);

class Random {
 public:
  explicit Random(uint64_t seed) : engine_(seed) {}

  // 64 raw bits.
  uint64_t Bits() { return engine_(); }
  // Uniform in [0, 1), 53 bits of precision.
  double Uniform();
  // Uniform integer in [low, high]; requires low <= high.
  int64_t UniformInt(int64_t low, int64_t high);
  // True with probability p (p <= 0 never, p >= 1 always).
  bool Chance(double p);
  // Exponentially distributed with the given mean.
  double Exponential(double mean);
  // Standard normal (Box-Muller, one value per call).
  double Normal();
  // Log-normal with the given median and shape (sigma of the underlying normal).
  double LogNormal(double median, double sigma);
  // An index into weights chosen with probability proportional to its weight; requires a
  // non-empty list with a positive sum.
  size_t PickWeighted(std::span<const double> weights);
  // One element of a non-empty list, uniformly.
  template <typename T>
  const T& Pick(std::span<const T> items) {
    return items[static_cast<size_t>(UniformInt(0, static_cast<int64_t>(items.size()) - 1))];
  }

 private:
  std::mt19937_64 engine_;
};

}  // namespace sm3gen
