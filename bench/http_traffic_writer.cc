#include "bench/http_traffic_writer.h"

#include <fmt/format.h>

#include <algorithm>
#include <cstdint>
#include <memory>
#include <queue>
#include <random>
#include <set>
#include <string>
#include <string_view>
#include <vector>

namespace bench {
namespace {

using capture::Micros;
using capture::testing::BuildFrame;
using capture::testing::Frame;
using capture::testing::PcapWriter;
using capture::testing::Segment;
using capture::testing::TcpConversation;
using Totals = TrafficTotals;

constexpr uint64_t kSeed = kTrafficSeed;
constexpr int kConcurrentConnections = 400;
constexpr int kClients = 6000;
constexpr int kServers = 24;
constexpr uint32_t kMss = 1448;
constexpr Micros kStart = 1718100000LL * 1000000;  // 2024-06-11 10:00 UTC

enum class ObjectKind { kCss, kScript, kImage };

// One planned exchange on a connection.
struct Exchange {
  bool page = false;
  ObjectKind kind = ObjectKind::kCss;
  bool not_modified = false;
  bool chunked = false;
  size_t body_size = 0;
  std::string target;
};

// A client's keep-alive connection: a page, its objects, maybe another page, then a close.
struct Session {
  std::unique_ptr<TcpConversation> tcp;
  int client = 0;
  int server = 0;
  Micros rtt = 0;
  Micros next_time = 0;
  bool opened = false;
  std::vector<Exchange> plan;  // what is left to do, last first
  std::string page_url;        // Referer of the objects
};

// Writes HTTP traffic in time order. Each connection's next step (handshake and exchange, an
// exchange, or the close) produces segments with times at or after the step's start, so all
// pending segments older than the earliest next step can be written.
class TrafficWriter {
 public:
  TrafficWriter(PcapWriter* writer, uint64_t packet_target)
      : writer_(writer), target_(packet_target), random_(kSeed) {
    std::uniform_int_distribution<int> byte(0, 255);
    binary_.resize(256 * 1024);
    for (char& c : binary_) {
      c = static_cast<char>(byte(random_));
    }
    static constexpr const char* kWords[] = {
        "<div class=\"item\">",
        "<a href=\"/catalog/item?id=",
        "\">",
        "</a>",
        "</div>\n",
        "<p>Lorem ipsum dolor sit amet, consectetur adipiscing elit.</p>\n",
        "<li>",
        "</li>",
        "<span class=\"price\">",
        "</span>",
        "<img src=\"/img/thumb",
        ".png\" alt=\"\">\n"};
    while (text_.size() < 256 * 1024) {
      text_ += kWords[random_() % std::size(kWords)];
      text_ += std::to_string(random_() % 100000);
    }
  }

  Totals Run() {
    std::priority_queue<std::pair<Micros, int>, std::vector<std::pair<Micros, int>>, std::greater<>>
        ready;
    sessions_.resize(kConcurrentConnections);
    for (int i = 0; i < kConcurrentConnections; ++i) {
      StartSession(&sessions_[i], kStart + Uniform(0, 200000));
      ready.push({sessions_[i].next_time, i});
    }
    while (!ready.empty()) {
      const auto [time, index] = ready.top();
      ready.pop();
      WritePendingBefore(time);
      Session& session = sessions_[index];
      if (Step(&session)) {
        ready.push({session.next_time, index});
      } else if (busy_clients_.erase(session.client), generated_ < target_) {
        StartSession(&session, time + Uniform(1000, 50000));
        ready.push({session.next_time, index});
      }
    }
    WritePendingBefore(INT64_MAX);
    totals_.duration_us = static_cast<uint64_t>(last_time_ - kStart);
    return totals_;
  }

 private:
  struct Pending {
    Micros time;
    uint64_t order;  // keeps each connection's segments in the order they were sent
    Segment segment;
    bool operator>(const Pending& other) const {
      return time != other.time ? time > other.time : order > other.order;
    }
  };

  Micros Uniform(Micros low, Micros high) {
    return std::uniform_int_distribution<Micros>(low, high)(random_);
  }
  bool Chance(double p) { return std::uniform_real_distribution<double>(0, 1)(random_) < p; }

  static std::string ClientAddress(int client) {
    if (client % 10 == 9) {
      return fmt::format("2001:db8:{:x}::{:x}", client >> 8, client & 0xff);
    }
    return fmt::format("10.{}.{}.{}", client >> 16 & 0xff, client >> 8 & 0xff, client & 0xff);
  }
  static std::string ServerAddress(int server, bool v6) {
    return v6 ? fmt::format("2001:db8:ffff::{:x}", server + 1)
              : fmt::format("172.16.0.{}", server + 1);
  }
  static std::string Host(int server) { return fmt::format("www{}.shop.example", server); }

