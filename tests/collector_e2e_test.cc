// The agent with the simulated collector: it starts the writer and the capture process through
// sm3ctl, reads a minute of traffic at 2000 records per second across many rollovers, stops
// them at shutdown, and after a restart that reads what was left its tables hold exactly what
// reached the files.

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/utsname.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <map>
#include <nlohmann/json.hpp>
#include <string>
#include <thread>

#include "tests/agent_fixture.h"
#include "tests/agent_process.h"

namespace q7test {
namespace {

using namespace std::chrono_literals;

class CollectorE2ETest : public AgentE2ETest {
 protected:
  // Lays out <base>/dpx/ as an installation does: sm3ctl, its configuration and linux/.
  void installCollector(const std::string& data) {
    std::filesystem::create_directories(truthDir());
    superviseCollectorWith(
        "MODE=simulate\nDATA_DIR=" + data +
        "\nRATE=2000\nSTEM=traffic\nROLL_BYTES=3000000\nROLL_SECONDS=3600\nBIN_DIR=" +
        std::filesystem::path(SM3GEN_PATH).parent_path().string() + "\nTRUTH_DIR=" + truthDir() +
        "\nSEED=11\n");
  }
  std::string truthDir() const { return home_.path() + "truth"; }
  // Pid files are named after the node name's first 24 characters, dots kept.
  std::string pidFile(const std::string& prefix) const {
    struct utsname names {};
    uname(&names);
    return base() + "dpx/linux/" + prefix + std::string(names.nodename).substr(0, 24) + ".pid";
  }
};

TEST_F(CollectorE2ETest, SimulatedTrafficAcrossRolloversCountedExactly) {
  const std::string data = useDataDirectory();
  installCollector(data);
  registerCatchAllPattern();
  const std::string address = start();

  // Both processes run, named by their pid files.
  EXPECT_TRUE(waitFor(
      [&] { return !readFile(pidFile("zolt414_")).empty() && !readFile(pidFile("zelt_")).empty(); },
      30s));
  // The writer rolls the live file over as it fills: let it do so several times.
  const auto rolledFiles = [&] {
    int rolled = 0;
    for (const auto& entry : std::filesystem::directory_iterator(data)) {
      rolled += entry.path().filename().string().find('-') != std::string::npos ? 1 : 0;
    }
    return rolled;
  };
  EXPECT_TRUE(waitFor([&] { return rolledFiles() >= 5; }, 120s)) << rolledFiles();

  // The agent stops the writer, then the capture process, then itself.
  agent_->signal(SIGTERM);
  const auto status = agent_->wait(30s);
  ASSERT_TRUE(status.has_value()) << "agent did not exit";
  EXPECT_TRUE(WIFEXITED(*status) && WEXITSTATUS(*status) == 0);
  EXPECT_FALSE(std::filesystem::exists(pidFile("zolt414_")));
  EXPECT_FALSE(std::filesystem::exists(pidFile("zelt_")));

  // What reached the files, per application.
  const nlohmann::json truth =
      nlohmann::json::parse(readFile(truthDir() + "/sm3writer.json"), nullptr, false);
  ASSERT_FALSE(truth.is_discarded());
  std::map<std::string, long> expected;
  long pages = 0;
  for (const auto& [app, figures] : truth["applications"].items()) {
    if (const long n = figures["pages"]["count"].get<long>(); n > 0) {
      expected[app] = n;
      pages += n;
    }
  }
  ASSERT_GT(pages, 0);

  // Restarted without the collector, the agent reads what it had not read yet.
  superviseCollector_ = false;
  const std::string again = start();
  ASSERT_TRUE(waitForIntakeIdle(again, data + "/traffic.sm3", 30s));
  int code = 0;
  const nlohmann::json summary = get(again, "/api/v1/tables/Q7TXSM", &code);
  EXPECT_EQ(pages, totalRequests(summary));
  const nlohmann::json apps = get(again, "/api/v1/tables/Q7APPSM", &code);
  std::map<std::string, long> counted;
  for (const auto& row : apps["rows"]) {
    counted[row["applicatin"].get<std::string>()] += row["totreq"].get<long>();
  }
  EXPECT_EQ(expected, counted);
  stopWith(SIGTERM);
}

}  // namespace
}  // namespace q7test
