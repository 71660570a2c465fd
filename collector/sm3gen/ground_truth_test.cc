// The truth names records the way the agent does, buckets statuses as documented, and agrees
// with an independent reading of the bytes it describes.

#include "collector/sm3gen/ground_truth.h"

#include <gtest/gtest.h>

#include <map>
#include <string>

#include "collector/sm3gen/test_support.h"

namespace sm3gen {
namespace {

TEST(sm3genTruth, NamesFollowTheAgentsRules) {
  Record page;
  page.kind = RecordKind::kPage;
  page.host = std::string(140, 'h');
  page.server_address = "198.51.100.10";
  page.url = "/" + std::string(300, 'u');
  EXPECT_EQ(std::string(127, 'h'), ApplicationName(page));
  EXPECT_EQ("/" + std::string(126, 'u'), TransactionName(page));
  page.host.clear();
  EXPECT_EQ("198.51.100.10", ApplicationName(page));
  // Audio and video have no host field: a host left in the struct must not count.
  Record video = page;
  video.kind = RecordKind::kVideo;
  video.host = "media.stream.example.net";
  video.server_address = std::string(130, 'a');
  EXPECT_EQ(std::string(127, 'a'), ApplicationName(video));
}

TEST(sm3genTruth, StatusBucketsAndResponseTimeBounds) {
  Tally tally;
  EXPECT_EQ(0, tally.ToJson()["rt_min"]);
  const int32_t statuses[] = {99, 100, 199, 200, 302, 400, 401, 403, 404, 499, 500, 503, 599, 600};
  int32_t rt = 10;
  for (int32_t status : statuses) {
    tally.Add(rt, status);
    rt = rt == 10 ? 3 : rt + 100;
  }
  const auto json = tally.ToJson();
  EXPECT_EQ(14, json["count"]);
  EXPECT_EQ(3, json["rt_min"]);
  EXPECT_EQ(1203, json["rt_max"]);
  EXPECT_EQ(10 + 3 * 13 + 100 * (1 + 12) * 12 / 2, json["rt_sum"]);
  const nlohmann::json status = {{"1xx", 2}, {"2xx", 1}, {"3xx", 1}, {"4xx", 5}, {"5xx", 3},
                                 {"403", 1}, {"404", 1}, {"500", 1}, {"bad", 8}};
  EXPECT_EQ(status, json["status"]);
}

// Recomputes counts, response-time sums and bounds per application and transaction from the
// bytes, reading fields by their documented positions, and compares them with the truth.
TEST(sm3genTruth, AgreesWithAnIndependentReading) {
  ModelOptions model;
  model.start = 1795450020;
  model.sites = 8;
  model.av_share = 10;
  model.error_share = 10;
  model.ipv6_share = 30;
  StreamOptions stream;
  stream.line_end = LineEnd::kMixed;
  stream.junk_every = 7;
  const auto out = testing::Generate(model, stream, 4000, true);

  nlohmann::json expected = nlohmann::json::object();
  std::map<std::string, int> by_kind;
  int records = 0;
  for (const auto& line : testing::ReadLines(out.bytes)) {
    if (line.trailer.empty()) {
      continue;  // the cut-off tail
    }
    ++records;
    ++by_kind[line.tag];
    const bool page_layout = line.fields.size() == 46;
    const std::string host = page_layout ? line.fields[39] : "";
    const std::string app = (host.empty() ? line.fields[12] : host).substr(0, 127);
    const std::string url = line.fields[page_layout ? 22 : 23].substr(0, 127);
    const int rt = std::stoi(line.fields[14]);
    const int status = std::stoi(line.fields[page_layout ? 27 : 28]);
    const char* group = line.tag == "hpage" ? "pages" : "objects";
    for (nlohmann::json* tally : {&expected[app][group], &expected[app]["urls"][url][group]}) {
      const bool first = !tally->contains("count");
      (*tally)["count"] = (first ? 0 : (*tally)["count"].get<int>()) + 1;
      (*tally)["rt_sum"] = (first ? 0 : (*tally)["rt_sum"].get<int64_t>()) + rt;
      (*tally)["rt_min"] = first ? rt : std::min(rt, (*tally)["rt_min"].get<int>());
      (*tally)["rt_max"] = first ? rt : std::max(rt, (*tally)["rt_max"].get<int>());
      (*tally)["bad"] = (first ? 0 : (*tally)["bad"].get<int>()) + (status >= 401);
    }
  }
  EXPECT_EQ(4000, records);
  EXPECT_EQ(records, out.truth["records"]);
  for (const char* kind : {"hpage", "hobj", "audio", "video"}) {
    EXPECT_EQ(by_kind[kind], out.truth["by_kind"][kind]) << kind;
    EXPECT_GT(by_kind[kind], 0) << kind;
  }

  // Same applications and transactions, and the same figures in each.
  const auto& apps = out.truth["applications"];
  ASSERT_EQ(expected.size(), apps.size());
  auto check = [](const nlohmann::json& want, const nlohmann::json& got, const std::string& where) {
    const int count = want.contains("count") ? want["count"].get<int>() : 0;
    EXPECT_EQ(count, got["count"]) << where;
    if (count > 0) {
      EXPECT_EQ(want["rt_sum"], got["rt_sum"]) << where;
      EXPECT_EQ(want["rt_min"], got["rt_min"]) << where;
      EXPECT_EQ(want["rt_max"], got["rt_max"]) << where;
      EXPECT_EQ(want["bad"], got["status"]["bad"]) << where;
    }
  };
  for (const auto& [app, want] : expected.items()) {
    ASSERT_TRUE(apps.contains(app)) << app;
    for (const char* group : {"pages", "objects"}) {
      check(want.value(group, nlohmann::json::object()), apps[app][group], app);
    }
    ASSERT_EQ(want["urls"].size(), apps[app]["urls"].size()) << app;
    for (const auto& [url, url_want] : want["urls"].items()) {
      ASSERT_TRUE(apps[app]["urls"].contains(url)) << app << " " << url;
      for (const char* group : {"pages", "objects"}) {
        check(url_want.value(group, nlohmann::json::object()), apps[app]["urls"][url][group],
              app + " " + url);
      }
    }
  }
}

}  // namespace
}  // namespace sm3gen
