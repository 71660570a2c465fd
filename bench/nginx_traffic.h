#pragma once

// The traffic of the shop site behind bench_logs_race's access log, as nginx would log it.
//
// One site without a virtual host in the log: thousands of pages (.html and extensionless) and
// objects (.css .js .woff2 .png .jpg .gif .svg .ico), thousands of IPv4 and some IPv6 clients.
// Visitors browse page views: a page, then its objects from the same client with the page's
// full URL as Referer (fonts and sprites name their style sheet), shared assets only on the
// first view of a visit (304 for returning visitors). Crawlers fetch pages without Referer,
// scanners probe for 404s and 403s, other sites hotlink images, feed readers poll. Status mix:
// mostly 200, some 304, 301/302, 404, 403 and 500/502/503. Times in whole milliseconds with a
// long tail; no upstream time where nginx answered itself. No query strings, so per-URL
// figures need no convention about them.
//
// Thread safety: GenerateTraffic keeps no state between calls.

#include <cstdint>
#include <functional>
#include <string>
#include <string_view>

namespace bench {

using Micros = int64_t;

// The URL host the site's pages are linked under ("http://HOST/..."), for `sm3logs --host`.
inline constexpr char kLogHost[] = "shop.example";

// One request as nginx logs it. The views point into the generator's own tables and stay
// valid while the emit call runs.
struct LoggedRequest {
  Micros end = 0;           // when it ended, from the start of the traffic
  std::string_view client;  // address text
  std::string_view agent;   // User-Agent
  std::string_view method = "GET";
  std::string path;
  bool http2 = false;
  int status = 200;
  uint64_t bytes = 0;
  std::string referer;  // "-" when none
  int64_t request_ms = 0;
  int64_t upstream_ms = -1;  // -1: nginx answered itself ('-')
};

// Generates `lines` requests, paced to span about 90 minutes, and hands each to emit in the
// order nginx writes them: by end, then in the order they were made. The traffic depends only
// on lines and seed. Returns the number of visits (people, crawlers, scanners, feed readers).
uint64_t GenerateTraffic(uint64_t lines, uint64_t seed,
                         const std::function<void(const LoggedRequest&)>& emit);

}  // namespace bench
