#include "collector/sm3gen/traffic_model.h"

#include <fmt/format.h>
#include <time.h>

#include <algorithm>
#include <cassert>
#include <cmath>
#include <limits>

namespace sm3gen {
namespace {

constexpr char kProductVersion[] = "3.1.0";
constexpr char kApplicationId[] = "1";
constexpr char kCollectorId[] = "sm3gen-probe-1";
constexpr char kTimeZone[] = "UTC";

// Field widths the agent keeps; longer text would be cut silently.
constexpr size_t kUrlWidth = 254;
constexpr size_t kTitleWidth = 254;

// Longest time the model reports, ms: beyond an hour a transaction is a hung connection.
constexpr double kMaxMs = 3600000;

struct Weighted {
  int32_t value;
  double weight;
};

constexpr Weighted kPageStatuses[] = {{200, 88},  {302, 5},   {304, 3.5}, {301, 1.5},
                                      {204, 1.0}, {100, 0.5}, {101, 0.3}};
constexpr Weighted kObjectStatuses[] = {{200, 72}, {304, 25}, {206, 1.5}, {204, 1.5}};
constexpr Weighted kMediaStatuses[] = {{200, 55}, {206, 43}, {304, 2}};
// 99 and 600 are outside HTTP's range; real collectors see them from broken servers.
constexpr Weighted kErrorStatuses[] = {{404, 32}, {403, 10}, {401, 8}, {400, 8}, {500, 16},
                                       {502, 5},  {503, 9},  {504, 4}, {99, 4},  {600, 4}};
constexpr Weighted kOtherMethods[] = {
    {static_cast<int32_t>(Method::kGet), 95},     {static_cast<int32_t>(Method::kHead), 2},
    {static_cast<int32_t>(Method::kPut), 0.8},    {static_cast<int32_t>(Method::kOptions), 0.8},
    {static_cast<int32_t>(Method::kDelete), 0.6}, {static_cast<int32_t>(Method::kTrace), 0.4},
    {static_cast<int32_t>(Method::kConnect), 0.4}};
constexpr int32_t kAudioRates[] = {64, 96, 128, 192, 256, 320};
constexpr int32_t kVideoRates[] = {800, 1500, 2500, 4000, 6000};
constexpr std::string_view kAnchors[] = {"top", "comments", "reviews", "section-2"};

template <size_t N>
int32_t PickValue(Random* rng, const Weighted (&table)[N]) {
  double weights[N];
  for (size_t i = 0; i < N; ++i) {
    weights[i] = table[i].weight;
  }
  return table[rng->PickWeighted(weights)].value;
}

int32_t Ms(double value) {
  return static_cast<int32_t>(std::clamp(std::round(value), 0.0, kMaxMs));
}

int32_t Clamp32(int64_t value) {
  return static_cast<int32_t>(std::clamp<int64_t>(value, 0, std::numeric_limits<int32_t>::max()));
}

std::string Fit(std::string text, size_t width) {
  if (text.size() > width) {
    text.resize(width);
  }
  return text;
}

bool IsError(int32_t status) {
  return status < 200 || status >= 400;
}

std::string_view Reason(int32_t status) {
  switch (status) {
    case 400:
      return "Bad Request";
    case 401:
      return "Unauthorized";
    case 403:
      return "Forbidden";
    case 404:
      return "Not Found";
    case 500:
      return "Internal Server Error";
    case 502:
      return "Bad Gateway";
    case 503:
      return "Service Unavailable";
    case 504:
      return "Gateway Timeout";
    default:
      return "Error";
  }
}

// Splits the URI into the collector's path (up to and with the last '/'), file and query.
void SplitUrl(Record* r) {
  const std::string_view url = r->url;
  const size_t question = url.find('?');
  const std::string_view before = url.substr(0, question);
  const size_t slash = before.rfind('/');
  const size_t file_start = slash == std::string_view::npos ? 0 : slash + 1;
  r->url_path = std::string(before.substr(0, file_start));
  r->url_file = std::string(before.substr(file_start));
  r->url_query = question == std::string_view::npos ? "" : std::string(url.substr(question + 1));
}

// Packet counts from the byte counts: full-size segments plus handshake and acknowledgements.
void FillPackets(Record* r) {
  constexpr int64_t kSegment = 1460;
  const int64_t request_packets = 2 + (r->request_bytes + kSegment - 1) / kSegment;
  const int64_t reply_packets = 1 + (r->reply_bytes + kSegment - 1) / kSegment;
  r->request_packets = Clamp32(request_packets);
  r->reply_packets = Clamp32(reply_packets);
  r->request_ack_packets = Clamp32(1 + (reply_packets + 1) / 2);
  r->reply_ack_packets = Clamp32(1 + (request_packets + 1) / 2);
  r->total_bytes = Clamp32(static_cast<int64_t>(r->request_bytes) + r->reply_bytes);
}

std::string FullUrl(const Record& page, int port) {
  const std::string_view authority = page.host.empty() ? page.server_address : page.host;
  std::string url = port == 443 ? "https://" : "http://";
  const bool bracket = page.host.empty() && authority.find(':') != std::string_view::npos;
  url += bracket ? fmt::format("[{}]", authority) : std::string(authority);
  if (port != 80 && port != 443) {
    url += fmt::format(":{}", port);
  }
  return url + page.url;
}

}  // namespace

TrafficModel::TrafficModel(const ModelOptions& options)
    : options_(options),
      rng_(Mix64(options.seed ^ 0x7472616666696300ULL)),
      guid_salt_(Mix64(options.seed) ^ Mix64(static_cast<uint64_t>(options.start) + 1)) {
  assert(options.rate > 0 && "rate must be positive");
  // The population comes from its own stream so that it does not shift with traffic choices.
  Random setup(Mix64(options.seed ^ 0x706f70756c617465ULL));
  BuildSites(&setup);
  BuildClients(&setup);
}

void TrafficModel::BuildSites(Random* setup) {
  const auto known = KnownSites();
  const int count = std::clamp(options_.sites, 1, kMaxSites);
  for (int i = 0; i < count; ++i) {
    Site site;
    bool ipv6 = false;
    double weight = 2;
    if (static_cast<size_t>(i) < known.size()) {
      const SiteTemplate& t = known[i];
      site.host = t.host;
      site.static_host = t.static_host;
      site.server_description = t.server;
      site.port = t.port;
      site.pages = t.pages;
      ipv6 = t.ipv6;
      weight = t.weight;
    } else {
      site.host = fmt::format("site{}.example.com", i + 1);
      site.server_description = setup->Pick(GenericServers());
      site.port = setup->Chance(0.3) ? 80 : 443;
      site.pages = GenericPages();
      ipv6 = setup->Chance(0.5);
    }
    // Documentation address ranges: nothing here can reach a real host.
    site.ipv4 = fmt::format("198.51.100.{}", 10 + i);
    site.static_ipv4 = fmt::format("203.0.113.{}", 10 + i);
    if (ipv6) {
      site.ipv6 = fmt::format("2001:db8:5e::{:x}", i + 1);
      site.static_ipv6 = fmt::format("2001:db8:5e:cd::{:x}", i + 1);
    }
    for (const PageTemplate& page : site.pages) {
      site.page_weights.push_back(page.weight);
    }
    sites_.push_back(std::move(site));
    site_weights_.push_back(weight);
  }
}

void TrafficModel::BuildClients(Random* setup) {
  const auto networks = ClientNetworks();
  std::vector<double> network_weights;
  for (const ClientNetwork& n : networks) {
    network_weights.push_back(n.weight);
  }
  const auto agents = UserAgents();
  std::vector<double> agent_weights;
  for (const UserAgent& a : agents) {
    agent_weights.push_back(a.weight);
  }
  std::vector<int> used(networks.size(), 0);  // addresses handed out per network
  const int count = std::clamp(options_.clients, 1, kMaxClients);
  for (int i = 0; i < count; ++i) {
    const size_t n = setup->PickWeighted(network_weights);
    const int host = used[n]++;
    Client client;
    client.network = &networks[n];
    client.ipv4 = fmt::format("{}{}.{}", networks[n].ipv4_prefix, host / 254, host % 254 + 1);
    if (setup->Chance(options_.ipv6_share / 100)) {
      client.ipv6 = fmt::format("{}{:x}::{:x}:{:x}", networks[n].ipv6_prefix, host / 254 + 1,
                                setup->UniformInt(0x100, 0xffff), host % 254 + 1);
    }
    client.user_agent = agents[setup->PickWeighted(agent_weights)].text;
    clients_.push_back(std::move(client));
  }
}

int64_t TrafficModel::TimeOf(int64_t sequence) const {
  return options_.start +
         static_cast<int64_t>(std::floor(static_cast<double>(sequence) / options_.rate));
}

Record TrafficModel::Next() {
  if (pending_.empty()) {
    PlanPage();
  }
  Record record = std::move(pending_.front());
  pending_.pop_front();
  if (options_.url_keys > 0) {
    // An odd multiplier not divisible by 5 is a bijection modulo every 2^a 5^b.
    const uint64_t key =
        static_cast<uint64_t>(sequence_) * 2654435761u % static_cast<uint64_t>(options_.url_keys);
    record.url = fmt::format("/key/{}", key);
    SplitUrl(&record);
  }
  Stamp(&record);
  return record;
}

void TrafficModel::Stamp(Record* r) {
  const int64_t seconds = TimeOf(sequence_);
  r->time_utc = static_cast<int32_t>(seconds);
  const time_t t = static_cast<time_t>(seconds);
  struct tm utc {};
  gmtime_r(&t, &utc);
  r->date = fmt::format("{:04}-{:02}-{:02}", utc.tm_year + 1900, utc.tm_mon + 1, utc.tm_mday);
  r->time_of_day = fmt::format("{:02}:{:02}:{:02}", utc.tm_hour, utc.tm_min, utc.tm_sec);
  // The first half is a bijection of the sequence number, so GUIDs of one run never repeat.
  const uint64_t sequence = static_cast<uint64_t>(sequence_);
  r->guid = fmt::format("{:016x}{:016x}", Mix64(guid_salt_ ^ sequence),
                        Mix64(Mix64(sequence) + guid_salt_));
  ++sequence_;
}

std::string TrafficModel::Expand(std::string_view pattern, Fill* fill) {
  std::string out;
  size_t i = 0;
  while (i < pattern.size()) {
    const size_t open = pattern.find('{', i);
    const size_t close = open == std::string_view::npos ? open : pattern.find('}', open);
    if (close == std::string_view::npos) {
      out.append(pattern.substr(i));
      break;
    }
    out.append(pattern.substr(i, open - i));
    const std::string_view name = pattern.substr(open + 1, close - open - 1);
    const int kind = name == "n" ? 0 : name == "id" ? 1 : name == "hex" ? 3 : 2;
    std::string value;
    if (fill->replay[kind] < fill->values[kind].size()) {
      value = fill->values[kind][fill->replay[kind]++];
    } else {
      switch (kind) {
        case 0:
          value = fmt::format("{}", rng_.UniformInt(1, 9));
          break;
        case 1:
          value = fmt::format("{}", rng_.UniformInt(10000, 99999));
          break;
        case 2:
          value = rng_.Pick(Words());
          break;
        default:
          value = fmt::format("{:016x}", rng_.Bits());
          break;
      }
      fill->values[kind].push_back(value);
      fill->replay[kind] = fill->values[kind].size();
    }
    if (name == "W" && !value.empty()) {
      value[0] = static_cast<char>(value[0] - 'a' + 'A');
    }
    out += value;
    i = close + 1;
  }
  return out;
}

int32_t TrafficModel::PickStatus(RecordKind kind, Method method) {
  if (rng_.Chance(options_.error_share / 100)) {
    return PickValue(&rng_, kErrorStatuses);
  }
  int32_t status;
  switch (kind) {
    case RecordKind::kPage:
      status = PickValue(&rng_, kPageStatuses);
      break;
    case RecordKind::kObject:
      status = PickValue(&rng_, kObjectStatuses);
      break;
    default:
      status = PickValue(&rng_, kMediaStatuses);
      break;
  }
  // Only reads are conditional: a POST or PUT never comes back "not modified".
  return status == 304 && method != Method::kGet && method != Method::kHead ? 200 : status;
}

Method TrafficModel::PickMethod(double post_share) {
  if (rng_.Chance(post_share)) {
    return Method::kPost;
  }
  return static_cast<Method>(PickValue(&rng_, kOtherMethods));
}

int32_t TrafficModel::ServerTime(double median_ms, int32_t status) {
  double factor = 1;
  switch (status) {
    case 304:
      factor = 0.3;
      break;
    case 400:
    case 401:
    case 403:
    case 404:
      factor = 0.25;
      break;
    case 500:
      factor = 1.8;
      break;
    case 503:
      // Either refused at once by an overloaded server or after a long queue.
      return Ms(rng_.Chance(0.3) ? rng_.LogNormal(15000, 0.3) : rng_.LogNormal(5, 0.5));
    case 504:
      return Ms(rng_.LogNormal(30000, 0.05));  // a proxy's time-out
    default:
      break;
  }
  double value = rng_.LogNormal(std::max(median_ms * factor, 1.0), 0.6);
  if (rng_.Chance(0.005)) {
    value *= static_cast<double>(rng_.UniformInt(10, 60));  // a stalled back end
  }
  return Ms(value);
}

int32_t TrafficModel::NetworkTime(const Client& client, double round_trips,
                                  int64_t transfer_bytes) {
  const double latency = rng_.LogNormal(client.network->rtt_ms * round_trips, 0.35);
  const double transfer = static_cast<double>(transfer_bytes) * 8 / client.network->bandwidth_kbps;
  return Ms(latency + transfer);
}

int32_t TrafficModel::ReplyBody(int32_t status, Method method, double median_kb) {
  if (method == Method::kHead || status == 304 || status == 204 ||
      (status >= 100 && status < 200)) {
    return 0;
  }
  if (status == 301 || status == 302) {
    return Clamp32(std::llround(rng_.LogNormal(300, 0.3)));
  }
  if (IsError(status)) {
    return Clamp32(std::llround(rng_.LogNormal(1200, 0.5)));
  }
  return Clamp32(std::llround(rng_.LogNormal(median_kb * 1024, 0.5)));
}

void TrafficModel::Address(const Client& client, const Site& site, bool static_host, Record* r) {
  r->product_version = kProductVersion;
  r->application_id = kApplicationId;
  r->collector_id = kCollectorId;
  r->gmt_offset = 0;
  r->time_zone = kTimeZone;
  // Dual-stack clients prefer IPv6 when the site offers it.
  const bool ipv6 = !client.ipv6.empty() && !site.ipv6.empty();
  r->client_address = ipv6 ? client.ipv6 : client.ipv4;
  r->server_address =
      static_host ? (ipv6 ? site.static_ipv6 : site.static_ipv4) : (ipv6 ? site.ipv6 : site.ipv4);
  r->server_port = site.port;
  r->protocol = site.port == 443 ? "HTTPS" : "HTTP/1.1";
  r->browser = client.user_agent;
  r->server_description = site.server_description;
}

void TrafficModel::PlanPage() {
  Client& client =
      clients_[static_cast<size_t>(rng_.UniformInt(0, static_cast<int64_t>(clients_.size()) - 1))];
  int site_index;
  std::string referrer;
  if (client.current_site >= 0 && rng_.Chance(0.7)) {
    site_index = client.current_site;
    referrer = client.last_page;
  } else {
    site_index = static_cast<int>(rng_.PickWeighted(site_weights_));
    Fill fill;
    referrer = rng_.Chance(0.4) ? Expand(rng_.Pick(ExternalReferrers()), &fill) : "N/A";
  }
  const bool new_visit = client.current_site != site_index;
  const Site& site = sites_[static_cast<size_t>(site_index)];
  const PageTemplate& tmpl = site.pages[rng_.PickWeighted(site.page_weights)];

  Record page;
  page.kind = RecordKind::kPage;
  Address(client, site, false, &page);
  page.host = site.host;
  if (site.port != 443 && rng_.Chance(0.02)) {
    // An HTTP/1.0 client without a Host header: the agent falls back to the server address.
    page.host.clear();
    page.protocol = "HTTP/1.0";
  }
  page.client_port = static_cast<int32_t>(rng_.UniformInt(32768, 60999));
  Fill fill;
  page.url = Fit(Expand(tmpl.url, &fill), kUrlWidth);
  SplitUrl(&page);
  if (rng_.Chance(0.03)) {
    page.url_anchor = rng_.Pick(std::span<const std::string_view>(kAnchors));
  }
  page.referrer = Fit(referrer, kUrlWidth);
  page.method = PickMethod(tmpl.post_share);
  page.status = PickStatus(RecordKind::kPage, page.method);
  if (page.status >= 400 && page.status < 600) {
    page.title = fmt::format("{} {}", page.status, Reason(page.status));
  } else if (page.status == 200 && !tmpl.title.empty()) {
    std::fill(std::begin(fill.replay), std::end(fill.replay), 0);
    page.title = Fit(Expand(tmpl.title, &fill), kTitleWidth);
  }

  page.resolve_ms = rng_.Chance(new_visit ? 0.6 : 0.05) ? Ms(rng_.LogNormal(12, 0.8)) : 0;
  page.server_ms = ServerTime(tmpl.server_ms, page.status);
  page.request_bytes = Clamp32(std::llround(rng_.LogNormal(480, 0.25)));
  if (page.method == Method::kPost || page.method == Method::kPut) {
    page.request_bytes += Clamp32(std::llround(rng_.LogNormal(1500, 1.0)));
  }
  page.reply_bytes = Clamp32(std::llround(rng_.LogNormal(350, 0.2))) +
                     ReplyBody(page.status, page.method, tmpl.reply_kb);
  page.network_ms = NetworkTime(client, 3, page.reply_bytes);

  std::vector<Record> objects;
  if (page.status == 200 && page.method != Method::kHead && tmpl.objects > 0) {
    // Log-normal around the mean (its median is mean / e^(sigma^2/2)).
    const double mean = options_.objects * tmpl.objects;
    const double count = rng_.LogNormal(mean / std::exp(0.18), 0.6);
    const int n = static_cast<int>(std::min(std::round(count), 200.0));
    for (int i = 0; i < n; ++i) {
      if (rng_.Chance(options_.av_share / 100)) {
        const MediaTemplate& media = rng_.Pick(MediaStreams());
        objects.push_back(PlanMedia(page, media, client));
      } else {
        objects.push_back(PlanObject(page, site, client));
      }
      Record& object = objects.back();
      object.referrer = Fit(FullUrl(page, site.port), kUrlWidth);
      object.client_port = std::min(page.client_port + static_cast<int32_t>(i % 6), 65535);
    }
  }

  int64_t object_bytes = 0;
  double rt_sum = 0;
  double rt_max = 0;
  for (const Record& object : objects) {
    object_bytes += object.reply_bytes;
    rt_sum += object.response_ms;
    rt_max = std::max(rt_max, static_cast<double>(object.response_ms));
    if (object.status == 304) {
      ++page.header_requests;
      page.header_resolve_ms += object.resolve_ms;
    }
  }
  page.object_count = static_cast<int32_t>(objects.size());
  page.object_bytes = Clamp32(object_bytes);
  // Browsers fetch about six objects at a time.
  page.load_ms = objects.empty() ? 0 : Ms(std::max(rt_max, rt_sum / 6));
  page.response_ms =
      Ms(static_cast<double>(page.resolve_ms) + page.server_ms + page.network_ms + page.load_ms);
  FillPackets(&page);

  client.current_site = site_index;
  client.last_page = FullUrl(page, site.port);
  pending_.push_back(std::move(page));
  for (Record& object : objects) {
    pending_.push_back(std::move(object));
  }
}

Record TrafficModel::PlanObject(const Record& page, const Site& site, const Client& client) {
  std::vector<double> weights;
  for (const ObjectTemplate& t : EmbeddedObjects()) {
    weights.push_back(t.weight);
  }
  const ObjectTemplate& tmpl = EmbeddedObjects()[rng_.PickWeighted(weights)];
  const bool from_static = !site.static_host.empty() && rng_.Chance(0.8);

  Record r;
  r.kind = RecordKind::kObject;
  Address(client, site, from_static, &r);
  r.protocol = page.protocol;
  r.host = page.host.empty() ? "" : from_static ? site.static_host : site.host;
  Fill fill;
  r.url = Fit(Expand(tmpl.url, &fill), kUrlWidth);
  SplitUrl(&r);
  r.method = tmpl.url.starts_with("/api/") && rng_.Chance(0.5) ? Method::kPost
             : rng_.Chance(0.01)                               ? Method::kHead
                                                               : Method::kGet;
  r.status = PickStatus(RecordKind::kObject, r.method);
  r.resolve_ms = from_static && rng_.Chance(0.1) ? Ms(rng_.LogNormal(10, 0.8)) : 0;
  r.server_ms = ServerTime(tmpl.server_ms, r.status);
  r.request_bytes = Clamp32(std::llround(rng_.LogNormal(420, 0.25)));
  r.reply_bytes = Clamp32(std::llround(rng_.LogNormal(300, 0.2))) +
                  ReplyBody(r.status, r.method, tmpl.reply_kb);
  r.network_ms = NetworkTime(client, 2, r.reply_bytes);
  r.response_ms = Ms(static_cast<double>(r.resolve_ms) + r.server_ms + r.network_ms);
  FillPackets(&r);
  return r;
}

Record TrafficModel::PlanMedia(const Record& page, const MediaTemplate& media,
                               const Client& client) {
  Record r;
  r.kind = media.kind;
  r.product_version = kProductVersion;
  r.application_id = kApplicationId;
  r.collector_id = kCollectorId;
  r.time_zone = kTimeZone;
  r.client_address = page.client_address;
  r.server_address = page.server_address;
  r.server_port = page.server_port;
  r.protocol = page.protocol;
  r.browser = page.browser;
  r.server_description = page.server_description;
  Fill fill;
  r.url = Fit(Expand(media.url, &fill), kUrlWidth);
  r.status = PickStatus(media.kind, Method::kGet);
  const bool segment = media.url.find("segment") != std::string_view::npos;
  if (media.kind == RecordKind::kAudio) {
    r.duration_ms = Ms(std::clamp(rng_.LogNormal(180000, 0.6), 5000.0, 3600000.0));
    r.bit_rate_kbps = rng_.Pick(std::span<const int32_t>(kAudioRates));
  } else {
    r.duration_ms = segment ? 6000 : Ms(std::clamp(rng_.LogNormal(240000, 0.8), 3000.0, 1800000.0));
    r.bit_rate_kbps = rng_.Pick(std::span<const int32_t>(kVideoRates));
  }
  // kbit/s times ms over 8 is bytes; at most 6000 * 1800000 / 8, well inside 32 bits.
  const int64_t full = static_cast<int64_t>(r.bit_rate_kbps) * r.duration_ms / 8;
  int64_t body = full;
  if (r.status == 206) {
    body = std::min<int64_t>(full, std::llround(rng_.LogNormal(2 << 20, 0.5)));
  } else if (r.status != 200) {
    body = ReplyBody(r.status, Method::kGet, 1);
  }
  r.request_bytes = Clamp32(std::llround(rng_.LogNormal(450, 0.25)));
  r.reply_bytes = Clamp32(std::llround(rng_.LogNormal(380, 0.2)) + body);
  const int32_t server = ServerTime(25, r.status);
  // Streams start playing after the first quarter megabyte, not after the whole download.
  r.network_ms = NetworkTime(client, 3, std::min<int64_t>(body, 256 * 1024));
  r.response_ms = Ms(static_cast<double>(server) + r.network_ms);
  FillPackets(&r);
  return r;
}

}  // namespace sm3gen
