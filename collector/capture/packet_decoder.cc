#include "collector/capture/packet_decoder.h"

#include <algorithm>
#include <cstring>

namespace capture {
namespace {

// libpcap link types (DLT_*). DLT_RAW is 12 on Linux and 14 on OpenBSD; files may also carry
// the LINKTYPE_RAW number itself.
constexpr int kDltNull = 0;
constexpr int kDltEthernet = 1;
constexpr int kDltRaw = 12;
constexpr int kDltRawOpenBsd = 14;
constexpr int kLinkTypeRaw = 101;
constexpr int kDltLoop = 108;
constexpr int kDltLinuxSll = 113;
constexpr int kDltLinuxSll2 = 276;
constexpr int kDltIpv4 = 228;
constexpr int kDltIpv6 = 229;

constexpr uint16_t kEtherIpv4 = 0x0800;
constexpr uint16_t kEtherIpv6 = 0x86DD;
constexpr uint16_t kEtherVlan = 0x8100;
constexpr uint16_t kEtherQinQ = 0x88A8;
constexpr uint16_t kEtherQinQOld = 0x9100;

constexpr uint8_t kProtoTcp = 6;

uint16_t Be16(const uint8_t* p) {
  return static_cast<uint16_t>(p[0] << 8 | p[1]);
}
uint32_t Be32(const uint8_t* p) {
  return static_cast<uint32_t>(p[0]) << 24 | static_cast<uint32_t>(p[1]) << 16 |
         static_cast<uint32_t>(p[2]) << 8 | p[3];
}

// The network protocol as an EtherType, and where its header starts; 0 when unknown.
struct Network {
  uint16_t ether_type = 0;
  uint32_t offset = 0;
};

// BSD loopback's address family is in the capturing host's byte order, which the file does not
// record: accept either order. IPv6's number differs between systems.
uint16_t FamilyToEtherType(uint32_t family) {
  switch (family) {
    case 2:
      return kEtherIpv4;
    case 10:  // Linux
    case 24:  // NetBSD, OpenBSD
    case 28:  // FreeBSD
    case 30:  // macOS
      return kEtherIpv6;
    default:
      return 0;
  }
}

bool LinkLayer(int link_type, const uint8_t* data, uint32_t caplen, Network* out,
               DecodeResult* failure) {
  *failure = DecodeResult::kTruncated;
  switch (link_type) {
    case kDltEthernet: {
      uint32_t offset = 12;
      if (caplen < offset + 2) {
        return false;
      }
      uint16_t type = Be16(data + offset);
      // One or two VLAN tags (802.1Q, 802.1ad).
      while (type == kEtherVlan || type == kEtherQinQ || type == kEtherQinQOld) {
        offset += 4;
        if (caplen < offset + 2) {
          return false;
        }
        type = Be16(data + offset);
      }
      *out = {type, offset + 2};
      return true;
    }
    case kDltLinuxSll:
      if (caplen < 16) {
        return false;
      }
      *out = {Be16(data + 14), 16};
      return true;
    case kDltLinuxSll2:
      if (caplen < 20) {
        return false;
      }
      *out = {Be16(data), 20};
      return true;
    case kDltNull:
    case kDltLoop: {
      if (caplen < 4) {
        return false;
      }
      uint32_t host_order;
      std::memcpy(&host_order, data, 4);
      uint16_t type =
          link_type == kDltLoop ? FamilyToEtherType(Be32(data)) : FamilyToEtherType(host_order);
      if (type == 0) {
        type = FamilyToEtherType(Be32(data));
      }
      *out = {type, 4};
      return true;
    }
    case kDltRaw:
    case kDltRawOpenBsd:
    case kLinkTypeRaw:
      if (caplen < 1) {
        return false;
      }
      *out = {static_cast<uint16_t>((data[0] >> 4) == 6 ? kEtherIpv6 : kEtherIpv4), 0};
      return true;
    case kDltIpv4:
      *out = {kEtherIpv4, 0};
      return true;
    case kDltIpv6:
      *out = {kEtherIpv6, 0};
      return true;
    default:
      *failure = DecodeResult::kUnsupportedLink;
      return false;
  }
}

// Where the IP payload starts, how long it is on the wire, and its protocol.
struct Transport {
  uint32_t offset = 0;
  uint32_t wire_size = 0;
  uint8_t protocol = 0;
};

DecodeResult Ipv4(const uint8_t* data, uint32_t caplen, uint32_t at, TcpSegment* segment,
                  Transport* out) {
  if (caplen < at + 20) {
    return DecodeResult::kTruncated;
  }
  const uint8_t* ip = data + at;
  if ((ip[0] >> 4) != 4) {
    return DecodeResult::kUnsupportedLink;
  }
  const uint32_t header = (ip[0] & 0x0F) * 4u;
  const uint32_t total = Be16(ip + 2);
  if (header < 20 || total < header) {
    return DecodeResult::kTruncated;
  }
  if ((Be16(ip + 6) & 0x3FFF) != 0) {  // more fragments, or an offset
    return DecodeResult::kFragment;
  }
  segment->src = IpAddress{};
  segment->dst = IpAddress{};
  std::memcpy(segment->src.bytes.data(), ip + 12, 4);
  std::memcpy(segment->dst.bytes.data(), ip + 16, 4);
  *out = {at + header, total - header, ip[9]};
  return DecodeResult::kTcp;
}

DecodeResult Ipv6(const uint8_t* data, uint32_t caplen, uint32_t at, TcpSegment* segment,
                  Transport* out) {
  if (caplen < at + 40) {
    return DecodeResult::kTruncated;
  }
  const uint8_t* ip = data + at;
  if ((ip[0] >> 4) != 6) {
    return DecodeResult::kUnsupportedLink;
  }
  uint32_t remaining = Be16(ip + 4);
  if (remaining == 0) {  // a jumbogram's length is in an option: trust the capture
    remaining = caplen - at - 40;
  }
  segment->src = IpAddress{};
  segment->dst = IpAddress{};
  segment->src.v6 = segment->dst.v6 = true;
  std::memcpy(segment->src.bytes.data(), ip + 8, 16);
  std::memcpy(segment->dst.bytes.data(), ip + 24, 16);
  uint8_t next = ip[6];
  uint32_t offset = at + 40;
  // Extension headers before the transport header.
  for (int hops = 0; hops < 8; ++hops) {
    uint32_t length;
    switch (next) {
      case 0:   // hop-by-hop options
      case 43:  // routing
      case 60:  // destination options
        if (caplen < offset + 2) {
          return DecodeResult::kTruncated;
        }
        length = (data[offset + 1] + 1u) * 8;
        break;
      case 44:  // fragment
        if (caplen < offset + 8) {
          return DecodeResult::kTruncated;
        }
        if ((Be16(data + offset + 2) & 0xFFF9) != 0) {  // an offset or more fragments
          return DecodeResult::kFragment;
        }
        length = 8;
        break;
      case 51:  // authentication header
        if (caplen < offset + 2) {
          return DecodeResult::kTruncated;
        }
        length = (data[offset + 1] + 2u) * 4;
        break;
      default:
        *out = {offset, remaining, next};
        return DecodeResult::kTcp;
    }
    if (length > remaining) {
      return DecodeResult::kTruncated;
    }
    next = data[offset];
    offset += length;
    remaining -= length;
  }
  return DecodeResult::kUnsupportedLink;
}

}  // namespace

DecodeResult DecodePacket(int link_type, const uint8_t* data, uint32_t caplen, Micros time,
                          TcpSegment* segment) {
  Network network;
  DecodeResult result;
  if (!LinkLayer(link_type, data, caplen, &network, &result)) {
    return result;
  }
  Transport transport;
  switch (network.ether_type) {
    case kEtherIpv4:
      result = Ipv4(data, caplen, network.offset, segment, &transport);
      break;
    case kEtherIpv6:
      result = Ipv6(data, caplen, network.offset, segment, &transport);
      break;
    default:
      return DecodeResult::kNotTcp;
  }
  if (result != DecodeResult::kTcp) {
    return result;
  }
  if (transport.protocol != kProtoTcp) {
    return DecodeResult::kNotTcp;
  }
  const uint32_t at = transport.offset;
  if (caplen < at + 20) {
    return DecodeResult::kTruncated;
  }
  const uint8_t* tcp = data + at;
  const uint32_t header = (tcp[12] >> 4) * 4u;
  if (header < 20 || header > transport.wire_size || caplen < at + header) {
    return DecodeResult::kTruncated;
  }
  segment->time = time;
  segment->src_port = Be16(tcp);
  segment->dst_port = Be16(tcp + 2);
  segment->seq = Be32(tcp + 4);
  segment->ack = Be32(tcp + 8);
  segment->flags = tcp[13];
  segment->wire_payload_size = transport.wire_size - header;
  segment->payload = tcp + header;
  // Ethernet pads short frames; the IP length says where the payload really ends.
  segment->payload_size = std::min(segment->wire_payload_size, caplen - (at + header));
  return DecodeResult::kTcp;
}

}  // namespace capture
