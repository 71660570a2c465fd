// Requests q7ctl builds and how the client reads replies: URL encoding, COLUMN=VALUE words, the
// event stream parser, and calls against a small in-process HTTP server.

#include "tools/q7ctl/client.h"

#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <httplib.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <chrono>
#include <string>
#include <thread>
#include <vector>

#include "framework/mutex.h"

namespace q7ctl {
namespace {

// Blanks, '+', '&', '=' and '%' must arrive as typed; unreserved characters stay readable.
TEST(RequestTest, SampleTargetEncodesWhereTexts) {
  EXPECT_EQ("a-b_c.d~E9", UrlEncode("a-b_c.d~E9"));
  EXPECT_EQ("APPLICATIN%20EQ%20a%2Bb%26c%3Dd%25%2F", UrlEncode("APPLICATIN EQ a+b&c=d%/"));
  EXPECT_EQ("%C3%A9", UrlEncode("\xC3\xA9"));
  EXPECT_EQ("/api/v1/tables/Q7TXSM", SampleTarget("Q7TXSM", {}, std::nullopt));
  EXPECT_EQ("/api/v1/tables/Q7TXSM?where=A%20EQ%201&where=B%20GT%202&limit=0",
            SampleTarget("Q7TXSM", {"A EQ 1", "B GT 2"}, 0));
  EXPECT_EQ("/api/v1/tables/T?limit=5", SampleTarget("T", {}, 5));
  EXPECT_EQ("/api/v1/situations/My%20Shop", SituationTarget("My Shop"));
}

// The value is everything after the first '='; no '=' or no column is refused.
TEST(RequestTest, ParseConditionSplitsAtTheFirstEquals) {
  Json condition;
  std::string error;
  ASSERT_TRUE(ParseCondition("TRANSPATTN=*/q?a=1&b=2", &condition, &error));
  EXPECT_EQ(Json::parse(R"({"column": "TRANSPATTN", "op": "EQ", "value": "*/q?a=1&b=2"})"),
            condition);
  ASSERT_TRUE(ParseCondition("APPLICATIN=", &condition, &error));
  EXPECT_EQ("", condition["value"]);
  EXPECT_FALSE(ParseCondition("APPLICATIN", &condition, &error));
  EXPECT_NE(std::string::npos, error.find("COLUMN=VALUE")) << error;
  EXPECT_FALSE(ParseCondition("=Shop", &condition, &error));
}

// Events end at a blank line wherever the chunks split; comments and other fields are skipped.
TEST(SseParserTest, SplitsEventsAcrossChunks) {
  SseParser parser;
  EXPECT_TRUE(parser.Feed(": keep-alive\n\nda").empty());
  EXPECT_TRUE(parser.Feed("ta: {\"a\":1}\r\n").empty());
  EXPECT_EQ(std::vector<std::string>{"{\"a\":1}"}, parser.Feed("\r\nevent: x\nid: 7\n"));
  EXPECT_EQ((std::vector<std::string>{"one\ntwo", "3"}),
            parser.Feed("data:one\ndata: two\n\ndata: 3\n\n"));
}

// An agent stand-in on a free loopback port, recording what it was sent.
class FakeAgent {
 public:
  FakeAgent() {
    server_.Put(
        R"(/api/v1/situations/(.+))", [this](const httplib::Request& req, httplib::Response& res) {
          Record(req);
          if (req.get_header_value("Authorization") != "Bearer t0ken") {
            res.status = 401;
            res.set_content(R"({"error": "a valid token is required"})", "application/json");
            return;
          }
          res.set_content("{}", "application/json");
        });
    server_.Get(
        R"(/api/v1/tables/(.+))", [this](const httplib::Request& req, httplib::Response& res) {
          Record(req);
          if (req.matches[1] != "Q7TXSM") {
            res.status = 404;
            res.set_content(R"({"error": "no such table: )" + std::string(req.matches[1]) + "\"}",
                            "application/json");
            return;
          }
          res.set_content(R"({"table": "Q7TXSM", "rows": [{"b": 1, "a": 2}]})", "application/json");
        });
    server_.Get("/api/v1/events/stream", [](const httplib::Request&, httplib::Response& res) {
      res.set_chunked_content_provider("text/event-stream",
                                       [](std::size_t, httplib::DataSink& sink) {
                                         const std::string events =
                                             ": hello\n\ndata: {\"n\": 1}\n\n"
                                             "data: not json\n\ndata: {\"n\": 2}\n\n";
                                         sink.write(events.data(), events.size());
                                         sink.done();
                                         return true;
                                       });
    });
    port_ = server_.bind_to_any_port("127.0.0.1");
    thread_ = std::thread([this] { server_.listen_after_bind(); });
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(5);
    while (!server_.is_running() && std::chrono::steady_clock::now() < deadline) {
      std::this_thread::sleep_for(std::chrono::milliseconds(1));
    }
  }
  ~FakeAgent() {
    server_.stop();
    thread_.join();
  }

  std::string url() const { return "http://127.0.0.1:" + std::to_string(port_); }

  // The last request's Authorization header, body and where parameters.
  struct Seen {
    std::string authorization;
    std::string body;
    std::vector<std::string> wheres;
  };
  Seen last() {
    fw::MutexLock lock(mutex_);
    return last_;
  }

