#pragma once

// WriteNginxLog: a seeded access log in nginx's "nginx-timed" format (combined plus
// $request_time $upstream_response_time), for benchmarks that feed the same log to sm3logs and
// to other log analysers. The traffic is nginx_traffic.h's. Lines are in the order nginx writes
// them, stamped in whole seconds at the request's end, +0000.
//
// Thread safety: WriteNginxLog keeps no state between calls.

#include <cstdint>
#include <string>

#include "bench/nginx_traffic.h"

namespace bench {

struct LogShape {
  uint64_t lines = 0;
  uint64_t seed = 0;
  int64_t end_unix = 0;  // the last line's time stamp is at or just before this second
};

// What a written log holds.
struct LogSummary {
  uint64_t lines = 0;
  uint64_t visits = 0;  // sessions of people, crawlers, scanners and feed readers
  uint64_t bytes = 0;
  int64_t first_unix = 0;  // the first and last time stamps
  int64_t last_unix = 0;
};

// Writes shape.lines lines to path (replacing it). The traffic depends only on lines and seed;
// end_unix only places it in time. Returns false with *error when the file cannot be written.
bool WriteNginxLog(const LogShape& shape, const std::string& path, LogSummary* summary,
                   std::string* error);

}  // namespace bench
