#include "collector/capture/packet_decoder.h"

#include <arpa/inet.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <array>
#include <cstring>
#include <string>
#include <vector>

namespace capture {
namespace {

using Bytes = std::vector<uint8_t>;

void Put16(Bytes* b, uint16_t v) {
  b->push_back(static_cast<uint8_t>(v >> 8));
  b->push_back(static_cast<uint8_t>(v));
}
void Put32(Bytes* b, uint32_t v) {
  Put16(b, static_cast<uint16_t>(v >> 16));
  Put16(b, static_cast<uint16_t>(v));
}

// TCP 40000 -> 80, seq 7, ack 9, ACK|PSH, with payload.
Bytes Tcp(const std::string& payload) {
  Bytes b;
  Put16(&b, 40000);
  Put16(&b, 80);
  Put32(&b, 7);
  Put32(&b, 9);
  b.push_back(5 << 4);
  b.push_back(kTcpAck | kTcpPsh);
  Put16(&b, 65535);
  Put32(&b, 0);  // checksum, urgent pointer
  b.insert(b.end(), payload.begin(), payload.end());
  return b;
}

Bytes Ipv4(const Bytes& tcp, uint16_t fragment = 0, uint8_t protocol = 6) {
  Bytes b = {0x45, 0};
  Put16(&b, static_cast<uint16_t>(20 + tcp.size()));
  Put16(&b, 1);
  Put16(&b, fragment);
  b.push_back(64);
  b.push_back(protocol);
  Put16(&b, 0);
  b.insert(b.end(), {192, 0, 2, 1, 192, 0, 2, 2});
  b.insert(b.end(), tcp.begin(), tcp.end());
  return b;
}

// IPv6 with a destination-options header before TCP.
Bytes Ipv6(const Bytes& tcp) {
  Bytes b = {0x60, 0, 0, 0};
  Put16(&b, static_cast<uint16_t>(8 + tcp.size()));
  b.push_back(60);  // destination options
  b.push_back(64);
  for (int side = 0; side < 2; ++side) {
    b.insert(b.end(), {0x20, 0x01, 0x0d, 0xb8});
    b.insert(b.end(), 11, 0);
    b.push_back(static_cast<uint8_t>(side + 1));
  }
  b.insert(b.end(), {6, 0, 1, 4, 0, 0, 0, 0});  // next TCP, 8 bytes, PadN
  b.insert(b.end(), tcp.begin(), tcp.end());
  return b;
}

Bytes Ethernet(const Bytes& ip, uint16_t type, int vlans) {
  Bytes b(12, 0xAA);
  for (int i = 0; i < vlans; ++i) {
    Put16(&b, i == 0 && vlans == 2 ? 0x88A8 : 0x8100);
    Put16(&b, 100);
  }
  Put16(&b, type);
  b.insert(b.end(), ip.begin(), ip.end());
  return b;
}

DecodeResult Decode(int link_type, const Bytes& frame, TcpSegment* s) {
  return DecodePacket(link_type, frame.data(), static_cast<uint32_t>(frame.size()), 42, s);
}

std::string Payload(const TcpSegment& s) {
  return std::string(reinterpret_cast<const char*>(s.payload), s.payload_size);
}

TEST(PacketDecoderTest, EveryLinkTypeReachesTheSameSegment) {
  const Bytes ip4 = Ipv4(Tcp("GET /"));
  Bytes sll(14, 0);
  Put16(&sll, 0x0800);
  sll.insert(sll.end(), ip4.begin(), ip4.end());
  Bytes sll2;
  Put16(&sll2, 0x0800);
  sll2.insert(sll2.end(), 18, 0);
  sll2.insert(sll2.end(), ip4.begin(), ip4.end());
  Bytes null_le = {2, 0, 0, 0};
  null_le.insert(null_le.end(), ip4.begin(), ip4.end());
  Bytes loop_be = {0, 0, 0, 2};
  loop_be.insert(loop_be.end(), ip4.begin(), ip4.end());
  const struct {
    int link_type;
    Bytes frame;
  } cases[] = {
      {1, Ethernet(ip4, 0x0800, 0)},
      {1, Ethernet(ip4, 0x0800, 1)},
      {1, Ethernet(ip4, 0x0800, 2)},
      {113, sll},
      {276, sll2},
      {0, null_le},
      {108, loop_be},
      {12, ip4},
      {101, ip4},
      {228, ip4},
  };
  for (const auto& c : cases) {
    TcpSegment s;
    ASSERT_EQ(Decode(c.link_type, c.frame, &s), DecodeResult::kTcp) << c.link_type;
    EXPECT_EQ(Payload(s), "GET /") << c.link_type;
    EXPECT_EQ(s.src_port, 40000);
    EXPECT_EQ(s.dst_port, 80);
    EXPECT_EQ(s.seq, 7u);
    EXPECT_EQ(s.ack, 9u);
    EXPECT_EQ(s.flags, kTcpAck | kTcpPsh);
    EXPECT_EQ(s.time, 42);
    EXPECT_FALSE(s.src.v6);
    EXPECT_EQ(s.src.bytes[3], 1);
    EXPECT_EQ(s.dst.bytes[3], 2);
  }
}

TEST(PacketDecoderTest, Ipv6WithExtensionHeader) {
  TcpSegment s;
  const Bytes frame = Ethernet(Ipv6(Tcp("HTTP/1.1")), 0x86DD, 0);  // s points into it
  ASSERT_EQ(Decode(1, frame, &s), DecodeResult::kTcp);
  EXPECT_TRUE(s.src.v6);
  EXPECT_EQ(Payload(s), "HTTP/1.1");
  char text[64];
  FormatAddress(s.dst, text, sizeof(text));
  EXPECT_STREQ(text, "2001:db8::2");
  Bytes raw6 = Ipv6(Tcp("x"));
  ASSERT_EQ(Decode(12, raw6, &s), DecodeResult::kTcp);  // raw IP picks the version
  Bytes null6 = {10, 0, 0, 0};                          // Linux AF_INET6 on loopback
  null6.insert(null6.end(), raw6.begin(), raw6.end());
  EXPECT_EQ(Decode(0, null6, &s), DecodeResult::kTcp);
}

// IPv4 is formatted by hand; it must read as inet_ntop writes it, every octet width included.
TEST(PacketDecoderTest, Ipv4AddressesFormatLikeInetNtop) {
  for (const std::array<uint8_t, 4> octets : {std::array<uint8_t, 4>{0, 0, 0, 0},
                                              {255, 255, 255, 255},
                                              {10, 0, 100, 9},
                                              {192, 168, 1, 20},
                                              {1, 99, 100, 199}}) {
    IpAddress a;
    std::copy(octets.begin(), octets.end(), a.bytes.begin());
    char mine[64];
    char theirs[64];
    FormatAddress(a, mine, sizeof(mine));
    ASSERT_NE(inet_ntop(AF_INET, a.bytes.data(), theirs, sizeof(theirs)), nullptr);
    EXPECT_STREQ(mine, theirs);
  }
}

TEST(PacketDecoderTest, EthernetPaddingIsNotPayload) {
  Bytes frame = Ethernet(Ipv4(Tcp("")), 0x0800, 0);
  frame.insert(frame.end(), 6, 0);  // padded to the 60-byte minimum
  TcpSegment s;
  ASSERT_EQ(Decode(1, frame, &s), DecodeResult::kTcp);
  EXPECT_EQ(s.payload_size, 0u);
  EXPECT_EQ(s.wire_payload_size, 0u);
}

TEST(PacketDecoderTest, SnapLengthCutKeepsTheWireLength) {
  Bytes frame = Ethernet(Ipv4(Tcp("0123456789")), 0x0800, 0);
  frame.resize(frame.size() - 6);
  TcpSegment s;
  ASSERT_EQ(Decode(1, frame, &s), DecodeResult::kTcp);
  EXPECT_EQ(Payload(s), "0123");
  EXPECT_EQ(s.wire_payload_size, 10u);
}

TEST(PacketDecoderTest, WhatIsNotATcpSegment) {
  TcpSegment s;
  const Bytes ip4 = Ipv4(Tcp("x"));
  EXPECT_EQ(Decode(1, Ethernet(Ipv4(Tcp("x"), 0, 17), 0x0800, 0), &s), DecodeResult::kNotTcp);
  EXPECT_EQ(Decode(1, Ethernet(ip4, 0x0806, 0), &s), DecodeResult::kNotTcp);  // ARP
  EXPECT_EQ(Decode(1, Ethernet(Ipv4(Tcp("x"), 0x2000), 0x0800, 0), &s),
            DecodeResult::kFragment);  // more fragments
  EXPECT_EQ(Decode(1, Ethernet(Ipv4(Tcp("x"), 0x0010), 0x0800, 0), &s),
            DecodeResult::kFragment);  // a later fragment
  EXPECT_EQ(Decode(147, ip4, &s), DecodeResult::kUnsupportedLink);
  // Every prefix of a good frame is refused without reading past it.
  const Bytes frame = Ethernet(Ipv6(Tcp("")), 0x86DD, 1);
  for (size_t size = 0; size < frame.size(); ++size) {
    const Bytes cut(frame.begin(), frame.begin() + static_cast<long>(size));
    EXPECT_EQ(Decode(1, cut, &s), DecodeResult::kTruncated) << size;
  }
}

}  // namespace
}  // namespace capture
