// sm3ctl with the real programs, run the way the agent runs it: "env -i PATH=... /bin/sh
// sm3ctl ..." with SIGINT and SIGTERM blocked, in a directory laid out like an installation.

#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <spawn.h>
#include <sys/utsname.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <functional>
#include <map>
#include <nlohmann/json.hpp>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "tests/support/scratch_dir.h"

extern char** environ;

namespace {

namespace fs = std::filesystem;

// Started through a link named sm3capture or sm3logs, this binary stands in for that program: it
// writes its arguments, one a line, to <name>.args beside the link, keeps its pid file
// while it runs and ends on SIGTERM like the real one. It must be a real executable because
// sm3ctl recognises its processes by the name they were started under. Runs before main, so
// GoogleTest never starts in the stand-in.
const bool kStandInChecked = [] {
  const std::string self = program_invocation_name;
  const std::string name = fs::path(self).filename();
  if (name != "sm3capture" && name != "sm3logs") {
    return true;
  }
  std::ifstream in("/proc/self/cmdline", std::ios::binary);
  std::vector<std::string> args;
  for (std::string arg; std::getline(in, arg, '\0');) {
    args.push_back(arg);
  }
  std::ofstream lines(fs::path(self).parent_path() / (name + ".args"));
  std::string pid_file;
  for (size_t i = 1; i < args.size(); ++i) {
    lines << args[i] << "\n";
    if (args[i - 1] == "--pid-file") {
      pid_file = args[i];
    }
  }
  lines.close();
  sigset_t stop;
  sigemptyset(&stop);
  sigaddset(&stop, SIGTERM);
  sigprocmask(SIG_BLOCK, &stop, nullptr);
  std::ofstream(pid_file) << getpid() << "\n";
  // A minute at most, so that a test that dies before stopping it leaves nothing behind.
  const timespec limit{60, 0};
  sigtimedwait(&stop, nullptr, &limit);
  std::remove(pid_file.c_str());
  _exit(0);
}();

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
  // read(2) rather than a stream: a process that ends between open and read makes the read
  // fail with ESRCH, which libstdc++'s stream buffer turns into an exception.
  std::string stat(512, '\0');
  const int fd = ::open(("/proc/" + std::to_string(pid) + "/stat").c_str(), O_RDONLY | O_CLOEXEC);
  const ssize_t got = fd < 0 ? -1 : ::read(fd, stat.data(), stat.size());
  if (fd >= 0) {
    ::close(fd);
  }
  stat.resize(got > 0 ? static_cast<size_t>(got) : 0);
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
  for (const auto& stop : {std::pair{gen, SIGINT}, std::pair{writer, SIGTERM}}) {
    // Plain variables, not a structured binding: clang 14's lambdas cannot capture one.
    const pid_t pid = stop.first;
    const int signal = stop.second;
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

// A configuration with capture settings; the programs come from bin/, where sm3capture is this
// test's stand-in and the others are the real ones.
class Sm3ctlCaptureTest : public Sm3ctlTest {
 protected:
  void SetUp() override {
    Sm3ctlTest::SetUp();
    fs::create_directories(root_.file("bin"));
    fs::create_symlink(fs::read_symlink("/proc/self/exe"), root_.file("bin/sm3capture"));
    fs::create_symlink(fs::read_symlink("/proc/self/exe"), root_.file("bin/sm3logs"));
    for (const char* program : {"sm3gen", "sm3writer"}) {
      fs::create_symlink(std::string(SM3_BIN_DIR) + "/" + program, root_.file("bin/") + program);
    }
  }
  // Later lines win over the defaults written by the base fixture.
  void Configure(const std::string& lines) {
    std::ofstream(dpx() + "/sm3ctl.conf", std::ios::app) << "BIN_DIR=../../bin\n" << lines;
  }
  // The stand-in's arguments, one a line; empty before it ran.
  std::vector<std::string> CaptureArgs(const std::string& program = "sm3capture") const {
    std::istringstream in(root_.read("bin/" + program + ".args"));
    std::vector<std::string> args;
    for (std::string arg; std::getline(in, arg);) {
      args.push_back(arg);
    }
    return args;
  }
};

// Capture mode runs sm3capture on the configured interface and filter, into the FIFO, with the
// optional settings after the fixed ones; a filter with blanks (and its quotes) is one argument
// while CAPTURE_OPTIONS splits at blanks; status and stop know the program.
TEST_F(Sm3ctlCaptureTest, CaptureModeRunsSm3captureWithItsSettings) {
  Configure(
      "MODE=capture\nINTERFACE=lo\nFILTER='tcp port 8080 and host 10.0.0.1'\nSNAPLEN=512\n"
      "CAPTURE_OPTIONS=--stats 60  --promiscuous\n");
  const Result started = Ctl("start", "collector");
  ASSERT_EQ(0, started.status) << started.output;
  const std::vector<std::string> expected = {"--interface",  "lo",
                                             "--filter",     "tcp port 8080 and host 10.0.0.1",
                                             "--fifo",       dpx() + "/linux/sm3.fifo",
                                             "--pid-file",   pid_files_.at("collector"),
                                             "--snaplen",    "512",
                                             "--stats",      "60",
                                             "--promiscuous"};
  EXPECT_EQ(expected, CaptureArgs());
  const long pid = Pid("collector");
  EXPECT_TRUE(Running(pid));

  const Result status = Ctl("status", "");
  EXPECT_NE(std::string::npos, status.output.find("collector is running (pid " +
                                                  std::to_string(pid) + ", sm3capture)"))
      << status.output;
  const Result again = Ctl("start", "collector");
  EXPECT_EQ(0, again.status);
  EXPECT_NE(std::string::npos, again.output.find("already running")) << again.output;

  const Result stopped = Ctl("stop", "collector");
  EXPECT_EQ(0, stopped.status);
  EXPECT_NE(std::string::npos, stopped.output.find("collector stopped")) << stopped.output;
  EXPECT_EQ(std::string::npos, stopped.output.find("killing")) << stopped.output;
  EXPECT_FALSE(Running(pid));
  EXPECT_FALSE(HasPidFile("collector"));
}

// Access-log mode follows LOG_PATH (relative to the script) with a named format, or a format in
// GoAccess's notation passed whole however many blanks it holds, keeping its position in linux/.
TEST_F(Sm3ctlCaptureTest, AccessLogModeRunsSm3logsWithItsSettings) {
  Configure(
      "MODE=accesslog\nLOG_PATH=logs/access.log\nFORMAT=apache-timed\n"
      "LOGS_OPTIONS=--host shop.example  --server-port 443\n");
  ASSERT_EQ(0, Ctl("start", "collector").status);
  const std::vector<std::string> args = CaptureArgs("sm3logs");
  ASSERT_GE(args.size(), 10u);
  EXPECT_EQ(args[0], "--follow");
  EXPECT_EQ(args[1], dpx() + "/logs/access.log");
  EXPECT_EQ(args[2], "--state");
  EXPECT_EQ(args[3].rfind(dpx() + "/linux/sm3logs_", 0), 0u) << args[3];
  const std::vector<std::string> rest(args.begin() + 4, args.end());
  const std::vector<std::string> expected = {"--fifo",        dpx() + "/linux/sm3.fifo",
                                             "--pid-file",    pid_files_.at("collector"),
                                             "--format",      "apache-timed",
                                             "--host",        "shop.example",
                                             "--server-port", "443"};
  EXPECT_EQ(expected, rest);
  const Result status = Ctl("status", "");
  EXPECT_NE(std::string::npos, status.output.find(", sm3logs)")) << status.output;
  ASSERT_EQ(0, Ctl("stop", "collector").status);
  EXPECT_FALSE(HasPidFile("collector"));

  Configure("LOG_FORMAT='%h %^[%d:%t %^] \"%r\" %s %b %T'\nDATE_FORMAT=%d/%b/%Y\n");
  ASSERT_EQ(0, Ctl("start", "collector").status);
  const std::vector<std::string> custom = CaptureArgs("sm3logs");
  const auto at = std::find(custom.begin(), custom.end(), "--log-format");
  ASSERT_NE(at, custom.end());
  EXPECT_EQ(*(at + 1), "%h %^[%d:%t %^] \"%r\" %s %b %T");
  EXPECT_EQ(*(at + 2), "--date-format");
  EXPECT_EQ(std::find(custom.begin(), custom.end(), "--format"), custom.end());
  ASSERT_EQ(0, Ctl("stop", "collector").status);

  Configure("LOG_PATH=\n");
  const Result refused = Ctl("start", "collector");
  EXPECT_EQ(1, refused.status);
  EXPECT_NE(std::string::npos, refused.output.find("needs LOG_PATH")) << refused.output;
}

// Without FILTER the default web ports are captured; without SNAPLEN or CAPTURE_OPTIONS nothing
// more is passed.
TEST_F(Sm3ctlCaptureTest, DefaultFilterIsTheWebPorts) {
  Configure("MODE=capture\nINTERFACE=eth0\n");
  const Result started = Ctl("start", "collector");
  ASSERT_EQ(0, started.status) << started.output;
  const std::vector<std::string> expected = {"--interface", "eth0",
                                             "--filter",    "tcp port 80 or tcp port 8080",
                                             "--fifo",      dpx() + "/linux/sm3.fifo",
                                             "--pid-file",  pid_files_.at("collector")};
  EXPECT_EQ(expected, CaptureArgs());
}

// The mode may change while a collector runs: start leaves the running one alone (never two
// programs writing into the FIFO) and stop ends whichever program it is.
TEST_F(Sm3ctlCaptureTest, ModeChangeBetweenStartAndStop) {
  Configure("MODE=simulate\n");
  ASSERT_EQ(0, Ctl("start", "analyzer").status);
  ASSERT_EQ(0, Ctl("start", "collector").status);
  const long generator = Pid("collector");
  ASSERT_TRUE(Running(generator));

  Configure("MODE=capture\nINTERFACE=lo\n");
  const Result kept = Ctl("start", "collector");
  EXPECT_EQ(0, kept.status);
  EXPECT_NE(std::string::npos, kept.output.find("already running as sm3gen")) << kept.output;
  EXPECT_TRUE(CaptureArgs().empty());
  EXPECT_EQ(generator, Pid("collector"));
  Result stopped = Ctl("stop", "collector");
  EXPECT_NE(std::string::npos, stopped.output.find("collector stopped")) << stopped.output;
  EXPECT_FALSE(Running(generator));

  // And back: sm3capture started in capture mode is stopped under MODE=simulate.
  ASSERT_EQ(0, Ctl("start", "collector").status);
  const long capture = Pid("collector");
  ASSERT_TRUE(Running(capture));
  Configure("MODE=simulate\n");
  stopped = Ctl("stop", "collector");
  EXPECT_NE(std::string::npos, stopped.output.find("collector stopped")) << stopped.output;
  EXPECT_EQ(std::string::npos, stopped.output.find("killing")) << stopped.output;
  EXPECT_FALSE(Running(capture));
  EXPECT_FALSE(HasPidFile("collector"));
}

// Settings that cannot work are refused before anything starts, naming the key; stop still
// works with them, and bad command lines exit 2.
TEST_F(Sm3ctlCaptureTest, BadSettingsAndCommandsAreRefused) {
  Configure("MODE=capture\n");
  Result refused = Ctl("start", "collector");
  EXPECT_EQ(1, refused.status);
  EXPECT_NE(std::string::npos, refused.output.find("needs INTERFACE")) << refused.output;
  EXPECT_TRUE(CaptureArgs().empty());
  EXPECT_FALSE(HasPidFile("collector"));
  EXPECT_EQ(0, Ctl("stop", "collector").status);

  Configure("INTERFACE=lo\nSNAPLEN=big\n");
  refused = Ctl("start", "collector");
  EXPECT_EQ(1, refused.status);
  EXPECT_NE(std::string::npos, refused.output.find("SNAPLEN")) << refused.output;

  Configure("SNAPLEN=\nFILTER=\n");
  refused = Ctl("start", "collector");
  EXPECT_EQ(1, refused.status);
  EXPECT_NE(std::string::npos, refused.output.find("FILTER")) << refused.output;

  Configure("MODE=replay\n");
  refused = Ctl("start", "collector");
  EXPECT_EQ(1, refused.status);
  EXPECT_NE(std::string::npos, refused.output.find("MODE must be")) << refused.output;
  EXPECT_FALSE(HasPidFile("collector"));

  EXPECT_EQ(2, Ctl("start", "everything").status);
  EXPECT_EQ(2, Ctl("restart", "analyzer").status);
}

}  // namespace
