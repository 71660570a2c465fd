#include "bench/url_figures.h"

#include <fmt/format.h>

#include <algorithm>
#include <cmath>
#include <set>

namespace bench {
namespace {

constexpr const char* kStatusKeys[] = {"1xx", "2xx", "3xx", "4xx", "5xx", "403", "404", "500"};
constexpr const char* kStatusColumns[] = {"num1xx", "num2xx", "num3xx", "num4xx",
                                          "num5xx", "num403", "num404", "num500"};

int64_t Int(const nlohmann::json& row, const char* column) {
  const auto it = row.find(column);
  return it != row.end() && it->is_number() ? it->get<int64_t>() : 0;
}

// One agent row into its path's figures; times in the row are milliseconds, averages
// truncated, so a row's sum is its average times its count.
void AddAgentRow(const nlohmann::json& row, bool page, LogFigures* figures) {
  const int64_t count = Int(row, "totreq");
  if (count <= 0) {
    return;
  }
  UrlFigures& url = figures->urls[row.value("transactn", std::string())];
  url.hits += static_cast<uint64_t>(count);
  url.max_us = std::max(url.max_us, Int(row, "maxrtt") * 1000);
  url.sum_us += static_cast<double>(Int(row, "oatime")) * 1000.0 * static_cast<double>(count);
  if (page) {
    url.page = true;
    url.load_sum_us +=
        static_cast<double>(Int(row, "loadtime")) * 1000.0 * static_cast<double>(count);
  }
  figures->hits += static_cast<uint64_t>(count);
  for (size_t i = 0; i < std::size(kStatusKeys); ++i) {
    figures->statuses[kStatusKeys[i]] += static_cast<uint64_t>(Int(row, kStatusColumns[i]));
  }
}

}  // namespace

LogFigures FromGoAccess(const nlohmann::json& report) {
  LogFigures figures;
  for (const char* panel : {"requests", "static_requests", "not_found"}) {
    if (!report.contains(panel)) {
      continue;
    }
    for (const nlohmann::json& item : report[panel]["data"]) {
      UrlFigures& url = figures.urls[item.value("data", std::string())];
      const uint64_t hits = item["hits"]["count"].get<uint64_t>();
      url.hits += hits;
      url.max_us = std::max(url.max_us, item.value("maxts", int64_t{0}));
      url.sum_us += static_cast<double>(item.value("cumts", int64_t{0}));
      figures.hits += hits;
    }
  }
  for (const char* key : kStatusKeys) {
    figures.statuses[key] = 0;
  }
  for (const nlohmann::json& family : report["status_codes"]["data"]) {
    for (const nlohmann::json& code : family["items"]) {
      // "404 - Not Found: ..."
      const std::string text = code.value("data", std::string());
      const uint64_t hits = code["hits"]["count"].get<uint64_t>();
      if (text.size() >= 3) {
        figures.statuses[text.substr(0, 1) + "xx"] += hits;
        const std::string exact = text.substr(0, 3);
        if (figures.statuses.count(exact) != 0) {
          figures.statuses[exact] += hits;
        }
      }
    }
  }
  return figures;
}

LogFigures FromAgent(const nlohmann::json& pages, const nlohmann::json& objects) {
  LogFigures figures;
  for (const char* key : kStatusKeys) {
    figures.statuses[key] = 0;
  }
  for (const nlohmann::json& row : pages["rows"]) {
    AddAgentRow(row, true, &figures);
  }
  for (const nlohmann::json& row : objects["rows"]) {
    AddAgentRow(row, false, &figures);
  }
  return figures;
}

Comparison Compare(const LogFigures& goaccess, const LogFigures& agent, double tolerance_ms) {
  Comparison c;
  std::set<std::string> paths;
  for (const auto& [path, figures] : goaccess.urls) {
    paths.insert(path);
  }
  for (const auto& [path, figures] : agent.urls) {
    paths.insert(path);
  }
  static const UrlFigures kNone;
  for (const std::string& path : paths) {
    ++c.urls;
    const auto g_it = goaccess.urls.find(path);
    const auto a_it = agent.urls.find(path);
    const UrlFigures& g = g_it == goaccess.urls.end() ? kNone : g_it->second;
    const UrlFigures& a = a_it == agent.urls.end() ? kNone : a_it->second;
    if (g.hits != a.hits) {
      c.disagreements.push_back(fmt::format("{}: hits GoAccess {} agent {}", path, g.hits, a.hits));
      continue;
    }
    ++c.hits_agree;
    // GoAccess's times are whole milliseconds here (the log has three decimals); the agent's
    // exchange time is its response time less the load time of the page's objects.
    const double g_avg_ms = g.sum_us / static_cast<double>(g.hits) / 1000.0;
    const double a_avg_ms = (a.sum_us - a.load_sum_us) / static_cast<double>(a.hits) / 1000.0;
    if (std::fabs(g_avg_ms - a_avg_ms) <= tolerance_ms) {
      ++c.avg_agree;
    } else {
      c.disagreements.push_back(
          fmt::format("{}: average GoAccess {:.3f} ms agent {:.3f} ms", path, g_avg_ms, a_avg_ms));
    }
    // GoAccess reads "1.025" through a double and truncates to microseconds (1024999): round
    // back to the log's milliseconds.
    const int64_t g_max_ms = (g.max_us + 500) / 1000;
    const int64_t a_max_ms = a.max_us / 1000;
    if (g_max_ms == a_max_ms) {
      ++c.max_agree;
    } else if (a.page && a_max_ms > g_max_ms) {
      ++c.max_with_load;
    } else {
      c.disagreements.push_back(
          fmt::format("{}: maximum GoAccess {} ms agent {} ms", path, g_max_ms, a_max_ms));
    }
  }
  for (const auto& [key, count] : goaccess.statuses) {
    const auto it = agent.statuses.find(key);
    const uint64_t theirs = it == agent.statuses.end() ? 0 : it->second;
    if (count == theirs) {
      ++c.statuses_agree;
    } else {
      c.disagreements.push_back(fmt::format("status {}: GoAccess {} agent {}", key, count, theirs));
    }
  }
  return c;
}

}  // namespace bench
