// The collector's files through the real q7agent: files written while the agent was down, a
// file the collector renamed, a live file that grows, is renamed and rolls over to a newer name
// while the agent runs, a stop in the middle of writing and a restart. Every page must be
// counted exactly once.

#include <gtest/gtest.h>
#include <signal.h>

#include <atomic>
#include <chrono>
#include <cstdio>
#include <filesystem>
#include <map>
#include <nlohmann/json.hpp>
#include <string>
#include <thread>

#include "tests/agent_fixture.h"
#include "tests/agent_process.h"

namespace q7test {
namespace {

using namespace std::chrono_literals;

class IntakeE2ETest : public AgentE2ETest {
 protected:
  // Appends records to data/name with sm3gen and adds its truth to the expected page counts.
  void write(const std::string& name, int records, const std::string& options = "") {
    const std::string truthPath = home_.path() + "truth" + std::to_string(++batches_) + ".json";
    const std::string command = std::string(SM3GEN_PATH) + " --append --out " + data_ + "/" + name +
                                " --truth " + truthPath + " --records " + std::to_string(records) +
                                " --seed " + std::to_string(batches_) +
                                " --sites 3 --rate 2000 --start " + std::to_string(time(nullptr)) +
                                " " + options;
    ASSERT_EQ(0, system(command.c_str())) << command;
    const nlohmann::json truth = nlohmann::json::parse(readFile(truthPath));
    for (const auto& [app, figures] : truth["applications"].items()) {
      if (const long pages = figures["pages"]["count"].get<long>(); pages > 0) {
        expected_[app] += pages;  // applications with objects only have no summary row
      }
    }
  }
  void rename(const std::string& from, const std::string& to) {
    std::filesystem::rename(data_ + "/" + from, data_ + "/" + to);
  }
  long expectedTotal() const {
    long sum = 0;
    for (const auto& [app, count] : expected_) {
      sum += count;
    }
    return sum;
  }

  // Waits until the agent has read everything up to the end of the live file, then checks
  // Q7TXSM's total and each application's summary row: once the intake is idle a page read
  // twice would show, and nothing more can arrive.
  void expectTablesMatchTruth(const std::string& address, const std::string& live,
                              std::chrono::seconds timeout) {
    ASSERT_TRUE(waitForIntakeIdle(address, data_ + "/" + live, timeout));
    int status = 0;
    const nlohmann::json summary = get(address, "/api/v1/tables/Q7TXSM", &status);
    EXPECT_EQ(expectedTotal(), totalRequests(summary));
    const nlohmann::json apps = get(address, "/api/v1/tables/Q7APPSM", &status);
    ASSERT_EQ(200, status);
    std::map<std::string, long> counted;
    for (const auto& row : apps["rows"]) {
      counted[row["applicatin"].get<std::string>()] += row["totreq"].get<long>();
    }
    EXPECT_EQ(expected_, counted);
  }

  std::string data_;
  int batches_ = 0;
  std::map<std::string, long> expected_;  // application -> pages written
};

TEST_F(IntakeE2ETest, EveryPageCountedOnceAcrossRenamesRolloversAndRestarts) {
  data_ = useDataDirectory();
  registerCatchAllPattern();
  // Written while the agent was down: an older file with junk between records and a cut tail
  // (small enough to be read in one pass), a file the collector already renamed, and the live
  // file.
  write("day0.sm3", 40, "--junk-every 3 --truncate-tail");
  write("day1.sm3", 150);
  rename("day1.sm3", "day1-0001.sm3");
  write("day1.sm3", 200);
  const std::string address = start();
  expectTablesMatchTruth(address, "day1.sm3", 20s);

  // The live file grows, then the collector renames it and starts it afresh, smaller.
  write("day1.sm3", 120);
  write("day1.sm3", 80);
  rename("day1.sm3", "day1-0002.sm3");
  write("day1.sm3", 30);
  expectTablesMatchTruth(address, "day1.sm3", 20s);
  write("day1.sm3", 60);

  // A newer file: the manager rolls over to it at its next look (every 5 s).
  write("day2.sm3", 50);
  expectTablesMatchTruth(address, "day2.sm3", 20s);

  // Stop the agent while the collector keeps writing: batches go on from before the SIGTERM
  // until after the agent has exited (12 at least); then more while it is down.
  std::atomic<int> batches{0};
  std::atomic<bool> agentGone{false};
  std::thread writer([&] {
    bool afterExit = false;
    while (!afterExit || batches.load() < 12) {
      afterExit = agentGone.load();
      write("day2.sm3", 150);
      ++batches;
    }
  });
  EXPECT_TRUE(
      waitFor([&] { return batches.load() >= 2; }, 20s));  // no ASSERT: the thread must be joined
  agent_->signal(SIGTERM);
  const auto exited = agent_->wait(10s);
  agentGone = true;
  writer.join();
  ASSERT_TRUE(exited.has_value());
  write("day2.sm3", 100);

  // The paths this test is about were really taken.
  const std::string log = trace();
  EXPECT_NE(std::string::npos, log.find("Found new file name [" + data_ + "/day1-0002.sm3]"));
  EXPECT_NE(std::string::npos, log.find("Must be a rollover"));
  EXPECT_NE(std::string::npos, log.find("only processed"));  // the cut tail of day0.sm3

  const std::string again = start();
  expectTablesMatchTruth(again, "day2.sm3", 30s);
  stopWith(SIGTERM);
  EXPECT_NE(std::string::npos,
            trace().find("Found last processed file of [" + data_ + "/day2.sm3]"));
}

}  // namespace
}  // namespace q7test