  void StartSession(Session* session, Micros time) {
    // One connection per client at a time: a second one would be a second browser tab, whose
    // page ends the first tab's view and leaves the rest of its objects without a page.
    do {
      session->client = static_cast<int>(random_() % kClients);
    } while (busy_clients_.count(session->client) != 0);
    busy_clients_.insert(session->client);
    session->server = static_cast<int>(random_() % kServers);
    const bool v6 = session->client % 10 == 9;
    const uint16_t port = static_cast<uint16_t>(32768 + next_port_++ % 28000);
    session->tcp = std::make_unique<TcpConversation>(
        ClientAddress(session->client), port, ServerAddress(session->server, v6), 80,
        static_cast<uint32_t>(random_()), static_cast<uint32_t>(random_()));
    session->tcp->set_mss(kMss);
    session->rtt = Uniform(2000, 90000);
    session->next_time = time;
    session->opened = false;
    session->plan.clear();
    const int pages = Chance(0.3) ? 2 : 1;
    for (int p = 0; p < pages; ++p) {
      PlanPage(session);
    }
    std::reverse(session->plan.begin(), session->plan.end());
  }

  void PlanPage(Session* session) {
    Exchange page;
    page.page = true;
    page.body_size = static_cast<size_t>(Uniform(10 * 1024, 60 * 1024));
    page.chunked = Chance(0.15);
    page.target = fmt::format("/catalog/section{}/page{}.html", random_() % 40, random_() % 500);
    session->plan.push_back(page);
    const int objects = static_cast<int>(Uniform(3, 12));
    for (int i = 0; i < objects; ++i) {
      Exchange object;
      const uint64_t pick = random_() % 100;
      object.kind = pick < 25   ? ObjectKind::kCss
                    : pick < 50 ? ObjectKind::kScript
                                : ObjectKind::kImage;
      object.not_modified = Chance(0.2);
      switch (object.kind) {
        case ObjectKind::kCss:
          object.body_size = static_cast<size_t>(Uniform(2 * 1024, 30 * 1024));
          object.target = fmt::format("/static/css/site{}.css", random_() % 30);
          break;
        case ObjectKind::kScript:
          object.body_size = static_cast<size_t>(Uniform(5 * 1024, 60 * 1024));
          object.chunked = Chance(0.3);
          object.target = fmt::format("/static/js/app{}.js?v={}", random_() % 30, random_() % 9);
          break;
        case ObjectKind::kImage:
          object.body_size = static_cast<size_t>(Uniform(1024, 50 * 1024));
          object.target = fmt::format("/img/product{}.png", random_() % 5000);
          break;
      }
      session->plan.push_back(object);
    }
  }

  // One step of the session at its next_time. False when the connection is closed.
  bool Step(Session* session) {
    TcpConversation& tcp = *session->tcp;
    Micros t = session->next_time;
    if (session->plan.empty() || generated_ >= target_) {
      if (!session->opened) {
        return false;  // started just before the target was reached: never seen on the wire
      }
      tcp.ClientFin(t);
      tcp.ServerFin(t + 60);
      tcp.ClientAck(t + session->rtt);
      Queue(&tcp);
      return false;
    }
    if (!session->opened) {
      tcp.Handshake(t, t + 40, t + session->rtt);
      t += session->rtt + 30;
      session->opened = true;
      ++totals_.connections;
    }
    const Exchange exchange = session->plan.back();
    session->plan.pop_back();
    if (exchange.page) {
      session->page_url = fmt::format("http://{}{}", Host(session->server), exchange.target);
    }
    tcp.ClientSends(Request(*session, exchange), t);
    t += exchange.page ? Uniform(5000, 150000) : Uniform(300, 20000);
    const std::string reply = Reply(exchange);
    // Server segments in bursts; the client ACKs every second one, an RTT later as seen here.
    int unacked = 0;
    for (size_t at = 0; at < reply.size(); at += kMss) {
      tcp.ServerSends(std::string_view(reply).substr(at, kMss), t);
      if (++unacked == 2) {
        tcp.ClientAck(t + session->rtt);
        unacked = 0;
      }
      t += (at / kMss) % 10 == 9 ? session->rtt / 2 : Uniform(12, 120);
    }
    t += session->rtt;
    if (unacked != 0) {
      tcp.ClientAck(t);  // the delayed ACK of the last odd segment
    }
    Queue(&tcp);
    ++totals_.exchanges;
    if (exchange.page) {
      ++totals_.pages;
    } else {
      ++totals_.objects;
    }
    totals_.not_modified += exchange.not_modified ? 1 : 0;
    totals_.chunked += exchange.chunked && !exchange.not_modified ? 1 : 0;
    const bool next_is_page = !session->plan.empty() && session->plan.back().page;
    session->next_time = t + (next_is_page ? Uniform(1000000, 8000000) : Uniform(100, 3000));
    return true;
  }

