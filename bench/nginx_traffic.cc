#include "bench/nginx_traffic.h"

#include <fmt/format.h>

#include <algorithm>
#include <array>
#include <cmath>
#include <cstdio>
#include <ctime>
#include <functional>
#include <initializer_list>
#include <memory>
#include <queue>
#include <random>
#include <string_view>
#include <tuple>
#include <vector>

namespace bench {
namespace {

constexpr Micros kMilli = 1000;
constexpr Micros kSecond = 1000000;

// Arrivals are paced so that the lines asked for span about this long.
constexpr double kSpanSeconds = 90 * 60;
constexpr double kLinesPerVisit = 23.0;  // a rough guess, for the pacing only (spans come out
                                         // at 70 to 90 minutes)

constexpr int kItems = 3000;  // /shop/item/<1000..3999>.html, with an image and a thumbnail
constexpr int kFirstItem = 1000;
constexpr int kCategories = 150;
constexpr int kBlogPosts = 200;
constexpr int kSearchTerms = 300;
constexpr int kIcons = 40;
constexpr int kBanners = 12;
constexpr int kPeopleV4 = 6000;
constexpr int kPeopleV6 = 500;
constexpr int kGooglebots = 80;
constexpr int kBingbots = 40;
constexpr int kScanners = 200;
constexpr int kFeedReaders = 12;

constexpr std::string_view kBrowsers[] = {
    "Mozilla/5.0 (Windows NT 10.0; Win64; x64) AppleWebKit/537.36 (KHTML, like Gecko) "
    "Chrome/119.0.0.0 Safari/537.36",
    "Mozilla/5.0 (Macintosh; Intel Mac OS X 10_15_7) AppleWebKit/537.36 (KHTML, like Gecko) "
    "Chrome/119.0.0.0 Safari/537.36",
    "Mozilla/5.0 (X11; Linux x86_64; rv:120.0) Gecko/20100101 Firefox/120.0",
    "Mozilla/5.0 (Windows NT 10.0; Win64; x64; rv:120.0) Gecko/20100101 Firefox/120.0",
    "Mozilla/5.0 (iPhone; CPU iPhone OS 17_1 like Mac OS X) AppleWebKit/605.1.15 (KHTML, like "
    "Gecko) Version/17.1 Mobile/15E148 Safari/604.1",
    "Mozilla/5.0 (Macintosh; Intel Mac OS X 10_15_7) AppleWebKit/605.1.15 (KHTML, like Gecko) "
    "Version/17.1 Safari/605.1.15",
    "Mozilla/5.0 (Linux; Android 14; Pixel 7) AppleWebKit/537.36 (KHTML, like Gecko) "
    "Chrome/119.0.6045.163 Mobile Safari/537.36",
    "Mozilla/5.0 (Windows NT 10.0; Win64; x64) AppleWebKit/537.36 (KHTML, like Gecko) "
    "Chrome/119.0.0.0 Safari/537.36 Edg/119.0.2151.72",
};
constexpr std::string_view kGooglebot =
    "Mozilla/5.0 (compatible; Googlebot/2.1; +http://www.google.com/bot.html)";
constexpr std::string_view kBingbot =
    "Mozilla/5.0 (compatible; bingbot/2.0; +http://www.bing.com/bingbot.htm)";
constexpr std::string_view kScannerAgents[] = {"Mozilla/5.0 zgrab/0.x", "curl/7.88.1",
                                               "python-requests/2.31.0"};
constexpr std::string_view kFeedAgent =
    "Feedly/1.0 (+http://www.feedly.com/fetcher.html; 42 subscribers; )";
constexpr std::string_view kProbes[] = {"/wp-login.php",
                                        "/xmlrpc.php",
                                        "/.env",
                                        "/phpmyadmin/index.php",
                                        "/.git/config",
                                        "/admin",
                                        "/server-status",
                                        "/wp-content/plugins/revslider/",
                                        "/cgi-bin/luci",
                                        "/vendor/phpunit",
                                        "/actuator/health",
                                        "/config.json"};
constexpr std::string_view kLandingReferers[] = {"-",
                                                 "-",
                                                 "https://www.google.com/",
                                                 "https://www.google.com/",
                                                 "https://www.google.com/",
                                                 "https://www.bing.com/",
                                                 "https://duckduckgo.com/"};

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

// Sizes of a static file stay the same from request to request.
uint64_t StableSize(std::string_view path, uint64_t low, uint64_t high) {
  return low + std::hash<std::string_view>{}(path) % (high - low + 1);
}

// Visits as events in time: each visit steps from page view to page view, each step makes the
// requests of that view, and a request is handed on once nothing made later can end before it.
class TrafficModel {
 public:
  // emit must outlive the model.
  TrafficModel(uint64_t lines, uint64_t seed, const std::function<void(const LoggedRequest&)>& emit)
      : target_(lines), random_(seed), emit_(emit) {
    clients_.reserve(kPeopleV4 + kPeopleV6 + kGooglebots + kBingbots + kScanners + kFeedReaders);
    static constexpr int kFirstOctets[] = {24,  31,  46,  62,  77,  81,  86,  92,  109,
                                           151, 176, 185, 188, 193, 203, 212, 213, 217};
    for (int i = 0; i < kPeopleV4; ++i) {
      clients_.push_back(fmt::format("{}.{}.{}.{}", kFirstOctets[random_() % 18], random_() % 256,
                                     random_() % 256, 1 + random_() % 254));
    }
    for (int i = 0; i < kPeopleV6; ++i) {
      clients_.push_back(fmt::format("2001:db8:{:x}:{:x}::{:x}", random_() % 0xffff,
                                     random_() % 0xffff, 1 + random_() % 0xfffe));
    }
    first_googlebot_ = static_cast<int>(clients_.size());
    for (int i = 0; i < kGooglebots; ++i) {
      clients_.push_back(fmt::format("66.249.66.{}", 1 + i));
    }
    first_bingbot_ = static_cast<int>(clients_.size());
    for (int i = 0; i < kBingbots; ++i) {
      clients_.push_back(fmt::format("40.77.167.{}", 10 + i));
    }
    first_scanner_ = static_cast<int>(clients_.size());
    for (int i = 0; i < kScanners; ++i) {
      clients_.push_back(fmt::format("{}.{}.{}.{}", 45 + random_() % 150, random_() % 256,
                                     random_() % 256, 1 + random_() % 254));
    }
    first_feed_ = static_cast<int>(clients_.size());
    for (int i = 0; i < kFeedReaders; ++i) {
      clients_.push_back(fmt::format("52.{}.{}.{}", 1 + i, random_() % 256, 1 + random_() % 254));
    }
    busy_.assign(clients_.size(), false);
  }

