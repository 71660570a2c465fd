// Request metrics: outcomes and buckets as the rows classify them, thresholds that become bucket
// bounds without disturbing what was counted, and a series cap that always holds while keeping
// applications apart where it can.

#include "core/analyzer/analysis/request_metrics.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <limits>
#include <set>
#include <string>

#include "framework/prometheus_text.h"

namespace {

RequestMetrics::Request Page(int32_t threshold, int64_t millis, int status = 200) {
  return {threshold, millis, millis / 2, 3, millis - millis / 2, status >= 401, status};
}

const RequestMetrics::Series& Find(const RequestMetrics& m, const std::string& app,
                                   const std::string& tx) {
  const auto& all = m.all();
  const auto found = std::find_if(all.begin(), all.end(), [&](const auto& s) {
    return s.application == app && s.transaction == tx;
  });
  EXPECT_NE(found, all.end()) << app << "/" << tx;
  return *found;
}

// The cumulative count at bound millis.
uint64_t AtOrBelow(const RequestMetrics& m, const RequestMetrics::Series& s, int32_t millis) {
  uint64_t n = 0;
  for (size_t i = 0; i < m.bounds().size() && m.bounds()[i] <= millis; ++i) {
    n += s.buckets[i];
  }
  return n;
}

TEST(RequestMetricsTest, CountsOutcomesBucketsAndApdex) {
  RequestMetrics m;
  m.add("Shop", "/", Page(300, 300));      // good: at the threshold
  m.add("Shop", "/", Page(300, 301));      // slow
  m.add("Shop", "/", Page(300, 1200));     // tolerating's edge
  m.add("Shop", "/", Page(300, 10, 500));  // failed however fast
  m.add("Shop", "/", Page(300, 90000));    // past the ladder
  const auto& s = Find(m, "Shop", "/");
  EXPECT_EQ(1u, s.good);
  EXPECT_EQ(3u, s.slow);
  EXPECT_EQ(1u, s.failed);
  EXPECT_EQ(2u, s.satisfied);   // 300 and the fast failure: apdex is by time alone
  EXPECT_EQ(2u, s.tolerating);  // 301 and 1200
  EXPECT_EQ(2u, AtOrBelow(m, s, 300));
  EXPECT_EQ(4u, AtOrBelow(m, s, 1200));
  EXPECT_EQ(4u, AtOrBelow(m, s, 60000));
  EXPECT_EQ(1u, s.buckets.back());  // +Inf
  EXPECT_EQ(1u, s.statusClasses[4]);
  EXPECT_EQ(4u, s.statusClasses[1]);
  EXPECT_EQ(91811u, s.responseMillis);
}

TEST(RequestMetricsTest, ANewThresholdSplitsNoCountedRequests) {
  RequestMetrics m;
  for (int i = 0; i < 10; ++i) {
    m.add("Shop", "/", Page(1000, 700));
  }
  const uint64_t below = AtOrBelow(m, Find(m, "Shop", "/"), 500);
  m.add("News", "/", Page(600, 10));  // adds bounds 600 and 2400
  ASSERT_TRUE(std::binary_search(m.bounds().begin(), m.bounds().end(), 600));
  ASSERT_TRUE(std::binary_search(m.bounds().begin(), m.bounds().end(), 2400));
  const auto& shop = Find(m, "Shop", "/");
  EXPECT_EQ(m.bounds().size() + 1, shop.buckets.size());
  // Counted before the bound existed: above it, so every cumulative count stays as it was.
  EXPECT_EQ(below, AtOrBelow(m, shop, 600));
  EXPECT_EQ(10u, AtOrBelow(m, shop, 1000));
  // The largest threshold a pattern takes is a bound; four times it does not fit and is none.
  m.add("Never", "/", Page(std::numeric_limits<int32_t>::max(), 10));
  EXPECT_EQ(std::numeric_limits<int32_t>::max(), m.bounds().back());
  EXPECT_EQ(1u, Find(m, "Never", "/").good);
}

TEST(RequestMetricsTest, TheCapHoldsAndKeepsApplicationsApart) {
  // 10,000 distinct transactions of 25 applications against the default cap, and 30
  // applications' against a cap smaller than their number.
  RequestMetrics wide;
  for (int app = 0; app < 25; ++app) {
    for (int tx = 0; tx < 400; ++tx) {
      wide.add("app" + std::to_string(app), "/page" + std::to_string(tx), Page(500, 100));
    }
  }
  // At most the cap; short of it only by the slots held for "_other" series not needed yet.
  EXPECT_LE(wide.series(), RequestMetrics::kDefaultMaxSeries);
  EXPECT_GE(wide.series(), RequestMetrics::kDefaultMaxSeries - 25);
  EXPECT_GT(wide.overflowRequests(), 0u);
  RequestMetrics m(50);
  for (int app = 0; app < 30; ++app) {
    for (int tx = 0; tx < 400; ++tx) {
      m.add("app" + std::to_string(app), "/page" + std::to_string(tx), Page(500, 100));
    }
  }
  EXPECT_LE(m.series(), 50u);
  uint64_t total = 0;
  uint64_t underOther = 0;
  std::set<std::string> overflowApps;
  for (const auto& s : m.all()) {
    total += s.requests();
    if (s.transaction == RequestMetrics::kOther) {
      overflowApps.insert(s.application);
      underOther += s.requests();
    }
  }
  EXPECT_EQ(30u * 400u, total);  // nothing lost to the cap
  EXPECT_EQ(underOther, m.overflowRequests());
  // Every application that got a series of its own also got its own "_other"; the rest share
  // the one "_other"/"_other" series.
  EXPECT_TRUE(overflowApps.contains(RequestMetrics::kOther));
  EXPECT_GT(overflowApps.size(), 1u);
  for (const auto& app : overflowApps) {
    if (app != RequestMetrics::kOther) {
      EXPECT_GT(Find(m, app, "/page0").requests(), 0u);
    }
  }
  // A limit of one keeps only the shared series.
  RequestMetrics tiny(1);
  tiny.add("a", "b", Page(1, 1));
  tiny.add("c", "d", Page(1, 1));
  ASSERT_EQ(1u, tiny.series());
  EXPECT_EQ(2u, tiny.all()[0].requests());
}

TEST(RequestMetricsTest, WritesOneFamilyPerMetric) {
  RequestMetrics m;
  m.add("Shop \"eu\"", "/a\nb", Page(250, 100));
  fw::PrometheusText out;
  m.write(out);
  const std::string& text = out.text();
  EXPECT_NE(std::string::npos,
            text.find("q7_requests_total{application=\"Shop \\\"eu\\\"\",transaction=\"/a\\nb\","
                      "outcome=\"good\"} 1\n"));
  EXPECT_NE(std::string::npos, text.find("le=\"0.25\"} 1\n"));
  EXPECT_NE(std::string::npos, text.find("le=\"1\"} 1\n"));
  EXPECT_NE(std::string::npos, text.find("q7_response_time_seconds_sum{application=\"Shop "
                                         "\\\"eu\\\"\",transaction=\"/a\\nb\"} 0.1\n"));
  size_t families = 0;
  for (size_t at = text.find("# TYPE"); at != std::string::npos; at = text.find("# TYPE", at + 1)) {
    ++families;
  }
  EXPECT_EQ(12u, families);
}

}  // namespace
