#pragma once

// Per-URL and per-status figures of one access log as two tools report them: GoAccess's JSON
// report and the agent's summary tables. Both are folded into one shape so that they can be
// compared line by line.
//
// GoAccess keys a request by path, method and protocol and puts it in one of three panels
// (requests, static_requests, not_found for 404s); its times are microseconds (cumulated,
// maximum). The agent keys pages (Q7TXSM) by application, URL, client and server, and objects
// (Q7SUBTXSM) by URL and the page they belong to; its times are whole milliseconds, and a
// page's response time includes the load time of its objects. Each side is summed per path.
//
// Thread safety: plain data and pure functions.

#include <cstdint>
#include <map>
#include <nlohmann/json.hpp>
#include <string>
#include <vector>

namespace bench {

// What one tool reports for one URL path.
struct UrlFigures {
  uint64_t hits = 0;
  int64_t max_us = 0;      // longest time served
  double sum_us = 0;       // time served, summed over hits (the agent's: from truncated averages)
  double load_sum_us = 0;  // agent pages only: the objects' load time included in sum_us
  bool page = false;       // agent: some hits were pages, whose times include their objects
};

struct LogFigures {
  std::map<std::string, UrlFigures> urls;    // by path
  std::map<std::string, uint64_t> statuses;  // "2xx" ... "5xx", and "403", "404", "500"
  uint64_t hits = 0;
};

// GoAccess's report (-o report.json): the three request panels and the status codes.
LogFigures FromGoAccess(const nlohmann::json& report);

// The agent's samples of Q7TXSM (pages) and Q7SUBTXSM (objects).
LogFigures FromAgent(const nlohmann::json& pages, const nlohmann::json& objects);

// How the two reports compare. Averages agree within tolerance_ms (the agent's averages are
// truncated to whole milliseconds, per row); maxima exactly, except that a page's maximum on
// the agent's side includes its objects' load time and so may only be larger.
struct Comparison {
  uint64_t urls = 0;  // paths in either report
  uint64_t hits_agree = 0;
  uint64_t avg_agree = 0;
  uint64_t max_agree = 0;      // exactly
  uint64_t max_with_load = 0;  // page maxima above GoAccess's by the views' load time
  uint64_t statuses_agree = 0;
  std::vector<std::string> disagreements;  // one line each
};

Comparison Compare(const LogFigures& goaccess, const LogFigures& agent, double tolerance_ms);

}  // namespace bench
