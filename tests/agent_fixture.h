#pragma once

// Test fixture for end-to-end tests: the real q7agent in a temporary home, started with an
// environment that keeps it self-contained (free port, no collector processes, every trace
// class into the home's log), and helpers to read its HTTP API.

#include <gtest/gtest.h>
#include <httplib.h>
#include <sys/wait.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <map>
#include <memory>
#include <nlohmann/json.hpp>
#include <string>
#include <vector>

#include "tests/agent_process.h"
#include "tests/support/catch_all_pattern.h"

namespace q7test {

using namespace std::chrono_literals;

class AgentE2ETest : public ::testing::Test {
 protected:
  std::map<std::string, std::string> env() const {
    std::map<std::string, std::string> vars = {
        {"Q7_HOME", home_.path()}, {"Q7_HTTP_ADDRESS", "127.0.0.1:0"},
        {"Q7_TRACE", "*=ALL"},     {"Q7_TRACE_FILE", ""},
        {"DPX_NOSTART", ""},       {"TZ", "UTC"}};
    for (const auto& [name, value] : extraEnv_) {
      vars[name] = value;  // a test's own setting wins over the defaults above
    }
    if (superviseCollector_) {
      vars.erase("DPX_NOSTART");
    }
    return vars;
  }
  std::string tracePath() const { return home_.path() + "logs/q7agent.log"; }
  std::string trace() const { return readFile(tracePath()); }
  std::string base() const { return home_.path() + "zorvan6/"; }

  // Points the agent's collector data directory at <home>data (created); returns it with no
  // trailing '/'.
  std::string useDataDirectory() {
    const std::string data = home_.path() + "data";
    home_.writeFile("config/" + shortHostName() + "_q7.cfg",
                    "[AGENT]\nKQ7DPXLOGPATH=" + data + "\n");
    std::filesystem::create_directories(data);
    return data;
  }

  // Starts one catch-all situation on the transaction pattern table, as an operator does: over
  // the API, on an agent started for the purpose and stopped again, so that the situation (kept
  // across restarts) is in place before the test's own start. It keeps every application and
  // transaction name and collects every instance. The agent reads the data directory meanwhile:
  // call this before the test writes data.
  void registerCatchAllPattern() {
    const bool supervise = superviseCollector_;
    superviseCollector_ = false;
    const std::string address = start();
    const std::string body = CatchAllPatternBody(10000000, 1);
    std::string reply;
    const int status = send(address, "PUT", "/api/v1/situations/everything", body, token(), &reply);
    EXPECT_TRUE(status == 200 || status == 201) << status << " " << reply;
    stopWith(SIGTERM);
    superviseCollector_ = supervise;
  }

  // The bearer token the agent created at its first start.
  std::string token() const {
    std::string t = readFile(home_.path() + "config/q7_api_token");
    while (!t.empty() && (t.back() == '\n' || t.back() == ' ')) {
      t.pop_back();
    }
    return t;
  }
  // A request with an optional bearer token; its status and body.
  int send(const std::string& address, const std::string& method, const std::string& path,
           const std::string& body, const std::string& bearer, std::string* reply = nullptr) {
    httplib::Client client("http://" + address);
    client.set_connection_timeout(2);
    httplib::Headers headers;
    if (!bearer.empty()) {
      headers.emplace("Authorization", "Bearer " + bearer);
    }
    const auto res = method == "PUT" ? client.Put(path.c_str(), headers, body, "application/json")
                                     : client.Delete(path.c_str(), headers);
    if (!res) {
      return -1;
    }
    if (reply != nullptr) {
      *reply = res->body;
    }
    return res->status;
  }
  // The sum of totreq over a sample's rows.
  static long totalRequests(const nlohmann::json& body) {
    long sum = 0;
    for (const auto& row : body["rows"]) {
      sum += row["totreq"].get<long>();
    }
    return sum;
  }

