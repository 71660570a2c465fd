// The requests of one step of a GenerateTraffic visit: a person's page with its objects, a
// crawler's page, a scanner's probe, a hotlinked image, a feed poll; each with the status, size
// and times nginx would log. Which visits there are and when they step is in nginx_traffic.cc.

#include <fmt/format.h>

#include <algorithm>
#include <array>
#include <cmath>
#include <functional>
#include <initializer_list>
#include <iterator>
#include <random>
#include <string>
#include <string_view>
#include <tuple>
#include <vector>

#include "bench/traffic_model.h"

namespace bench {
namespace traffic {
namespace {

constexpr int kItems = 3000;  // /shop/item/<1000..3999>.html, with an image and a thumbnail
constexpr int kFirstItem = 1000;
constexpr int kCategories = 150;
constexpr int kBlogPosts = 200;
constexpr int kSearchTerms = 300;
constexpr int kIcons = 40;
constexpr int kBanners = 12;

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

// Sizes of a static file stay the same from request to request.
uint64_t StableSize(std::string_view path, uint64_t low, uint64_t high) {
  return low + std::hash<std::string_view>{}(path) % (high - low + 1);
}

}  // namespace

int64_t TrafficModel::LogNormalMs(double median_ms, double sigma) {
  std::lognormal_distribution<double> d(std::log(median_ms), sigma);
  return static_cast<int64_t>(d(random_));
}

int TrafficModel::PopularItem() {
  const double u = std::uniform_real_distribution<double>(0, 1)(random_);
  return kFirstItem + static_cast<int>(kItems * u * u * u);
}

std::string TrafficModel::Full(std::string_view path) {
  return fmt::format("http://{}{}", kLogHost, path);
}

Request TrafficModel::Base(const Visit& v, Micros start, std::string path) {
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

void TrafficModel::Dynamic(Request* r, double median_ms) {
  int64_t upstream = LogNormalMs(median_ms, 0.9);
  if (Chance(0.02)) {
    upstream *= Uniform(5, 40);  // a slow query, a cold cache
  }
  r->upstream_ms = std::min<int64_t>(upstream, 60000);
  r->request_ms = std::min<int64_t>(r->upstream_ms + LogNormalMs(3, 1.2), 60000);
}

void TrafficModel::Static(Request* r) {
  int64_t ms = LogNormalMs(5.0 + static_cast<double>(r->bytes) / 8000.0, 1.0);
  if (Chance(0.01)) {
    ms *= Uniform(10, 50);  // a slow mobile client
  }
  r->request_ms = std::min<int64_t>(ms, 30000);
  r->upstream_ms = -1;
}

void TrafficModel::Tiny(Request* r, int status, uint64_t bytes) {
  r->status = status;
  r->bytes = bytes;
  r->request_ms = Uniform(0, 1);
  r->upstream_ms = -1;
}

void TrafficModel::PageOutcome(Request* r, uint64_t low, uint64_t high) {
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

Micros TrafficModel::PersonStep(Visit* v, Micros now) {
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

Micros TrafficModel::Objects(const Visit& v, PageKind kind, int item, const std::string& page_url,
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
    for (const char* path : {"/static/fonts/inter-regular.woff2", "/static/fonts/inter-bold.woff2",
                             "/img/ui/sprite.png"}) {
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
        wanted.push_back({fmt::format("/img/banner/b{}.gif", random_() % kBanners), page_url, 10000,
                          60000, false});
      }
      thumbs(8, PopularItem());
      break;
    case PageKind::kItem:
      wanted.push_back({fmt::format("/img/product/{}.jpg", item), page_url, 40000, 250000, false});
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

void TrafficModel::CrawlerStep(Visit* v, Micros now) {
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

void TrafficModel::ScannerStep(Visit* v, Micros now) {
  const std::string_view probe = kProbes[random_() % std::size(kProbes)];
  Request r = Base(*v, now, std::string(probe));
  const bool forbidden = probe == "/admin" || probe == "/.git/config" || probe == "/server-status";
  Tiny(&r, forbidden ? 403 : 404, forbidden ? 153 : 153 + random_() % 400);
  Emit(std::move(r), now);
}

void TrafficModel::HotlinkStep(Visit* v, Micros now) {
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

void TrafficModel::FeedStep(Visit* v, Micros now) {
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

}  // namespace traffic
}  // namespace bench
