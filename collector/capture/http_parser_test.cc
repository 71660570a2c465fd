#include "collector/capture/http_parser.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <memory>
#include <random>
#include <string>
#include <string_view>
#include <vector>

namespace capture {
namespace {

using Desync = HttpParser::Desync;
using Kind = HttpParser::Kind;

struct Message {
  HttpHead head;
  HttpMessageSpan span;
};

// Records every call; trace holds one letter a call (Begin, Head, Message, Desync) so tests can
// check their order.
class Recorder : public HttpParser::Listener {
 public:
  void OnMessageBegin(uint64_t offset, Micros time) override {
    trace += 'B';
    begins.push_back({offset, time});
  }
  bool OnHead(const HttpHead&) override {
    trace += 'H';
    return head_reply;
  }
  void OnMessage(const HttpHead& head, const HttpMessageSpan& span) override {
    trace += 'M';
    messages.push_back({head, span});
    switched_at_message = parser->switched();
  }
  void OnDesync(Desync reason) override {
    trace += 'D';
    desyncs.push_back(reason);
  }

  const HttpParser* parser = nullptr;
  bool head_reply = false;  // what OnHead answers
  bool switched_at_message = false;
  std::string trace;
  std::vector<std::pair<uint64_t, Micros>> begins;
  std::vector<Message> messages;
  std::vector<Desync> desyncs;
};

class HttpParserTest : public ::testing::Test {
 protected:
  void Start(Kind kind, size_t max_head = 64 * 1024) {
    rec_ = Recorder();
    parser_ = std::make_unique<HttpParser>(kind, &rec_, max_head);
    rec_.parser = parser_.get();
  }
  void Feed(std::string_view bytes, Micros time = 0) {
    parser_->Feed(reinterpret_cast<const uint8_t*>(bytes.data()), bytes.size(), time);
  }
  const HttpMessageSpan& span(size_t i) const { return rec_.messages.at(i).span; }
  const HttpHead& head(size_t i) const { return rec_.messages.at(i).head; }

