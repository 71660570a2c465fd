#pragma once

// RecordBuilder: one HttpExchange as a collector record: addresses, times in milliseconds,
// packets, bytes, the request's URL split into host, path, file, query and anchor, the headers
// the record carries, the status and the method code. Text is made safe for the record format
// ('^', '<' and control characters are percent-encoded) and cut to each field's width.
//
// Page-view figures (load time, object count and size) are the assembler's; it passes them in.
//
// Thread safety: none; one thread owns a builder.

#include <cstdint>
#include <string>
#include <string_view>

#include "collector/capture/http_exchange.h"
#include "collector/sm3gen/record.h"

namespace capture {

// What a page's record says of the view it heads.
struct PageFigures {
  Micros load = 0;  // from the page's last reply byte to its last object's
  int32_t object_count = 0;
  int64_t object_bytes = 0;     // the objects' reply bytes
  int32_t header_requests = 0;  // objects answered with headers only (304)
};

class RecordBuilder {
 public:
  RecordBuilder(std::string product_version, std::string collector_id);

  // The record of exchange as kind; figures only for a page (kind kPage).
  sm3gen::Record Build(const HttpExchange& exchange, sm3gen::RecordKind kind,
                       const PageFigures& figures);

 private:
  std::string NextGuid();

  const std::string product_version_;
  const std::string collector_id_;
  const uint64_t guid_prefix_;  // random per process, so GUIDs differ across restarts
  uint64_t guid_counter_ = 0;
  // The local time of the last second formatted, reused while records share it.
  int64_t zone_second_ = INT64_MIN;
  int32_t zone_offset_ = 0;
  std::string zone_name_;
  std::string zone_date_;
  std::string zone_time_;
};

// Milliseconds from microseconds, rounded to nearest; negative spans count as 0.
int32_t RoundMillis(Micros micros);

// The parts of a request-target. An absolute-form target ("http://host/p") is reduced to its
// path and query; its authority is returned as host_from_target.
struct UrlParts {
  std::string_view origin;  // path and query, as the URL field holds it
  std::string_view host_from_target;
  std::string_view path;    // the directory part, up to and including the last '/'
  std::string_view file;    // after the last '/'
  std::string_view query;   // after '?', without it
  std::string_view anchor;  // after '#', without it
};
UrlParts SplitTarget(std::string_view target);

// host without its port ("shop.example:8080" -> "shop.example", "[::1]:80" -> "[::1]").
std::string_view HostWithoutPort(std::string_view host);

}  // namespace capture
