#include "collector/capture/testing/packet_builder.h"

#include <gtest/gtest.h>
#include <pcap/pcap.h>
#include <stdlib.h>
#include <unistd.h>

#include <cstdio>
#include <cstring>
#include <filesystem>
#include <map>
#include <string>
#include <vector>

namespace capture::testing {
namespace {

constexpr char kRequest[] = "GET /index.html HTTP/1.1\r\nHost: shop.example\r\n\r\n";

std::string Response(size_t body_size) {
  return "HTTP/1.1 200 OK\r\nContent-Length: " + std::to_string(body_size) +
         "\r\nContent-Type: text/html\r\n\r\n" + std::string(body_size, 'x');
}

// A whole connection: handshake, one exchange in MSS-sized segments, ACK, close both ways.
std::vector<Segment> Connection(bool v6, uint16_t client_port, Micros start) {
  TcpConversation tcp(v6 ? "2001:db8::10" : "10.1.2.3", client_port,
                      v6 ? "2001:db8::80" : "192.168.7.80", 80);
  tcp.Handshake(start, start + 100, start + 200);
  tcp.ClientSends(kRequest, start + 300);
  tcp.ServerSends(Response(4000), start + 900, 10);
  tcp.ClientAck(start + 1000);
  tcp.ClientFin(start + 2000);
  tcp.ServerFin(start + 2100);
  tcp.ClientAck(start + 2200);
  return tcp.TakeSegments();
}

// An independent RFC 1071 check: a block with a correct checksum in it sums to 0xffff.
uint16_t Sum(const uint8_t* data, size_t size, uint32_t sum = 0) {
  for (size_t i = 0; i < size; ++i) {
    sum += i % 2 == 0 ? data[i] << 8 : data[i];
  }
  while (sum > 0xffff) {
    sum = (sum >> 16) + (sum & 0xffff);
  }
  return static_cast<uint16_t>(sum);
}

uint32_t PseudoHeader(const uint8_t* src, const uint8_t* dst, size_t address_size,
                      size_t tcp_size) {
  return Sum(src, address_size) + Sum(dst, address_size) + 6 + static_cast<uint32_t>(tcp_size);
}

// ---- Sequence numbers ----

// Each side's numbers advance by its payload, SYN and FIN, and every segment acknowledges the
// other side's bytes: the bookkeeping the reassembler tests rely on.
TEST(TcpConversationTest, NumbersFollowBothSides) {
  TcpConversation tcp("10.0.0.1", 40000, "10.0.0.2", 80, 1000, 9000);
  tcp.set_mss(1448);
  tcp.Handshake(1, 2, 3);
  tcp.ClientSends(std::string(3000, 'q'), 10, 5);
  tcp.ServerSends("ok", 30);
  tcp.ClientFin(40);
  tcp.ServerAck(50);
  const std::vector<Segment>& s = tcp.segments();
  ASSERT_EQ(s.size(), 9u);

  EXPECT_EQ(s[0].flags, kTcpSyn);
  EXPECT_EQ(s[0].seq, 1000u);
  EXPECT_EQ(s[1].flags, kTcpSyn | kTcpAck);
  EXPECT_EQ(s[1].seq, 9000u);
  EXPECT_EQ(s[1].ack, 1001u);
  EXPECT_EQ(s[2].ack, 9001u);

  // 3000 bytes at an MSS of 1448: 1448 + 1448 + 104, PSH on the last, times stepped.
  EXPECT_EQ(s[3].seq, 1001u);
  EXPECT_EQ(s[4].seq, 2449u);
  EXPECT_EQ(s[5].seq, 3897u);
  EXPECT_EQ(s[5].payload.size(), 104u);
  EXPECT_EQ(s[4].flags, kTcpAck);
  EXPECT_EQ(s[5].flags, kTcpAck | kTcpPsh);
  EXPECT_EQ(s[5].time, 20);

  EXPECT_EQ(s[6].ack, 4001u);
  EXPECT_FALSE(s[6].from_client);
  EXPECT_EQ(s[7].seq, 4001u);  // the FIN
  EXPECT_EQ(s[7].ack, 9003u);
  EXPECT_EQ(s[8].ack, 4002u);  // the FIN took one number
  EXPECT_EQ(tcp.client_next_seq(), 4002u);
}

// Sequence numbers wrap as TCP's do.
TEST(TcpConversationTest, SequenceWraps) {
  TcpConversation tcp("10.0.0.1", 40000, "10.0.0.2", 80, 0xfffffff0u, 7);
  tcp.Handshake(1, 2, 3);
  tcp.ClientSends(std::string(40, 'q'), 10);
  EXPECT_EQ(tcp.segments().back().seq, 0xfffffff1u);
  EXPECT_EQ(tcp.client_next_seq(), 0x19u);
}

// A slice of a segment carries the sequence number of its own first byte.
TEST(TcpConversationTest, SliceStartsAtItsOwnByte) {
  TcpConversation tcp("10.0.0.1", 40000, "10.0.0.2", 80, 100, 900);
  tcp.Handshake(1, 2, 3);
  tcp.ClientSends("abcdefgh", 10);
  const Segment& whole = tcp.segments().back();
  const Segment middle = Slice(whole, 2, 3);
  EXPECT_EQ(middle.payload, "cde");
  EXPECT_EQ(middle.seq, whole.seq + 2);
  EXPECT_EQ(middle.flags, kTcpAck);  // PSH stays with the end
  EXPECT_EQ(Slice(whole, 5, 3).flags, kTcpAck | kTcpPsh);

  const TcpSegment view = middle.View();
  EXPECT_EQ(std::string(reinterpret_cast<const char*>(view.payload), view.payload_size), "cde");
  EXPECT_EQ(view.wire_payload_size, 3u);
}

// ---- Frames ----

// IPv4 with options and an odd-sized payload: lengths and both checksums verify.
TEST(PacketBuilderTest, Ipv4LengthsAndChecksums) {
  Segment segment = Connection(false, 40000, 0)[3];
  segment.payload += "!";  // odd, to exercise the checksum's last byte
  FrameOptions options;
  options.ip_options = std::string("\x01\x01\x01\x00", 4);
  options.tcp_options = std::string("\x02\x04\x05\xb4", 4);
  const Frame frame = BuildFrame(segment, {kLinkRaw}, options);
  const uint8_t* ip = frame.data.data();
  ASSERT_EQ(frame.data.size(), 24 + 24 + segment.payload.size());
  EXPECT_EQ(frame.wire_len, frame.data.size());
  EXPECT_EQ(ip[0], 0x46);
  EXPECT_EQ(ip[2] << 8 | ip[3], static_cast<int>(frame.data.size()));
  EXPECT_EQ(Sum(ip, 24), 0xffff);
  const size_t tcp_size = frame.data.size() - 24;
  EXPECT_EQ(ip[24 + 12], 6 << 4);
  EXPECT_EQ(Sum(ip + 24, tcp_size, PseudoHeader(ip + 12, ip + 16, 4, tcp_size)), 0xffff);
}

// IPv6 with extension headers: the payload length counts them, the TCP checksum does not.
TEST(PacketBuilderTest, Ipv6LengthsAndChecksums) {
  const Segment segment = Connection(true, 40000, 0)[3];
  FrameOptions options;
  options.ipv6_hop_by_hop = true;
  options.more_fragments = true;
  const Frame frame = BuildFrame(segment, {kLinkRaw}, options);
  const uint8_t* ip = frame.data.data();
  ASSERT_EQ(frame.data.size(), 40 + 16 + 20 + segment.payload.size());
  EXPECT_EQ(ip[4] << 8 | ip[5], static_cast<int>(frame.data.size() - 40));
  EXPECT_EQ(ip[6], 0);       // hop-by-hop first
  EXPECT_EQ(ip[40], 44);     // then the fragment header
  EXPECT_EQ(ip[48], 6);      // then TCP
  EXPECT_EQ(ip[48 + 3], 1);  // more fragments, offset 0
  const size_t tcp_size = frame.data.size() - 56;
  EXPECT_EQ(Sum(ip + 56, tcp_size, PseudoHeader(ip + 8, ip + 24, 16, tcp_size)), 0xffff);
}

// Link headers put the IP packet where each link type says it starts.
TEST(PacketBuilderTest, LinkHeaderSizes) {
  const Segment v4 = Connection(false, 40000, 0)[0];
  const Segment v6 = Connection(true, 40000, 0)[0];
  const size_t raw4 = BuildFrame(v4, {kLinkRaw}).data.size();
  const std::map<int, size_t> sizes = {{kLinkNull, 4},
                                       {kLinkEthernet, 14},
                                       {kLinkRawFile, 0},
                                       {kLinkLinuxSll, 16},
                                       {kLinkLinuxSll2, 20}};
  for (const auto& [type, size] : sizes) {
    const Frame frame = BuildFrame(v4, {type});
    EXPECT_EQ(frame.data.size(), raw4 + size) << "link type " << type;
    EXPECT_EQ(frame.data[size], 0x45) << "link type " << type;
  }
  const Frame tagged = BuildFrame(v6, {kLinkEthernet, {0x88a8, 0x8100}});
  const std::vector<uint8_t> expected_types = {0x88, 0xa8, 0x00, 100,  0x81, 0x00,
                                               0x00, 101,  0x86, 0xdd, 0x60};
  EXPECT_EQ(std::vector<uint8_t>(tagged.data.begin() + 12, tagged.data.begin() + 23),
            expected_types);
  const Frame loopback = BuildFrame(v6, {kLinkNull, {}, 24});
  uint32_t family = 0;
  std::memcpy(&family, loopback.data.data(), 4);
  EXPECT_EQ(family, 24u);
}

// ---- Capture files ----

class CaptureFileTest : public ::testing::Test {
 protected:
  void SetUp() override {
    char pattern[] = "/tmp/packet_builder_test.XXXXXX";
    ASSERT_NE(::mkdtemp(pattern), nullptr);
    dir_ = pattern;
  }
  void TearDown() override { std::filesystem::remove_all(dir_); }

