#include "collector/capture/record_builder.h"

#include <fmt/format.h>
#include <strings.h>

#include <algorithm>
#include <climits>
#include <ctime>
#include <random>

namespace capture {
namespace {

// Field widths in characters (the slot less its terminator).
constexpr size_t kVersionWidth = 10;
constexpr size_t kCollectorWidth = 31;
constexpr size_t kZoneWidth = 32;
constexpr size_t kAddressWidth = 64;
constexpr size_t kTextWidth = 254;
constexpr size_t kProtocolWidth = 32;
constexpr size_t kAnchorWidth = 126;

bool NeedsEscape(unsigned char c) {
  return c < 0x20 || c == 0x7F || c == '^' || c == '<';
}

// text, made safe for the record format and cut to width characters. Most text needs no
// escape: runs up to the next character that does are copied whole.
std::string Field(std::string_view text, size_t width) {
  std::string out;
  out.reserve(std::min(text.size(), width));
  size_t i = 0;
  while (i < text.size() && out.size() < width) {
    size_t run = i;
    while (run < text.size() && !NeedsEscape(static_cast<unsigned char>(text[run]))) {
      ++run;
    }
    const size_t take = std::min(run - i, width - out.size());
    out.append(text.data() + i, take);
    i += take;
    if (i < run || i == text.size()) {
      break;  // cut at the width, or done
    }
    if (out.size() + 3 > width) {
      break;
    }
    out += fmt::format("%{:02X}", static_cast<unsigned char>(text[i]));
    ++i;
  }
  return out;
}

sm3gen::Method MethodCode(std::string_view method) {
  static constexpr std::pair<std::string_view, sm3gen::Method> kMethods[] = {
      {"GET", sm3gen::Method::kGet},         {"POST", sm3gen::Method::kPost},
      {"HEAD", sm3gen::Method::kHead},       {"PUT", sm3gen::Method::kPut},
      {"OPTIONS", sm3gen::Method::kOptions}, {"DELETE", sm3gen::Method::kDelete},
      {"TRACE", sm3gen::Method::kTrace},     {"CONNECT", sm3gen::Method::kConnect},
  };
  for (const auto& [name, code] : kMethods) {
    if (method == name) {
      return code;
    }
  }
  return static_cast<sm3gen::Method>(0);  // "UNDEFINED" (PATCH and the rest)
}

int32_t Clamp32(int64_t value) {
  return static_cast<int32_t>(std::clamp<int64_t>(value, INT32_MIN, INT32_MAX));
}

std::string AddressText(const IpAddress& address) {
  char text[64];
  FormatAddress(address, text, sizeof(text));
  return text;
}

}  // namespace

int32_t RoundMillis(Micros micros) {
  return micros <= 0 ? 0 : Clamp32((micros + 500) / 1000);
}

std::string_view HostWithoutPort(std::string_view host) {
  if (!host.empty() && host.front() == '[') {
    const size_t close = host.find(']');
    return close == std::string_view::npos ? host : host.substr(0, close + 1);
  }
  const size_t colon = host.find(':');
  // More than one colon: a bare IPv6 address, which has no port.
  if (colon != std::string_view::npos && host.find(':', colon + 1) == std::string_view::npos) {
    return host.substr(0, colon);
  }
  return host;
}

UrlParts SplitTarget(std::string_view target) {
  UrlParts parts;
  std::string_view rest = target;
  for (std::string_view scheme : {"http://", "https://"}) {
    if (rest.size() >= scheme.size() &&
        strncasecmp(rest.data(), scheme.data(), scheme.size()) == 0) {
      rest.remove_prefix(scheme.size());
      const size_t slash = rest.find_first_of("/?#");
      parts.host_from_target = rest.substr(0, slash);
      rest = slash == std::string_view::npos ? std::string_view() : rest.substr(slash);
      break;
    }
  }
  parts.origin = rest;
  const size_t hash = rest.find('#');
  if (hash != std::string_view::npos) {
    parts.anchor = rest.substr(hash + 1);
    rest = rest.substr(0, hash);
  }
  const size_t question = rest.find('?');
  if (question != std::string_view::npos) {
    parts.query = rest.substr(question + 1);
    rest = rest.substr(0, question);
  }
  const size_t slash = rest.rfind('/');
  if (slash == std::string_view::npos) {
    parts.file = rest;
  } else {
    parts.path = rest.substr(0, slash + 1);
    parts.file = rest.substr(slash + 1);
  }
  return parts;
}

RecordBuilder::RecordBuilder(std::string product_version, std::string collector_id)
    : product_version_(Field(product_version, kVersionWidth)),
      collector_id_(Field(collector_id, kCollectorWidth)),
      guid_prefix_((static_cast<uint64_t>(std::random_device{}()) << 32) ^ std::random_device{}() ^
                   static_cast<uint64_t>(std::time(nullptr))) {}

std::string RecordBuilder::NextGuid() {
  return fmt::format("{:016X}{:016X}", guid_prefix_, ++guid_counter_);
}

sm3gen::Record RecordBuilder::Build(const HttpExchange& exchange, sm3gen::RecordKind kind,
                                    const PageFigures& figures) {
  sm3gen::Record r;
  r.kind = kind;
  r.product_version = product_version_;
  r.collector_id = collector_id_;
  r.guid = NextGuid();

  const int64_t second = exchange.start / 1000000;
  if (second != zone_second_) {
    zone_second_ = second;
    const time_t t = static_cast<time_t>(second);
    struct tm local {};
    localtime_r(&t, &local);
    zone_offset_ = static_cast<int32_t>(local.tm_gmtoff);
    zone_name_ = Field(local.tm_zone != nullptr ? local.tm_zone : "", kZoneWidth);
    zone_date_ =
        fmt::format("{:04}-{:02}-{:02}", local.tm_year + 1900, local.tm_mon + 1, local.tm_mday);
    zone_time_ = fmt::format("{:02}:{:02}:{:02}", local.tm_hour, local.tm_min, local.tm_sec);
  }
  r.time_utc = Clamp32(second);
  r.date = zone_date_;
  r.time_of_day = zone_time_;
  r.gmt_offset = zone_offset_;
  r.time_zone = zone_name_;

  const ConnectionInfo& c = exchange.connection;
  r.client_address = Field(
      exchange.client_name.empty() ? AddressText(c.client) : exchange.client_name, kAddressWidth);
  r.client_port = c.client_port;
  r.server_address = Field(AddressText(c.server), kAddressWidth);
  r.server_port = c.server_port;

  // Whole milliseconds first, so that total = server + network (+ load) holds exactly.
  const int32_t exchange_ms = RoundMillis(exchange.response_last - exchange.start);
  const int32_t server_ms =
      std::min(exchange_ms, RoundMillis(exchange.response_first - exchange.request_last));
  const bool page = kind == sm3gen::RecordKind::kPage;
  const int32_t load_ms = page ? RoundMillis(figures.load) : 0;
  r.response_ms = Clamp32(int64_t{exchange_ms} + load_ms);
  r.server_ms = server_ms;
  r.network_ms = exchange_ms - server_ms;
  r.request_packets = Clamp32(exchange.request_packets);
  r.request_ack_packets = Clamp32(exchange.request_acks);
  r.reply_packets = Clamp32(exchange.response_packets);
  r.reply_ack_packets = Clamp32(exchange.response_acks);
  r.request_bytes = Clamp32(static_cast<int64_t>(exchange.request_bytes));
  r.reply_bytes = Clamp32(static_cast<int64_t>(exchange.response_bytes));
  r.total_bytes = Clamp32(static_cast<int64_t>(exchange.request_bytes + exchange.response_bytes));

  const HttpHead& request = exchange.request;
  const HttpHead& response = exchange.response;
  const UrlParts url = SplitTarget(request.target);
  r.url = Field(url.origin, kTextWidth);
  r.referrer = request.referer.empty() ? "N/A" : Field(request.referer, kTextWidth);
  r.browser = Field(request.user_agent, kTextWidth);
  r.server_description = Field(response.server, kTextWidth);
  r.protocol = Field(fmt::format("HTTP/{}.{}", response.version_major, response.version_minor),
                     kProtocolWidth);
  r.status = response.status;
  r.method = MethodCode(request.method);
  r.host = Field(HostWithoutPort(request.host.empty() ? url.host_from_target : request.host),
                 kTextWidth);
  r.url_path = Field(url.path, kTextWidth);
  r.url_file = Field(url.file, kTextWidth);
  r.url_query = Field(url.query, kTextWidth);
  r.url_anchor = Field(url.anchor, kAnchorWidth);
  if (page) {
    r.load_ms = load_ms;
    r.object_count = figures.object_count;
    r.object_bytes = Clamp32(figures.object_bytes);
    r.header_requests = figures.header_requests;
  }
  return r;
}

}  // namespace capture
