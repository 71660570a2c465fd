#pragma once

// TrafficModel: simulated web traffic as seen by the collector, one record at a time. A page
// comes first, then its embedded objects (images, style sheets, scripts, now and then audio or
// video), then the next page. Clients browse a few sites from several IPv4 networks, some
// over IPv6; statuses, methods and times follow realistic mixes.
//
// The same options always give the same records. Time stamps start at options.start and
// advance by 1/rate seconds per record, so a live writer can emit records at that rate.
//
// Thread safety: none; one thread uses an instance.

#include <cstdint>
#include <deque>
#include <string>
#include <vector>

#include "collector/sm3gen/random.h"
#include "collector/sm3gen/record.h"
#include "collector/sm3gen/site_catalog.h"

namespace sm3gen {

struct ModelOptions {
  uint64_t seed = 1;
  int64_t start = 0;       // time stamp of the first record, seconds since 1970 UTC
  double rate = 50;        // records per second of traffic time; > 0
  int sites = 4;           // 1..kMaxSites
  int clients = 200;       // 1..kMaxClients
  double ipv6_share = 15;  // percent of clients that also have an IPv6 address
  double objects = 6;      // mean embedded objects per ordinary page (APIs have none)
  double av_share = 3;     // percent of embedded objects that are audio or video
  double error_share = 5;  // percent of records answered with a 4xx, 5xx or odd status
  // > 0: every record's URL becomes "/key/<k>" with k taken in a fixed scrambled order from
  // 0..url_keys-1, so the first url_keys records have distinct URLs (benchmarks of key counts).
  int64_t url_keys = 0;
};

inline constexpr int kMaxSites = 200;
inline constexpr int kMaxClients = 50000;

class TrafficModel {
 public:
  explicit TrafficModel(const ModelOptions& options);

  TrafficModel(const TrafficModel&) = delete;
  TrafficModel& operator=(const TrafficModel&) = delete;

  // The next record.
  Record Next();

  // The time stamp of the record with this 0-based sequence number.
  int64_t TimeOf(int64_t sequence) const;

  // Records returned by Next so far.
  int64_t produced() const { return sequence_; }

 private:
  struct Site {
    std::string host;
    std::string static_host;  // empty: objects come from host
    std::string server_description;
    int port = 80;
    std::string ipv4, ipv6;                // ipv6 empty when the site has none
    std::string static_ipv4, static_ipv6;  // addresses of static_host
    std::span<const PageTemplate> pages;
    std::vector<double> page_weights;
  };
  struct Client {
    std::string ipv4;
    std::string ipv6;  // empty for IPv4-only clients
    const ClientNetwork* network = nullptr;
    std::string user_agent;
    int current_site = -1;  // the site being browsed, -1 before the first page
    std::string last_page;  // full URL of the previous page: the next page's referrer
  };
  // Values drawn for placeholders, so a title can repeat the words of its URL.
  struct Fill {
    std::vector<std::string> values[4];
    size_t replay[4] = {0, 0, 0, 0};
  };

  void BuildSites(Random* setup);
  void BuildClients(Random* setup);
  // Queues a page and its embedded objects.
  void PlanPage();
  Record PlanObject(const Record& page, const Site& site, const Client& client);
  Record PlanMedia(const Record& page, const MediaTemplate& media, const Client& client);
  // Sets the addresses, ports, browser, protocol and the collector's fixed fields.
  void Address(const Client& client, const Site& site, bool static_host, Record* record);
  std::string Expand(std::string_view pattern, Fill* fill);
  int32_t PickStatus(RecordKind kind, Method method);
  Method PickMethod(double post_share);
  int32_t ServerTime(double median_ms, int32_t status);
  int32_t NetworkTime(const Client& client, double round_trips, int64_t transfer_bytes);
  int32_t ReplyBody(int32_t status, Method method, double median_kb);
  // Adds the time, date, GUID and sequence number.
  void Stamp(Record* record);

  ModelOptions options_;
  Random rng_;
  uint64_t guid_salt_;
  std::vector<Site> sites_;
  std::vector<double> site_weights_;
  std::vector<Client> clients_;
  std::deque<Record> pending_;  // planned records not yet returned
  int64_t sequence_ = 0;        // records returned so far
};

}  // namespace sm3gen
