// sm3ctl with the real programs, run the way the agent runs it: "env -i PATH=... /bin/sh
// sm3ctl ..." with SIGINT and SIGTERM blocked, in a directory laid out like an installation.

#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <spawn.h>
#include <sys/utsname.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <functional>
#include <map>
#include <nlohmann/json.hpp>
#include <string>
#include <thread>
#include <vector>

#include "tests/support/scratch_dir.h"

extern char** environ;

namespace {

namespace fs = std::filesystem;

struct Result {
  int status = -1;  // exit status, -1 when it did not exit normally
  std::string output;
};

// Polls until done() holds or the deadline passes.
bool WaitFor(const std::function<bool()>& done, std::chrono::milliseconds limit) {
  const auto deadline = std::chrono::steady_clock::now() + limit;
  while (!done()) {
    if (std::chrono::steady_clock::now() > deadline) {
      return false;
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
  }
  return true;
}

// A live process, zombies excluded (nobody may reap the orphaned collector processes here).
bool Running(long pid) {
  std::ifstream in("/proc/" + std::to_string(pid) + "/stat");
  std::string stat((std::istreambuf_iterator<char>(in)), {});
  const size_t paren = stat.rfind(')');
  return paren != std::string::npos && paren + 2 < stat.size() && stat[paren + 2] != 'Z';
}

class Sm3ctlTest : public ::testing::Test {
 protected:
  void SetUp() override {
    fs::create_directories(dpx() + "/linux");
    fs::copy_file(SM3CTL_PATH, dpx() + "/sm3ctl");
    std::ofstream(dpx() + "/sm3ctl.conf")
        << "# as installed, with small files\nMODE=simulate\nDATA_DIR=data\nRATE=1000\n"
        << "ROLL_BYTES=40000\nROLL_SECONDS=3600\nBIN_DIR=" << SM3_BIN_DIR
        << "\nTRUTH_DIR=truth\nSEED=5\n";
    struct utsname names {};
    uname(&names);
    const std::string agent = std::string(names.nodename).substr(0, 24);
    pid_files_ = {{"analyzer", dpx() + "/linux/zolt414_" + agent + ".pid"},
                  {"collector", dpx() + "/linux/zelt_" + agent + ".pid"}};
  }
  void TearDown() override {
    Ctl("stop", "collector");
    Ctl("stop", "analyzer");
  }

  std::string dpx() const { return root_.file("zorvan6/dpx"); }

  // Starts a program with SIGINT and SIGTERM blocked and SIGINT ignored, as a program started
  // by the agent through a shell finds them; output goes to out.
  static pid_t Spawn(std::vector<std::string> args, const std::string& out) {
    std::vector<char*> argv;
    for (std::string& arg : args) {
      argv.push_back(arg.data());
    }
    argv.push_back(nullptr);
    posix_spawnattr_t attr;
    posix_spawnattr_init(&attr);
    sigset_t blocked;
    sigemptyset(&blocked);
    sigaddset(&blocked, SIGINT);
    sigaddset(&blocked, SIGTERM);
    posix_spawnattr_setsigmask(&attr, &blocked);
    posix_spawnattr_setflags(&attr, POSIX_SPAWN_SETSIGMASK);
    posix_spawn_file_actions_t files;
    posix_spawn_file_actions_init(&files);
    posix_spawn_file_actions_addopen(&files, 1, out.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
    posix_spawn_file_actions_adddup2(&files, 1, 2);
    // An ignored signal stays ignored across exec.
    struct sigaction ignore {
    }, saved{};
    ignore.sa_handler = SIG_IGN;
    sigaction(SIGINT, &ignore, &saved);
    pid_t child = -1;
    if (posix_spawn(&child, argv[0], &files, &attr, argv.data(), environ) != 0) {
      child = -1;
    }
    sigaction(SIGINT, &saved, nullptr);
    posix_spawn_file_actions_destroy(&files);
    posix_spawnattr_destroy(&attr);
    return child;
  }

  // Runs sm3ctl with a bare environment, as the agent does.
  Result Ctl(const std::string& action, const std::string& target) {
    const std::string out = root_.file("ctl.out");
    std::vector<std::string> args = {
        "/usr/bin/env",    "-i",  "PATH=/bin:/sbin:/usr/bin:/usr/sbin", "/bin/sh",
        dpx() + "/sm3ctl", action};
    if (!target.empty()) {
      args.push_back(target);
    }
    Result result;
    const pid_t child = Spawn(args, out);
    int status = 0;
    if (child > 0 && waitpid(child, &status, 0) == child && WIFEXITED(status)) {
      result.status = WEXITSTATUS(status);
    }
    result.output = root_.read("ctl.out");
    return result;
  }

  long Pid(const std::string& target) const {
    std::ifstream in(pid_files_.at(target));
    long pid = 0;
    return in >> pid ? pid : 0;
  }
  bool HasPidFile(const std::string& target) const { return fs::exists(pid_files_.at(target)); }

  // Records per tag in every data file, and the total.
  std::map<std::string, int64_t> Records() const {
    std::map<std::string, int64_t> count;
    for (const auto& entry : fs::directory_iterator(dpx() + "/data")) {
      std::ifstream in(entry.path());
      std::string line;
      while (std::getline(in, line)) {
        const size_t close = line.find('>');
        ++count[line.substr(1, close - 1)];
        ++count["all"];
      }
    }
    return count;
  }
  nlohmann::json Truth(const std::string& name) const {
    return nlohmann::json::parse(root_.read("zorvan6/dpx/truth/" + name));
  }

  q7test::ScratchDir root_;
  std::map<std::string, std::string> pid_files_;
};

// The agent's whole supervision cycle: start both, records flow, a killed writer is replaced,
// stop leaves nothing behind, and the writer's truth matches what reached the files.
TEST_F(Sm3ctlTest, SupervisionCycle) {
  // A pid file naming some other live program is stale.
  std::ofstream(pid_files_.at("analyzer")) << getpid() << "\n";
  Result started = Ctl("start", "analyzer");
  ASSERT_EQ(0, started.status) << started.output;
  EXPECT_NE(std::string::npos, started.output.find("stale")) << started.output;
  started = Ctl("start", "collector");
  ASSERT_EQ(0, started.status) << started.output;
  const long writer = Pid("analyzer");
  EXPECT_NE(getpid(), writer);
  EXPECT_TRUE(Running(writer));
  EXPECT_TRUE(Running(Pid("collector")));
  EXPECT_TRUE(fs::is_fifo(dpx() + "/linux/sm3.fifo"));

  const Result again = Ctl("start", "analyzer");
  EXPECT_EQ(0, again.status);
  EXPECT_NE(std::string::npos, again.output.find("already running")) << again.output;
  EXPECT_EQ(writer, Pid("analyzer"));

  ASSERT_TRUE(WaitFor([&] { return Records()["all"] >= 300; }, std::chrono::seconds(10)));
  EXPECT_TRUE(fs::exists(dpx() + "/data/traffic-0001.sm3"));

  // A killed writer leaves its pid file behind; start replaces it.
  kill(static_cast<pid_t>(writer), SIGKILL);
  ASSERT_TRUE(WaitFor([&] { return !Running(writer); }, std::chrono::seconds(5)));
  EXPECT_TRUE(HasPidFile("analyzer"));
  const int64_t before = Records()["all"];
  started = Ctl("start", "analyzer");
  ASSERT_EQ(0, started.status) << started.output;
  const long second = Pid("analyzer");
  EXPECT_NE(writer, second);
  EXPECT_TRUE(Running(second));
  ASSERT_TRUE(WaitFor([&] { return Records()["all"] >= before + 300; }, std::chrono::seconds(10)));

  // Stopped with their signals blocked by their parent, they still stop.
  const long collector = Pid("collector");
  for (const char* target : {"collector", "analyzer"}) {
    const Result stop = Ctl("stop", target);
    EXPECT_EQ(0, stop.status);
    EXPECT_EQ(std::string::npos, stop.output.find("killing")) << stop.output;
  }
  EXPECT_FALSE(Running(collector));
  EXPECT_FALSE(Running(second));
  EXPECT_FALSE(HasPidFile("analyzer"));
  EXPECT_FALSE(HasPidFile("collector"));
  const Result stopped = Ctl("stop", "analyzer");
  EXPECT_EQ(0, stopped.status);
  EXPECT_NE(std::string::npos, stopped.output.find("not running")) << stopped.output;

  // The second writer's truth covers what it appended: everything after the kill.
  const auto records = Records();
  const nlohmann::json truth = Truth("sm3writer.json");
  EXPECT_EQ(records.at("all") - before, truth["records"]);
  int64_t by_kind = 0;
  for (const auto& [tag, count] : truth["by_kind"].items()) {
    by_kind += count.get<int64_t>();
  }
  EXPECT_EQ(truth["records"], by_kind);
  // The capture process wrote at least what reached the files (the kill lost some in flight).
  EXPECT_GE(Truth("sm3gen.json")["records"].get<int64_t>(), records.at("all"));
}

// Both programs undo the blocked and ignored stop signals they inherit: SIGINT and SIGTERM end
// them in order, with exit status 0 and their pid files gone.
TEST_F(Sm3ctlTest, ProgramsStopThoughStartedWithStopSignalsBlocked) {
  const std::string fifo = root_.file("fifo");
  const std::string writer_pid = root_.file("writer.pid");
  const std::string gen_pid = root_.file("gen.pid");
  const pid_t writer = Spawn({std::string(SM3_BIN_DIR) + "/sm3writer", "--fifo", fifo, "--data-dir",
                              root_.file("direct"), "--pid-file", writer_pid},
                             root_.file("writer.log"));
  const pid_t gen = Spawn({std::string(SM3_BIN_DIR) + "/sm3gen", "--live", "--rate", "500",
                           "--fifo", fifo, "--pid-file", gen_pid},
                          root_.file("gen.log"));
  ASSERT_GT(writer, 0);
  ASSERT_GT(gen, 0);
  ASSERT_TRUE(WaitFor([&] { return fs::exists(writer_pid) && fs::exists(gen_pid); },
                      std::chrono::seconds(5)));
  ASSERT_TRUE(WaitFor([&] { return fs::file_size(root_.file("direct/traffic.sm3")) > 0; },
                      std::chrono::seconds(5)));
  for (const auto& [pid, signal] : {std::pair{gen, SIGINT}, std::pair{writer, SIGTERM}}) {
    kill(pid, signal);
    int status = -1;
    const bool ended =
        WaitFor([&] { return waitpid(pid, &status, WNOHANG) == pid; }, std::chrono::seconds(5));
    if (!ended) {
      kill(pid, SIGKILL);
      waitpid(pid, &status, 0);
    }
    EXPECT_TRUE(ended) << "pid " << pid << " ignored signal " << signal;
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << status;
  }
  EXPECT_FALSE(fs::exists(writer_pid));
  EXPECT_FALSE(fs::exists(gen_pid));
  EXPECT_EQ('\n', root_.read("direct/traffic.sm3").back());
}

TEST_F(Sm3ctlTest, CaptureModeAndBadCommandsAreRefused) {
  std::ofstream(dpx() + "/sm3ctl.conf", std::ios::app) << "MODE=capture\n";
  const Result capture = Ctl("start", "collector");
  EXPECT_EQ(1, capture.status);
  EXPECT_NE(std::string::npos, capture.output.find("not available")) << capture.output;
  EXPECT_FALSE(HasPidFile("collector"));
  EXPECT_EQ(2, Ctl("start", "everything").status);
  EXPECT_EQ(2, Ctl("restart", "analyzer").status);
}

}  // namespace
