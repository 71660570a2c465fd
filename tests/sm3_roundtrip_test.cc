// sm3gen's files read back by the agent's own record path: the counts, response-time figures
// and status buckets per application and URL equal sm3gen's ground truth.

#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/wait.h>

#include <algorithm>
#include <map>
#include <nlohmann/json.hpp>
#include <string>

#include "core/analyzer/intake/sm3_framing.h"
#include "core/analyzer/intake/sm3_parser.h"
#include "framework/trace.h"
#include "tests/support/scratch_dir.h"

namespace {

using nlohmann::json;

// What the truth says of a set of records, in the truth's shape.
json EmptyStats() {
  return {{"count", 0},
          {"rt_sum", 0},
          {"rt_min", 0},
          {"rt_max", 0},
          {"status",
           {{"1xx", 0},
            {"2xx", 0},
            {"3xx", 0},
            {"4xx", 0},
            {"5xx", 0},
            {"403", 0},
            {"404", 0},
            {"500", 0},
            {"bad", 0}}}};
}

void Add(json& stats, const CDPXTransaction& t) {
  const long rt = t.getTotalResponseTime();
  const long count = stats["count"].get<long>();
  stats["rt_min"] = count == 0 ? rt : std::min(rt, stats["rt_min"].get<long>());
  stats["rt_max"] = count == 0 ? rt : std::max(rt, stats["rt_max"].get<long>());
  stats["count"] = count + 1;
  stats["rt_sum"] = stats["rt_sum"].get<long>() + rt;
  json& status = stats["status"];
  const int code = t.getRequestStatus();
  auto bump = [&status](const char* bucket) { status[bucket] = status[bucket].get<long>() + 1; };
  if (code >= 100 && code <= 599) {
    bump((std::to_string(code / 100) + "xx").c_str());
  }
  for (const char* single : {"403", "404", "500"}) {
    if (std::to_string(code) == single) {
      bump(single);
    }
  }
  if (t.isBadStatusCode()) {
    bump("bad");
  }
}

// Accumulates every parsed record per application and URL, pages and objects apart.
class TallySink : public CSM3RecordSink {
 public:
  bool processSM3Line(char* line, int recordType) override {
    auto t = createDPXTransaction(line, recordType);
    if (!t) {
      ++rejected;
      return true;
    }
    const char* part = recordType == 1 ? "pages" : "objects";
    json& app = applications[t->getApplicationName()];
    if (app.is_null()) {
      app = {{"pages", EmptyStats()}, {"objects", EmptyStats()}, {"urls", json::object()}};
    }
    Add(app[part], *t);
    json& url = app["urls"][t->getTransactionName()];
    if (url.is_null()) {
      url = {{"pages", EmptyStats()}, {"objects", EmptyStats()}};
    }
    Add(url[part], *t);
    ++records;
    return true;
  }
  json applications = json::object();
  long records = 0;
  long rejected = 0;
};

class RoundTripTest : public ::testing::Test {
 protected:
  static void SetUpTestSuite() {
    std::string error;
    // A truncated tail is traced at the error level on every pass; keep it off the terminal.
    fw::TraceOpen(scratch_->file("trace.log"), 1 << 20, 1, &error);
  }
  static void TearDownTestSuite() { fw::TraceClose(); }

  // Runs sm3gen with args, writing data.sm3 and truth.json; returns the truth.
  json Generate(const std::string& args) {
    const std::string command = std::string(SM3GEN_PATH) + " --out " + dir_.file("data.sm3") +
                                " --truth " + dir_.file("truth.json") + " " + args;
    const int status = system(command.c_str());
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << command;
    return json::parse(dir_.read("truth.json"));
  }

  // Reads the file as a data file monitor does: chunks of at most 32768 bytes from the consumed
  // offset, until a pass consumes nothing.
  long ReadInChunks(const std::string& file, TallySink& sink) {
    long offset = 0;
    for (;;) {
      std::string chunk = file.substr(offset, MAX_BUFFER);
      const long length = static_cast<long>(chunk.size());
      if (length == 0) {
        break;
      }
      const long consumed = processDPXContents(chunk.data(), length, length == MAX_BUFFER, sink);
      if (consumed == 0) {
        break;
      }
      offset += consumed;
    }
    return offset;
  }

  static inline q7test::ScratchDir* scratch_ = new q7test::ScratchDir;  // lives for the process
  q7test::ScratchDir dir_;
};

// A junk-free file read in monitor-sized chunks, a truncated record at its end: every complete
// record exactly once, the cut one never, and the offset stops at the cut record.
TEST_F(RoundTripTest, ChunkedReadMatchesTruth) {
  const json truth = Generate("--records 3000 --seed 42 --eol mixed --truncate-tail");
  const std::string file = dir_.read("data.sm3");
  ASSERT_GT(file.size(), 3u * MAX_BUFFER);
  TallySink sink;
  const long offset = ReadInChunks(file, sink);
  EXPECT_EQ(0, sink.rejected);
  EXPECT_EQ(truth["records"].get<long>(), sink.records);
  EXPECT_EQ(truth["applications"], sink.applications);
  EXPECT_EQ(file.rfind('<'), static_cast<size_t>(offset));
}

// Junk between records is passed over within one pass: one pass over the whole file sees every
// record exactly once.
TEST_F(RoundTripTest, JunkBetweenRecordsInOnePass) {
  const json truth = Generate("--records 1500 --seed 7 --junk-every 3 --sites 3");
  ASSERT_GT(truth["junk_blocks"].get<long>(), 0);
  std::string file = dir_.read("data.sm3");
  TallySink sink;
  processDPXContents(file.data(), static_cast<long>(file.size()), false, sink);
  EXPECT_EQ(0, sink.rejected);
  EXPECT_EQ(truth["records"].get<long>(), sink.records);
  EXPECT_EQ(truth["applications"], sink.applications);
}

}  // namespace
