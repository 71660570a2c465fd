#pragma once

// TcpSegment: one TCP segment as the packet decoder hands it to the reassembler, with the
// capture time of its packet. It points into the packet buffer and lives only as long as it.

#include <array>
#include <cstdint>

namespace capture {

// Microseconds since 1970 UTC, from the capture's packet time stamps. Every time in the
// capture pipeline is one of these: the capture point's clock, never the host's.
using Micros = int64_t;

// An IPv4 or IPv6 address; IPv4 uses the first 4 bytes and leaves the rest zero.
struct IpAddress {
  std::array<uint8_t, 16> bytes{};
  bool v6 = false;

  bool operator==(const IpAddress&) const = default;
};

// TCP header flags.
inline constexpr uint8_t kTcpFin = 0x01;
inline constexpr uint8_t kTcpSyn = 0x02;
inline constexpr uint8_t kTcpRst = 0x04;
inline constexpr uint8_t kTcpPsh = 0x08;
inline constexpr uint8_t kTcpAck = 0x10;

struct TcpSegment {
  Micros time = 0;
  IpAddress src;
  IpAddress dst;
  uint16_t src_port = 0;
  uint16_t dst_port = 0;
  uint32_t seq = 0;
  uint32_t ack = 0;
  uint8_t flags = 0;
  const uint8_t* payload = nullptr;  // the captured payload bytes, payload_size of them
  uint32_t payload_size = 0;
  // Payload length by the IP header. Larger than payload_size when the snap length cut the
  // packet: the missing bytes are a gap in the stream, not absent from it.
  uint32_t wire_payload_size = 0;
};

// The text form of an address: dotted IPv4 or RFC 5952 IPv6.
void FormatAddress(const IpAddress& address, char* out, unsigned size);

}  // namespace capture