  std::string Write(const std::string& name, FileFormat format, int link_type,
                    const std::vector<Frame>& frames) {
    const std::string path = dir_ + "/" + name;
    std::string error;
    EXPECT_TRUE(WriteCaptureFile(path, format, link_type, frames, &error)) << error;
    return path;
  }

  static bool HaveTshark() { return ::access("/usr/bin/tshark", X_OK) == 0; }

  // tshark's fields for each packet, one row per packet.
  static std::vector<std::vector<std::string>> Tshark(const std::string& path,
                                                      const std::string& fields) {
    const std::string command =
        "/usr/bin/tshark -n -o tcp.check_checksum:TRUE -o ip.check_checksum:TRUE -r '" + path +
        "' -T fields -E occurrence=f " + fields + " 2>/dev/null";
    std::vector<std::vector<std::string>> rows;
    std::FILE* pipe = ::popen(command.c_str(), "r");
    if (pipe == nullptr) {
      return rows;
    }
    char line[4096];
    while (std::fgets(line, sizeof(line), pipe) != nullptr) {
      std::string text(line);
      if (!text.empty() && text.back() == '\n') {
        text.pop_back();
      }
      std::vector<std::string> row(1);
      for (char c : text) {
        if (c == '\t') {
          row.emplace_back();
        } else {
          row.back() += c;
        }
      }
      rows.push_back(std::move(row));
    }
    ::pclose(pipe);
    return rows;
  }

