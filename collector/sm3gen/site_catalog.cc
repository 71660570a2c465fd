#include "collector/sm3gen/site_catalog.h"

namespace sm3gen {
namespace {

// clang-format off
// url, title, weight, server_ms, reply_kb, objects, post_share
constexpr PageTemplate kShopPages[] = {
    {"/", "Shop Example | Home", 12, 60, 48, 1.6, 0},
    {"/shop/catalog?category={w}&page={n}", "{W} | Shop Example", 9, 120, 64, 1.4, 0},
    {"/shop/product/{id}", "{W} deal {id} | Shop Example", 10, 90, 56, 1.5, 0},
    {"/shop/cart", "Your cart | Shop Example", 4, 150, 20, 0.8, 0.3},
    {"/shop/checkout?step={n}", "Checkout step {n} | Shop Example", 2, 320, 18, 0.6, 0.45},
    {"/account/login", "Sign in | Shop Example", 3, 200, 12, 0.5, 0.5},
    {"/search?q={w}&sort=relevance", "Results for {w} | Shop Example", 5, 180, 40, 1.0, 0},
    // Longer than 127 characters before its query: every variant shares one transaction name.
    {"/shop/catalog/electronics/computers-and-accessories/laptops-and-notebooks/ultrabooks/"
     "thin-and-light/14-inch-displays/compare.html?sku={id}&with={id}",
     "Compare ultrabooks | Shop Example", 1, 260, 70, 1.2, 0},
    {"/api/cart/items", "", 3, 40, 2, 0, 0.6},
};

constexpr PageTemplate kNewsPages[] = {
    {"/", "Example News - Front page", 14, 80, 90, 2.0, 0},
    {"/world/", "World | Example News", 6, 70, 70, 1.8, 0},
    {"/articles/2026/11/{w}-{w}-{id}.html", "{W} and {w}: what we know | Example News", 12, 60, 60,
     1.5, 0},
    // Long, but the distinct part ends before character 127.
    {"/articles/2026/11/{id}-analysis-the-long-road-from-{w}-to-{w}-and-back-again.html",
     "Analysis: the long road | Example News", 3, 70, 80, 1.5, 0},
    {"/live/{w}", "Live: {W} | Example News", 4, 40, 30, 1.0, 0},
    {"/culture/cafe-{w}.html", "Café culture: {W} | Example News", 2, 60, 55, 1.5, 0},
    {"/rss.xml", "", 2, 20, 25, 0, 0},
    {"/comments/post", "", 1, 120, 1, 0, 1.0},
};

constexpr PageTemplate kIntranetPages[] = {
    {"/default.aspx", "Corp Intranet", 8, 400, 35, 1.2, 0},
    {"/hr/timesheet.aspx?week={n}", "Timesheet week {n}", 5, 900, 28, 0.8, 0.4},
    {"/wiki/{W}_Guidelines", "{W} guidelines - Corp Wiki", 4, 300, 45, 1.0, 0},
    // Reporting-services style URL: 180 characters, varying only beyond character 127.
    {"/ReportServer/Pages/ReportViewer.aspx?%2fFinance%2fQuarterly%20Revenue%20by%20Region%20and"
     "%20Product%20Line&rs:Command=Render&rs:Format=HTML4.0&rc:Toolbar=true&Period=Q{n}&Region={W}",
     "Quarterly Revenue by Region - Report Viewer", 2, 2500, 120, 1.5, 0},
    {"/api/directory/people?q={w}", "", 3, 250, 4, 0, 0},
};

constexpr PageTemplate kPortalPages[] = {
    {"/", "Customer self-service", 5, 150, 30, 1.5, 0},
    {"/dashboard", "Dashboard - Customer self-service", 6, 350, 40, 1.8, 0},
    {"/tickets/{id}", "Ticket {id} - Customer self-service", 5, 220, 25, 1.0, 0.2},
    {"/api/v2/tickets?status=open&assignee={id}", "", 4, 180, 6, 0, 0},
};

constexpr PageTemplate kPaymentsPages[] = {
    {"/v1/charges", "", 6, 180, 1, 0, 0.9},
    {"/v1/charges/ch_{hex}", "", 4, 60, 1, 0, 0},
    {"/v1/customers?limit={n}0", "", 3, 90, 6, 0, 0},
    {"/healthz", "", 2, 2, 0.1, 0, 0},
};

constexpr PageTemplate kMediaPages[] = {
    {"/", "Stream Example", 4, 90, 60, 2.0, 0},
    {"/watch?v={hex}", "{W} {W} - Stream Example", 10, 110, 80, 2.5, 0},
    {"/browse/{w}", "{W} - Browse - Stream Example", 4, 130, 70, 2.0, 0},
};

constexpr PageTemplate kWikiPages[] = {
    {"/wiki/{W}", "{W} - Example Encyclopedia", 12, 70, 75, 1.0, 0},
    {"/w/index.php?title={W}&action=edit", "Editing {W} - Example Encyclopedia", 2, 200, 50, 1.0,
     0.5},
    {"/wiki/Special:Search?search={w}+{w}", "Search results - Example Encyclopedia", 3, 250, 30,
     0.8, 0},
};

constexpr PageTemplate kLegacyPages[] = {
    {"/index.html", "Welcome", 5, 10, 8, 0.5, 0},
    {"/cgi-bin/query.pl?id={id}", "Query result", 4, 700, 15, 0.3, 0.2},
};

constexpr PageTemplate kGenericPages[] = {
    {"/", "Home", 10, 80, 40, 1.5, 0},
    {"/about", "About us", 2, 60, 25, 1.0, 0},
    {"/contact", "Contact", 2, 90, 15, 0.8, 0.4},
    {"/products/{id}", "Product {id}", 6, 110, 45, 1.3, 0},
    {"/blog/{w}-{w}", "{W} {w}", 4, 70, 50, 1.2, 0},
};

// host, static_host, server, port, ipv6, weight, pages
constexpr SiteTemplate kSites[] = {
    {"www.shop.example", "static.shop.example", "nginx/1.24.0", 443, true, 10, kShopPages},
    {"news.example.org", "", "Apache/2.4.57 (Debian)", 80, false, 8, kNewsPages},
    {"intranet.corp.example", "", "Microsoft-IIS/10.0", 8080, true, 5, kIntranetPages},
    // A host name over 127 characters: the agent names its application by the first 127.
    {"portal.customer-self-service.eu-central-1.region-gateway.apps.enterprise-platform-"
     "production.internal.megacorp-holdings-international.example",
     "", "", 443, false, 3, kPortalPages},
    {"api.payments.example.com", "", "gunicorn/21.2.0", 443, true, 4, kPaymentsPages},
    {"media.stream.example.net", "img.stream.example.net", "cloudflare", 443, true, 5,
     kMediaPages},
    {"wiki.example.edu", "", "Apache/2.4.41 (Ubuntu)", 80, false, 4, kWikiPages},
    {"old.legacy.example", "", "Apache/1.3.42 (Unix)", 80, false, 1, kLegacyPages},
};

constexpr std::string_view kGenericServers[] = {
    "nginx/1.22.1", "Apache/2.4.62 (Debian)", "LiteSpeed", "openresty/1.21.4.1", "Caddy",
};

// url, weight, reply_kb, server_ms
constexpr ObjectTemplate kObjects[] = {
    {"/static/css/site.min.css?v={n}", 10, 24, 4},
    {"/static/css/print.css", 2, 3, 3},
    {"/static/js/app.{n}.bundle.js", 10, 180, 5},
    {"/static/js/vendor.js", 6, 320, 5},
    {"/static/js/analytics.js?id={n}", 4, 45, 6},
    {"/static/img/logo.svg", 8, 6, 3},
    {"/static/img/{w}-{n}.jpg", 20, 85, 8},
    {"/static/img/thumbs/{id}.webp", 14, 18, 6},
    {"/static/img/banner-{w}.png", 5, 140, 8},
    {"/static/fonts/source-sans-regular.woff2", 4, 40, 4},
    {"/favicon.ico", 4, 4, 2},
    {"/api/track?e=pageview&v={n}", 5, 0.1, 15},
};

constexpr MediaTemplate kMedia[] = {
    {"/media/audio/{w}-episode-{n}.mp3", RecordKind::kAudio},
    {"/radio/live.aac", RecordKind::kAudio},
    {"/media/video/{w}-{n}.mp4", RecordKind::kVideo},
    {"/hls/{w}/1080p/segment-{id}.ts", RecordKind::kVideo},
    {"/media/video/trailer-{id}.webm", RecordKind::kVideo},
};

// ipv4_prefix, ipv6_prefix, weight, rtt_ms, bandwidth_kbps
constexpr ClientNetwork kNetworks[] = {
    {"10.1.", "2001:db8:c1:", 40, 2, 100000},     // head office LAN
    {"10.20.", "2001:db8:c20:", 20, 35, 20000},   // branch offices over VPN
    {"172.16.", "2001:db8:dc:", 10, 1, 1000000},  // servers in the data centre
    {"192.168.", "2001:db8:f0:", 30, 60, 8000},   // home workers
};

// text, weight
constexpr UserAgent kUserAgents[] = {
    {"Mozilla/5.0 (Windows NT 10.0; Win64; x64) AppleWebKit/537.36 (KHTML, like Gecko) "
     "Chrome/120.0.0.0 Safari/537.36", 24},
    {"Mozilla/5.0 (Windows NT 10.0; Win64; x64) AppleWebKit/537.36 (KHTML, like Gecko) "
     "Chrome/119.0.0.0 Safari/537.36 Edg/119.0.2151.97", 12},
    {"Mozilla/5.0 (Macintosh; Intel Mac OS X 10_15_7) AppleWebKit/605.1.15 (KHTML, like Gecko) "
     "Version/17.1 Safari/605.1.15", 12},
    {"Mozilla/5.0 (X11; Linux x86_64; rv:120.0) Gecko/20100101 Firefox/120.0", 8},
    {"Mozilla/5.0 (iPhone; CPU iPhone OS 17_1 like Mac OS X) AppleWebKit/605.1.15 (KHTML, like "
     "Gecko) Version/17.1 Mobile/15E148 Safari/604.1", 16},
    {"Mozilla/5.0 (Linux; Android 14; Pixel 8) AppleWebKit/537.36 (KHTML, like Gecko) "
     "Chrome/120.0.6099.43 Mobile Safari/537.36", 14},
    {"Mozilla/5.0 (compatible; Googlebot/2.1; +http://www.google.com/bot.html)", 4},
    {"curl/7.88.1", 3},
    {"python-requests/2.31.0", 3},
    {"Mozilla/4.0 (compatible; MSIE 8.0; Windows NT 6.1; Trident/4.0)", 1},
    {"", 1},  // clients that send no User-Agent
};

constexpr std::string_view kExternalReferrers[] = {
    "https://www.search.example/search?q={w}",
    "https://social.example.com/feed",
    "https://mail.example.net/",
};

constexpr std::string_view kWords[] = {
    "laptops", "phones",  "garden",   "kitchen",  "books",    "music",   "travel",  "sports",
    "weather", "science", "health",   "budget",   "climate",  "football", "recipes", "cameras",
    "markets", "energy",  "elections", "startups", "festival", "housing", "bicycles", "coffee",
};
// clang-format on

}  // namespace

std::span<const SiteTemplate> KnownSites() {
  return kSites;
}
std::span<const PageTemplate> GenericPages() {
  return kGenericPages;
}
std::span<const std::string_view> GenericServers() {
  return kGenericServers;
}
std::span<const ObjectTemplate> EmbeddedObjects() {
  return kObjects;
}
std::span<const MediaTemplate> MediaStreams() {
  return kMedia;
}
std::span<const ClientNetwork> ClientNetworks() {
  return kNetworks;
}
std::span<const UserAgent> UserAgents() {
  return kUserAgents;
}
std::span<const std::string_view> ExternalReferrers() {
  return kExternalReferrers;
}
std::span<const std::string_view> Words() {
  return kWords;
}

}  // namespace sm3gen
