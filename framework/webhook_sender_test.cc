#include "framework/webhook_sender.h"

#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <httplib.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <chrono>
#include <condition_variable>
#include <functional>
#include <mutex>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "framework/trace_capture.h"
#include "tests/support/test_util.h"

namespace fw {
namespace {

using namespace std::chrono_literals;
using q7test::PollUntil;

// An in-process receiver on a loopback port. answer(n) gives the status of the n-th request
// (from 0); while hung, requests wait in the handler until Release.
class Receiver {
 public:
  explicit Receiver(std::function<int(int)> answer = [](int) { return 200; })
      : answer_(std::move(answer)) {
    server_.new_task_queue = [] { return new httplib::ThreadPool(16); };  // room for hung ones
    server_.Post(".*", [this](const httplib::Request& req, httplib::Response& res) {
      std::unique_lock<std::mutex> lock(mutex_);
      const int n = static_cast<int>(bodies_.size());
      bodies_.push_back(req.body);
      heads_.push_back(req.target + " " + req.get_header_value("Content-Type"));
      released_.wait(lock, [this] { return !hung_; });
      res.status = answer_(n);
    });
    port_ = server_.bind_to_any_port("127.0.0.1");
    thread_ = std::thread([this] { server_.listen_after_bind(); });
    EXPECT_TRUE(PollUntil([this] { return server_.is_running(); }, 5s));
  }
  ~Receiver() {
    Hang(false);
    server_.stop();
    thread_.join();
  }

  std::string url(const std::string& target = "/hook") const {
    return "http://127.0.0.1:" + std::to_string(port_) + target;
  }
  void Hang(bool hung) {
    std::lock_guard<std::mutex> lock(mutex_);
    hung_ = hung;
    released_.notify_all();
  }
  std::vector<std::string> bodies() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return bodies_;
  }
  // "target content-type" of each request.
  std::vector<std::string> heads() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return heads_;
  }

 private:
  const std::function<int(int)> answer_;
  httplib::Server server_;
  std::thread thread_;
  int port_ = 0;
  mutable std::mutex mutex_;
  std::condition_variable released_;
  bool hung_ = false;
  std::vector<std::string> bodies_;
  std::vector<std::string> heads_;
};

// A loopback port bound but not listening: connections are refused, and nothing else can take
// the port while the test holds it.
class DeadPort {
 public:
  DeadPort() : fd_(socket(AF_INET, SOCK_STREAM, 0)) {
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t length = sizeof(address);
    EXPECT_EQ(0, bind(fd_, reinterpret_cast<sockaddr*>(&address), length));
    EXPECT_EQ(0, getsockname(fd_, reinterpret_cast<sockaddr*>(&address), &length));
    url_ = "http://127.0.0.1:" + std::to_string(ntohs(address.sin_port)) + "/hook";
  }
  ~DeadPort() { close(fd_); }
  const std::string& url() const { return url_; }

 private:
  int fd_;
  std::string url_;
};

WebhookSender::Options FastOptions() {
  WebhookSender::Options options;
  options.timeout = 300ms;
  options.first_backoff = 20ms;
  options.max_backoff = 80ms;
  return options;
}

// Accepted URLs come apart as the client needs them (shown as "origin target"); rejected ones
// say what is wrong.
TEST(WebhookUrlTest, ParsesHttpUrlsAndNamesWhatIsWrong) {
  const std::vector<std::pair<std::string, std::string>> good = {
      {"http://example.com", "http://example.com:80 /"},
      {"https://example.com", "https://example.com:443 /"},
      {"HTTPS://hooks.example.com:8443/a/b?x=1&y=2", "https://hooks.example.com:8443 /a/b?x=1&y=2"},
      {"http://10.0.0.7:65535?token=s", "http://10.0.0.7:65535 /?token=s"},
      {"http://[::1]:9000/hook", "http://[::1]:9000 /hook"},
      {"https://[fd00::a:b]/x", "https://[fd00::a:b]:443 /x"},
  };
  for (const auto& [text, parts] : good) {
    WebhookUrl url;
    std::string error;
    EXPECT_TRUE(ParseWebhookUrl(text, &url, &error)) << text << ": " << error;
    EXPECT_EQ(parts, url.Origin() + " " + url.target) << text;
  }
  const std::vector<std::pair<std::string, std::string>> bad = {
      {"", "http:// or https://"},
      {"example.com/hook", "http:// or https://"},
      {"ftp://example.com/", "http:// or https://"},
      {"http://", "has no host"},
      {"http://:8080/", "has no host"},
      {"http://[]:8080/", "has no host"},
      {"http://host:0/", "port"},
      {"http://host:65536/", "port"},
      {"http://host:80a/", "port"},
      {"http://[::1/", "closing ]"},
      {"http://[not:v6]/", "not an IPv6 address"},
      {"http://::1/", "in brackets"},
      {"http://user:pw@host/", "user name or password"},
      {"http://host/a#frag", "#fragment"},
      {"http://host/a\r\nX-Evil: 1", "spaces or control characters"},
      {"http://ho%73t/", "not a host name"},
  };
  for (const auto& [text, problem] : bad) {
    WebhookUrl url;
    std::string error;
    EXPECT_FALSE(ParseWebhookUrl(text, &url, &error)) << text;
    EXPECT_NE(std::string::npos, error.find(problem)) << text << ": " << error;
  }
}