  // Generates until the target is emitted; returns the number of visits.
  uint64_t Run() {
    const double arrivals_per_second =
        static_cast<double>(target_) / (kLinesPerVisit * kSpanSeconds);
    std::exponential_distribution<double> gap(arrivals_per_second);
    Micros next_arrival = 0;
    while (emitted_ < target_) {
      const bool arrival = steps_.empty() || next_arrival <= steps_.top().first;
      const Micros now = arrival ? next_arrival : steps_.top().first;
      EmitEndedBy(now);
      if (arrival) {
        const int slot = NewVisit();
        steps_.push({now, slot});
        next_arrival = now + std::max<Micros>(1, static_cast<Micros>(gap(random_) * kSecond));
        continue;
      }
      const int slot = steps_.top().second;
      steps_.pop();
      const Micros next = Step(&visits_[slot], now);
      if (next >= 0) {
        steps_.push({next, slot});
      } else {
        busy_[visits_[slot].client] = false;
        free_slots_.push_back(slot);
      }
    }
    return visits_started_;
  }

 private:
  using Scheduled = std::pair<Micros, int>;

  bool Chance(double p) { return std::uniform_real_distribution<double>(0, 1)(random_) < p; }
  int Uniform(int low, int high) { return std::uniform_int_distribution<int>(low, high)(random_); }
  // Milliseconds from a log-normal of the given median.
  int64_t LogNormalMs(double median_ms, double sigma) {
    std::lognormal_distribution<double> d(std::log(median_ms), sigma);
    return static_cast<int64_t>(d(random_));
  }
  // Popular items first: a few hundred items get most views.
  int PopularItem() {
    const double u = std::uniform_real_distribution<double>(0, 1)(random_);
    return kFirstItem + static_cast<int>(kItems * u * u * u);
  }
  std::string_view Browser() { return kBrowsers[random_() % std::size(kBrowsers)]; }
  static std::string Full(std::string_view path) {
    return fmt::format("http://{}{}", kLogHost, path);
  }

