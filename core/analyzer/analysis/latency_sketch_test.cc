// The latency sketch: quantiles within 1 % of the exact ones whatever the distribution, merges
// that give what one sketch over every value gives, and an encoding that reads back exactly
// and refuses what it did not write.

#include "core/analyzer/analysis/latency_sketch.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cmath>
#include <random>
#include <string>
#include <vector>

namespace {

constexpr double kQuantiles[] = {0, 0.01, 0.25, 0.5, 0.9, 0.95, 0.99, 0.999, 1};

// The value at rank floor(q (n-1)) of the sorted values: what quantile() estimates.
double Exact(std::vector<double> values, double q) {
  std::sort(values.begin(), values.end());
  return values[static_cast<size_t>(q * static_cast<double>(values.size() - 1))];
}

LatencySketch SketchOf(const std::vector<double>& values) {
  LatencySketch sketch;
  for (const double v : values) {
    sketch.add(v);
  }
  return sketch;
}

void ExpectWithinOnePercent(const std::vector<double>& values, const char* name) {
  const LatencySketch sketch = SketchOf(values);
  ASSERT_EQ(values.size(), sketch.count()) << name;
  for (const double q : kQuantiles) {
    const double exact = Exact(values, q);
    EXPECT_NEAR(exact, sketch.quantile(q), exact * LatencySketch::kRelativeAccuracy + 1e-9)
        << name << " q=" << q;
  }
  EXPECT_EQ(*std::max_element(values.begin(), values.end()), sketch.max()) << name;
  EXPECT_EQ(*std::min_element(values.begin(), values.end()), sketch.min()) << name;
}

TEST(LatencySketchTest, QuantilesWithinOnePercent) {
  std::mt19937_64 rng(20261127);
  std::vector<double> uniform, lognormal, bimodal, heavyTail, integral;
  std::uniform_real_distribution<double> u(0, 5000);
  std::lognormal_distribution<double> ln(5, 1.2);
  std::normal_distribution<double> fast(40, 5), slow(3000, 300);
  std::uniform_real_distribution<double> unit(0, 1);
  for (int i = 0; i < 20000; ++i) {
    uniform.push_back(u(rng));
    lognormal.push_back(ln(rng));
    bimodal.push_back(std::max(0.0, i % 10 == 0 ? slow(rng) : fast(rng)));
    heavyTail.push_back(std::min(60000.0, 10 / std::pow(unit(rng) + 1e-9, 1.5)));  // Pareto
    integral.push_back(static_cast<double>(rng() % 2000));  // whole milliseconds, as recorded
  }
  ExpectWithinOnePercent(uniform, "uniform");
  ExpectWithinOnePercent(lognormal, "lognormal");
  ExpectWithinOnePercent(bimodal, "bimodal");
  ExpectWithinOnePercent(heavyTail, "heavy tail");
  ExpectWithinOnePercent(integral, "whole milliseconds");
  ExpectWithinOnePercent(std::vector<double>(1000, 250), "constant");
  ExpectWithinOnePercent(std::vector<double>(1000, 0), "all 0 ms");
  ExpectWithinOnePercent(std::vector<double>(1000, 60000), "all 60 s");
  ExpectWithinOnePercent({0, 0, 0, 60000}, "0 ms and 60 s");
  ExpectWithinOnePercent({7}, "one request");
}

// A sketch is small: buckets only where requests are.
TEST(LatencySketchTest, SparseAndBounded) {
  LatencySketch few;
  few.add(120, 500);
  few.add(130, 500);
  EXPECT_EQ(2u, few.buckets());
  LatencySketch wide;
  for (double v = 1; v <= 60000; v *= 1.001) {
    wide.add(v);
  }
  EXPECT_LT(wide.buckets(), 600u);  // 1 ms to 60 s at 1 %
  LatencySketch empty;
  EXPECT_EQ(0, empty.quantile(0.5));
  EXPECT_EQ(0u, empty.buckets());
}

// Merging in any grouping and order gives the sketch of all the values: per interval, per
// agent, then the day or the fleet.
TEST(LatencySketchTest, MergesAsOneSketch) {
  std::mt19937_64 rng(5);
  std::lognormal_distribution<double> ln(4, 1.5);
  std::vector<double> all;
  std::vector<LatencySketch> parts(6);
  for (int i = 0; i < 6000; ++i) {
    const double v = i % 97 == 0 ? 0 : ln(rng);
    all.push_back(v);
    parts[rng() % parts.size()].add(v);
  }
  const LatencySketch one = SketchOf(all);
  LatencySketch leftToRight;
  for (const LatencySketch& part : parts) {
    leftToRight.merge(part);
  }
  LatencySketch pairs = parts[4];
  pairs.merge(parts[5]);
  LatencySketch rest = parts[2];
  rest.merge(parts[3]);
  rest.merge(pairs);
  LatencySketch grouped = parts[1];
  grouped.merge(parts[0]);
  grouped.merge(rest);
  EXPECT_EQ(one, leftToRight);
  EXPECT_EQ(one, grouped);
  LatencySketch withEmpty = one;
  withEmpty.merge(LatencySketch());
  EXPECT_EQ(one, withEmpty);
  LatencySketch intoEmpty;
  intoEmpty.merge(one);
  EXPECT_EQ(one, intoEmpty);
}

TEST(LatencySketchTest, EncodesAndRefusesWhatItDidNotWrite) {
  LatencySketch sketch;
  for (const double v : {0.0, 3.0, 3.0, 250.0, 60000.0}) {
    sketch.add(v);
  }
  const std::string bytes = sketch.encode();
  LatencySketch back;
  ASSERT_TRUE(LatencySketch::decode(bytes, &back));
  EXPECT_EQ(sketch, back);
  ASSERT_TRUE(LatencySketch::decode(LatencySketch().encode(), &back));
  EXPECT_TRUE(back.empty());

  back = sketch;
  for (size_t cut = 0; cut < bytes.size(); ++cut) {
    EXPECT_FALSE(LatencySketch::decode(bytes.substr(0, cut), &back)) << cut;
  }
  EXPECT_FALSE(LatencySketch::decode(bytes + "x", &back));
  std::string wrongCount = bytes;
  wrongCount[5] ^= 1;  // the count no longer adds up
  EXPECT_FALSE(LatencySketch::decode(wrongCount, &back));
  EXPECT_EQ(sketch, back);  // untouched by what failed
}

}  // namespace