// Bodies arrive as JSON, at the URL's path and query, in the order they were enqueued.
TEST(WebhookSenderTest, DeliversBodiesInOrder) {
  Receiver receiver;
  WebhookSender sender(FastOptions());
  std::vector<std::string> sent;
  for (int i = 0; i < 20; ++i) {
    sent.push_back("{\"n\":" + std::to_string(i) + "}");
    ASSERT_TRUE(sender.Enqueue(receiver.url("/hook?team=ops"), sent.back()));
  }
  ASSERT_TRUE(PollUntil([&] { return sender.counters().delivered == 20; }, 10s));
  EXPECT_EQ(sent, receiver.bodies());
  EXPECT_EQ(std::vector<std::string>(20, "/hook?team=ops application/json"), receiver.heads());
  const WebhookSender::Counters counters = sender.counters();
  EXPECT_EQ(20u, counters.enqueued);
  EXPECT_EQ(0u, counters.attempts_failed);
  EXPECT_EQ(0u, counters.pending);
}

// A receiver answering 500 twice gets the same body again until it answers 200, and the change
// that followed (a clear after its raise) waits behind it rather than overtaking it.
TEST(WebhookSenderTest, RetriesUntil2xxAndKeepsOrderPerUrl) {
  Receiver receiver([](int n) { return n < 2 ? 500 : 200; });
  WebhookSender sender(FastOptions());
  ASSERT_TRUE(sender.Enqueue(receiver.url(), R"({"state":"raised"})"));
  ASSERT_TRUE(sender.Enqueue(receiver.url(), R"({"state":"cleared"})"));
  ASSERT_TRUE(PollUntil([&] { return sender.counters().pending == 0; }, 10s));
  EXPECT_EQ((std::vector<std::string>{R"({"state":"raised"})", R"({"state":"raised"})",
                                      R"({"state":"raised"})", R"({"state":"cleared"})"}),
            receiver.bodies());
  const WebhookSender::Counters counters = sender.counters();
  EXPECT_EQ(2u, counters.delivered);
  EXPECT_EQ(2u, counters.attempts_failed);
  EXPECT_EQ(2u, counters.retried);
  EXPECT_EQ(0u, counters.given_up);
}

// A receiver that never answers costs a timeout per attempt, and the other receivers' deliveries
// go out between its attempts instead of after all of them.
TEST(WebhookSenderTest, HangingReceiverDoesNotHoldBackOthers) {
  Receiver hung;
  Receiver healthy;
  hung.Hang(true);
  WebhookSender::Options options = FastOptions();
  options.max_attempts = 20;  // behind all of them, the healthy receiver would wait 6 s
  WebhookSender sender(options);
  ASSERT_TRUE(sender.Enqueue(hung.url(), "{\"to\":\"hung\"}"));
  ASSERT_TRUE(PollUntil([&] { return hung.bodies().size() == 1; }, 5s));

  const auto start = std::chrono::steady_clock::now();
  for (int i = 0; i < 3; ++i) {
    ASSERT_TRUE(sender.Enqueue(healthy.url(), "{\"n\":" + std::to_string(i) + "}"));
  }
  // The receiver holds a body before its answer reaches the sender, so wait on the count.
  ASSERT_TRUE(PollUntil([&] { return sender.counters().delivered == 3; }, 5s));
  // At most the attempt in flight, a timeout, stands in their way.
  EXPECT_LT(std::chrono::steady_clock::now() - start, 2s);
  EXPECT_EQ(3u, healthy.bodies().size());

  ASSERT_TRUE(PollUntil([&] { return sender.counters().retried >= 2; }, 5s));
  hung.Hang(false);
  ASSERT_TRUE(PollUntil([&] { return sender.counters().delivered == 4; }, 5s));
  EXPECT_EQ(0u, sender.counters().given_up);
}