  int PickFreeClient(int first, int count) {
    for (int tries = 0; tries < 64; ++tries) {
      // Some people come back often: a fifth of the visits come from a tenth of them.
      const int pick = first + (Chance(0.2) ? static_cast<int>(random_() % (count / 10 + 1))
                                            : static_cast<int>(random_() % count));
      if (!busy_[pick]) {
        return pick;
      }
    }
    return -1;
  }

  int NewVisit() {
    int slot;
    if (!free_slots_.empty()) {
      slot = free_slots_.back();
      free_slots_.pop_back();
    } else {
      slot = static_cast<int>(visits_.size());
      visits_.emplace_back();
    }
    Visit& v = visits_[slot];
    v = Visit{};
    ++visits_started_;
    const double kind = std::uniform_real_distribution<double>(0, 1)(random_);
    int client = -1;
    if (kind < 0.04) {
      v.kind = VisitKind::kCrawler;
      const bool google = Chance(0.7);
      client = google ? PickFreeClient(first_googlebot_, kGooglebots)
                      : PickFreeClient(first_bingbot_, kBingbots);
      v.agent = google ? kGooglebot : kBingbot;
      v.steps_left = Uniform(5, 40);
    } else if (kind < 0.055) {
      v.kind = VisitKind::kScanner;
      client = PickFreeClient(first_scanner_, kScanners);
      v.agent = kScannerAgents[random_() % std::size(kScannerAgents)];
      v.steps_left = Uniform(3, 25);
    } else if (kind < 0.1) {
      v.kind = VisitKind::kFeed;
      client = PickFreeClient(first_feed_, kFeedReaders);
      v.agent = kFeedAgent;
      v.steps_left = 1;
    } else {
      v.kind = kind < 0.2 ? VisitKind::kHotlink : VisitKind::kPerson;
      client = PickFreeClient(0, kPeopleV4 + kPeopleV6);
      v.agent = Browser();
      v.http2 = Chance(0.7);
      v.returning = Chance(0.3);
      int pages = 1;
      while (pages < 15 && Chance(0.65)) {
        ++pages;
      }
      v.steps_left = v.kind == VisitKind::kHotlink ? 1 : pages;
    }
    if (client < 0) {
      v.steps_left = 0;  // everyone of that kind is busy: the visit does not happen
      client = 0;
    } else {
      busy_[client] = true;
    }
    v.client = client;
    return slot;
  }

  // One step of a visit at now; returns when its next step is due, or -1 when it is over.
  Micros Step(Visit* v, Micros now) {
    if (v->steps_left <= 0) {
      return -1;
    }
    switch (v->kind) {
      case VisitKind::kPerson:
        return PersonStep(v, now);
      case VisitKind::kCrawler:
        CrawlerStep(v, now);
        return --v->steps_left > 0 ? now + Uniform(500, 4000) * kMilli : -1;
      case VisitKind::kScanner:
        ScannerStep(v, now);
        return --v->steps_left > 0 ? now + Uniform(50, 500) * kMilli : -1;
      case VisitKind::kHotlink:
        HotlinkStep(v, now);
        return -1;
      case VisitKind::kFeed:
        FeedStep(v, now);
        return -1;
    }
    return -1;
  }

  Request Base(const Visit& v, Micros start, std::string path) {
    Request r;
    r.end = start;
    r.client_index = v.client;
    r.client = clients_[v.client];
    r.agent = v.agent;
    r.http2 = v.http2;
    r.path = std::move(path);
    r.referer = "-";
    return r;
  }

