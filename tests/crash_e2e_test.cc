// The agent killed with SIGKILL at random moments while the collector writes, and restarted at
// once: every record the collector wrote must be counted exactly once, in the summary tables,
// in the over-time history and in the instance files. Q7_KILLS (default 10) sets how many
// kills, Q7_KILL_MAX_MS (default 3000) the longest run between a start and its kill; make soak
// runs 200.

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <map>
#include <nlohmann/json.hpp>
#include <random>
#include <sstream>
#include <string>
#include <thread>

#include "core/layouts/table_layouts.h"
#include "tests/agent_fixture.h"
#include "tests/agent_process.h"
#include "tests/support/child_process.h"

namespace q7test {
namespace {

using namespace std::chrono_literals;

long EnvLong(const char* name, long fallback) {
  const char* value = std::getenv(name);
  return value != nullptr && *value != '\0' ? std::strtol(value, nullptr, 10) : fallback;
}

class CrashE2ETest : public AgentE2ETest {
 protected:
  // The history files of one stem: their records, and with a total, the sum of a field.
  template <class Row>
  std::pair<long, long> historyOf(const std::string& stem, int32_t Row::*total = nullptr) {
    long records = 0;
    long sum = 0;
    for (const auto& entry : std::filesystem::directory_iterator(base() + "odi/dpx")) {
      const std::string name = entry.path().filename().string();
      if (name.size() < stem.size() + 5 ||
          name.substr(name.size() - stem.size() - 5) != "_" + stem + ".dat" || name[0] == '.') {
        continue;
      }
      std::ifstream in(entry.path(), std::ios::binary);
      Row row;
      while (in.read(reinterpret_cast<char*>(&row), sizeof(row))) {
        ++records;
        if (total != nullptr) {
          sum += row.*total;
        }
      }
    }
    return {records, sum};
  }
};

TEST_F(CrashE2ETest, KilledAtRandomEveryRecordCountedOnce) {
  const long kills = EnvLong("Q7_KILLS", 10);
  const long maxUpMillis = EnvLong("Q7_KILL_MAX_MS", 3000);
  const unsigned seed = static_cast<unsigned>(EnvLong("Q7_KILL_SEED", time(nullptr)));
  std::printf("kills %ld, seed %u (Q7_KILL_SEED repeats a run)\n", kills, seed);
  const std::string data = useDataDirectory();
  home_.writeFile(
      "config/" + shortHostName() + "_q7.cfg",
      "[AGENT]\nKQ7DPXLOGPATH=" + data + "\nKQ7OVERTIMEINTERVAL=1\nKQ7CHECKPOINTSECONDS=2\n");
  registerCatchAllPattern();
  // Every record traced would fill the trace, and rotate away the starts this test counts.
  extraEnv_["Q7_TRACE"] = "*=ERROR analyzer=SUMMARY";

  // The collector: 2,000 records a second into the data directory, renaming the live file
  // every 2 MB (a few seconds).
  const std::string truthPath = home_.path() + "truth.json";
  ChildProcess writer(
      {SM3GEN_PATH, "--live", "--out-dir", data, "--rate", "2000", "--sites", "6", "--roll-bytes",
       "2000000", "--seed", std::to_string(seed), "--truth", truthPath},
      home_.path() + "sm3gen.out", home_.path() + "sm3gen.out");
  ASSERT_TRUE(writer.started());

  std::mt19937 random(seed);
  std::uniform_int_distribution<long> upFor(100, std::max(100L, maxUpMillis));
  std::chrono::milliseconds longestStart{0};
  for (long kill = 0; kill < kills; ++kill) {
    const auto began = std::chrono::steady_clock::now();
    start();
    longestStart = std::max(longestStart, std::chrono::duration_cast<std::chrono::milliseconds>(
                                              std::chrono::steady_clock::now() - began));
    // The kill falls at a random moment of the run: that moment is the point of the test.
    std::this_thread::sleep_for(std::chrono::milliseconds(upFor(random)));
    agent_->signal(SIGKILL);
    const auto status = agent_->wait(10s);
    ASSERT_TRUE(status.has_value() && WIFSIGNALED(*status)) << "kill " << kill;
  }
  writer.signal(SIGTERM);
  ASSERT_TRUE(writer.wait(10s).has_value());
  const nlohmann::json truth = nlohmann::json::parse(readFile(truthPath), nullptr, false);
  ASSERT_FALSE(truth.is_discarded());
  std::map<std::string, long> pagesByApp;
  long pages = 0;
  long objects = 0;
  for (const auto& [app, figures] : truth["applications"].items()) {
    if (const long n = figures["pages"]["count"].get<long>(); n > 0) {
      pagesByApp[app] = n;
      pages += n;
    }
    objects += figures["objects"]["count"].get<long>();
  }
  ASSERT_GT(pages, 0);

  // The last start reads what is left; then the tables hold everything.
  const auto began = std::chrono::steady_clock::now();
  const std::string address = start();
  ASSERT_TRUE(waitForIntakeIdle(address, data + "/traffic.sm3", 120s));
  const auto caughtUp = std::chrono::duration_cast<std::chrono::milliseconds>(
      std::chrono::steady_clock::now() - began);
  int status = 0;
  const long summaryPages = totalRequests(get(address, "/api/v1/tables/Q7TXSM", &status));
  std::map<std::string, long> counted;
  const nlohmann::json apps = get(address, "/api/v1/tables/Q7APPSM", &status);
  EXPECT_EQ(200, status) << apps.dump().substr(0, 300);
  for (const auto& row : apps["rows"]) {
    counted[row["applicatin"].get<std::string>()] += row["totreq"].get<long>();
  }
  const long summaryObjects = totalRequests(get(address, "/api/v1/tables/Q7SUBTXSM", &status));
  stopWith(SIGTERM);  // saves the current interval, so the history is whole

  const long overTimePages =
      historyOf<kq7_q7appot_data_t>("q7appot", &kq7_q7appot_data_t::totreq).second;
  const long overTimeObjects =
      historyOf<kq7_q7subtxot_data_t>("q7subtxot", &kq7_q7subtxot_data_t::totreq).second;
  const long pageInstances = historyOf<kq7_q7txins_data_t>("q7txins").first;
  const long objectInstances = historyOf<kq7_q7subtxins_data_t>("q7subtxins").first;
  const std::string log = trace();
  long resumed = 0;
  long longestRestore = 0;  // ms, as each start traced it
  std::string lastResume;   // the last start's trace line, and where it found a renamed file
  std::string lastRenamed;
  const auto lineAt = [&log](size_t at) {
    const size_t begin = log.rfind('\n', at) + 1;
    return log.substr(begin, log.find('\n', at) - begin);
  };
  for (size_t at = log.find("was renamed ["); at != std::string::npos;
       at = log.find("was renamed [", at + 1)) {
    lastRenamed = lineAt(at);
  }
  for (size_t at = log.find("Resuming from checkpoint"); at != std::string::npos;
       at = log.find("Resuming from checkpoint", at + 1)) {
    ++resumed;
    lastResume = lineAt(at);
    const size_t in = log.find("restored in ", at);
    if (in != std::string::npos) {
      longestRestore = std::max(longestRestore, std::strtol(log.c_str() + in + 12, nullptr, 10));
    }
  }
  std::printf(
      "written: %ld pages, %ld objects; restarts %ld (%ld from a checkpoint); longest "
      "checkpoint restore %ld ms; longest start to serving %lld ms; last catch-up %lld ms\n"
      "summary: %ld pages (%+ld), %ld objects (%+ld); over-time history: %ld pages (%+ld), %ld "
      "objects (%+ld); instances: %ld pages (%+ld), %ld objects (%+ld)\n",
      pages, objects, kills + 1, resumed, longestRestore,
      static_cast<long long>(longestStart.count()), static_cast<long long>(caughtUp.count()),
      summaryPages, summaryPages - pages, summaryObjects, summaryObjects - objects, overTimePages,
      overTimePages - pages, overTimeObjects, overTimeObjects - objects, pageInstances,
      pageInstances - pages, objectInstances, objectInstances - objects);
  std::printf("%s\n%s\n", lastResume.c_str(), lastRenamed.c_str());
  EXPECT_EQ(pages, summaryPages);
  EXPECT_EQ(pagesByApp, counted);
  EXPECT_EQ(objects, summaryObjects);
  EXPECT_EQ(pages, overTimePages);
  EXPECT_EQ(objects, overTimeObjects);
  EXPECT_EQ(pages, pageInstances);
  EXPECT_EQ(objects, objectInstances);
  EXPECT_GE(resumed, kills);  // every start after a kill went on from a checkpoint
  if (::testing::Test::HasFailure()) {
    // Where each start resumed and what the intake did about renames, to see what went wrong.
    std::istringstream lines(log);
    for (std::string line; std::getline(lines, line);) {
      for (const char* mark : {"heckpoint", "esuming", "last processed", "Starting a new monitor",
                               "Found new file", "Must be a rollover", "renamed"}) {
        if (line.find(mark) != std::string::npos) {
          std::printf("%s\n", line.c_str());
          break;
        }
      }
    }
  }
}

}  // namespace
}  // namespace q7test