  std::string Request(const Session& session, const Exchange& exchange) const {
    std::string request = fmt::format(
        "GET {} HTTP/1.1\r\nHost: {}\r\n"
        "User-Agent: Mozilla/5.0 (X11; Linux x86_64; rv:115.0) Gecko/20100101 Firefox/115.0\r\n"
        "Accept: {}\r\nAccept-Language: en-US,en;q=0.5\r\nAccept-Encoding: gzip, deflate\r\n"
        "Connection: keep-alive\r\nCookie: session={:08x}{:08x}\r\n",
        exchange.target, Host(session.server),
        exchange.page ? "text/html,application/xhtml+xml,application/xml;q=0.9,*/*;q=0.8" : "*/*",
        session.client, session.client * 2654435761u);
    if (!exchange.page) {
      request += fmt::format("Referer: {}\r\n", session.page_url);
    }
    if (exchange.not_modified) {
      request +=
          "If-None-Match: \"5f3a-61b2c\"\r\n"
          "If-Modified-Since: Mon, 10 Jun 2024 08:00:00 GMT\r\n";
    }
    request += "\r\n";
    return request;
  }

  std::string Reply(const Exchange& exchange) {
    if (exchange.not_modified) {
      return "HTTP/1.1 304 Not Modified\r\nDate: Tue, 11 Jun 2024 10:00:00 GMT\r\n"
             "Server: nginx/1.22.1\r\nETag: \"5f3a-61b2c\"\r\nConnection: keep-alive\r\n\r\n";
    }
    const char* type = exchange.page                          ? "text/html; charset=utf-8"
                       : exchange.kind == ObjectKind::kCss    ? "text/css"
                       : exchange.kind == ObjectKind::kScript ? "application/javascript"
                                                              : "image/png";
    const std::string& source =
        exchange.page || exchange.kind != ObjectKind::kImage ? text_ : binary_;
    const size_t from = random_() % (source.size() - exchange.body_size);
    const std::string_view body = std::string_view(source).substr(from, exchange.body_size);
    std::string reply = fmt::format(
        "HTTP/1.1 200 OK\r\nDate: Tue, 11 Jun 2024 10:00:00 GMT\r\nServer: nginx/1.22.1\r\n"
        "Content-Type: {}\r\nConnection: keep-alive\r\nCache-Control: max-age=600\r\n"
        "ETag: \"5f3a-61b2c\"\r\n",
        type);
    if (!exchange.chunked) {
      reply += fmt::format("Content-Length: {}\r\n\r\n", body.size());
      reply += body;
      return reply;
    }
    reply += "Transfer-Encoding: chunked\r\n\r\n";
    for (size_t at = 0; at < body.size(); at += 8192) {
      const std::string_view chunk = body.substr(at, 8192);
      reply += fmt::format("{:x}\r\n", chunk.size());
      reply += chunk;
      reply += "\r\n";
    }
    reply += "0\r\n\r\n";
    return reply;
  }

  void Queue(TcpConversation* tcp) {
    for (Segment& segment : tcp->TakeSegments()) {
      const Micros time = segment.time;
      pending_.push(Pending{time, order_++, std::move(segment)});
      ++generated_;
    }
  }

  void WritePendingBefore(Micros time) {
    while (!pending_.empty() && pending_.top().time <= time) {
      const Frame frame = BuildFrame(pending_.top().segment);
      writer_->Write(frame);
      ++totals_.packets;
      totals_.bytes += frame.data.size();
      last_time_ = frame.time;
      pending_.pop();
    }
  }

  PcapWriter* const writer_;
  const uint64_t target_;
  std::mt19937_64 random_;
  std::string text_;    // html-like text that pages, style sheets and scripts are cut from
  std::string binary_;  // random bytes for images
  std::vector<Session> sessions_;
  std::set<int> busy_clients_;  // clients with a connection open
  std::priority_queue<Pending, std::vector<Pending>, std::greater<>> pending_;
  uint64_t order_ = 0;
  uint64_t generated_ = 0;  // segments queued so far
  uint32_t next_port_ = 0;
  Micros last_time_ = kStart;
  Totals totals_;
};

}  // namespace

TrafficTotals WriteHttpTraffic(PcapWriter* writer, uint64_t packet_target) {
  return TrafficWriter(writer, packet_target).Run();
}

}  // namespace bench