  // A page the application rendered: upstream time plus the time to send it.
  void Dynamic(Request* r, double median_ms) {
    int64_t upstream = LogNormalMs(median_ms, 0.9);
    if (Chance(0.02)) {
      upstream *= Uniform(5, 40);  // a slow query, a cold cache
    }
    r->upstream_ms = std::min<int64_t>(upstream, 60000);
    r->request_ms = std::min<int64_t>(r->upstream_ms + LogNormalMs(3, 1.2), 60000);
  }
  // A file nginx served itself.
  void Static(Request* r) {
    int64_t ms = LogNormalMs(5.0 + static_cast<double>(r->bytes) / 8000.0, 1.0);
    if (Chance(0.01)) {
      ms *= Uniform(10, 50);  // a slow mobile client
    }
    r->request_ms = std::min<int64_t>(ms, 30000);
    r->upstream_ms = -1;
  }
  void Tiny(Request* r, int status, uint64_t bytes) {
    r->status = status;
    r->bytes = bytes;
    r->request_ms = Uniform(0, 1);
    r->upstream_ms = -1;
  }
  // An application page's status: mostly 200, rarely a failure.
  void PageOutcome(Request* r, uint64_t low, uint64_t high) {
    const double roll = std::uniform_real_distribution<double>(0, 1)(random_);
    if (roll < 0.004) {
      r->status = 500;
      r->bytes = static_cast<uint64_t>(Uniform(900, 2100));
      Dynamic(r, 200);
    } else if (roll < 0.006) {
      r->status = 502;
      r->bytes = 559;
      r->upstream_ms = Uniform(0, 5);
      r->request_ms = r->upstream_ms + Uniform(0, 2);
    } else if (roll < 0.0075) {
      r->status = 503;
      r->bytes = 599;
      r->upstream_ms = -1;  // refused by nginx's rate limit
      r->request_ms = 0;
    } else {
      r->status = 200;
      r->bytes = static_cast<uint64_t>(Uniform(static_cast<int>(low), static_cast<int>(high)));
      Dynamic(r, 45);
    }
  }

  Micros Emit(Request r, Micros start) {
    r.end = start + r.request_ms * kMilli;
    r.order = order_++;
    const Micros end = r.end;
    pending_.push(std::move(r));
    return end;
  }

  Micros PersonStep(Visit* v, Micros now) {
    --v->steps_left;
    std::string path;
    int item = -1;
    PageKind page_kind = PageKind::kPlain;
    if (!v->follow.empty()) {
      path = std::move(v->follow);
      v->follow.clear();
    } else {
      const double roll = std::uniform_real_distribution<double>(0, 1)(random_);
      const bool landing = v->views == 0;
      if (roll < (landing ? 0.3 : 0.08)) {
        path = "/";
        page_kind = PageKind::kHome;
      } else if (roll < (landing ? 0.7 : 0.58)) {
        item = PopularItem();
        page_kind = PageKind::kItem;
      } else if (roll < (landing ? 0.9 : 0.78)) {
        path = fmt::format("/shop/category/c{}", random_() % kCategories);
        page_kind = PageKind::kCategory;
      } else if (roll < (landing ? 0.995 : 0.85)) {
        path = fmt::format("/blog/post-{}", random_() % kBlogPosts);
        page_kind = PageKind::kBlog;
      } else if (roll < (landing ? 1.0 : 0.9)) {
        path = fmt::format("/search/term{}", random_() % kSearchTerms);
      } else if (roll < 0.95 && v->views > 0 &&
                 v->last_page.find("/shop/item/") != std::string::npos) {
        // Add to cart: a POST answered by a redirect to the cart, fetched at once.
        Request r = Base(*v, now, "/shop/cart/add");
        r.method = "POST";
        r.referer = v->last_page;
        r.status = 302;
        r.bytes = 0;
        Dynamic(&r, 30);
        const Micros end = Emit(std::move(r), now);
        v->follow = "/shop/cart";
        ++v->steps_left;
        return end + Uniform(20, 120) * kMilli;
      } else if (roll < 0.97) {
        // An old link without the trailing slash.
        Request r = Base(*v, now, "/shop");
        r.referer = v->last_page.empty() ? "-" : v->last_page;
        Tiny(&r, 301, 169);
        const Micros end = Emit(std::move(r), now);
        v->follow = "/shop/";
        ++v->steps_left;
        return end + Uniform(20, 120) * kMilli;
      } else {
        static constexpr std::string_view kPlain[] = {"/about",         "/contact", "/shop/",
                                                      "/shop/checkout", "/account", "/help.html"};
        path = kPlain[random_() % std::size(kPlain)];
      }
    }
    if (page_kind == PageKind::kItem) {
      if (Chance(0.012)) {
        // A stale link to an item that is gone.
        path = fmt::format("/shop/item/{}.html", 90000 + random_() % 9000);
        item = -1;
      } else {
        path = fmt::format("/shop/item/{}.html", item);
      }
    }
    Request page = Base(*v, now, path);
    page.referer = v->views == 0
                       ? std::string(kLandingReferers[random_() % std::size(kLandingReferers)])
                       : v->last_page;
    if (page_kind == PageKind::kItem && item < 0) {
      page.status = 404;
      page.bytes = 3216;
      Dynamic(&page, 20);
    } else {
      PageOutcome(&page, 20000, 80000);
    }
    const bool loaded = page.status == 200;
    const Micros page_end = Emit(std::move(page), now);
    const std::string page_url = Full(path);
    Micros last_end = page_end;
    if (loaded) {
      last_end = Objects(*v, page_kind, item, page_url, page_end);
    }
    ++v->views;
    v->last_page = page_url;
    if (v->steps_left <= 0) {
      return -1;
    }
    // Reading time before the next page.
    const Micros think = std::max<Micros>(1500, LogNormalMs(9000, 0.8)) * kMilli;
    return std::max(last_end, page_end) + std::min<Micros>(think, 120 * kSecond);
  }