  Recorder rec_;
  std::unique_ptr<HttpParser> parser_;
};

const std::string kGet = "GET /a HTTP/1.1\r\nHost: h\r\n\r\n";

// ---- Framing

// Three requests in one segment, the last running into a second: each counts the segments it
// touches, and the shared segment counts for all.
TEST_F(HttpParserTest, PipelinedRequestsInOneSegment) {
  Start(Kind::kRequest);
  const std::string post = "POST /b HTTP/1.1\r\nContent-Length: 4\r\n\r\nbody";
  const std::string old = "GET /c HTTP/1.0\n\n";
  Feed(kGet + post + "\r\n" + old.substr(0, 5), 10);  // a stray CRLF after a body is allowed
  Feed(old.substr(5), 20);
  ASSERT_EQ(rec_.trace, "BHMBHMBHM");
  EXPECT_EQ(head(1).method, "POST");
  EXPECT_EQ(head(1).target, "/b");
  EXPECT_EQ(head(2).version_minor, 0);
  EXPECT_EQ(span(1).begin_offset, kGet.size());
  EXPECT_EQ(span(1).end_offset, kGet.size() + post.size());
  EXPECT_EQ(span(1).packets, 1u);
  EXPECT_EQ(span(2).packets, 2u);
  EXPECT_EQ(span(2).first_time, 10);
  EXPECT_EQ(span(2).last_time, 20);
  EXPECT_EQ(span(2).begin_offset, kGet.size() + post.size() + 2);
  EXPECT_EQ(span(2).end_offset, kGet.size() + post.size() + 2 + old.size());
}

TEST_F(HttpParserTest, ReplySplitByteByByte) {
  Start(Kind::kResponse);
  const std::string reply = "HTTP/1.1 200 OK\r\nContent-Length: 3\r\nServer: s\r\n\r\nabc";
  for (size_t i = 0; i < reply.size(); ++i) {
    Feed(reply.substr(i, 1), 100 + static_cast<Micros>(i));
  }
  ASSERT_EQ(rec_.trace, "BHM");
  EXPECT_EQ(rec_.begins[0], std::make_pair(uint64_t{0}, Micros{100}));
  EXPECT_EQ(head(0).server, "s");
  EXPECT_EQ(span(0).end_offset, reply.size());
  EXPECT_EQ(span(0).packets, reply.size());
  EXPECT_EQ(span(0).last_time, 100 + static_cast<Micros>(reply.size()) - 1);
  EXPECT_FALSE(parser_->in_message());
}

// Replies of every framing, cut into random segments: the same messages come out, and spans
// match the cuts (segment i has time i).
TEST_F(HttpParserTest, EverySegmentationGivesTheSameReplies) {
  const std::vector<std::pair<int, std::string>> replies = {
      {200, "HTTP/1.1 200 OK\r\nContent-Length: 5\r\n\r\nhello"},
      {200,
       "HTTP/1.1 200 OK\r\nTransfer-Encoding: gzip, chunked\r\n\r\n"
       "5;name=\"v\"\r\nhello\r\n1A \r\nabcdefghijklmnopqrstuvwxyz\n0\r\nX-T: 1\r\n\r\n"},
      {204, "HTTP/1.1 204 No Content\r\nContent-Length: 5\r\n\r\n"},
      {304, "HTTP/1.1 304 Not Modified\nContent-Length: 9\n\n"},
      {100, "HTTP/1.1 100 Continue\r\n\r\n"},
      {200, "HTTP/1.0 200\r\n\r\nuntil the end"},
  };
  std::string stream;
  std::vector<size_t> bounds = {0};
  for (const auto& reply : replies) {
    stream += reply.second;
    bounds.push_back(stream.size());
  }
  std::mt19937 rng(1);
  for (int round = 0; round < 300; ++round) {
    std::vector<size_t> cuts = {0};
    while (cuts.back() < stream.size()) {
      const size_t most = round % 3 == 0 ? 1 : 40;
      cuts.push_back(std::min(stream.size(), cuts.back() + 1 + rng() % most));
    }
    Start(Kind::kResponse);
    for (size_t i = 0; i + 1 < cuts.size(); ++i) {
      Feed(std::string_view(stream).substr(cuts[i], cuts[i + 1] - cuts[i]), Micros(i));
    }
    parser_->End(1000);
    ASSERT_EQ(rec_.messages.size(), replies.size()) << rec_.trace << " round " << round;
    ASSERT_TRUE(rec_.desyncs.empty());
    for (size_t m = 0; m < replies.size(); ++m) {
      const HttpMessageSpan& s = span(m);
      EXPECT_EQ(head(m).status, replies[m].first);
      EXPECT_EQ(s.begin_offset, bounds[m]);
      ASSERT_EQ(s.end_offset, bounds[m + 1]);
      EXPECT_FALSE(s.truncated || s.gap);
      const auto segment = [&](size_t offset) {
        return Micros(std::upper_bound(cuts.begin(), cuts.end(), offset) - cuts.begin() - 1);
      };
      EXPECT_EQ(s.first_time, segment(s.begin_offset));
      EXPECT_EQ(s.last_time, segment(s.end_offset - 1));
      EXPECT_EQ(s.packets, segment(s.end_offset - 1) - segment(s.begin_offset) + 1);
    }
  }
}

TEST_F(HttpParserTest, ReplyToHeadHasNoBody) {
  Start(Kind::kResponse);
  rec_.head_reply = true;
  Feed(
      "HTTP/1.1 200 OK\r\nContent-Length: 10\r\n\r\n"
      "HTTP/1.1 200 OK\r\nTransfer-Encoding: chunked\r\n\r\n");
  EXPECT_EQ(rec_.trace, "BHMBHM");
  EXPECT_EQ(head(0).content_length, 10);
}

TEST_F(HttpParserTest, SwitchingProtocolsEndsHttp) {
  Start(Kind::kResponse);
  Feed("HTTP/1.1 101 Switching Protocols\r\nUpgrade: websocket\r\n\r\n\x81\x05hello");
  Feed("\x16\x03\x01 not http\n");
  parser_->Gap(100, 0);
  parser_->End(0);
  EXPECT_EQ(rec_.trace, "BHM");
  EXPECT_TRUE(rec_.switched_at_message);  // the connection stops feeding from there
}

TEST_F(HttpParserTest, RequestBodies) {
  Start(Kind::kRequest);
  // Without a length a request has no body, so the next line is the next request.
  Feed(
      "PUT /x HTTP/1.1\r\nTransfer-Encoding: chunked\r\n\r\n3\r\nabc\r\n0\r\n\r\n"
      "M-SEARCH * HTTP/1.1\r\n\r\nGET /y HTTP/1.1\r\nTransfer-Encoding: gzip\r\n\r\n");
  EXPECT_EQ(rec_.trace, "BHMBHMBD");
  EXPECT_EQ(head(1).method, "M-SEARCH");
  EXPECT_EQ(rec_.desyncs, std::vector{Desync::kBadHead});
}

TEST_F(HttpParserTest, HeaderFields) {
  Start(Kind::kRequest);
  const std::string long_agent(HttpHead::kMaxFieldBytes + 10, 'u');
  const std::string request =
      "GET / HTTP/1.1\r\nhOST:  a.example \t\r\nHost: b\r\nReferer: r1,\r\n  r2\r\n\tr3\r\n"
      "Bad Name: x\r\nUser-Agent: " +
      long_agent +
      "\r\nContent-Length: 2, 2\r\n"
      "Content-Length: 2\r\nConnection:\r\nContent-Type: text/html\r\n\r\nok";
  Feed(request);
  ASSERT_EQ(rec_.trace, "BHM");
  EXPECT_EQ(head(0).host, "a.example");
  EXPECT_EQ(head(0).referer, "r1, r2 r3");
  EXPECT_EQ(head(0).user_agent, long_agent.substr(0, HttpHead::kMaxFieldBytes));
  EXPECT_EQ(head(0).content_length, 2);
  EXPECT_EQ(head(0).content_type, "text/html");
  EXPECT_EQ(span(0).end_offset, request.size());
}

TEST_F(HttpParserTest, BadContentLengthDropsTheMessage) {
  for (const char* value :
       {"abc", "5, 6", "7, 3", "-1", "5\r\nContent-Length: 6", "", "1 2", "99999999999999999999"}) {
    Start(Kind::kResponse);
    Feed(std::string("HTTP/1.1 200 OK\r\nContent-Length: ") + value + "\r\n\r\n" +
         "HTTP/1.1 404 Not Found\r\nContent-Length: 0\r\n\r\n");
    EXPECT_EQ(rec_.trace, "BDBHM") << value;
    EXPECT_EQ(rec_.desyncs, std::vector{Desync::kBadHead});
  }
}

// ---- Gaps and the end of the stream

TEST_F(HttpParserTest, GapInLengthBody) {
  Start(Kind::kResponse);
  Feed("HTTP/1.1 200 OK\r\nContent-Length: 10\r\n\r\nab", 1);
  parser_->Gap(3, 2);
  Feed("cdefgHTTP/1.1 204 No Content\r\n\r\n", 3);
  ASSERT_EQ(rec_.trace, "BHMBHM");
  EXPECT_TRUE(span(0).gap);
  EXPECT_FALSE(span(1).gap);
  EXPECT_EQ(span(0).end_offset, span(1).begin_offset);
  EXPECT_EQ(span(0).packets, 2u);

  // A gap ending with the body leaves the next message in step.
  Start(Kind::kResponse);
  Feed("HTTP/1.1 200 OK\r\nContent-Length: 10\r\n\r\nab", 1);
  parser_->Gap(8, 2);
  Feed("HTTP/1.1 204 No Content\r\n\r\n", 3);
  EXPECT_EQ(rec_.trace, "BHMBHM");

  // A gap past the body's end: the body ends where its length says; the next start line may
  // begin right after the gap.
  Start(Kind::kResponse);
  const std::string head = "HTTP/1.1 200 OK\r\nContent-Length: 10\r\n\r\n";
  Feed(head + "ab", 1);
  parser_->Gap(20, 2);
  Feed("HTTP/1.1 200 OK\r\nContent-Length: 0\r\n\r\n", 3);
  ASSERT_EQ(rec_.trace, "BHMDBHM");
  EXPECT_EQ(rec_.desyncs, std::vector{Desync::kGapInFraming});
  EXPECT_EQ(span(0).end_offset, head.size() + 10);
  EXPECT_EQ(span(0).last_time, 1);
  EXPECT_TRUE(span(0).gap);
  EXPECT_FALSE(span(0).truncated);
  EXPECT_EQ(span(1).begin_offset, head.size() + 2 + 20);
}

TEST_F(HttpParserTest, GapInChunkedBody) {
  const std::string head = "HTTP/1.1 200 OK\r\nTransfer-Encoding: chunked\r\n\r\n";
  // Inside a chunk's data: framing holds.
  Start(Kind::kResponse);
  Feed(head + "a\r\n01", 1);
  parser_->Gap(8, 2);
  Feed("\r\n0\r\n\r\n", 3);
  ASSERT_EQ(rec_.trace, "BHM");
  EXPECT_TRUE(span(0).gap);
  EXPECT_FALSE(span(0).truncated);

  // Past a chunk's data, or in a size line: where the next chunk begins is lost.
  for (const auto& [before, gap] : {std::pair<std::string, uint64_t>{"a\r\n01", 9},
                                    std::pair<std::string, uint64_t>{"a\r\n0123456789\r\n1", 3}}) {
    Start(Kind::kResponse);
    Feed(head + before, 1);
    parser_->Gap(gap, 2);
    Feed("\r\nHTTP/1.1 304 Not Modified\r\n\r\n", 3);
    ASSERT_EQ(rec_.trace, "BHMDBHM") << before;
    EXPECT_TRUE(span(0).gap && span(0).truncated);
    EXPECT_EQ(span(0).last_time, 1);
    EXPECT_EQ(rec_.desyncs, std::vector{Desync::kGapInFraming});
  }
}

TEST_F(HttpParserTest, GapInHeadOrBetweenMessages) {
  Start(Kind::kRequest);
  Feed("GET / HTTP/1.1\r\nHo", 1);
  parser_->Gap(10, 2);
  Feed("st: x\r\n\r\n" + kGet, 3);
  EXPECT_EQ(rec_.trace, "BDBHM");
  EXPECT_EQ(rec_.desyncs, std::vector{Desync::kGapInHead});

  Start(Kind::kRequest);
  Feed(kGet, 1);
  parser_->Gap(10, 2);
  Feed("ody of an unseen POST\r\n", 3);
  parser_->Gap(5, 4);  // still the same episode
  Feed(kGet, 5);
  EXPECT_EQ(rec_.trace, "BHMDBHM");
  EXPECT_EQ(rec_.desyncs, std::vector{Desync::kGapInFraming});
  EXPECT_EQ(span(1).begin_offset, kGet.size() + 10 + 23 + 5);
}

TEST_F(HttpParserTest, EndOfStream) {
  Start(Kind::kResponse);
  Feed("HTTP/1.1 200 OK\r\n\r\nclose", 1);
  parser_->Gap(4, 2);
  parser_->End(9);
  ASSERT_EQ(rec_.trace, "BHM");
  EXPECT_FALSE(span(0).truncated);
  EXPECT_TRUE(span(0).gap);
  EXPECT_EQ(span(0).end_offset, 28u);
  EXPECT_EQ(span(0).last_time, 1);

  Start(Kind::kResponse);
  Feed("HTTP/1.1 200 OK\r\nContent-Length: 9\r\n\r\nabc", 1);
  EXPECT_TRUE(parser_->in_message());
  parser_->End(9);
  ASSERT_EQ(rec_.trace, "BHM");
  EXPECT_TRUE(span(0).truncated);
  EXPECT_EQ(span(0).last_time, 1);

  Start(Kind::kResponse);
  Feed("HTTP/1.1 200 OK\r\nServer: x\r\n", 1);
  parser_->End(9);
  EXPECT_EQ(rec_.trace, "B");
}

// ---- Losing and finding the stream

TEST_F(HttpParserTest, StreamSeenFromItsMiddle) {
  Start(Kind::kResponse);
  parser_->SetMidstream();
  Feed("tail of a body\nstill body HTTP/1.1 200 OK\r\n", 1);
  Feed("more\r\nHTTP/1.1 2", 2);  // a start line held across segments
  Feed("00 OK\r\nContent-Length: 1\r\n\r\nx", 3);
  ASSERT_EQ(rec_.trace, "DBHM");
  EXPECT_EQ(rec_.desyncs, std::vector{Desync::kMidstream});
  EXPECT_EQ(span(0).begin_offset, 43u + 6u);
  EXPECT_EQ(span(0).first_time, 2);
  EXPECT_EQ(span(0).packets, 2u);
}

TEST_F(HttpParserTest, ForeignProtocolsAreNotHttp) {
  const std::string tls("\x16\x03\x01\x02\x00\x01\x00\x01\xfc\x03\x03", 11);
  for (const std::string& start :
       {tls, std::string("PRI * HTTP/2.0\r\n\r\nSM\r\n\r\n"), std::string("GET /\r\n")}) {
    Start(Kind::kRequest);
    parser_->SetMidstream();
    for (int i = 0; i < 5; ++i) {
      Feed(start);
    }
    EXPECT_EQ(rec_.desyncs,
              std::vector{start == "GET /\r\n" ? Desync::kMidstream : Desync::kNotHttp});
    EXPECT_TRUE(rec_.messages.empty());
  }
  Start(Kind::kResponse);
  Feed("HTTP/2.0 200 OK\r\n\r\n");
  EXPECT_EQ(rec_.desyncs, std::vector{Desync::kNotHttp});
  // A tunnel after CONNECT is another protocol too, not a broken request.
  Start(Kind::kRequest);
  Feed("CONNECT h:443 HTTP/1.1\r\n\r\n" + tls);
  EXPECT_EQ(rec_.trace, "BHMD");
  EXPECT_EQ(rec_.desyncs, std::vector{Desync::kNotHttp});
}

TEST_F(HttpParserTest, MalformedStartLines) {
  for (const char* line : {"HTTP/1.1 099 Low", "HTTP/1.1 20 OK", "HTTP/1.1 200OK", "HTTP/1.2x 200",
                           "HTTP/1.1  200 OK", "http/1.1 200 OK", "HTTP/1.1 200 O\x01K"}) {
    Start(Kind::kResponse);
    Feed(std::string(line) + "\r\n\r\n");
    EXPECT_EQ(rec_.trace, "D") << line;
  }
  for (const char* line : {"GET  / HTTP/1.1", "GET / HTTP/1.1 ", "G(T / HTTP/1.1", "GET / HTTP/1.",
                           "GET /\x7f HTTP/1.1", "GET / HTTP/1.1\r\r"}) {
    Start(Kind::kRequest);
    Feed(std::string(line) + "\r\n\r\n");
    EXPECT_EQ(rec_.trace, "D") << line;
  }
  // Known bad before its line ends: no waiting for a newline that may never come.
  Start(Kind::kResponse);
  Feed("HTTP/1.1 2");
  Feed("x");
  EXPECT_EQ(rec_.trace, "D");
}

TEST_F(HttpParserTest, HeadOverTheLimit) {
  Start(Kind::kRequest);
  const std::string filler = "X-Filler: " + std::string(1000, 'f') + "\r\n";
  Feed("GET / HTTP/1.1\r\n");
  for (int i = 0; i < 70; ++i) {
    Feed(filler);
  }
  Feed("\r\n" + kGet);
  EXPECT_EQ(rec_.trace, "BDBHM");
  EXPECT_EQ(rec_.desyncs, std::vector{Desync::kHeadTooLarge});

  // While resynchronising, a line held across segments is bounded.
  Start(Kind::kRequest);
  Feed("junk\r\nGET /" + std::string(5000, 'a'));
  Feed(std::string(5000, 'a') + " HTTP/1.1\r\n\r\n");
  Feed(kGet);
  EXPECT_EQ(rec_.trace, "DBHM");
  EXPECT_EQ(head(0).target, "/a");
}

// The reply is dropped, and the line where a chunk size was expected is where the next one
// may start.
TEST_F(HttpParserTest, BadChunkSizeDropsTheMessage) {
  Start(Kind::kResponse);
  const std::string chunked = "HTTP/1.1 200 OK\r\nTransfer-Encoding: chunked\r\n\r\n2\r\nab\r\n";
  Feed(chunked + "HTTP/1.1 200 OK\r\nContent-Length: 0\r\n\r\n");
  EXPECT_EQ(rec_.trace, "BHDBHM");
  EXPECT_EQ(span(0).begin_offset, chunked.size());
  EXPECT_EQ(rec_.desyncs, std::vector{Desync::kBadHead});
}

// Mangled streams cut at random with random gaps: no crash, bounded work and well-formed
// calls (a head ends in its message or in a desync dropping it; desyncs never repeat back to
// back; messages do not overlap).
TEST_F(HttpParserTest, MangledStreamsKeepTheCallOrder) {
  const std::string chunked = "Transfer-Encoding: chunked\r\n\r\n4;x\r\nwxyz\r\n0\r\nT: 1\r\n\r\n";
  const std::string requests =
      kGet + "POST /p HTTP/1.1\r\nContent-Length: 3\r\n\r\nabc" + "PUT /c HTTP/1.1\r\n" + chunked;
  const std::string replies = "HTTP/1.1 200 OK\r\n" + chunked +
                              "HTTP/1.1 100 Continue\r\n\r\nHTTP/1.1 200 OK\r\nContent-Length: 2"
                              "\r\n\r\nok";
  const std::string alphabet("\r\n :;0a9Ff\x16\x80\t,-", 15);
  std::mt19937 rng(2);
  int dropped_after_head = 0;
  for (int round = 0; round < 3000; ++round) {
    std::string stream = round % 2 ? requests : replies;
    for (int i = 0, n = static_cast<int>(rng() % 4); i < n; ++i) {
      stream[rng() % stream.size()] = alphabet[rng() % alphabet.size()];
    }
    Start(round % 2 ? Kind::kRequest : Kind::kResponse, 48 + rng() % 100);
    for (size_t pos = 0; pos < stream.size();) {
      if (rng() % 20 == 0) {
        parser_->Gap(1 + rng() % 20, 0);
      }
      const size_t n = std::min<size_t>(stream.size() - pos, 1 + rng() % 30);
      Feed(std::string_view(stream).substr(pos, n));
      pos += n;
    }
    parser_->End(0);
    const std::string& trace = rec_.trace;
    EXPECT_EQ(trace.find("DD"), std::string::npos) << trace;
    size_t desync = 0;
    for (size_t i = 0; i < trace.size(); ++i) {
      if (trace[i] == 'D') {
        ++desync;
      } else if (trace[i] == 'H') {
        ASSERT_LT(i + 1, trace.size()) << stream;
        if (trace[i + 1] == 'D') {
          ++dropped_after_head;
          const Desync reason = rec_.desyncs.at(desync);
          EXPECT_TRUE(reason == Desync::kBadHead || reason == Desync::kHeadTooLarge) << stream;
        } else {
          ASSERT_EQ(trace[i + 1], 'M') << stream;
        }
      }
    }
    for (size_t i = 1; i < rec_.messages.size(); ++i) {
      EXPECT_LE(span(i - 1).end_offset, span(i).begin_offset);
    }
  }
  EXPECT_GT(dropped_after_head, 0);  // the mangling reached chunked framing
}

}  // namespace
}  // namespace capture
