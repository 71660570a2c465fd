#include "collector/capture/page_assembler.h"

#include <strings.h>

#include <algorithm>
#include <cctype>

namespace capture {
namespace {

// A view keeps at most this many objects, and a client this many waiting replies: beyond
// them the oldest is written as it is rather than held without bound.
constexpr size_t kMaxObjectsPerView = 4096;
constexpr size_t kMaxWaitingPerClient = 256;

bool StartsWithNoCase(std::string_view text, std::string_view prefix) {
  return text.size() >= prefix.size() &&
         strncasecmp(text.data(), prefix.data(), prefix.size()) == 0;
}

bool IsPage(std::string_view content_type) {
  return StartsWithNoCase(content_type, "text/html") ||
         StartsWithNoCase(content_type, "application/xhtml+xml");
}

sm3gen::RecordKind ObjectKind(std::string_view content_type) {
  if (StartsWithNoCase(content_type, "audio/")) {
    return sm3gen::RecordKind::kAudio;
  }
  if (StartsWithNoCase(content_type, "video/")) {
    return sm3gen::RecordKind::kVideo;
  }
  return sm3gen::RecordKind::kObject;
}

// authority in lower case without the scheme's default port.
std::string NormaliseAuthority(std::string_view authority, std::string_view default_port) {
  std::string out(authority);
  std::transform(out.begin(), out.end(), out.begin(),
                 [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
  const std::string suffix = ":" + std::string(default_port);
  if (out.size() > suffix.size() &&
      out.compare(out.size() - suffix.size(), suffix.size(), suffix) == 0) {
    out.resize(out.size() - suffix.size());
  }
  return out;
}

std::string_view WithoutFragment(std::string_view text) {
  return text.substr(0, text.find('#'));
}

}  // namespace

std::string NormaliseUrl(std::string_view url) {
  std::string_view default_port = "80";
  if (StartsWithNoCase(url, "http://")) {
    url.remove_prefix(7);
  } else if (StartsWithNoCase(url, "https://")) {
    url.remove_prefix(8);
    default_port = "443";
  } else if (url.substr(0, 2) == "//") {
    url.remove_prefix(2);
  }
  const size_t slash = url.find_first_of("/?#");
  const std::string_view authority = url.substr(0, slash);
  std::string_view rest = slash == std::string_view::npos ? std::string_view() : url.substr(slash);
  rest = WithoutFragment(rest);
  std::string out = NormaliseAuthority(authority, default_port);
  if (rest.empty() || rest.front() != '/') {
    out.push_back('/');
  }
  out.append(rest);
  return out;
}

std::string RequestKey(const HttpExchange& exchange) {
  const UrlParts url = SplitTarget(exchange.request.target);
  std::string authority = exchange.request.host;
  if (authority.empty()) {
    authority = std::string(url.host_from_target);
  }
  if (authority.empty()) {
    char text[64];
    FormatAddress(exchange.connection.server, text, sizeof(text));
    authority = exchange.connection.server.v6 ? "[" + std::string(text) + "]" : text;
    authority += ":" + std::to_string(exchange.connection.server_port);
  }
  std::string out = NormaliseAuthority(authority, "80");
  std::string_view rest = WithoutFragment(url.origin);
  if (rest.empty() || rest.front() != '/') {
    out.push_back('/');
  }
  out.append(rest);
  return out;
}

size_t PageAssembler::AddressHash::operator()(const IpAddress& address) const {
  size_t h = 1469598103934665603ull;
  for (size_t i = 0; i < (address.v6 ? 16u : 4u); ++i) {
    h = (h ^ address.bytes[i]) * 1099511628211ull;
  }
  return h;
}

PageAssembler::PageAssembler(RecordBuilder* builder, RecordSink* sink, CaptureStats* stats)
    : builder_(builder), sink_(sink), stats_(stats) {}

PageAssembler::~PageAssembler() = default;

PageAssembler::Item PageAssembler::MakeItem(const HttpExchange& exchange) const {
  Item item;
  item.exchange = exchange;
  item.key = RequestKey(exchange);
  item.hostless =
      exchange.host_assumed || (exchange.request.host.empty() &&
                                SplitTarget(exchange.request.target).host_from_target.empty());
  if (!exchange.request.referer.empty()) {
    item.referer_key = NormaliseUrl(exchange.request.referer);
  }
  item.kind = IsPage(exchange.response.content_type) ? sm3gen::RecordKind::kPage
                                                     : ObjectKind(exchange.response.content_type);
  return item;
}

bool PageAssembler::Due(const View& view, Micros now) const {
  return now - view.page.exchange.start > kViewSpan || now - view.last_end > kQuietClose;
}

bool PageAssembler::Claims(const View& view, const Item& item) const {
  if (item.referer_key.empty() || item.exchange.start - view.page.exchange.start > kViewSpan) {
    return false;
  }
  // A URL known without its host matches a Referer by what follows the Referer's host.
  const std::string_view referer_path =
      std::string_view(item.referer_key).substr(item.referer_key.find('/'));
  const auto named = [&](const Item& target) {
    if (!target.hostless) {
      return target.key == item.referer_key;
    }
    return std::string_view(target.key).substr(target.key.find('/')) == referer_path;
  };
  return named(view.page) || std::any_of(view.objects.begin(), view.objects.end(), named);
}

void PageAssembler::Attach(View* view, Item&& item) {
  view->last_end = std::max(view->last_end, item.exchange.response_last);
  view->objects.push_back(std::move(item));
}

void PageAssembler::ClaimWaiting(Client* client) {
  // Repeat while something joins: an image may name a style sheet that only now joined.
  bool claimed = true;
  while (claimed && !client->waiting.empty()) {
    claimed = false;
    for (auto it = client->waiting.begin(); it != client->waiting.end();) {
      if (client->view.objects.size() < kMaxObjectsPerView && Claims(client->view, *it)) {
        Attach(&client->view, std::move(*it));
        it = client->waiting.erase(it);
        claimed = true;
      } else {
        ++it;
      }
    }
  }
}

void PageAssembler::OnExchange(const HttpExchange& exchange) {
  now_ = std::max(now_, exchange.response_last);
  Item item = MakeItem(exchange);
  Client& client = clients_[exchange.connection.client];
  if (client.has_view && Due(client.view, now_)) {
    WriteView(&client);
  }
  if (item.kind == sm3gen::RecordKind::kPage) {
    if (client.has_view) {
      WriteView(&client);  // the client's next page ends the view before it
    }
    client.has_view = true;
    client.view.page = std::move(item);
    client.view.objects.clear();
    client.view.last_end = client.view.page.exchange.response_last;
    ClaimWaiting(&client);
  } else if (client.has_view && client.view.objects.size() < kMaxObjectsPerView &&
             Claims(client.view, item)) {
    Attach(&client.view, std::move(item));
  } else if (!item.referer_key.empty()) {
    if (client.waiting.size() >= kMaxWaitingPerClient) {
      WriteAlone(client.waiting.front(), /*orphan=*/true);
      client.waiting.pop_front();
    }
    client.waiting.push_back(std::move(item));
  } else {
    WriteAlone(item, /*orphan=*/false);
  }
  Advance(now_);
}

void PageAssembler::Advance(Micros now) {
  now_ = std::max(now_, now);
  // Looking through every client costs; once a second of capture time is soon enough.
  if (now_ - last_advance_ < 1000000 && now_ >= last_advance_) {
    return;
  }
  last_advance_ = now_;
  // Due views are written oldest page first, so the output does not depend on hash order.
  std::vector<std::pair<Micros, Client*>> due;
  for (auto it = clients_.begin(); it != clients_.end();) {
    Client& client = it->second;
    while (!client.waiting.empty() && now_ - client.waiting.front().exchange.start > kViewSpan) {
      WriteAlone(client.waiting.front(), /*orphan=*/true);
      client.waiting.pop_front();
    }
    if (client.has_view && Due(client.view, now_)) {
      due.emplace_back(client.view.page.exchange.start, &client);
    }
    if (!client.has_view && client.waiting.empty()) {
      it = clients_.erase(it);
    } else {
      ++it;
    }
  }
  std::sort(due.begin(), due.end(), [](const auto& a, const auto& b) { return a.first < b.first; });
  for (const auto& entry : due) {
    WriteView(entry.second);
  }
}

void PageAssembler::Flush() {
  std::vector<std::pair<Micros, Client*>> open;
  for (auto& entry : clients_) {
    if (entry.second.has_view) {
      open.emplace_back(entry.second.view.page.exchange.start, &entry.second);
    }
  }
  std::sort(open.begin(), open.end(),
            [](const auto& a, const auto& b) { return a.first < b.first; });
  for (const auto& entry : open) {
    WriteView(entry.second);
  }
  for (auto& entry : clients_) {
    for (const Item& item : entry.second.waiting) {
      WriteAlone(item, /*orphan=*/true);
    }
  }
  clients_.clear();
}

uint64_t PageAssembler::OldestHeld() const {
  uint64_t oldest = UINT64_MAX;
  for (const auto& entry : clients_) {
    const Client& client = entry.second;
    if (client.has_view) {
      oldest = std::min(oldest, client.view.page.exchange.sequence);
      for (const Item& object : client.view.objects) {
        oldest = std::min(oldest, object.exchange.sequence);
      }
    }
    for (const Item& item : client.waiting) {
      oldest = std::min(oldest, item.exchange.sequence);
    }
  }
  return oldest;
}

void PageAssembler::WriteView(Client* client) {
  View& view = client->view;
  PageFigures figures;
  Micros last_object_end = 0;
  for (const Item& object : view.objects) {
    last_object_end = std::max(last_object_end, object.exchange.response_last);
    figures.object_bytes += static_cast<int64_t>(object.exchange.response_bytes);
    if (object.exchange.response.status == 304) {
      ++figures.header_requests;
    }
  }
  figures.object_count = static_cast<int32_t>(view.objects.size());
  if (!view.objects.empty()) {
    figures.load = std::max<Micros>(0, last_object_end - view.page.exchange.response_last);
  }
  Write(view.page.exchange, sm3gen::RecordKind::kPage, figures);
  ++stats_->pages;
  for (const Item& object : view.objects) {
    Write(object.exchange, object.kind, PageFigures{});
    ++stats_->objects;
  }
  client->has_view = false;
  view.objects.clear();
}

void PageAssembler::WriteAlone(const Item& item, bool orphan) {
  Write(item.exchange, sm3gen::RecordKind::kPage, PageFigures{});
  ++stats_->pages;
  if (orphan) {
    ++stats_->orphan_objects;
  }
}

void PageAssembler::Write(const HttpExchange& exchange, sm3gen::RecordKind kind,
                          const PageFigures& figures) {
  ++stats_->exchanges;
  sink_->Write(builder_->Build(exchange, kind, figures));
}

}  // namespace capture
