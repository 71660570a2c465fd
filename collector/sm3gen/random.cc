#include "collector/sm3gen/random.h"

#include <cassert>
#include <cmath>
#include <limits>
#include <numbers>

namespace sm3gen {

uint64_t Mix64(uint64_t value) {
  value += 0x9e3779b97f4a7c15ULL;
  value = (value ^ (value >> 30)) * 0xbf58476d1ce4e5b9ULL;
  value = (value ^ (value >> 27)) * 0x94d049bb133111ebULL;
  return value ^ (value >> 31);
}

double Random::Uniform() {
  return static_cast<double>(Bits() >> 11) * 0x1.0p-53;
}

int64_t Random::UniformInt(int64_t low, int64_t high) {
  assert(low <= high && "UniformInt needs low <= high");
  const uint64_t span = static_cast<uint64_t>(high) - static_cast<uint64_t>(low) + 1;
  if (span == 0) {  // the full 64-bit range
    return static_cast<int64_t>(Bits());
  }
  // Rejection keeps every value equally likely where a plain modulo would favour small ones.
  const uint64_t limit =
      std::numeric_limits<uint64_t>::max() - std::numeric_limits<uint64_t>::max() % span;
  uint64_t bits = Bits();
  while (bits >= limit) {
    bits = Bits();
  }
  return static_cast<int64_t>(static_cast<uint64_t>(low) + bits % span);
}

bool Random::Chance(double p) {
  return Uniform() < p;
}

double Random::Exponential(double mean) {
  return -mean * std::log1p(-Uniform());
}

double Random::Normal() {
  const double u1 = 1.0 - Uniform();  // (0, 1]: log stays finite
  const double u2 = Uniform();
  return std::sqrt(-2.0 * std::log(u1)) * std::cos(2.0 * std::numbers::pi * u2);
}

double Random::LogNormal(double median, double sigma) {
  return median * std::exp(sigma * Normal());
}

size_t Random::PickWeighted(std::span<const double> weights) {
  assert(!weights.empty() && "PickWeighted needs weights");
  double total = 0;
  for (double w : weights) {
    total += w;
  }
  double point = Uniform() * total;
  for (size_t i = 0; i < weights.size(); ++i) {
    if (point < weights[i]) {
      return i;
    }
    point -= weights[i];
  }
  return weights.size() - 1;  // rounding left the point at the very end
}

}  // namespace sm3gen