  // Installs the collector control script in the agent's home with `conf` as its sm3ctl.conf,
  // and has the agent supervise the collector processes from its next start.
  void superviseCollectorWith(const std::string& conf) {
    const std::string dpx = base() + "dpx/";
    std::filesystem::create_directories(dpx + "linux");
    std::filesystem::copy_file(SM3CTL_PATH, dpx + "sm3ctl");
    std::filesystem::permissions(dpx + "sm3ctl", std::filesystem::perms::owner_all,
                                 std::filesystem::perm_options::add);
    std::ofstream(dpx + "sm3ctl.conf") << conf;
    superviseCollector_ = true;
  }

  // A failed supervised test leaves no collector process behind: the agent would have stopped
  // them, and they run in sessions of their own.
  void TearDown() override {
    const std::string ctl = base() + "dpx/sm3ctl";
    if (!superviseCollector_ || !std::filesystem::exists(ctl)) {
      return;
    }
    agent_.reset();
    for (const char* target : {"collector", "analyzer"}) {
      const std::string command = "/bin/sh " + ctl + " stop " + target + " >/dev/null 2>&1";
      EXPECT_NE(-1, std::system(command.c_str()));
    }
  }

  // Starts the agent and waits until its API answers; returns the bound address.
  std::string start() {
    std::remove((home_.path() + "logs/q7agent.addr").c_str());
    agent_ = std::make_unique<AgentProcess>(std::vector<std::string>{}, env());
    std::string address;
    const bool up = waitFor(
        [&] {
          address = readFile(home_.path() + "logs/q7agent.addr");
          if (address.empty() || address.back() != '\n') {
            return false;
          }
          address.pop_back();
          return true;
        },
        10s);
    EXPECT_TRUE(up) << trace();
    return address;
  }

  nlohmann::json get(const std::string& address, const std::string& path, int* status) {
    httplib::Client client("http://" + address);
    client.set_connection_timeout(2);
    auto res = client.Get(path.c_str());
    if (!res) {
      *status = -1;
      return {};
    }
    *status = res->status;
    return nlohmann::json::parse(res->body, nullptr, false);
  }

  // Waits until the agent has read the data file `file` to its end and finished with every
  // transaction it queued: from then on its tables change only when a file grows. The monitor
  // may leave a final line end unread, so one byte short of the end counts as the end; an
  // offset beyond the end is that of an older file by the same name (renamed since).
  bool waitForIntakeIdle(const std::string& address, const std::string& file,
                         std::chrono::milliseconds timeout) {
    nlohmann::json counters;
    const bool idle = waitFor(
        [&] {
          int status = 0;
          counters = get(address, "/api/v1/agent", &status)["counters"];
          std::error_code ec;
          const auto size = static_cast<long long>(std::filesystem::file_size(file, ec));
          const auto number = [&](const char* name) { return counters.value(name, -1LL); };
          const long long queued =
              number("records_read") - number("records_unparsed") - number("outliers_dropped");
          return status == 200 && !ec && counters.value("file", "") == file &&
                 number("offset") >= size - 1 && number("offset") <= size &&
                 number("queue_depth") == 0 && number("transactions_taken") == queued;
        },
        timeout);
    EXPECT_TRUE(idle) << "intake not idle on " << file << ": " << counters.dump();
    return idle;
  }

  // Sends sig and checks the exit status 0 within 2 seconds.
  void stopWith(int sig) {
    const auto sent = std::chrono::steady_clock::now();
    agent_->signal(sig);
    const auto status = agent_->wait(5s);
    ASSERT_TRUE(status.has_value()) << "agent did not exit";
    EXPECT_LT(std::chrono::steady_clock::now() - sent, 2s);
    ASSERT_TRUE(WIFEXITED(*status)) << "status " << *status;
    EXPECT_EQ(0, WEXITSTATUS(*status));
  }

  // The body of a GET as text (CSV replies).
  std::string getText(const std::string& address, const std::string& path) {
    httplib::Client client("http://" + address);
    auto res = client.Get(path.c_str());
    return res ? res->body : std::string();
  }

  TempHome home_;
  std::unique_ptr<AgentProcess> agent_;
  std::map<std::string, std::string> extraEnv_;
  bool superviseCollector_ = false;  // true: the agent starts and stops the collector processes
};

}  // namespace q7test
