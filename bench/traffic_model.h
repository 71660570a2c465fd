#pragma once

// TrafficModel: the generator behind GenerateTraffic (nginx_traffic.h), whose work is split in
// two: nginx_traffic.cc holds the visitors (the client population, visit arrivals, each visit's
// steps in time, and the order requests are handed on) and traffic_requests.cc the requests a
// step makes (pages with their objects, crawler, scanner, hotlink and feed requests) with the
// status, size and times nginx would log. For those two files only.
//
// Thread safety: a model is used by one thread.

#include <cstdint>
#include <functional>
#include <queue>
#include <random>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "bench/nginx_traffic.h"

namespace bench {
namespace traffic {

inline constexpr Micros kMilli = 1000;
inline constexpr Micros kSecond = 1000000;

// A request in the making: its client by index, and its place among requests that end together.
struct Request : LoggedRequest {
  uint64_t order = 0;  // generation order: keeps lines that end together in a stable order
  int client_index = 0;

  bool operator>(const Request& other) const {
    return end != other.end ? end > other.end : order > other.order;
  }
};

enum class VisitKind { kPerson, kCrawler, kScanner, kHotlink, kFeed };
enum class PageKind { kHome, kItem, kCategory, kBlog, kPlain };

struct Visit {
  VisitKind kind = VisitKind::kPerson;
  int client = 0;
  std::string_view agent;
  bool http2 = false;
  bool returning = false;  // has the shared assets cached: they come back as 304
  int steps_left = 0;
  int views = 0;
  std::string last_page;  // full URL of the last page: the next page's Referer
  std::string follow;     // a redirect's target, fetched next
};

// Visits as events in time: each visit steps from page view to page view, each step makes the
// requests of that view, and a request is handed on once nothing made later can end before it.
class TrafficModel {
 public:
  // emit must outlive the model.
  TrafficModel(uint64_t lines, uint64_t seed,
               const std::function<void(const LoggedRequest&)>& emit);

  // Generates until the target is emitted; returns the number of visits.
  uint64_t Run();

 private:
  using Scheduled = std::pair<Micros, int>;

  bool Chance(double p) { return std::uniform_real_distribution<double>(0, 1)(random_) < p; }
  int Uniform(int low, int high) { return std::uniform_int_distribution<int>(low, high)(random_); }

  // ---- The visitors (nginx_traffic.cc). ----
  std::string_view Browser();
  int PickFreeClient(int first, int count);
  int NewVisit();
  // One step of a visit at now; returns when its next step is due, or -1 when it is over.
  Micros Step(Visit* v, Micros now);
  // Queues r, started at start, to be handed on; returns when it ends.
  Micros Emit(Request r, Micros start);
  // Hands on (in end order) every pending request that ended by now: nothing generated later
  // can end before now, since every later request starts at or after it.
  void EmitEndedBy(Micros now);

  // ---- The requests of a step (traffic_requests.cc). ----
  // Milliseconds from a log-normal of the given median.
  int64_t LogNormalMs(double median_ms, double sigma);
  // Popular items first: a few hundred items get most views.
  int PopularItem();
  static std::string Full(std::string_view path);
  Request Base(const Visit& v, Micros start, std::string path);
  // A page the application rendered: upstream time plus the time to send it.
  void Dynamic(Request* r, double median_ms);
  // A file nginx served itself.
  void Static(Request* r);
  void Tiny(Request* r, int status, uint64_t bytes);
  // An application page's status: mostly 200, rarely a failure.
  void PageOutcome(Request* r, uint64_t low, uint64_t high);
  Micros PersonStep(Visit* v, Micros now);
  // The objects of a page view, fetched over a few connections once the HTML arrived. Returns
  // when the last one ended.
  Micros Objects(const Visit& v, PageKind kind, int item, const std::string& page_url,
                 Micros page_end);
  void CrawlerStep(Visit* v, Micros now);
  void ScannerStep(Visit* v, Micros now);
  void HotlinkStep(Visit* v, Micros now);
  void FeedStep(Visit* v, Micros now);

  const uint64_t target_;
  std::mt19937_64 random_;
  const std::function<void(const LoggedRequest&)>& emit_;
  std::vector<std::string> clients_;
  std::vector<bool> busy_;  // one visit per client at a time, as one browser
  int first_googlebot_ = 0;
  int first_bingbot_ = 0;
  int first_scanner_ = 0;
  int first_feed_ = 0;
  std::vector<Visit> visits_;
  std::vector<int> free_slots_;
  std::priority_queue<Scheduled, std::vector<Scheduled>, std::greater<>> steps_;
  std::priority_queue<Request, std::vector<Request>, std::greater<>> pending_;
  uint64_t order_ = 0;
  uint64_t emitted_ = 0;
  uint64_t visits_started_ = 0;
};

}  // namespace traffic
}  // namespace bench