// A receiver that refuses connections is retried after doubling backoffs up to the largest, and
// given up after max_attempts attempts with an error trace.
TEST(WebhookSenderTest, DeadReceiverIsGivenUpAfterMaxAttempts) {
  TraceCapture trace("framework=ALL");
  DeadPort dead;
  WebhookSender::Options options = FastOptions();
  options.max_attempts = 5;
  WebhookSender sender(options);
  ASSERT_TRUE(sender.Enqueue(dead.url(), "{}"));
  ASSERT_TRUE(PollUntil([&] { return sender.counters().given_up == 1; }, 10s));
  const WebhookSender::Counters counters = sender.counters();
  EXPECT_EQ(5u, counters.attempts_failed);
  EXPECT_EQ(4u, counters.retried);
  EXPECT_EQ(0u, counters.delivered);
  EXPECT_EQ(0u, counters.pending);
  EXPECT_EQ(1, trace.count("attempt 1 (no answer (Connection error)), next in 20 ms"));
  EXPECT_EQ(1, trace.count("attempt 2 (no answer (Connection error)), next in 40 ms"));
  EXPECT_EQ(2, trace.count("next in 80 ms"));
  EXPECT_EQ(1, trace.count("ERROR Run: webhook delivery to http://127.0.0.1:"));
  EXPECT_TRUE(trace.contains("given up after 5 attempts"));
}

// Past its capacity the sender refuses at once, counts and traces it; an unusable URL and a
// stopped sender are refused too.
TEST(WebhookSenderTest, RefusesWithoutBlockingWhenFull) {
  TraceCapture trace("*=ERROR");
  DeadPort dead;
  WebhookSender::Options options = FastOptions();
  options.capacity = 2;
  options.first_backoff = 10s;
  WebhookSender sender(options);
  EXPECT_TRUE(sender.Enqueue(dead.url(), "{\"n\":1}"));
  EXPECT_TRUE(sender.Enqueue(dead.url(), "{\"n\":2}"));

  const auto start = std::chrono::steady_clock::now();
  for (int n = 3; n <= 52; ++n) {
    EXPECT_FALSE(sender.Enqueue(dead.url(), "{\"n\":" + std::to_string(n) + "}"));
  }
  EXPECT_LT(std::chrono::steady_clock::now() - start, 1s);
  EXPECT_FALSE(sender.Enqueue("ftp://example.com/", "{}"));
  EXPECT_FALSE(sender.Enqueue("ftp://example.com/", "{}"));

  WebhookSender::Counters counters = sender.counters();
  EXPECT_EQ(2u, counters.enqueued);
  EXPECT_EQ(50u, counters.dropped_full);
  EXPECT_EQ(2u, counters.dropped_invalid);
  EXPECT_EQ(2u, counters.pending);
  // Each kind traced once within the period, not once a refusal.
  EXPECT_EQ(1, trace.count("dropped (1 so far): 2 deliveries are pending already"));
  EXPECT_EQ(2, trace.count(" so far): "));

  sender.Stop();
  EXPECT_FALSE(sender.Enqueue(dead.url(), "{}"));
  counters = sender.counters();
  EXPECT_EQ(2u, counters.enqueued);
  EXPECT_EQ(50u, counters.dropped_full);
}

// Stop does not wait out a backoff.
TEST(WebhookSenderTest, StopDuringLongBackoffIsPrompt) {
  DeadPort dead;
  WebhookSender::Options options = FastOptions();
  options.first_backoff = 60s;
  WebhookSender sender(options);
  ASSERT_TRUE(sender.Enqueue(dead.url(), "{}"));
  ASSERT_TRUE(PollUntil([&] { return sender.counters().retried == 1; }, 5s));
  const auto start = std::chrono::steady_clock::now();
  sender.Stop();
  EXPECT_LT(std::chrono::steady_clock::now() - start, 1s);
  EXPECT_EQ(1u, sender.counters().pending);
}

// A POST waiting on a receiver that hangs is cut short by Stop, not waited out: the agent's
// own stop must not take the POST's timeouts.
TEST(WebhookSenderTest, StopDuringAHangingPostIsPrompt) {
  Receiver hung;
  hung.Hang(true);
  WebhookSender::Options options = FastOptions();
  options.timeout = 30s;
  WebhookSender sender(options);
  ASSERT_TRUE(sender.Enqueue(hung.url(), "{}"));
  ASSERT_TRUE(PollUntil([&] { return hung.bodies().size() == 1; }, 5s));
  const auto start = std::chrono::steady_clock::now();
  sender.Stop();
  EXPECT_LT(std::chrono::steady_clock::now() - start, 2s);
  EXPECT_EQ(0u, sender.counters().delivered);
}

}  // namespace
}  // namespace fw
