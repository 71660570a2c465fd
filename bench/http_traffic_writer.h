#pragma once

// HTTP/1.1 traffic for bench_capture, written as packets into a capture file: many clients on
// keep-alive connections (handshakes, pages of 10-60 KB, style sheets, scripts and images, some
// 304s and chunked replies, MSS-sized segments, delayed ACKs and FIN closes), in time order.
// Seeded: the same target gives the same file.
//
// Thread safety: WriteHttpTraffic keeps no state between calls.

#include <cstdint>
#include <map>
#include <string>

#include "collector/capture/testing/packet_builder.h"

namespace bench {

// Part of the cached file's name: change it whenever the traffic changes.
constexpr int kTrafficVersion = 2;
constexpr uint64_t kTrafficSeed = 7031;

// What the generated capture holds; kept beside the file as "key value" lines.
struct TrafficTotals {
  uint64_t packets = 0;
  uint64_t bytes = 0;  // captured, link layer included
  uint64_t connections = 0;
  uint64_t exchanges = 0;
  uint64_t pages = 0;
  uint64_t objects = 0;
  uint64_t not_modified = 0;
  uint64_t chunked = 0;
  uint64_t duration_us = 0;  // from the first packet to the last

  std::map<std::string, uint64_t*> Fields() {
    return {{"packets", &packets},           {"bytes", &bytes},     {"connections", &connections},
            {"exchanges", &exchanges},       {"pages", &pages},     {"objects", &objects},
            {"not_modified", &not_modified}, {"chunked", &chunked}, {"duration_us", &duration_us}};
  }
};

// Writes about packet_target packets into writer and returns what they hold.
TrafficTotals WriteHttpTraffic(capture::testing::PcapWriter* writer, uint64_t packet_target);

}  // namespace bench