  // The objects of a page view, fetched over a few connections once the HTML arrived. Returns
  // when the last one ended.
  Micros Objects(const Visit& v, PageKind kind, int item, const std::string& page_url,
                 Micros page_end) {
    struct Wanted {
      std::string path;
      std::string referer;
      uint64_t low, high;  // size range
      bool shared;         // a site-wide asset the browser caches
    };
    std::vector<Wanted> wanted;
    const std::string css_url = Full("/static/css/main.css");
    if (v.views == 0) {
      for (const auto& [path, low, high] :
           std::initializer_list<std::tuple<const char*, uint64_t, uint64_t>>{
               {"/static/css/main.css", 20000, 60000},
               {"/static/css/shop.css", 8000, 30000},
               {"/static/js/vendor.js", 150000, 350000},
               {"/static/js/app.js", 30000, 90000},
               {"/static/js/shop.js", 10000, 40000},
               {"/static/js/analytics.js", 20000, 45000},
               {"/img/logo.svg", 2000, 8000},
               {"/favicon.ico", 1150, 15086}}) {
        wanted.push_back({path, page_url, low, high, true});
      }
      for (const char* path : {"/static/fonts/inter-regular.woff2",
                               "/static/fonts/inter-bold.woff2", "/img/ui/sprite.png"}) {
        wanted.push_back({path, css_url, 30000, 70000, true});
      }
      for (int i = 0; i < 3; ++i) {
        wanted.push_back(
            {fmt::format("/img/ui/icon{}.png", random_() % kIcons), page_url, 1000, 4000, true});
      }
    }
    const auto thumbs = [&](int count, int around) {
      for (int i = 0; i < count; ++i) {
        const int id = kFirstItem + (around - kFirstItem + Uniform(-60, 60) + kItems) % kItems;
        wanted.push_back({fmt::format("/img/thumb/{}.jpg", id), page_url, 4000, 20000, false});
      }
    };
    switch (kind) {
      case PageKind::kHome:
        for (int i = 0; i < 3; ++i) {
          wanted.push_back({fmt::format("/img/banner/b{}.gif", random_() % kBanners), page_url,
                            10000, 60000, false});
        }
        thumbs(8, PopularItem());
        break;
      case PageKind::kItem:
        wanted.push_back(
            {fmt::format("/img/product/{}.jpg", item), page_url, 40000, 250000, false});
        thumbs(4, item);
        break;
      case PageKind::kCategory:
        thumbs(12, PopularItem());
        break;
      case PageKind::kBlog:
        wanted.push_back(
            {fmt::format("/img/blog/{}.jpg", std::hash<std::string>{}(page_url) % (kBlogPosts * 2)),
             page_url, 60000, 400000, false});
        break;
      case PageKind::kPlain:
        break;
    }
    // Six connections (HTTP/1.1) or a dozen streams (HTTP/2); each takes the next object.
    std::array<Micros, 12> free_at{};
    const size_t lanes = v.http2 ? 12 : 6;
    const Micros parsed = page_end + Uniform(20, 150) * kMilli;
    for (size_t i = 0; i < lanes; ++i) {
      free_at[i] = parsed + static_cast<Micros>(i) * Uniform(1, 5) * kMilli;
    }
    Micros last = page_end;
    for (Wanted& w : wanted) {
      const size_t lane = static_cast<size_t>(
          std::min_element(free_at.begin(), free_at.begin() + static_cast<long>(lanes)) -
          free_at.begin());
      const Micros start = free_at[lane];
      Request r = Base(v, start, std::move(w.path));
      r.referer = std::move(w.referer);
      const bool revalidate = w.shared ? v.returning && Chance(0.85) : Chance(0.08);
      if (revalidate) {
        Tiny(&r, 304, 0);
      } else if (!w.shared && Chance(0.005)) {
        Tiny(&r, 404, 153);
      } else {
        r.status = 200;
        r.bytes = StableSize(r.path, w.low, w.high);
        Static(&r);
      }
      const Micros end = Emit(std::move(r), start);
      free_at[lane] = end + Uniform(0, 3) * kMilli;
      last = std::max(last, end);
    }
    return last;
  }

