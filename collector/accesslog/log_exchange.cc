#include "collector/accesslog/log_exchange.h"

#include <arpa/inet.h>
#include <strings.h>

#include <algorithm>

namespace accesslog {
namespace {

struct Extension {
  std::string_view name;
  std::string_view content_type;
};

// Objects by extension; anything else is a page. Media get their family so views write them
// as <audio> and <video>.
constexpr Extension kObjects[] = {
    {"css", "text/css"},         {"js", "text/javascript"},
    {"mjs", "text/javascript"},  {"map", "application/json"},
    {"png", "image/png"},        {"jpg", "image/jpeg"},
    {"jpeg", "image/jpeg"},      {"gif", "image/gif"},
    {"svg", "image/svg+xml"},    {"ico", "image/x-icon"},
    {"webp", "image/webp"},      {"avif", "image/avif"},
    {"bmp", "image/bmp"},        {"tif", "image/tiff"},
    {"tiff", "image/tiff"},      {"woff", "font/woff"},
    {"woff2", "font/woff2"},     {"ttf", "font/ttf"},
    {"otf", "font/otf"},         {"eot", "application/vnd.ms-fontobject"},
    {"mp3", "audio/mpeg"},       {"ogg", "audio/ogg"},
    {"oga", "audio/ogg"},        {"wav", "audio/wav"},
    {"m4a", "audio/mp4"},        {"aac", "audio/aac"},
    {"flac", "audio/flac"},      {"opus", "audio/opus"},
    {"weba", "audio/webm"},      {"mp4", "video/mp4"},
    {"m4v", "video/mp4"},        {"webm", "video/webm"},
    {"ogv", "video/ogg"},        {"mov", "video/quicktime"},
    {"mkv", "video/x-matroska"}, {"avi", "video/x-msvideo"},
    {"ts", "video/mp2t"},        {"m3u8", "video/x-mpegurl"},
    {"mpd", "video/x-dash"},
};

int VersionMinor(std::string_view protocol) {
  // "HTTP/1.0" -> 0; anything else reads as HTTP/1.1.
  return protocol.size() == 8 && protocol.substr(0, 7) == "HTTP/1." && protocol[7] == '0' ? 0 : 1;
}

}  // namespace

std::string_view ContentTypeOf(std::string_view target) {
  std::string_view path = target.substr(0, target.find_first_of("?#"));
  path = path.substr(path.rfind('/') == std::string_view::npos ? 0 : path.rfind('/') + 1);
  const size_t dot = path.rfind('.');
  if (dot != std::string_view::npos) {
    const std::string_view extension = path.substr(dot + 1);
    for (const Extension& object : kObjects) {
      if (extension.size() == object.name.size() &&
          strncasecmp(extension.data(), object.name.data(), extension.size()) == 0) {
        return object.content_type;
      }
    }
  }
  return "text/html";
}

void ToExchange(const LogEntry& entry, const ServerSide& server, capture::HttpExchange* e) {
  *e = capture::HttpExchange{};
  capture::ConnectionInfo& c = e->connection;
  if (inet_pton(AF_INET, entry.client.c_str(), c.client.bytes.data()) != 1) {
    if (inet_pton(AF_INET6, entry.client.c_str(), c.client.bytes.data()) == 1) {
      c.client.v6 = true;
    } else {
      c.client = capture::IpAddress{};
      e->client_name = entry.client;
    }
  }
  c.client_port = entry.client_port;
  c.server = server.address;
  if (!entry.server_address.empty()) {
    capture::IpAddress logged;
    if (inet_pton(AF_INET, entry.server_address.c_str(), logged.bytes.data()) == 1) {
      c.server = logged;
    } else if (inet_pton(AF_INET6, entry.server_address.c_str(), logged.bytes.data()) == 1) {
      logged.v6 = true;
      c.server = logged;
    }
  }
  c.server_port = server.port;

  const int64_t total = std::max<int64_t>(entry.request_time_us, 0);
  const int64_t upstream = entry.upstream_time_us >= 0 ? entry.upstream_time_us : total;
  const int64_t start = entry.time_is_start ? entry.time_us : entry.time_us - total;
  e->start = start;
  e->request_last = start;
  e->response_first = start + std::min(upstream, total);
  e->response_last = start + total;
  e->response_bytes = entry.body_bytes;

  capture::HttpHead& request = e->request;
  request.method = entry.method;
  request.target = entry.target;
  request.host = entry.vhost.empty() ? server.host : entry.vhost;
  e->host_assumed = entry.vhost.empty();
  request.referer = entry.referer;
  request.user_agent = entry.user_agent;
  request.version_minor = VersionMinor(entry.protocol);
  capture::HttpHead& response = e->response;
  response.status = entry.status;
  response.version_minor = request.version_minor;
  response.content_type = ContentTypeOf(entry.target);
}

}  // namespace accesslog
