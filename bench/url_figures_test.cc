#include "bench/url_figures.h"

#include <gtest/gtest.h>

#include <nlohmann/json.hpp>

namespace bench {
namespace {

nlohmann::json Item(const char* path, const char* method, const char* protocol, uint64_t hits,
                    int64_t cumts, int64_t maxts) {
  return {{"data", path},   {"method", method}, {"protocol", protocol}, {"hits", {{"count", hits}}},
          {"cumts", cumts}, {"maxts", maxts}};
}

nlohmann::json Code(const char* text, uint64_t hits) {
  return {{"data", text}, {"hits", {{"count", hits}}}};
}

nlohmann::json Row(const char* url, int totreq, int oatime, int maxrtt, int loadtime = 0) {
  return {{"transactn", url},     {"totreq", totreq}, {"oatime", oatime}, {"maxrtt", maxrtt},
          {"loadtime", loadtime}, {"num2xx", totreq}, {"num404", 0}};
}

// One path split by method and protocol, and over the panels, is one URL; statuses are read
// from the family items, 403/404/500 also on their own.
TEST(UrlFiguresTest, GoAccessItemsAreSummedPerPath) {
  const nlohmann::json report = {
      {"requests",
       {{"data",
         {Item("/a.html", "GET", "HTTP/1.1", 2, 30000, 20000),
          Item("/a.html", "POST", "HTTP/2", 1, 5000, 5000)}}}},
      {"static_requests", {{"data", {Item("/s.css", "GET", "HTTP/1.1", 4, 8000, 3000)}}}},
      {"not_found", {{"data", {Item("/a.html", "GET", "HTTP/1.1", 1, 1000, 1000)}}}},
      {"status_codes",
       {{"data",
         {{{"items", {Code("200 - OK: fine", 6)}}},
          {{"items", {Code("404 - Not Found: gone", 1), Code("403 - Forbidden: no", 1)}}}}}}}};
  const LogFigures figures = FromGoAccess(report);
  ASSERT_EQ(2u, figures.urls.size());
  const UrlFigures& page = figures.urls.at("/a.html");
  EXPECT_EQ(4u, page.hits);
  EXPECT_EQ(20000, page.max_us);
  EXPECT_DOUBLE_EQ(36000, page.sum_us);
  EXPECT_EQ(8u, figures.hits);
  EXPECT_EQ(6u, figures.statuses.at("2xx"));
  EXPECT_EQ(2u, figures.statuses.at("4xx"));
  EXPECT_EQ(1u, figures.statuses.at("404"));
  EXPECT_EQ(1u, figures.statuses.at("403"));
  EXPECT_EQ(0u, figures.statuses.at("500"));
}

// Rows of one URL (clients, parent pages) add up; a page's load time is kept apart.
TEST(UrlFiguresTest, AgentRowsAreSummedPerPath) {
  const nlohmann::json pages = {
      {"rows", {Row("/a.html", 2, 1050, 2000, 1000), Row("/a.html", 1, 40, 40)}}};
  const nlohmann::json objects = {{"rows", {Row("/s.css", 3, 4, 9), Row("/s.css", 1, 2, 2)}}};
  const LogFigures figures = FromAgent(pages, objects);
  const UrlFigures& page = figures.urls.at("/a.html");
  EXPECT_TRUE(page.page);
  EXPECT_EQ(3u, page.hits);
  EXPECT_EQ(2000000, page.max_us);
  EXPECT_DOUBLE_EQ(2140000, page.sum_us);
  EXPECT_DOUBLE_EQ(2000000, page.load_sum_us);
  const UrlFigures& object = figures.urls.at("/s.css");
  EXPECT_FALSE(object.page);
  EXPECT_EQ(4u, object.hits);
  EXPECT_EQ(9000, object.max_us);
  EXPECT_EQ(7u, figures.statuses.at("2xx"));
}

LogFigures OneUrl(uint64_t hits, int64_t max_us, double sum_us, bool page = false,
                  double load_sum_us = 0) {
  LogFigures figures;
  UrlFigures& url = figures.urls["/u"];
  url.hits = hits;
  url.max_us = max_us;
  url.sum_us = sum_us;
  url.page = page;
  url.load_sum_us = load_sum_us;
  figures.hits = hits;
  figures.statuses["2xx"] = hits;
  return figures;
}

// GoAccess reads "1.025" as 1024999 us: that is the agent's 1025 ms, not a disagreement.
TEST(UrlFiguresTest, GoAccessMicrosecondTruncationAgrees) {
  const Comparison c =
      Compare(OneUrl(2, 1024999, 1034998), OneUrl(2, 1025000, 1035000), /*tolerance_ms=*/1);
  EXPECT_EQ(1u, c.max_agree);
  EXPECT_EQ(1u, c.avg_agree);
  EXPECT_TRUE(c.disagreements.empty());
}

// The average compares the exchange time: the agent's page average less its load time.
TEST(UrlFiguresTest, AverageWithinToleranceOnly) {
  EXPECT_TRUE(Compare(OneUrl(2, 9000, 10000), OneUrl(2, 9000, 2011000, true, 2000000), 1)
                  .disagreements.empty());
  EXPECT_EQ(1u, Compare(OneUrl(2, 9000, 10000), OneUrl(2, 9000, 14000), 1).disagreements.size());
}

// A page's maximum may only be higher on the agent's side (its view's load); an object's, and
// a lower one, disagree.
TEST(UrlFiguresTest, MaximumAbovePagesOnly) {
  const Comparison page =
      Compare(OneUrl(1, 50000, 50000), OneUrl(1, 1050000, 1050000, true, 1000000), 1);
  EXPECT_EQ(1u, page.max_with_load);
  EXPECT_TRUE(page.disagreements.empty());
  EXPECT_EQ(1u, Compare(OneUrl(1, 50000, 50000), OneUrl(1, 51000, 50000), 1).disagreements.size());
  EXPECT_EQ(
      1u, Compare(OneUrl(1, 50000, 50000), OneUrl(1, 49000, 50000, true), 1).disagreements.size());
}

// Different hits (a URL one side lacks, too) and status counts are disagreements.
TEST(UrlFiguresTest, HitsAndStatusMismatchesAreReported) {
  LogFigures agent = OneUrl(3, 9000, 27000);
  agent.urls["/only-ours"].hits = 1;
  agent.statuses["2xx"] = 4;
  const Comparison c = Compare(OneUrl(2, 9000, 18000), agent, 1);
  EXPECT_EQ(0u, c.hits_agree);
  EXPECT_EQ(2u, c.urls);
  EXPECT_EQ(3u, c.disagreements.size());
}

}  // namespace
}  // namespace bench
