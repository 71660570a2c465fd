// The agent killed while the collector writes, and restarted: every record the collector wrote
// must be counted exactly once, in the summary tables, in the over-time history and in the
// instance files.
// - at random moments: Q7_KILLS (default 10) kills, each run at most Q7_KILL_MAX_MS (default
//   3000) long; make soak runs 200;
// - half-way through writing the checkpoint, "DPXLastFile" or a history file;
// - with a full disk (a small tmpfs under the agent's base directory, grown later; skipped
//   where tmpfs cannot be mounted).
// Besides, every file the agent reads back at a start, damaged at once, is set aside.

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/mount.h>
#include <sys/wait.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <map>
#include <memory>
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

// What each start that recovers from a checkpoint traces.
constexpr char kResuming[] = "Resuming from checkpoint";

long EnvLong(const char* name, long fallback) {
  const char* value = std::getenv(name);
  return value != nullptr && *value != '\0' ? std::strtol(value, nullptr, 10) : fallback;
}

class CrashE2ETest : public AgentE2ETest {
 protected:
  void TearDown() override {
    if (mounted_) {
      agent_.reset();
      writer_.reset();
      ::umount2(base().c_str(), MNT_DETACH);
    }
    AgentE2ETest::TearDown();
  }

  // A data directory, 1-minute intervals, checkpoints every 2 s and the catch-all pattern.
  void prepare() {
    data_ = useDataDirectory();
    home_.writeFile(
        "config/" + shortHostName() + "_q7.cfg",
        "[AGENT]\nKQ7DPXLOGPATH=" + data_ + "\nKQ7OVERTIMEINTERVAL=1\nKQ7CHECKPOINTSECONDS=2\n");
    registerCatchAllPattern();
    // Every record traced would fill the trace, and rotate away the starts the tests count
    // (those lines are always written).
    extraEnv_["Q7_TRACE"] = "*=ERROR";
  }

  // The collector: rate records a second into the data directory, renaming the live file every
  // 2 MB.
  void startWriter(unsigned seed, int rate) {
    writer_ = std::make_unique<ChildProcess>(
        std::vector<std::string>{SM3GEN_PATH, "--live", "--out-dir", data_, "--rate",
                                 std::to_string(rate), "--sites", "6", "--roll-bytes", "2000000",
                                 "--seed", std::to_string(seed), "--truth", truthPath()},
        home_.path() + "sm3gen.out", home_.path() + "sm3gen.out");
    ASSERT_TRUE(writer_->started());
  }
  std::string truthPath() const { return home_.path() + "truth.json"; }

