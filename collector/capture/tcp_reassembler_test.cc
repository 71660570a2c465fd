#include "collector/capture/tcp_reassembler.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <string>
#include <vector>

namespace capture {
namespace {

// Everything a handler was told, as text: "S:data@time", "C:gap5", "S:ack", "C:end".
struct Recording {
  std::vector<std::string> events;
  std::string bytes[2];
  ConnectionInfo info;
  int connections = 0;
  int destroyed = 0;
};

class RecordingHandler : public StreamHandler {
 public:
  explicit RecordingHandler(Recording* r) : r_(r) {}
  ~RecordingHandler() override { ++r_->destroyed; }
  void OnData(Direction dir, const uint8_t* data, uint32_t size, Micros time) override {
    const std::string text(reinterpret_cast<const char*>(data), size);
    r_->bytes[static_cast<int>(dir)] += text;
    r_->events.push_back(Name(dir) + text + "@" + std::to_string(time));
  }
  void OnGap(Direction dir, uint64_t size, Micros) override {
    r_->bytes[static_cast<int>(dir)] += std::string(size, '?');
    r_->events.push_back(Name(dir) + "gap" + std::to_string(size));
  }
  void OnPureAck(Direction dir, Micros) override { r_->events.push_back(Name(dir) + "ack"); }
  void OnEnd(Direction dir, Micros) override { r_->events.push_back(Name(dir) + "end"); }

 private:
  static std::string Name(Direction dir) { return dir == Direction::kToServer ? "S:" : "C:"; }
  Recording* r_;
};

class RecordingFactory : public StreamHandlerFactory {
 public:
  explicit RecordingFactory(Recording* r) : r_(r) {}
  std::unique_ptr<StreamHandler> NewConnection(const ConnectionInfo& info) override {
    r_->info = info;
    ++r_->connections;
    return std::make_unique<RecordingHandler>(r_);
  }

 private:
  Recording* r_;
};

IpAddress V4(uint8_t last) {
  IpAddress a;
  a.bytes[0] = 10;
  a.bytes[3] = last;
  return a;
}

// A client (10.0.0.1:40000) and a server (10.0.0.2:80) with sequence numbers kept per side.
class TcpReassemblerTest : public ::testing::Test {
 protected:
  TcpReassemblerTest() : factory_(&r_) { Reset(ReassemblerOptions{}); }

  void Reset(const ReassemblerOptions& options) {
    tcp_ = std::make_unique<TcpReassembler>(options, &factory_, &stats_);
  }

  TcpSegment Segment(bool from_client, uint32_t seq, uint8_t flags, const std::string& payload,
                     Micros time) {
    payloads_.push_back(payload);
    TcpSegment s;
    s.time = time;
    s.src = from_client ? V4(1) : V4(2);
    s.dst = from_client ? V4(2) : V4(1);
    s.src_port = from_client ? client_port_ : 80;
    s.dst_port = from_client ? 80 : client_port_;
    s.seq = seq;
    s.ack = from_client ? server_next_ : client_next_;
    s.flags = flags;
    s.payload = reinterpret_cast<const uint8_t*>(payloads_.back().data());
    s.payload_size = s.wire_payload_size = static_cast<uint32_t>(payload.size());
    return s;
  }
  void Handshake(Micros time = 1) {
    tcp_->Add(Segment(true, client_isn_, kTcpSyn, "", time));
    tcp_->Add(Segment(false, server_isn_, kTcpSyn | kTcpAck, "", time + 1));
    client_next_ = client_isn_ + 1;
    server_next_ = server_isn_ + 1;
    tcp_->Add(Segment(true, client_next_, kTcpAck, "", time + 2));
    r_.events.clear();
  }
  // A segment of the client's stream at relative offset (0 = first byte after the SYN).
  TcpSegment Client(uint32_t offset, const std::string& payload, Micros time,
                    uint8_t flags = kTcpAck | kTcpPsh) {
    return Segment(true, client_isn_ + 1 + offset, flags, payload, time);
  }
  TcpSegment Server(uint32_t offset, const std::string& payload, Micros time,
                    uint8_t flags = kTcpAck | kTcpPsh) {
    return Segment(false, server_isn_ + 1 + offset, flags, payload, time);
  }
  void Add(const TcpSegment& s) { tcp_->Add(s); }

  Recording r_;
  RecordingFactory factory_;
  CaptureStats stats_;
  std::unique_ptr<TcpReassembler> tcp_;
  std::vector<std::string> payloads_ = std::vector<std::string>();
  uint32_t client_isn_ = 1000;
  uint32_t server_isn_ = 5000;
  uint32_t client_next_ = 0;  // what the server acknowledges
  uint32_t server_next_ = 0;
  uint16_t client_port_ = 40000;

