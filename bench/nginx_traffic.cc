// GenerateTraffic's visitors: who they are (addresses and user agents), when visits arrive,
// when each next steps, and the order their requests are handed on. What a step requests is in
// traffic_requests.cc.

#include "bench/nginx_traffic.h"

#include <fmt/format.h>

#include <algorithm>
#include <functional>
#include <iterator>
#include <random>
#include <string_view>

#include "bench/traffic_model.h"

namespace bench {
namespace traffic {
namespace {

// Arrivals are paced so that the lines asked for span about this long.
constexpr double kSpanSeconds = 90 * 60;
constexpr double kLinesPerVisit = 23.0;  // a rough guess, for the pacing only (spans come out
                                         // at 70 to 90 minutes)

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

}  // namespace

TrafficModel::TrafficModel(uint64_t lines, uint64_t seed,
                           const std::function<void(const LoggedRequest&)>& emit)
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

uint64_t TrafficModel::Run() {
  const double arrivals_per_second = static_cast<double>(target_) / (kLinesPerVisit * kSpanSeconds);
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

std::string_view TrafficModel::Browser() {
  return kBrowsers[random_() % std::size(kBrowsers)];
}

int TrafficModel::PickFreeClient(int first, int count) {
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

int TrafficModel::NewVisit() {
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

Micros TrafficModel::Step(Visit* v, Micros now) {
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

Micros TrafficModel::Emit(Request r, Micros start) {
  r.end = start + r.request_ms * kMilli;
  r.order = order_++;
  const Micros end = r.end;
  pending_.push(std::move(r));
  return end;
}

void TrafficModel::EmitEndedBy(Micros now) {
  while (!pending_.empty() && pending_.top().end <= now && emitted_ < target_) {
    emit_(pending_.top());
    ++emitted_;
    pending_.pop();
  }
}

}  // namespace traffic

uint64_t GenerateTraffic(uint64_t lines, uint64_t seed,
                         const std::function<void(const LoggedRequest&)>& emit) {
  return traffic::TrafficModel(lines, seed, emit).Run();
}

}  // namespace bench
