#pragma once

// The fixed material the traffic model draws from: the web sites it simulates with their pages,
// the embedded objects and media a page pulls in, client networks, browsers and words for
// URLs. Everything here is static data; the model picks from it with its own random source.
//
// URL and title patterns may hold placeholders the model fills in:
//   {n}   a digit 1-9            (few distinct values)
//   {id}  a number 10000-99999   (many distinct values)
//   {w}   a lower-case word, {W} the same capitalised
//   {hex} 16 hexadecimal digits  (practically unique)

#include <span>
#include <string_view>

#include "collector/sm3gen/record.h"

namespace sm3gen {

// One page of a site and what loading it costs.
struct PageTemplate {
  std::string_view url;    // request URI pattern: path, optional "?query"
  std::string_view title;  // title pattern; empty for answers without one (APIs, feeds)
  double weight;           // popularity within the site
  double server_ms;        // median server time
  double reply_kb;         // median reply body, KiB
  double objects;          // embedded objects relative to the configured mean; 0 = none
  double post_share;       // share of requests sent as POST
};

// A site: a host name served by one address pair, optionally with a separate host for its
// static files.
struct SiteTemplate {
  std::string_view host;
  std::string_view static_host;  // empty: embedded objects come from host
  std::string_view server;       // Server header; empty when the site hides it
  int port;                      // 443 is HTTPS, 80 and 8080 plain HTTP
  bool ipv6;                     // also reachable over IPv6
  double weight;                 // share of traffic relative to the other sites
  std::span<const PageTemplate> pages;
};

// An embedded object (<hobj>) a page may load.
struct ObjectTemplate {
  std::string_view url;
  double weight;
  double reply_kb;  // median body size, KiB
  double server_ms;
};

// An audio or video stream a page may play.
struct MediaTemplate {
  std::string_view url;
  RecordKind kind;  // kAudio or kVideo
};

// A client network: addresses are prefix + host number; latency and bandwidth shape the
// network time of its requests.
struct ClientNetwork {
  std::string_view ipv4_prefix;  // first two octets and a dot, e.g. "10.1."
  std::string_view ipv6_prefix;  // e.g. "2001:db8:c1:", the rest is filled in per client
  double weight;                 // share of clients
  double rtt_ms;                 // median round trip
  double bandwidth_kbps;
};

std::span<const SiteTemplate> KnownSites();
// Pages of the generic sites the model makes up when more sites are asked for than are known.
std::span<const PageTemplate> GenericPages();
std::span<const std::string_view> GenericServers();
std::span<const ObjectTemplate> EmbeddedObjects();
std::span<const MediaTemplate> MediaStreams();
std::span<const ClientNetwork> ClientNetworks();
// A browser or tool and its share of clients.
struct UserAgent {
  std::string_view text;
  double weight;
};

std::span<const UserAgent> UserAgents();
// Referrers of visits that arrive from outside the simulated sites.
std::span<const std::string_view> ExternalReferrers();
std::span<const std::string_view> Words();

}  // namespace sm3gen