  // The history files of one stem: their records, and with a total, the sum of a field.
  template <class Row>
  std::pair<long, long> historyOf(const std::string& stem, int32_t Row::*total = nullptr) {
    long records = 0;
    long sum = 0;
    for (const auto& entry : std::filesystem::directory_iterator(base() + "odi/dpx")) {
      const std::string name = entry.path().filename().string();
      const std::string tail = "_" + stem + ".dat";
      if (name[0] == '.' || name.size() < tail.size() ||
          name.compare(name.size() - tail.size(), tail.size(), tail) != 0) {
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

  // Stops the writer, starts the agent once more to read what is left, and checks the tables,
  // the history and the instance files against the writer's truth. Prints the figures.
  void expectEveryRecordOnce() {
    // After a long run its truth is large: writing it takes a while.
    writer_->signal(SIGTERM);
    ASSERT_TRUE(writer_->wait(180s).has_value());
    const nlohmann::json truth = nlohmann::json::parse(readFile(truthPath()), nullptr, false);
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

    const auto began = std::chrono::steady_clock::now();
    const std::string address = start();
    ASSERT_TRUE(waitForIntakeIdle(address, data_ + "/traffic.sm3", 120s));
    const auto caughtUp = std::chrono::duration_cast<std::chrono::milliseconds>(
        std::chrono::steady_clock::now() - began);
    int status = 0;
    const long summaryPages = totalRequests(get(address, "/api/v1/tables/Q7TXSM", &status));
    std::map<std::string, long> counted;
    const nlohmann::json apps = get(address, "/api/v1/tables/Q7APPSM", &status);
    for (const auto& row : apps["rows"]) {
      counted[row["applicatin"].get<std::string>()] += row["totreq"].get<long>();
    }
    // The latency sketches are checkpointed with the rows: none lost or counted twice either.
    std::map<std::string, long> sketched;
    const nlohmann::json latency = get(address, "/api/v1/latency?window=summary", &status);
    for (const auto& row : latency["rows"]) {
      sketched[row["application"].get<std::string>()] += row["requests"].get<long>();
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
    if (const char* keep = std::getenv("Q7_CRASH_TRACE"); keep != nullptr && *keep != '\0') {
      std::ofstream(keep, std::ios::binary | std::ios::trunc) << log;  // for a look afterwards
    }
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
    resumed_ = 0;
    for (size_t at = log.find(kResuming); at != std::string::npos;
         at = log.find(kResuming, at + 1)) {
      ++resumed_;
      lastResume = lineAt(at);
      const size_t in = log.find("restored in ", at);
      if (in != std::string::npos) {
        longestRestore = std::max(longestRestore, std::strtol(log.c_str() + in + 12, nullptr, 10));
      }
    }
    std::printf(
        "written: %ld pages, %ld objects; %ld starts from a checkpoint; longest checkpoint "
        "restore %ld ms; last catch-up %lld ms\n"
        "summary: %ld pages (%+ld), %ld objects (%+ld); over-time history: %ld pages (%+ld), %ld "
        "objects (%+ld); instances: %ld pages (%+ld), %ld objects (%+ld)\n%s\n%s\n",
        pages, objects, resumed_, longestRestore, static_cast<long long>(caughtUp.count()),
        summaryPages, summaryPages - pages, summaryObjects, summaryObjects - objects, overTimePages,
        overTimePages - pages, overTimeObjects, overTimeObjects - objects, pageInstances,
        pageInstances - pages, objectInstances, objectInstances - objects, lastResume.c_str(),
        lastRenamed.c_str());
    EXPECT_EQ(pagesByApp, counted);
    EXPECT_EQ(pagesByApp, sketched) << "latency sketches";
    // A summary by URL folds at most MAX_ROWS (25,000) history rows, and nearly every page has
    // a URL of its own: beyond that the per-URL totals are short by design.
    const long pageRows = historyOf<kq7_q7txot_data_t>("q7txot").first;
    const long objectRows = historyOf<kq7_q7subtxot_data_t>("q7subtxot").first;
    if (pageRows <= 25000) {
      EXPECT_EQ(pages, summaryPages);
    }
    if (objectRows <= 25000) {
      EXPECT_EQ(objects, summaryObjects);
    }
    if (pageRows > 25000 || objectRows > 25000) {
      std::printf("per-URL summaries not compared: %ld and %ld history rows by URL\n", pageRows,
                  objectRows);
    }
    EXPECT_EQ(pages, overTimePages);
    EXPECT_EQ(objects, overTimeObjects);
    EXPECT_EQ(pages, pageInstances);
    EXPECT_EQ(objects, objectInstances);
    if (::testing::Test::HasFailure()) {
      // Where each start resumed and what the intake did about renames.
      std::istringstream lines(log);
      for (std::string line; std::getline(lines, line);) {
        for (const char* mark : {"heckpoint", "esuming", "last processed", "Starting a new monitor",
                                 "Found new file", "Found [", "Must be a rollover", "renamed"}) {
          if (line.find(mark) != std::string::npos) {
            std::printf("%s\n", line.c_str());
            break;
          }
        }
      }
    }
  }

  // Transactions the running agent has taken from its queue.
  long taken(const std::string& address) {
    int status = 0;
    return get(address, "/api/v1/agent", &status)["counters"].value("transactions_taken", 0L);
  }

  std::string data_;
  std::unique_ptr<ChildProcess> writer_;
  long resumed_ = 0;  // starts that resumed from a checkpoint, as the last check counted them
  bool mounted_ = false;
};

TEST_F(CrashE2ETest, KilledAtRandomEveryRecordCountedOnce) {
  const long kills = EnvLong("Q7_KILLS", 10);
  const long maxUpMillis = EnvLong("Q7_KILL_MAX_MS", 3000);
  const unsigned seed = static_cast<unsigned>(EnvLong("Q7_KILL_SEED", time(nullptr)));
  std::printf("kills %ld, seed %u (Q7_KILL_SEED repeats a run)\n", kills, seed);
  prepare();
  startWriter(seed, 2000);

  std::mt19937 random(seed);
  std::uniform_int_distribution<long> upFor(100, std::max(100L, maxUpMillis));
  std::chrono::milliseconds longestStart{0};
  // Runs killed before their recovery was done: the API serves while the analyzer is still
  // putting a large checkpoint back (up to a second), and a kill may fall in that time.
  long killedRecovering = 0;
  const auto resumes = [this] {
    const std::string log = trace();
    long n = 0;
    for (size_t at = log.find(kResuming); at != std::string::npos;
         at = log.find(kResuming, at + 1)) {
      ++n;
    }
    return n;
  };
  for (long kill = 0; kill < kills; ++kill) {
    const long resumedBefore = resumes();
    const auto began = std::chrono::steady_clock::now();
    start();
    longestStart = std::max(longestStart, std::chrono::duration_cast<std::chrono::milliseconds>(
                                              std::chrono::steady_clock::now() - began));
    // The kill falls at a random moment of the run: that moment is the point of the test.
    std::this_thread::sleep_for(std::chrono::milliseconds(upFor(random)));
    agent_->signal(SIGKILL);
    const auto status = agent_->wait(10s);
    ASSERT_TRUE(status.has_value() && WIFSIGNALED(*status)) << "kill " << kill;
    killedRecovering += resumes() == resumedBefore ? 1 : 0;
  }
  std::printf("restarts %ld; longest start to serving %lld ms; %ld killed while recovering\n",
              kills + 1, static_cast<long long>(longestStart.count()), killedRecovering);
  expectEveryRecordOnce();
  // Every start after a kill went on from a checkpoint, but for those killed before they
  // were done, which must be rare.
  EXPECT_GE(resumed_ + killedRecovering, kills);
  EXPECT_LE(killedRecovering, std::max(1L, kills / 20));
}

// Killed half-way through writing each file it replaces: the file under its own name stays
// the previous one, whole, and nothing is lost or counted twice.
TEST_F(CrashE2ETest, KilledWhileWritingItsFilesEveryRecordCountedOnce) {
  prepare();
  startWriter(static_cast<unsigned>(time(nullptr)), 2000);
  // The checkpoint is written within 2 s of a start; "DPXLastFile" and the current interval's
  // history at a clean stop, which the SIGTERM asks for.
  for (const std::string fragment : {"q7checkpoint.dat", "DPXLastFile", "_1_q7appot.dat"}) {
    extraEnv_["Q7_KILL_DURING_WRITE"] = fragment;
    const std::string address = start();
    if (fragment != "q7checkpoint.dat") {
      // Stopped once it has counted records of this run.
      ASSERT_TRUE(waitFor([&] { return taken(address) > 0; }, 30s)) << fragment;
      agent_->signal(SIGTERM);
    }
    const auto status = agent_->wait(10s);
    ASSERT_TRUE(status.has_value() && WIFSIGNALED(*status) && WTERMSIG(*status) == SIGKILL)
        << fragment;
  }
  extraEnv_.erase("Q7_KILL_DURING_WRITE");
  expectEveryRecordOnce();
  EXPECT_EQ(std::string::npos, trace().find("does not load")) << "a half-written file was read";
}

// A full disk: history, checkpoint and instance writes fail; the agent keeps ingesting, holds
// what it could not write, and once there is room writes it all: nothing lost or repeated.
TEST_F(CrashE2ETest, FullDiskEveryRecordCountedOnce) {
  prepare();
  // The base directory moves onto a tmpfs with room for the first checkpoints and a few
  // seconds of instance records.
  const std::string kept = home_.path() + "base-before-tmpfs";
  std::filesystem::rename(base(), kept);
  std::filesystem::create_directories(base());
  if (::mount("tmpfs", base().c_str(), "tmpfs", 0, "size=24m") != 0) {
    GTEST_SKIP() << "cannot mount a tmpfs here: " << std::strerror(errno);
  }
  mounted_ = true;
  std::filesystem::copy(kept, base(), std::filesystem::copy_options::recursive);
  startWriter(static_cast<unsigned>(time(nullptr)), 500);
  const std::string address = start();
  ASSERT_TRUE(waitFor([&] { return trace().find("holding") != std::string::npos; }, 60s))
      << "the disk never filled";
  // Ingestion goes on while nothing can be written.
  const long before = taken(address);
  EXPECT_TRUE(waitFor([&] { return taken(address) > before + 500; }, 10s));
  EXPECT_TRUE(
      waitFor([&] { return trace().find("Checkpoint put off") != std::string::npos; }, 10s));

  ASSERT_EQ(0, ::mount("tmpfs", base().c_str(), "tmpfs", MS_REMOUNT, "size=2g"));
  EXPECT_TRUE(waitFor([&] { return trace().find("written again") != std::string::npos; }, 20s));
  stopWith(SIGTERM);
  expectEveryRecordOnce();
}

// Every file the agent reads back at a start, damaged at once: each is set aside with a trace
// naming it, and the agent starts and serves.
TEST_F(CrashE2ETest, DamagedFilesAreSetAsideAndTheAgentServes) {
  useDataDirectory();
  registerCatchAllPattern();
  const long now = time(nullptr);
  const std::string history = base() + "odi/dpx/";
  const std::string currentHistory = history + std::to_string(now - now % 300) + "_1_q7appot.dat";
  const std::map<std::string, std::string> damaged = {
      {base() + "q7checkpoint.dat", "q7checkpoint 9\nfrom a newer agent"},
      {history + "DPXLastFile", "torn"},
      {history + "tpatterns.dat", std::string("\x07\0\0\0garbage", 11)},
      {currentHistory, "five!"},
      {home_.path() + "config/q7_situations.json", "[{\"name\": "},
  };
  for (const auto& [path, bytes] : damaged) {
    std::ofstream(path, std::ios::binary | std::ios::trunc) << bytes;
  }
  const std::string address = start();
  const long started = time(nullptr);
  int status = 0;
  get(address, "/api/v1/agent", &status);
  EXPECT_EQ(200, status);
  get(address, "/api/v1/tables/Q7APPSM", &status);
  EXPECT_EQ(200, status);
  EXPECT_TRUE(waitFor([&] { return trace().find("Pattern file") != std::string::npos; }, 10s));
  stopWith(SIGTERM);
  const std::string log = trace();
  // The current interval's history is read at the start only while the interval lasts.
  const bool sameInterval = started / 300 == now / 300;
  for (const auto& [path, bytes] : damaged) {
    if (path == currentHistory && !sameInterval) {
      continue;
    }
    EXPECT_TRUE(std::filesystem::exists(path + ".bad")) << path;
    // Named by its path (the pattern files' with the directory's trailing '/' doubled).
    const std::string name = std::filesystem::path(path).filename().string();
    EXPECT_TRUE(log.find(name + " does not load") != std::string::npos ||
                log.find(name + " is not a JSON array") != std::string::npos)
        << path;
  }
}

}  // namespace
}  // namespace q7test
