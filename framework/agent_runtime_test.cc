// Identity, registration, the main loop and the HTTP server of the framework runtime.

#include "framework/agent_runtime.h"

#include <gtest/gtest.h>
#include <httplib.h>
#include <sys/utsname.h>

#include <atomic>
#include <cstring>
#include <future>
#include <nlohmann/json.hpp>
#include <string>

#include "framework/http_server.h"
#include "framework/status.h"
#include "tests/support/scratch_dir.h"

namespace fw {
namespace {

class AgentRuntimeTest : public ::testing::Test {
 protected:
  void SetUp() override { ResetRuntimeForTesting(); }
  void TearDown() override { ResetRuntimeForTesting(); }

  void fakeNodeName(const std::string& name) {
    SetUnameForTesting([name](struct utsname* u) {
      std::memset(u, 0, sizeof(*u));
      std::strncpy(u->nodename, name.c_str(), sizeof(u->nodename) - 1);
      return 0;
    });
  }
};

// The product code answers the build's version and node type; other codes are refused.
TEST_F(AgentRuntimeTest, VersionAndNodeTypeFromProductCode) {
  char ver[10];
  std::memset(ver, 'x', sizeof(ver));
  ASSERT_EQ(kOk, SetVersionFromProductCode("Q7", ver, sizeof(ver)));
  EXPECT_STREQ("01.00.00", ver);
  char tiny[4];
  ASSERT_EQ(kOk, SetVersionFromProductCode("Q7", tiny, sizeof(tiny)));
  EXPECT_STREQ("01.", tiny);
  EXPECT_EQ(kInvalidArgument, SetVersionFromProductCode("Q8", ver, sizeof(ver)));
  EXPECT_EQ(kOk, SetNodeTypeFromProductCode("Q7"));
  EXPECT_EQ("Q7", NodeType());
}

// The local host lookup and the origin node follow the injected node name and their limits.
TEST_F(AgentRuntimeTest, HostLookupsUseInjectedNodeName) {
  fakeNodeName("hostA.part2.example");
  char buf[8];
  ASSERT_EQ(kOk, DetermineLocalHost(buf, sizeof(buf)));
  EXPECT_STREQ("hostA.p", buf);  // cut to fit, terminated
  unsetenv("Q7_NODE_NAME");
  EXPECT_EQ("hostA:Q7", OriginNodeName());
  SetHostName("abcdefghijklmnopqrstuvwxyzABCDEFGHIJ");
  EXPECT_EQ(32u, OriginNodeName().size());
  setenv("Q7_NODE_NAME", "node1:Q7", 1);
  EXPECT_EQ("node1:Q7", OriginNodeName());
  unsetenv("Q7_NODE_NAME");
}

// Commands go to the callback whose prefix starts them; the capsule is marked finished.
TEST_F(AgentRuntimeTest, CommandsRouteByPrefix) {
  static int calls = 0;
  calls = 0;
  RegisterCommandCallback("KQ7", [](CtunaAutomationCapsule* c) {
    ++calls;
    return ctuna::FinishedAutomationCommand(c) == kOk ? 1 : 0;
  });
  CtunaAutomationCapsule mine{"KQ7 restart", false};
  EXPECT_EQ(1, DispatchCommand(&mine));
  EXPECT_TRUE(mine.finished);
  CtunaAutomationCapsule other{"KQ8 restart", false};
  EXPECT_EQ(kNotFound, DispatchCommand(&other));
  EXPECT_FALSE(other.finished);
  EXPECT_EQ(1, calls);
  EXPECT_EQ(kInvalidArgument, ctuna::FinishedAutomationCommand(nullptr));
}

TEST(HttpServerTest, ParsesAddresses) {
  std::string host;
  int port = -1;
  EXPECT_TRUE(HttpServer::ParseAddress("127.0.0.1:7420", &host, &port));
  EXPECT_EQ("127.0.0.1", host);
  EXPECT_EQ(7420, port);
  EXPECT_TRUE(HttpServer::ParseAddress("[::1]:0", &host, &port));
  EXPECT_EQ("::1", host);
  EXPECT_EQ(0, port);
  for (const char* bad : {"", "7420", "host:", ":80", "host:99999", "host:8a", "host:123456"}) {
    EXPECT_FALSE(HttpServer::ParseAddress(bad, &host, &port)) << bad;
  }
}

// The main loop calls the loader, serves the API and returns 0 on a shutdown request.
TEST_F(AgentRuntimeTest, MainLoopServesUntilShutdown) {
  q7test::ScratchDir scratch;
  const std::string home = scratch.path() + "/";
  setenv("Q7_HOME", home.c_str(), 1);
  setenv("Q7_HTTP_ADDRESS", "127.0.0.1:0", 1);
  static std::atomic<bool> loaded{false};
  loaded = false;
  RegisterAgentLoader([] {
    loaded = true;
    return 0;
  });
  SetHealthProvider([](nlohmann::json& h) { h["analyzer"] = "testing"; });
  auto result = std::async(std::launch::async, [] { return kunmain(0, nullptr); });

  std::string address;
  for (int i = 0; i < 500 && address.empty(); ++i) {
    FILE* f = fopen((home + "logs/q7agent.addr").c_str(), "r");
    if (f != nullptr) {
      char line[128] = {};
      if (fgets(line, sizeof(line), f) != nullptr && std::strchr(line, '\n') != nullptr) {
        address.assign(line, std::strcspn(line, "\n"));
      }
      fclose(f);
    }
    usleep(10000);
  }
  ASSERT_FALSE(address.empty());
  EXPECT_TRUE(loaded);
  httplib::Client client("http://" + address);
  auto res = client.Get("/healthz");
  ASSERT_TRUE(res);
  EXPECT_EQ(200, res->status);
  EXPECT_EQ("testing", nlohmann::json::parse(res->body).value("analyzer", ""));
  res = client.Get("/nothing");
  ASSERT_TRUE(res);
  EXPECT_EQ(404, res->status);
  EXPECT_TRUE(nlohmann::json::parse(res->body).contains("error"));

  RequestShutdown(1);
  ASSERT_EQ(std::future_status::ready, result.wait_for(std::chrono::seconds(5)));
  EXPECT_EQ(0, result.get());
  EXPECT_TRUE(ShutdownRequested());
  unsetenv("Q7_HOME");
  unsetenv("Q7_HTTP_ADDRESS");
}

}  // namespace
}  // namespace fw
