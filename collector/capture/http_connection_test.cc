#include "collector/capture/http_connection.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "collector/capture/testing/packet_builder.h"

namespace capture {
namespace {

using testing::Segment;
using testing::TcpConversation;

constexpr Micros kMs = 1000;

class CollectingSink : public ExchangeSink {
 public:
  void OnExchange(const HttpExchange& exchange) override { exchanges.push_back(exchange); }
  std::vector<HttpExchange> exchanges;
};

// Segments through the reassembler into HTTP connections, exchanges collected.
class HttpConnectionTest : public ::testing::Test {
 protected:
  HttpConnectionTest()
      : factory_(&sink_, &stats_, 64 * 1024),
        tcp_(ReassemblerOptions{}, &factory_, &stats_),
        talk_("10.0.0.1", 40000, "10.0.0.2", 80) {}

  void Run(const std::vector<Segment>& segments) {
    for (const Segment& segment : segments) {
      tcp_.Add(segment.View());
    }
  }
  void RunAll() { Run(talk_.TakeSegments()); }
  const std::vector<HttpExchange>& exchanges() const { return sink_.exchanges; }

  CollectingSink sink_;
  CaptureStats stats_;
  HttpConnectionFactory factory_;
  TcpReassembler tcp_;
  TcpConversation talk_;
};

TEST_F(HttpConnectionTest, PipelinedRequestsPairInOrder) {
  talk_.Handshake(0, 10 * kMs, 11 * kMs);
  const std::string first = "GET /a HTTP/1.1\r\nHost: h\r\n\r\n";
  const std::string second = "GET /b HTTP/1.1\r\nHost: h\r\nReferer: http://h/a\r\n\r\n";
  talk_.ClientSends(first + second, 12 * kMs);
  talk_.ServerAck(13 * kMs);
  talk_.ServerSends("HTTP/1.1 200 OK\r\nContent-Length: 3\r\n\r\nabc", 40 * kMs);
  talk_.ClientAck(41 * kMs);
  talk_.ServerSends("HTTP/1.1 404 Not Found\r\nContent-Length: 0\r\n\r\n", 50 * kMs);
  talk_.ClientFin(60 * kMs);
  talk_.ServerFin(61 * kMs);
  RunAll();
  ASSERT_EQ(exchanges().size(), 2u);
  const HttpExchange& a = exchanges()[0];
  const HttpExchange& b = exchanges()[1];
  EXPECT_EQ(a.request.target, "/a");
  EXPECT_EQ(a.response.status, 200);
  EXPECT_EQ(a.start, 0);  // the connection's first request begins at the SYN
  EXPECT_EQ(a.request_last, 12 * kMs);
  EXPECT_EQ(a.response_first, 40 * kMs);
  EXPECT_EQ(a.request_bytes, first.size());
  EXPECT_EQ(a.response_bytes, 41u);
  EXPECT_EQ(a.request_acks, 0u);  // the server's ACK came while /b waited for its reply
  EXPECT_EQ(b.request.target, "/b");
  EXPECT_EQ(b.request.referer, "http://h/a");
  EXPECT_EQ(b.response.status, 404);
  EXPECT_EQ(b.start, 12 * kMs);  // pipelined: its own first byte
  EXPECT_EQ(b.request_acks, 1u);
  EXPECT_EQ(b.response_first, 50 * kMs);
  EXPECT_EQ(stats_.unmatched_requests + stats_.unmatched_responses, 0u);
}

TEST_F(HttpConnectionTest, InterimReplyAndHead) {
  talk_.Handshake(0, 1 * kMs, 2 * kMs);
  const std::string interim = "HTTP/1.1 100 Continue\r\n\r\n";
  const std::string created = "HTTP/1.1 201 Created\r\nContent-Length: 2\r\n\r\nok";
  talk_.ClientSends(
      "POST /up HTTP/1.1\r\nHost: h\r\nContent-Length: 4\r\nExpect: 100-continue"
      "\r\n\r\n",
      3 * kMs);
  talk_.ServerSends(interim, 4 * kMs);
  talk_.ClientSends("data", 5 * kMs);
  talk_.ServerSends(created, 20 * kMs);
  // A HEAD's reply announces a length it never sends; the next reply must not be taken as it.
  talk_.ClientSends("HEAD /big HTTP/1.1\r\nHost: h\r\n\r\n", 30 * kMs);
  talk_.ServerSends("HTTP/1.1 200 OK\r\nContent-Length: 1000000\r\n\r\n", 31 * kMs);
  talk_.ClientSends("GET /c HTTP/1.1\r\nHost: h\r\n\r\n", 40 * kMs);
  talk_.ServerSends("HTTP/1.1 204 No Content\r\n\r\n", 41 * kMs);
  RunAll();
  ASSERT_EQ(exchanges().size(), 3u);
  const HttpExchange& post = exchanges()[0];
  EXPECT_EQ(post.response.status, 201);
  EXPECT_EQ(post.request_last, 5 * kMs);  // the body after 100 Continue
  EXPECT_EQ(post.response_first, 20 * kMs);
  EXPECT_EQ(post.response_packets, 2u);
  EXPECT_EQ(post.response_bytes, interim.size() + created.size());
  EXPECT_EQ(exchanges()[1].request.method, "HEAD");
  EXPECT_EQ(exchanges()[1].response.status, 200);
  EXPECT_EQ(exchanges()[2].response.status, 204);
}

TEST_F(HttpConnectionTest, GapInsideABodyKeepsTheExchange) {
  talk_.set_mss(100);
  talk_.Handshake(0, 1 * kMs, 2 * kMs);
  talk_.ClientSends("GET /big HTTP/1.1\r\nHost: h\r\n\r\n", 3 * kMs);
  const std::string reply =
      "HTTP/1.1 200 OK\r\nContent-Length: 400\r\n\r\n" + std::string(400, 'x');
  talk_.ServerSends(reply, 10 * kMs, 1 * kMs);
  talk_.ClientAck(20 * kMs);
  std::vector<Segment> segments = talk_.TakeSegments();
  // Drop the third reply segment (bytes 200-299, all body).
  int replies = 0;
  for (auto it = segments.begin(); it != segments.end(); ++it) {
    if (!it->from_client && !it->payload.empty() && ++replies == 3) {
      segments.erase(it);
      break;
    }
  }
  Run(segments);
  ASSERT_EQ(exchanges().size(), 1u);
  const HttpExchange& e = exchanges()[0];
  EXPECT_TRUE(e.gap);
  EXPECT_EQ(e.response_bytes, reply.size());  // by sequence numbers, the missed segment too
  EXPECT_EQ(e.response_packets, 4u);
  EXPECT_EQ(e.response_last, 14 * kMs);
  EXPECT_EQ(stats_.gaps, 1u);
}

TEST_F(HttpConnectionTest, GapInsideAHeadDropsItAndTheNextExchangeStillPairs) {
  talk_.set_mss(20);
  talk_.Handshake(0, 1 * kMs, 2 * kMs);
  talk_.ClientSends("GET /a HTTP/1.1\r\n\r\n", 3 * kMs);
  talk_.ServerSends("HTTP/1.1 200 OK\r\nContent-Length: 2\r\n\r\nok", 10 * kMs, 1 * kMs);
  talk_.ClientAck(20 * kMs);
  std::vector<Segment> segments = talk_.TakeSegments();
  for (auto it = segments.begin(); it != segments.end(); ++it) {
    if (!it->from_client && !it->payload.empty()) {
      segments.erase(it + 1);  // the reply head's second segment
      break;
    }
  }
  Run(segments);
  talk_.ClientSends("GET /b HTTP/1.1\r\n\r\n", 30 * kMs);
  talk_.ServerSends("HTTP/1.1 302 Found\r\nContent-Length: 0\r\n\r\n", 31 * kMs);
  RunAll();
  ASSERT_EQ(exchanges().size(), 1u);
  EXPECT_EQ(exchanges()[0].request.target, "/b");
  EXPECT_EQ(exchanges()[0].response.status, 302);
  EXPECT_EQ(stats_.dropped_heads, 1u);
  EXPECT_EQ(stats_.unmatched_requests, 1u);
}

TEST_F(HttpConnectionTest, ConnectionSeenFromItsMiddle) {
  talk_.Handshake(0, 1 * kMs, 2 * kMs);
  talk_.ClientSends("GET /old HTTP/1.1\r\n\r\n", 3 * kMs);
  talk_.ServerSends("HTTP/1.1 200 OK\r\nContent-Length: 10\r\n\r\n0123456789", 4 * kMs);
  talk_.TakeSegments();  // all before the capture began
  talk_.ServerSends("and some earlier body bytes", 5 * kMs);
  talk_.ClientSends("GET /new HTTP/1.1\r\n\r\n", 6 * kMs);
  talk_.ServerSends("HTTP/1.1 200 OK\r\nContent-Length: 0\r\n\r\n", 7 * kMs);
  RunAll();
  ASSERT_EQ(exchanges().size(), 1u);
  EXPECT_EQ(exchanges()[0].request.target, "/new");
  EXPECT_EQ(exchanges()[0].start, 6 * kMs);
  EXPECT_EQ(stats_.midstream, 1u);
  EXPECT_EQ(stats_.non_http_streams, 0u);
}

TEST_F(HttpConnectionTest, TlsIsCountedAndIgnored) {
  talk_.Handshake(0, 1 * kMs, 2 * kMs);
  talk_.ClientSends(std::string("\x16\x03\x01\x02\x00\x01\x00\x01\xfc\x03\x03", 11), 3 * kMs);
  talk_.ServerSends(std::string("\x16\x03\x03\x00\x7a\x02", 6), 4 * kMs);
  talk_.ClientRst(5 * kMs);
  RunAll();
  EXPECT_TRUE(exchanges().empty());
  EXPECT_EQ(stats_.non_http_streams, 1u);
  EXPECT_EQ(tcp_.connection_count(), 0u);
}

TEST_F(HttpConnectionTest, AcksAreCountedWhileEachSideIsSending) {
  talk_.set_mss(10);
  talk_.Handshake(0, 1 * kMs, 2 * kMs);
  talk_.ClientSends("POST / HTTP/1.1\r\nContent-Length: 5\r\n\r\nhello", 3 * kMs, 1 * kMs);
  talk_.ServerAck(9 * kMs);
  talk_.ServerAck(10 * kMs);
  talk_.ServerSends("HTTP/1.1 200 OK\r\nContent-Length: 20\r\n\r\n", 20 * kMs);
  talk_.ClientAck(21 * kMs);  // between reply segments
  talk_.ServerSends(std::string(20, 'z'), 22 * kMs, 1 * kMs);
  talk_.ClientAck(30 * kMs);  // after the reply: not counted
  // An unanswered request at the end is counted, not written.
  talk_.ClientSends("GET /never HTTP/1.1\r\n\r\n", 40 * kMs);
  talk_.ClientFin(41 * kMs);
  talk_.ServerFin(42 * kMs);
  RunAll();
  ASSERT_EQ(exchanges().size(), 1u);
  const HttpExchange& e = exchanges()[0];
  EXPECT_EQ(e.request_packets, 5u);
  EXPECT_EQ(e.request_acks, 2u);
  EXPECT_EQ(e.response_acks, 1u);
  EXPECT_EQ(stats_.unmatched_requests, 1u);
}

}  // namespace
}  // namespace capture
