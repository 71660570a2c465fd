// ServiceMonitor with a fake control script and short pauses: restarting a dead process at the
// next poll, prompt stops, and the stop command when the pid file is missing.

#include "tama/service_monitor.h"

#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <fstream>
#include <string>
#include <thread>

#include "tests/support/scratch_dir.h"
#include "tests/support/test_util.h"

namespace {

using Clock = std::chrono::steady_clock;
using namespace std::chrono_literals;

class ServiceMonitorTest : public ::testing::Test {
 protected:
  // A control script whose start does startBody and whose stop logs and removes the pid file.
  void writeScript(const std::string& startBody) {
    std::ofstream(script_) << "case \"$1\" in\n"
                           << "start) echo start >> " << log_ << "; " << startBody << " ;;\n"
                           << "stop) echo stop >> " << log_ << "; rm -f " << pidFile_ << " ;;\n"
                           << "esac\n";
  }
  void writePid(long pid) { std::ofstream(pidFile_) << pid << "\n"; }
  std::string log() const { return dir_.read("log"); }
  bool waitForLog(const std::string& text, std::chrono::milliseconds timeout) {
    const auto deadline = Clock::now() + timeout;
    while (log() != text && Clock::now() < deadline) {
      std::this_thread::sleep_for(20ms);
    }
    return log() == text;
  }
  // Waits until the monitor has done `count` polls in all.
  static bool waitForPolls(const ServiceMonitor& m, long count, std::chrono::milliseconds timeout) {
    return q7test::PollUntil([&] { return m.pollsDone() >= count; }, timeout);
  }
  std::unique_ptr<ServiceMonitor> monitor(long interval) {
    return std::make_unique<ServiceMonitor>(pidFile_.c_str(), "/bin/sh", startArgv_, "/bin/sh",
                                            stopArgv_, envp_, interval);
  }
  static long deadPid() {
    const pid_t child = fork();
    if (child == 0) {
      _exit(0);
    }
    waitpid(child, nullptr, 0);
    return child;
  }

  q7test::ScratchDir dir_;
  std::string script_ = dir_.file("sm3ctl");
  std::string log_ = dir_.file("log");
  std::string pidFile_ = dir_.file("zelt.pid");
  std::string sh_ = "/bin/sh";
  std::string start_ = "start";
  std::string stop_ = "stop";
  std::string which_ = "collector";
  std::string path_ = "PATH=/bin:/sbin:/usr/bin:/usr/sbin";
  char* startArgv_[5] = {sh_.data(), script_.data(), start_.data(), which_.data(), nullptr};
  char* stopArgv_[5] = {sh_.data(), script_.data(), stop_.data(), which_.data(), nullptr};
  char* envp_[2] = {path_.data(), nullptr};
};

// A pid file naming a dead process gets the start command at once and again at the next poll
// after the process died; at the stop a live process gets the stop command.
TEST_F(ServiceMonitorTest, DeadPidIsRestartedAtTheNextPoll) {
  writeScript("echo " + std::to_string(getpid()) + " > " + pidFile_);
  writePid(deadPid());
  auto m = monitor(1);
  m->startMonitoring();
  EXPECT_TRUE(waitForLog("start\n", 2s)) << log();
  ASSERT_TRUE(waitForPolls(*m, m->pollsDone() + 2, 5s));
  EXPECT_EQ("start\n", log());  // alive: polls start nothing
  writePid(deadPid());
  EXPECT_TRUE(waitForLog("start\nstart\n", 3s)) << log();
  m->stopMonitoring();
  EXPECT_EQ("start\nstart\nstop\n", log());
  EXPECT_EQ(0, m->getPID());  // the stop removed the pid file
}

// A stop during a long pause returns at once, after one run of the stop command.
TEST_F(ServiceMonitorTest, StopDuringAPauseReturnsAtOnce) {
  writeScript("true");
  writePid(getpid());
  auto m = monitor(60);
  m->startMonitoring();
  ASSERT_TRUE(waitForPolls(*m, 1, 5s));  // in its first pause
  const auto asked = Clock::now();
  m->stopMonitoring();
  EXPECT_LT(Clock::now() - asked, 5s);
  EXPECT_EQ("stop\n", log());
}

// Without a pid file the process counts as dead for starting, yet the stop command still runs
// (pid 0 tests the agent's own process group).
TEST_F(ServiceMonitorTest, MissingPidFileStillRunsTheStopCommand) {
  writeScript("true");
  auto m = monitor(60);
  m->startMonitoring();
  EXPECT_TRUE(waitForLog("start\n", 2s)) << log();
  m->stopMonitoring();
  EXPECT_EQ("start\nstop\n", log());
  EXPECT_EQ(0, m->getPID());
}

// A stop that arrives while the start command runs makes the next pause return at once.
TEST_F(ServiceMonitorTest, StopDuringTheStartCommandEndsAfterIt) {
  writeScript("sleep 1");
  auto m = monitor(60);
  m->startMonitoring();
  ASSERT_TRUE(waitForLog("start\n", 2s));  // the start command runs
  const auto asked = Clock::now();
  m->stopMonitoring();
  const auto took = Clock::now() - asked;
  EXPECT_GT(took, 300ms);  // it waited for the start command
  EXPECT_LT(took, 5s);     // but not for the 60-second pause
  EXPECT_EQ("start\nstop\n", log());
}

// getPID reads the leading number; garbage and a missing file give 0.
TEST_F(ServiceMonitorTest, ReadsThePidFile) {
  auto m = monitor(1);
  EXPECT_EQ(0, m->getPID());
  std::ofstream(pidFile_) << "4321 trailing";
  EXPECT_EQ(4321, m->getPID());
  std::ofstream(pidFile_) << "garbage";
  EXPECT_EQ(0, m->getPID());
  ServiceMonitor none(nullptr, "/bin/sh", startArgv_, "/bin/sh", stopArgv_, envp_, 1);
  EXPECT_EQ(0, none.getPID());
}

}  // namespace
