// q7ctl top in a real terminal: tmux runs it against an agent stand-in, the test reads the
// screen with capture-pane and presses keys with send-keys.

#include <gtest/gtest.h>
#include <httplib.h>
#include <unistd.h>

#include <chrono>
#include <string>
#include <thread>
#include <vector>

#include "framework/mutex.h"
#include "tests/support/child_process.h"
#include "tests/support/scratch_dir.h"
#include "tests/support/test_util.h"

namespace {

using namespace std::chrono_literals;

// The interval holds Shop (busy, quick) and Intranet (quiet, slow); the summary only Archive.
constexpr char kIntervalApps[] = R"({"table": "Q7APPCS", "rows": [
  {"applicatin": "Shop", "totreq": 900, "pcgood": 99500, "pcslow": 500, "pcfail": 0,
   "pcavail": 100000, "oatime": 120},
  {"applicatin": "Intranet", "totreq": 10, "pcgood": 50000, "pcslow": 40000, "pcfail": 10000,
   "pcavail": 90000, "oatime": 2400}]})";
constexpr char kIntervalLatency[] = R"({"rows": [
  {"application": "Shop", "transaction": "Catalog", "requests": 900, "p50_ms": 100.0,
   "p95_ms": 180.0, "p99_ms": 250.0, "max_ms": 900.0, "apdex": 0.99, "threshold_ms": 250},
  {"application": "Intranet", "transaction": "Pages", "requests": 10, "p50_ms": 2000.0,
   "p95_ms": 6000.0, "p99_ms": 7000.0, "max_ms": 7100.0, "apdex": 0.55,
   "threshold_ms": 2000}]})";
constexpr char kSummaryApps[] = R"({"table": "Q7APPSM", "rows": [
  {"applicatin": "Archive", "totreq": 5, "pcgood": 100000, "pcslow": 0, "pcfail": 0,
   "pcavail": 100000, "oatime": 80}]})";

class FakeAgent {
 public:
  FakeAgent() {
    server_.Get(R"(/api/v1/tables/(Q7APPCS|Q7APPSM))",
                [this](const httplib::Request& req, httplib::Response& res) {
                  Count(req.matches[1]);
                  res.set_content(req.matches[1] == "Q7APPCS" ? kIntervalApps : kSummaryApps,
                                  "application/json");
                });
    server_.Get("/api/v1/latency", [](const httplib::Request& req, httplib::Response& res) {
      res.set_content(
          req.get_param_value("window") == "interval" ? kIntervalLatency : R"({"rows": []})",
          "application/json");
    });
    port_ = server_.bind_to_any_port("127.0.0.1");
    thread_ = std::thread([this] { server_.listen_after_bind(); });
    q7test::PollUntil([this] { return server_.is_running(); }, 5s);
  }
  ~FakeAgent() {
    server_.stop();
    thread_.join();
  }
  std::string url() const { return "http://127.0.0.1:" + std::to_string(port_); }
  int summaries() {
    fw::MutexLock lock(mutex_);
    return summaries_;
  }

 private:
  void Count(const std::string& table) {
    fw::MutexLock lock(mutex_);
    summaries_ += table == "Q7APPSM" ? 1 : 0;
  }

  httplib::Server server_;
  int port_ = 0;
  std::thread thread_;
  fw::Mutex mutex_;
  int summaries_ GUARDED_BY(mutex_) = 0;
};

// A tmux server of the test's own, so that nobody's sessions are touched.
class Tmux {
 public:
  explicit Tmux(const std::string& dir) : dir_(dir), socket_("q7top" + std::to_string(getpid())) {}
  ~Tmux() { Run({"kill-server"}); }

  int Run(const std::vector<std::string>& args, std::string* out = nullptr) {
    std::vector<std::string> argv = {"/usr/bin/tmux", "-L", socket_};
    argv.insert(argv.end(), args.begin(), args.end());
    return q7test::RunToEnd(argv, dir_ + "tmux.out", dir_ + "tmux.err", out, nullptr, 10s);
  }
  std::string Screen() {
    std::string out;
    Run({"capture-pane", "-p", "-t", "top"}, &out);
    return out;
  }
  bool Shows(const std::string& text) {
    return q7test::PollUntil([&] { return Screen().find(text) != std::string::npos; }, 10s);
  }

 private:
  const std::string dir_;
  const std::string socket_;
};

TEST(Q7ctlTopTest, LiveScreenFollowsTheKeys) {
  if (access("/usr/bin/tmux", X_OK) != 0) {
    GTEST_SKIP() << "tmux is not installed (make deps installs it)";
  }
  q7test::ScratchDir scratch;
  FakeAgent agent;
  Tmux tmux(scratch.path() + "/");
  ASSERT_EQ(0, tmux.Run({"new-session", "-d", "-s", "top", "-x", "120", "-y", "30",
                         std::string(Q7CTL_PATH) + " --url " + agent.url() +
                             " --token t top --interval 0.2"}));
  ASSERT_TRUE(tmux.Shows("Applications, busiest first")) << tmux.Screen();
  std::string screen = tmux.Screen();
  EXPECT_NE(std::string::npos, screen.find("current interval")) << screen;
  ASSERT_NE(std::string::npos, screen.find("Intranet")) << screen;
  EXPECT_LT(screen.find("Shop"), screen.find("Intranet")) << screen;
  EXPECT_NE(std::string::npos, screen.find("99.5%")) << screen;

  tmux.Run({"send-keys", "-t", "top", "s"});
  ASSERT_TRUE(tmux.Shows("Applications, slowest first")) << tmux.Screen();
  screen = tmux.Screen();
  EXPECT_LT(screen.find("Intranet"), screen.find("Shop")) << screen;

  tmux.Run({"send-keys", "-t", "top", "w"});
  ASSERT_TRUE(tmux.Shows("Archive")) << tmux.Screen();
  EXPECT_NE(std::string::npos, tmux.Screen().find("summary period"));
  EXPECT_GT(agent.summaries(), 0);

  // q ends q7ctl, and with it the session's only window.
  tmux.Run({"send-keys", "-t", "top", "q"});
  EXPECT_TRUE(q7test::PollUntil(
      [&] {
        return tmux.Run({"has-session", "-t", "top"}) != 0;
      },
      10s))
      << tmux.Screen();
}

}  // namespace
