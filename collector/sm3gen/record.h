#pragma once

// Record: one collector record as the generator builds it, before formatting. Pages and
// embedded objects use the page layout (46 fields); audio and video use the object layout
// (31 fields). Fields a layout does not have are ignored when formatting.
//
// Text fields hold plain 8-bit text within the collector's field widths (noted per field) and
// never contain '^', '\r', '\n', NUL or '<'. Integers are what the collector writes: signed
// 32-bit.

#include <cstdint>
#include <string>
#include <string_view>

namespace sm3gen {

enum class RecordKind : int {
  kPage = 1,    // <hpage>
  kObject = 2,  // <hobj>, an embedded object such as an image, style sheet or script
  kAudio = 3,   // <audio>
  kVideo = 4,   // <video>
};

inline constexpr int kPageLayoutFields = 46;
inline constexpr int kObjectLayoutFields = 31;

// True for the kinds written in the page layout (pages and embedded objects).
inline bool UsesPageLayout(RecordKind kind) {
  return kind == RecordKind::kPage || kind == RecordKind::kObject;
}

// The tag name: "hpage", "hobj", "audio" or "video".
inline std::string_view KindTag(RecordKind kind) {
  switch (kind) {
    case RecordKind::kPage:
      return "hpage";
    case RecordKind::kObject:
      return "hobj";
    case RecordKind::kAudio:
      return "audio";
    case RecordKind::kVideo:
      return "video";
  }
  return "hpage";
}

// HTTP method codes of the page layout's last field.
enum class Method : int {
  kGet = 1,
  kPost = 2,
  kHead = 3,
  kPut = 4,
  kOptions = 5,
  kDelete = 6,
  kTrace = 7,
  kConnect = 8,
};

struct Record {
  RecordKind kind = RecordKind::kPage;

  // ---- Both layouts, fields 1-22. ----
  std::string product_version;  // <= 10, e.g. "3.1.0"
  std::string application_id;   // <= 2
  std::string reserved1;        // <= 64, empty
  std::string collector_id;     // <= 31
  std::string guid;             // <= 64, 32 hex digits, unique per record
  int32_t time_utc = 0;         // seconds since 1970 UTC
  std::string date;             // "YYYY-MM-DD" of time_utc
  std::string time_of_day;      // "HH:MM:SS" of time_utc
  int32_t gmt_offset = 0;       // seconds east of UTC
  std::string time_zone;        // <= 32
  std::string client_address;   // <= 64, IPv4 dotted or IPv6 text
  int32_t client_port = 0;
  std::string server_address;  // <= 64
  int32_t server_port = 0;
  int32_t response_ms = 0;  // total response time
  int32_t request_packets = 0;
  int32_t request_ack_packets = 0;
  int32_t reply_packets = 0;
  int32_t reply_ack_packets = 0;
  int32_t total_bytes = 0;  // request_bytes + reply_bytes
  int32_t request_bytes = 0;
  int32_t reply_bytes = 0;

  // ---- Both layouts, in different places. ----
  std::string url;                 // <= 254, request URI: path and optional "?query"
  std::string referrer;            // <= 254, "N/A" when none
  std::string browser;             // <= 254, User-Agent
  std::string server_description;  // <= 254, Server header, may be empty
  std::string protocol;            // <= 32, "HTTP/1.1", "HTTP/1.0" or "HTTPS"
  int32_t status = 0;              // HTTP status
  int32_t network_ms = 0;          // network part of the response time

  // ---- Page layout only (fields 29-46, with network_ms as field 36). ----
  int32_t server_ms = 0;
  int32_t resolve_ms = 0;         // DNS
  int32_t load_ms = 0;            // loading the embedded objects after the page
  int32_t object_count = 0;       // embedded objects of the page
  int32_t object_bytes = 0;       // their reply bytes
  int32_t header_requests = 0;    // objects answered with headers only (304)
  int32_t header_resolve_ms = 0;  // resolve time spent on those
  std::string host;               // <= 254, URL host name; empty when the request had none
  std::string url_path;           // <= 254, directory part of the URL, ends with '/'
  std::string url_file;           // <= 254, last path segment
  std::string url_query;          // <= 254, after '?', without it
  std::string url_anchor;         // <= 126, after '#', without it
  std::string title;              // <= 254
  Method method = Method::kGet;

  // ---- Object layout only (fields 23 and 30). ----
  int32_t duration_ms = 0;    // media duration
  int32_t bit_rate_kbps = 0;  // media bit rate, kbit/s
};

}  // namespace sm3gen