  std::string dir_;
};

// libpcap reads back every frame of every format unchanged, cut frames included, with link
// types mapped as it maps them and time stamps to the microsecond.
TEST_F(CaptureFileTest, LibpcapReadsEveryFormatBack) {
  std::vector<Frame> frames = BuildFrames(Connection(false, 40000, 1700000000123456));
  frames[4].Truncate(60);
  for (FileFormat format : {FileFormat::kPcap, FileFormat::kPcapNanos, FileFormat::kPcapng}) {
    for (int link : {kLinkEthernet, kLinkRawFile}) {
      SCOPED_TRACE(::testing::Message()
                   << "format " << static_cast<int>(format) << " link " << link);
      const std::string path = Write("read.pcap", format, link, frames);
      char error[PCAP_ERRBUF_SIZE];
      pcap_t* pcap =
          pcap_open_offline_with_tstamp_precision(path.c_str(), PCAP_TSTAMP_PRECISION_MICRO, error);
      ASSERT_NE(pcap, nullptr) << error;
      EXPECT_EQ(pcap_datalink(pcap), link == kLinkRawFile ? kLinkRaw : link);
      size_t count = 0;
      pcap_pkthdr* header = nullptr;
      const u_char* data = nullptr;
      while (pcap_next_ex(pcap, &header, &data) == 1) {
        ASSERT_LT(count, frames.size());
        const Frame& frame = frames[count++];
        EXPECT_EQ(header->ts.tv_sec * 1000000LL + header->ts.tv_usec, frame.time);
        EXPECT_EQ(header->len, frame.wire_len);
        ASSERT_EQ(header->caplen, frame.data.size());
        EXPECT_EQ(std::vector<uint8_t>(data, data + header->caplen), frame.data);
      }
      EXPECT_EQ(count, frames.size());
      pcap_close(pcap);
    }
  }
}

// tshark decodes each link type and IP version as the connection we scripted: every packet,
// every payload byte in each direction, good checksums, no sequence anomalies, and HTTP.
TEST_F(CaptureFileTest, TsharkSeesTheConversations) {
  if (!HaveTshark()) {
    GTEST_SKIP() << "tshark is not installed";
  }
  std::vector<Segment> segments = Connection(false, 40000, 1000000);
  for (const Segment& segment : Connection(true, 40001, 2000000)) {
    segments.push_back(segment);
  }
  struct Case {
    LinkSpec link;
    FileFormat format;
  };
  const std::vector<Case> cases = {
      {{kLinkEthernet}, FileFormat::kPcap},
      {{kLinkEthernet, {0x8100}}, FileFormat::kPcap},
      {{kLinkEthernet, {0x88a8, 0x8100}}, FileFormat::kPcap},
      {{kLinkLinuxSll}, FileFormat::kPcap},
      {{kLinkLinuxSll2}, FileFormat::kPcapNanos},
      {{kLinkNull}, FileFormat::kPcapng},
      {{kLinkRaw}, FileFormat::kPcapNanos},
      {{kLinkRawFile}, FileFormat::kPcapng},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(::testing::Message()
                 << "link " << c.link.type << " tags " << c.link.vlan_tpids.size());
    const std::string path =
        Write("conv.pcap", c.format, c.link.type, BuildFrames(segments, c.link));
    const auto rows = Tshark(path,
                             "-e tcp.srcport -e tcp.len -e tcp.checksum.status "
                             "-e tcp.analysis.flags -e http.request.method "
                             "-e http.response.code -e frame.time_epoch");
    ASSERT_EQ(rows.size(), segments.size());
    std::map<std::string, size_t> bytes_from_port;
    std::string methods;
    std::string codes;
    for (size_t i = 0; i < rows.size(); ++i) {
      const std::vector<std::string>& row = rows[i];
      ASSERT_GE(row.size(), 7u) << "packet " << i;
      bytes_from_port[row[0]] += std::stoul(row[1]);
      EXPECT_EQ(row[2], "1") << "checksum of packet " << i;
      EXPECT_EQ(row[3], "") << "analysis flags on packet " << i;
      methods += row[4];
      codes += row[5];
      EXPECT_NEAR(std::stod(row[6]), segments[i].time / 1e6, 1e-6);
    }
    EXPECT_EQ(bytes_from_port["80"], 2 * Response(4000).size());
    EXPECT_EQ(bytes_from_port["40000"], std::string(kRequest).size());
    EXPECT_EQ(bytes_from_port["40001"], std::string(kRequest).size());
    EXPECT_EQ(methods, "GETGET");
    EXPECT_EQ(codes, "200200");
  }
}

// A segment sent twice reads as a retransmission, and one dropped as a hole: the material the
// reassembler tests are made of means the same to tshark.
TEST_F(CaptureFileTest, TsharkSeesRetransmissionAndLoss) {
  if (!HaveTshark()) {
    GTEST_SKIP() << "tshark is not installed";
  }
  std::vector<Segment> segments = Connection(false, 40000, 1000000);
  segments.push_back(segments[5]);  // the second response segment again, later
  segments.back().time += 50000;
  segments.erase(segments.begin() + 6);  // the third never seen
  const std::string path =
      Write("loss.pcap", FileFormat::kPcap, kLinkEthernet, BuildFrames(segments));
  const auto rows = Tshark(path,
                           "-e frame.number -e tcp.analysis.retransmission "
                           "-e tcp.analysis.lost_segment");
  ASSERT_EQ(rows.size(), segments.size());
  std::string retransmitted;
  std::string lost;
  for (const auto& row : rows) {
    ASSERT_EQ(row.size(), 3u);
    retransmitted += row[1].empty() ? "" : row[0] + " ";
    lost += row[2].empty() ? "" : row[0] + " ";
  }
  EXPECT_EQ(retransmitted, std::to_string(segments.size()) + " ");
  EXPECT_EQ(lost, "9 ");  // the server's FIN, its next segment after the hole
}

}  // namespace
}  // namespace capture::testing