  void CrawlerStep(Visit* v, Micros now) {
    std::string path;
    const double roll = std::uniform_real_distribution<double>(0, 1)(random_);
    if (v->views == 0) {
      path = "/robots.txt";
    } else if (roll < 0.02) {
      path = "/sitemap.xml";
    } else if (roll < 0.72) {
      path = fmt::format("/shop/item/{}.html", kFirstItem + random_() % kItems);
    } else if (roll < 0.9) {
      path = fmt::format("/shop/category/c{}", random_() % kCategories);
    } else {
      path = fmt::format("/blog/post-{}", random_() % kBlogPosts);
    }
    Request r = Base(*v, now, path);
    if (path == "/robots.txt" || path == "/sitemap.xml") {
      r.status = 200;
      r.bytes = StableSize(path, 300, 90000);
      Static(&r);
    } else if (Chance(0.03)) {
      r.path = fmt::format("/shop/item/{}.html", 90000 + random_() % 9000);
      r.status = 404;
      r.bytes = 3216;
      Dynamic(&r, 20);
    } else {
      PageOutcome(&r, 20000, 80000);
    }
    Emit(std::move(r), now);
    ++v->views;
  }

  void ScannerStep(Visit* v, Micros now) {
    const std::string_view probe = kProbes[random_() % std::size(kProbes)];
    Request r = Base(*v, now, std::string(probe));
    const bool forbidden =
        probe == "/admin" || probe == "/.git/config" || probe == "/server-status";
    Tiny(&r, forbidden ? 403 : 404, forbidden ? 153 : 153 + random_() % 400);
    Emit(std::move(r), now);
  }

  void HotlinkStep(Visit* v, Micros now) {
    Request r = Base(*v, now, fmt::format("/img/product/{}.jpg", PopularItem()));
    r.referer = fmt::format("https://forum.example.net/t/{}", random_() % 5000);
    if (Chance(0.2)) {
      Tiny(&r, 304, 0);
    } else {
      r.status = 200;
      r.bytes = StableSize(r.path, 40000, 250000);
      Static(&r);
    }
    Emit(std::move(r), now);
  }

  void FeedStep(Visit* v, Micros now) {
    Request r = Base(*v, now, "/feed.xml");
    if (Chance(0.6)) {
      Tiny(&r, 304, 0);
    } else {
      r.status = 200;
      r.bytes = 48213;
      Dynamic(&r, 15);
    }
    Emit(std::move(r), now);
  }

  // Hands on (in end order) every pending request that ended by now: nothing generated later
  // can end before now, since every later request starts at or after it.
  void EmitEndedBy(Micros now) {
    while (!pending_.empty() && pending_.top().end <= now && emitted_ < target_) {
      emit_(pending_.top());
      ++emitted_;
      pending_.pop();
    }
  }

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

}  // namespace

uint64_t GenerateTraffic(uint64_t lines, uint64_t seed,
                         const std::function<void(const LoggedRequest&)>& emit) {
  return TrafficModel(lines, seed, emit).Run();
}

}  // namespace bench