 private:
  void Record(const httplib::Request& req) {
    fw::MutexLock lock(mutex_);
    last_ = Seen{req.get_header_value("Authorization"), req.body, {}};
    for (std::size_t i = 0; i < req.get_param_value_count("where"); ++i) {
      last_.wheres.push_back(req.get_param_value("where", i));
    }
  }

  httplib::Server server_;
  int port_ = 0;
  std::thread thread_;
  fw::Mutex mutex_;
  Seen last_ GUARDED_BY(mutex_);
};

// The token goes out as a Bearer header and the PUT body is the situation as given.
TEST(ApiClientTest, PutSendsBearerTokenAndBody) {
  FakeAgent agent;
  ApiClient client(agent.url(), "t0ken");
  Json conditions = Json::array();
  for (const char* word : {"APPLICATIN=Shop", "APPPATTERN=*"}) {
    Json condition;
    std::string error;
    ASSERT_TRUE(ParseCondition(word, &condition, &error));
    conditions.push_back(condition);
  }
  Json reply;
  const Result result =
      client.Put(SituationTarget("Shop"), SituationBody("Q7TXPTNS", conditions), &reply);
  ASSERT_TRUE(result.ok()) << result.message();
  EXPECT_EQ("Bearer t0ken", agent.last().authorization);
  EXPECT_EQ(R"({"table":"Q7TXPTNS","conditions":[{"column":"APPLICATIN","op":"EQ",)"
            R"("value":"Shop"},{"column":"APPPATTERN","op":"EQ","value":"*"}]})",
            agent.last().body);
}

// Error replies become "<error> (HTTP <status>)"; a missing token says where to put one.
TEST(ApiClientTest, ErrorRepliesBecomeMessages) {
  FakeAgent agent;
  Json reply;
  ApiClient client(agent.url(), "");
  Result result = client.Get("/api/v1/tables/NOPE", &reply);
  EXPECT_EQ("no such table: NOPE (HTTP 404)", result.message());
  result = client.Put(SituationTarget("Shop"), Json::object(), &reply);
  EXPECT_EQ(0u, result.message().find("a valid token is required; give the API token"))
      << result.message();
  EXPECT_NE(std::string::npos, result.message().find("(HTTP 401)"));
  EXPECT_EQ("", agent.last().authorization);  // no token, no header
}

// Where texts arrive decoded exactly as typed; the reply keeps its attribute order.
TEST(ApiClientTest, SampleRoundTrip) {
  FakeAgent agent;
  ApiClient client(agent.url(), "");
  Json reply;
  const Result result =
      client.Get(SampleTarget("Q7TXSM", {"TRANSACTN EQ /a b?x=1&y=+", "TOTREQ GT 2"}, 3), &reply);
  ASSERT_TRUE(result.ok()) << result.message();
  EXPECT_EQ((std::vector<std::string>{"TRANSACTN EQ /a b?x=1&y=+", "TOTREQ GT 2"}),
            agent.last().wheres);
  EXPECT_EQ("b", reply["rows"][0].begin().key());
}

// Each JSON event reaches the callback; the end of the stream is reported as an error, and a
// callback that has seen enough ends it cleanly.
TEST(ApiClientTest, StreamDeliversEvents) {
  FakeAgent agent;
  ApiClient client(agent.url(), "");
  std::vector<int> seen;
  Result result = client.Stream("/api/v1/events/stream", [&](const Json& event) {
    seen.push_back(event["n"].get<int>());
    return true;
  });
  EXPECT_EQ((std::vector<int>{1, 2}), seen);
  EXPECT_NE(std::string::npos, result.message().find("ended the event stream"));

  seen.clear();
  result = client.Stream("/api/v1/events/stream", [&](const Json& event) {
    seen.push_back(event["n"].get<int>());
    return false;
  });
  EXPECT_TRUE(result.ok()) << result.message();
  EXPECT_EQ(std::vector<int>{1}, seen);
}

// A loopback port that was free a moment ago and has nobody listening on it.
int ClosedPort() {
  const int fd = ::socket(AF_INET, SOCK_STREAM, 0);
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t length = sizeof(address);
  EXPECT_EQ(0, ::bind(fd, reinterpret_cast<sockaddr*>(&address), sizeof(address)));
  EXPECT_EQ(0, ::getsockname(fd, reinterpret_cast<sockaddr*>(&address), &length));
  ::close(fd);
  return ntohs(address.sin_port);
}

// Nobody listening: the message names the URL and suggests the agent is not running.
TEST(ApiClientTest, ConnectionFailureNamesTheUrl) {
  const int port = ClosedPort();
  const std::string url = "http://127.0.0.1:" + std::to_string(port);
  ApiClient client(url, "");
  Json reply;
  const Result result = client.Get("/api/v1/tables", &reply);
  EXPECT_NE(std::string::npos, result.message().find(url)) << result.message();
  EXPECT_NE(std::string::npos, result.message().find("running")) << result.message();
}

// Another scheme or a path after the port is a usage fault reported on each call, never thrown.
TEST(ApiClientTest, BadUrlIsReported) {
  for (const char* url : {"ftp://agent:1", "http://agent:1/api", "agent:1"}) {
    ApiClient client(url, "");
    Json reply;
    EXPECT_NE(std::string::npos, client.Get("/api/v1/tables", &reply).message().find("not a URL"))
        << url;
  }
}

}  // namespace
}  // namespace q7ctl