 private:
  void SetUp() override { payloads_.reserve(1000); }
};

TEST_F(TcpReassemblerTest, HandshakeNamesTheClientAndOrdersSegments) {
  Handshake(100);
  EXPECT_TRUE(r_.info.syn_seen);
  EXPECT_EQ(r_.info.syn_time, 100);
  EXPECT_EQ(r_.info.client_port, 40000);
  EXPECT_TRUE(r_.info.from_start[0] && r_.info.from_start[1]);
  // The third segment first, then the second, then the first: delivered in order, each with
  // its own capture time.
  Add(Client(6, "three", 30));
  Add(Client(3, "two", 20));
  Add(Client(0, "one", 10));
  EXPECT_EQ(r_.bytes[0], "onetwothree");
  ASSERT_EQ(r_.events.size(), 3u);
  EXPECT_EQ(r_.events[0], "S:one@10");
  EXPECT_EQ(r_.events[1], "S:two@20");
  EXPECT_EQ(r_.events[2], "S:three@30");
  EXPECT_EQ(stats_.out_of_order, 2u);
}

TEST_F(TcpReassemblerTest, RetransmissionsAndOverlapsDeliverOnlyNewBytes) {
  Handshake();
  Add(Client(0, "abcdef", 10));
  Add(Client(0, "abcdef", 11));  // exact duplicate
  Add(Client(3, "defghi", 12));  // overlaps three delivered bytes
  Add(Client(10, "klm", 13));    // ahead, waits
  Add(Client(8, "ijklmn", 14));  // fills the hole and overlaps the waiting one
  EXPECT_EQ(r_.bytes[0], "abcdefghijklmn");
  EXPECT_EQ(stats_.retransmissions, 1u);
  EXPECT_EQ(stats_.gaps, 0u);
}

TEST_F(TcpReassemblerTest, SequenceNumbersWrapAround) {
  client_isn_ = 0xFFFFFFF0u;
  Handshake();
  Add(Client(0, "0123456789", 10));
  Add(Client(10, "ABCDEFGHIJ", 11));  // crosses 2^32
  Add(Client(20, "xyz", 12));
  EXPECT_EQ(r_.bytes[0], "0123456789ABCDEFGHIJxyz");
}

TEST_F(TcpReassemblerTest, AcknowledgedHoleBecomesAGap) {
  Handshake();
  Add(Server(0, "HTTP", 10));
  Add(Server(8, "body", 12));  // bytes 4-7 never captured
  EXPECT_EQ(r_.bytes[1], "HTTP");
  // The client acknowledges everything: the hole is gone for good.
  server_next_ = server_isn_ + 1 + 12;
  Add(Segment(true, client_isn_ + 1, kTcpAck, "", 13));
  EXPECT_EQ(r_.bytes[1], "HTTP????body");
  EXPECT_EQ(stats_.gaps, 1u);
  EXPECT_EQ(stats_.gap_bytes, 4u);
  // An acknowledgement with no data behind it also names missed bytes.
  server_next_ = server_isn_ + 1 + 20;
  Add(Segment(true, client_isn_ + 1, kTcpAck, "", 14));
  EXPECT_EQ(r_.bytes[1], "HTTP????body????????");
}

TEST_F(TcpReassemblerTest, FinAfterAHoleEndsWithAGap) {
  Handshake();
  Add(Client(0, "GET", 10));
  Add(Client(3, " /", 11));
  Add(Server(0, "HTTP/1.0 200", 12));
  Add(Server(20, "tail", 14, kTcpAck | kTcpFin));  // 12-19 missed, or only late
  EXPECT_EQ(r_.bytes[1], "HTTP/1.0 200");
  // The client's FIN: both sides are done, so the hole will never be filled.
  Add(Client(5, "", 15, kTcpAck | kTcpFin));
  EXPECT_EQ(r_.bytes[1], "HTTP/1.0 200????????tail");
  EXPECT_EQ(r_.events.back(), "C:end");
  EXPECT_EQ(r_.destroyed, 1);
  EXPECT_EQ(tcp_->connection_count(), 0u);
}

TEST_F(TcpReassemblerTest, AcknowledgedFinEndsTheDirection) {
  Handshake();
  Add(Server(0, "abc", 10));
  Add(Server(6, "ghi", 11, kTcpAck | kTcpFin));  // 3-5 missed
  server_next_ = server_isn_ + 1 + 10;           // the client acknowledges the FIN
  Add(Segment(true, client_isn_ + 1, kTcpAck, "", 12));
  EXPECT_EQ(r_.bytes[1], "abc???ghi");
  EXPECT_NE(std::find(r_.events.begin(), r_.events.end(), "C:end"), r_.events.end());
}

TEST_F(TcpReassemblerTest, FullReorderBufferGivesUpTheHole) {
  ReassemblerOptions options;
  options.max_buffered_bytes = 8;
  Reset(options);
  Handshake();
  Add(Client(0, "ab", 1));
  Add(Client(4, "efgh", 2));  // waits: 4 bytes buffered
  Add(Client(8, "ijkl", 3));  // 8: still fits
  Add(Client(12, "mn", 4));   // would make 10: the hole at 2-3 is given up
  EXPECT_EQ(r_.bytes[0], "ab??efghijklmn");
  EXPECT_EQ(stats_.buffer_overflows, 1u);
}

TEST_F(TcpReassemblerTest, PureAcksAreReportedBySender) {
  Handshake();
  Add(Client(0, "GET / HTTP/1.1\r\n\r\n", 10));
  client_next_ += 18;
  Add(Segment(false, server_isn_ + 1, kTcpAck, "", 11));
  ASSERT_FALSE(r_.events.empty());
  EXPECT_EQ(r_.events.back(), "C:ack");
}

TEST_F(TcpReassemblerTest, ResetEndsBothDirections) {
  Handshake();
  Add(Client(0, "x", 10));
  Add(Segment(false, server_isn_ + 1, kTcpRst, "", 11));
  ASSERT_GE(r_.events.size(), 2u);
  EXPECT_EQ(r_.events[r_.events.size() - 2], "S:end");
  EXPECT_EQ(r_.events.back(), "C:end");
  EXPECT_EQ(tcp_->connection_count(), 0u);
}

TEST_F(TcpReassemblerTest, MidstreamConnectionTakesTheHigherPortAsClient) {
  // The server speaks first (its reply's tail); nothing was seen of the handshake.
  Add(Server(100, "rest of a body", 10));
  EXPECT_EQ(r_.connections, 1);
  EXPECT_FALSE(r_.info.syn_seen);
  EXPECT_EQ(r_.info.client_port, 40000);
  EXPECT_FALSE(r_.info.from_start[0]);
  EXPECT_EQ(r_.bytes[1], "rest of a body");
  // Its FIN and an ACK alone open nothing.
  client_port_ = 40001;
  Add(Segment(false, 77, kTcpAck | kTcpFin, "", 11));
  EXPECT_EQ(r_.connections, 1);
}

TEST_F(TcpReassemblerTest, IdleConnectionsExpireAndTheTableIsCapped) {
  ReassemblerOptions options;
  options.max_connections = 1;
  options.idle_timeout = 1000000;
  Reset(options);
  Handshake(1);
  // A second connection is refused while the first holds the only place, and counted once.
  client_port_ = 40001;
  Handshake(2);
  Add(Client(0, "x", 3));
  EXPECT_EQ(r_.connections, 1);
  EXPECT_EQ(stats_.connections_capped, 1u);
  tcp_->Expire(5000000);
  EXPECT_EQ(stats_.connections_expired, 1u);
  EXPECT_EQ(tcp_->connection_count(), 0u);
  Handshake(5000001);
  EXPECT_EQ(r_.connections, 2);
}

TEST_F(TcpReassemblerTest, NewSynOnTheSamePortsStartsANewConnection) {
  Handshake(1);
  Add(Client(0, "old", 2));
  Handshake(3);  // the same SYN again: a retransmission, nothing new
  EXPECT_EQ(r_.connections, 1);
  client_isn_ = 900000;  // the port reused without a FIN or RST seen
  Handshake(4);
  EXPECT_EQ(r_.connections, 2);
  EXPECT_EQ(r_.destroyed, 1);
  Add(Client(0, "new", 5));
  EXPECT_EQ(r_.bytes[0], "oldnew");
}

TEST_F(TcpReassemblerTest, DataOnASynFollowsIt) {
  Add(Segment(true, client_isn_, kTcpSyn, "GET", 1));  // TCP Fast Open
  Add(Client(3, " /", 2));
  EXPECT_EQ(r_.bytes[0], "GET /");
  EXPECT_EQ(stats_.gaps, 0u);
}

TEST_F(TcpReassemblerTest, SnapLengthCutIsAGap) {
  Handshake();
  TcpSegment s = Client(0, "GET /abc", 10);
  s.payload_size = 4;  // "GET " captured of 8 bytes
  Add(s);
  Add(Client(8, " HTTP/1.1", 11));
  EXPECT_EQ(r_.bytes[0], "GET ???? HTTP/1.1");
}

}  // namespace
}  // namespace capture
