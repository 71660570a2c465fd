#pragma once

// DecodePacket: one captured frame down to its TCP segment. Reads the link layers libpcap hands
// us (Ethernet with 802.1Q/802.1ad tags, Linux cooked SLL and SLL2, BSD loopback, raw IP),
// IPv4 and IPv6 (with extension headers), and the TCP header. Never reads past caplen.
//
// Thread safety: a pure function.

#include <cstdint>

#include "collector/capture/tcp_segment.h"

namespace capture {

enum class DecodeResult {
  kTcp,              // *segment is filled
  kNotTcp,           // another protocol
  kTruncated,        // the frame ends before the TCP header does
  kFragment,         // an IP fragment: not reassembled
  kUnsupportedLink,  // a link type or network protocol we do not read
};

// Decodes caplen bytes at data, captured at time with the libpcap link type (DLT_*). The
// segment's payload points into data.
DecodeResult DecodePacket(int link_type, const uint8_t* data, uint32_t caplen, Micros time,
                          TcpSegment* segment);

}  // namespace capture
