// Throughput of sm3capture on a capture file, against tshark on the same file. The bench writes
// itself a pcap of realistic HTTP/1.1 (many clients on keep-alive connections: handshakes,
// pages of 10-60 KB, style sheets, scripts and images, some 304s and chunked replies, MSS-sized
// segments, delayed ACKs and FIN closes), then runs `sm3capture --read FILE --out OUT` several
// times pinned to one CPU and reports the median run: packets/s, Mbit/s of captured bytes,
// exchanges/s, wall and CPU seconds and peak resident memory. tshark's HTTP dissection
// (`-Y http -T fields -e http.time`) runs once on the same CPU for comparison. The records
// written must number the exchanges generated.
//
// The capture is kept in /tmp under a name made of its parameters, so later runs reuse it.
//
// Usage: bench_capture [--packets N] [--runs N] [--cpu N]

#include <fcntl.h>
#include <fmt/format.h>
#include <sched.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <map>
#include <memory>
#include <queue>
#include <random>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "collector/capture/testing/packet_builder.h"

namespace {

using capture::Micros;
using capture::testing::BuildFrame;
using capture::testing::Frame;
using capture::testing::PcapWriter;
using capture::testing::Segment;
using capture::testing::TcpConversation;

// Part of the cached file's name: change it whenever the traffic below changes.
constexpr int kTrafficVersion = 2;
constexpr uint64_t kSeed = 7031;
constexpr int kConcurrentConnections = 400;
constexpr int kClients = 6000;
constexpr int kServers = 24;
constexpr uint32_t kMss = 1448;
constexpr Micros kStart = 1718100000LL * 1000000;  // 2024-06-11 10:00 UTC

// What the generated capture holds; kept beside the file as "key value" lines.
struct Totals {
  uint64_t packets = 0;
  uint64_t bytes = 0;  // captured, link layer included
  uint64_t connections = 0;
  uint64_t exchanges = 0;
  uint64_t pages = 0;
  uint64_t objects = 0;
  uint64_t not_modified = 0;
  uint64_t chunked = 0;
  uint64_t duration_us = 0;  // from the first packet to the last

  std::map<std::string, uint64_t*> Fields() {
    return {{"packets", &packets},           {"bytes", &bytes},     {"connections", &connections},
            {"exchanges", &exchanges},       {"pages", &pages},     {"objects", &objects},
            {"not_modified", &not_modified}, {"chunked", &chunked}, {"duration_us", &duration_us}};
  }
};

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

bool ReadTotals(const std::string& path, Totals* totals) {
  std::ifstream in(path);
  std::map<std::string, uint64_t*> fields = totals->Fields();
  std::string key;
  uint64_t value = 0;
  size_t seen = 0;
  while (in >> key >> value) {
    if (auto it = fields.find(key); it != fields.end()) {
      *it->second = value;
      ++seen;
    }
  }
  return seen == fields.size();
}

// The capture for these parameters, generated unless an earlier run left it.
bool PrepareCapture(uint64_t packets, std::string* path, Totals* totals) {
  *path = fmt::format("/tmp/q7capbench_p{}_v{}_s{}.pcap", packets, kTrafficVersion, kSeed);
  const std::string info = *path + ".info";
  if (std::filesystem::exists(*path) && ReadTotals(info, totals)) {
    std::printf("reusing %s\n", path->c_str());
    return true;
  }
  std::printf("writing %s ...\n", path->c_str());
  std::fflush(stdout);
  const std::string temp = *path + ".tmp";
  std::string error;
  std::unique_ptr<PcapWriter> writer = PcapWriter::Open(temp, capture::testing::FileFormat::kPcap,
                                                        capture::testing::kLinkEthernet, &error);
  if (writer == nullptr) {
    std::fprintf(stderr, "bench_capture: %s\n", error.c_str());
    return false;
  }
  *totals = TrafficWriter(writer.get(), packets).Run();
  if (!writer->Close()) {
    std::fprintf(stderr, "bench_capture: %s: write failed\n", temp.c_str());
    return false;
  }
  std::filesystem::rename(temp, *path);
  // The info file last: its presence says the capture is complete.
  {
    std::ofstream out(info + ".tmp");
    for (const auto& [key, value] : totals->Fields()) {
      out << key << ' ' << *value << '\n';
    }
  }
  std::filesystem::rename(info + ".tmp", info);
  return true;
}

struct RunResult {
  bool ok = false;
  int exit_code = -1;
  double wall = 0;  // seconds
  double cpu = 0;   // user + system seconds
  long peak_rss_kb = 0;
};

double Seconds(const timeval& tv) {
  return tv.tv_sec + tv.tv_usec / 1e6;
}

// Runs argv pinned to cpu with stdout and stderr sent to the given files, and measures it.
RunResult RunPinned(const std::vector<std::string>& argv, int cpu, const std::string& out_path,
                    const std::string& err_path) {
  RunResult result;
  const auto start = std::chrono::steady_clock::now();
  const pid_t child = ::fork();
  if (child < 0) {
    return result;
  }
  if (child == 0) {
    cpu_set_t set;
    CPU_ZERO(&set);
    CPU_SET(cpu, &set);
    ::sched_setaffinity(0, sizeof(set), &set);
    const int out = ::open(out_path.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
    const int err = ::open(err_path.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
    if (out < 0 || err < 0) {
      ::_exit(126);
    }
    ::dup2(out, STDOUT_FILENO);
    ::dup2(err, STDERR_FILENO);
    std::vector<char*> args;
    for (const std::string& arg : argv) {
      args.push_back(const_cast<char*>(arg.c_str()));
    }
    args.push_back(nullptr);
    ::execv(args[0], args.data());
    ::_exit(127);
  }
  int status = 0;
  rusage usage{};
  if (::wait4(child, &status, 0, &usage) != child) {
    return result;
  }
  result.wall = std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
  result.cpu = Seconds(usage.ru_utime) + Seconds(usage.ru_stime);
  result.peak_rss_kb = usage.ru_maxrss;
  result.exit_code = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
  result.ok = result.exit_code == 0;
  return result;
}

std::string ReadFile(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  return std::string(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
}

// Lines of path that hold a record ("<tag>...") or, for tshark, any non-empty value.
uint64_t CountLines(const std::string& path, bool records_only) {
  std::FILE* file = std::fopen(path.c_str(), "r");
  if (file == nullptr) {
    return 0;
  }
  uint64_t count = 0;
  bool line_start = true;
  bool counted = false;
  char buffer[1 << 16];
  size_t n = 0;
  while ((n = std::fread(buffer, 1, sizeof(buffer), file)) > 0) {
    for (size_t i = 0; i < n; ++i) {
      const char c = buffer[i];
      if (c == '\n') {
        line_start = true;
        counted = false;
        continue;
      }
      if (!counted && (records_only ? line_start && c == '<' : true)) {
        ++count;
        counted = true;
      }
      line_start = false;
    }
  }
  std::fclose(file);
  return count;
}

// The value of "key=N" in sm3capture's summary line, or -1.
long long SummaryValue(const std::string& summary, const std::string& key) {
  const size_t at = summary.find(" " + key + "=");
  return at == std::string::npos ? -1 : std::atoll(summary.c_str() + at + key.size() + 2);
}

std::string SummaryLine(const std::string& stderr_text) {
  const size_t at = stderr_text.rfind("sm3capture: packets=");
  if (at == std::string::npos) {
    return "";
  }
  return stderr_text.substr(at, stderr_text.find('\n', at) - at);
}

void PrintRow(const char* tool, const RunResult& run, const Totals& totals) {
  std::printf("%-12s %9.3f %9.3f %12.0f %9.1f %12.0f %12.1f\n", tool, run.wall, run.cpu,
              totals.packets / run.wall, totals.bytes * 8 / run.wall / 1e6,
              totals.exchanges / run.wall, run.peak_rss_kb / 1024.0);
}

int ChooseCpu(int wanted) {
  cpu_set_t set;
  CPU_ZERO(&set);
  if (::sched_getaffinity(0, sizeof(set), &set) != 0) {
    return 0;
  }
  if (wanted >= 0 && CPU_ISSET(wanted, &set)) {
    return wanted;
  }
  for (int cpu = 0; cpu < CPU_SETSIZE; ++cpu) {
    if (CPU_ISSET(cpu, &set)) {
      return cpu;
    }
  }
  return 0;
}

}  // namespace

int main(int argc, char** argv) {
  uint64_t packets = 1000000;
  int runs = 3;
  int cpu = 0;
  for (int i = 1; i < argc; ++i) {
    if (std::strcmp(argv[i], "--packets") == 0 && i + 1 < argc) {
      packets = std::strtoull(argv[++i], nullptr, 10);
    } else if (std::strcmp(argv[i], "--runs") == 0 && i + 1 < argc) {
      runs = std::atoi(argv[++i]);
    } else if (std::strcmp(argv[i], "--cpu") == 0 && i + 1 < argc) {
      cpu = std::atoi(argv[++i]);
    } else {
      std::fprintf(stderr, "usage: %s [--packets N] [--runs N] [--cpu N]\n", argv[0]);
      return 2;
    }
  }
  if (packets == 0 || runs <= 0) {
    std::fprintf(stderr, "bench_capture: --packets and --runs must be positive\n");
    return 2;
  }
  cpu = ChooseCpu(cpu);

  std::string capture_path;
  Totals totals;
  if (!PrepareCapture(packets, &capture_path, &totals)) {
    return 1;
  }
  std::printf(
      "capture: %llu packets, %.1f MB captured, %.1f s of traffic, %llu connections, "
      "%llu exchanges (%llu pages, %llu objects; %llu 304s, %llu chunked), "
      "%.1f packets per exchange\n",
      static_cast<unsigned long long>(totals.packets), totals.bytes / 1e6, totals.duration_us / 1e6,
      static_cast<unsigned long long>(totals.connections),
      static_cast<unsigned long long>(totals.exchanges),
      static_cast<unsigned long long>(totals.pages),
      static_cast<unsigned long long>(totals.objects),
      static_cast<unsigned long long>(totals.not_modified),
      static_cast<unsigned long long>(totals.chunked),
      static_cast<double>(totals.packets) / std::max<uint64_t>(totals.exchanges, 1));
  std::printf("every run pinned to CPU %d\n\n", cpu);
  std::fflush(stdout);

  const std::string work = fmt::format("/tmp/q7capbench_run_{}", ::getpid());
  const std::string out = work + ".sm3";
  const std::string err = work + ".err";
  std::vector<RunResult> results;
  for (int run = 0; run < runs; ++run) {
    RunResult result =
        RunPinned({SM3CAPTURE_PATH, "--read", capture_path, "--out", out}, cpu, "/dev/null", err);
    if (!result.ok) {
      std::fprintf(stderr, "bench_capture: sm3capture exited with %d:\n%s\n", result.exit_code,
                   ReadFile(err).c_str());
      return 1;
    }
    results.push_back(result);
  }
  std::vector<RunResult> by_wall = results;
  std::sort(by_wall.begin(), by_wall.end(),
            [](const RunResult& a, const RunResult& b) { return a.wall < b.wall; });
  const RunResult median = by_wall[by_wall.size() / 2];
  const std::string summary = SummaryLine(ReadFile(err));
  const uint64_t records = CountLines(out, true);

  RunResult tshark;
  uint64_t tshark_values = 0;
  const bool have_tshark = ::access("/usr/bin/tshark", X_OK) == 0;
  if (have_tshark) {
    std::printf("tshark: one run, this takes a while ...\n\n");
    std::fflush(stdout);
    const std::string tshark_out = work + ".tshark";
    tshark = RunPinned({"/usr/bin/tshark", "-n", "-r", capture_path, "-Y", "http", "-T", "fields",
                        "-e", "http.time"},
                       cpu, tshark_out, err);
    tshark_values = CountLines(tshark_out, false);
    std::remove(tshark_out.c_str());
  }

  std::printf("%-12s %9s %9s %12s %9s %12s %12s\n", "", "wall s", "cpu s", "packets/s", "Mbit/s",
              "exchanges/s", "peak RSS MB");
  PrintRow("sm3capture", median, totals);
  if (have_tshark && tshark.ok) {
    PrintRow("tshark", tshark, totals);
  }
  std::printf("\nsm3capture wall seconds of the %d runs:", runs);
  for (const RunResult& r : results) {
    std::printf(" %.3f", r.wall);
  }
  std::printf(" (median shown)\n");
  if (!have_tshark) {
    std::printf("tshark is not installed: no comparison\n");
  } else if (!tshark.ok) {
    std::printf("tshark exited with %d: no comparison\n", tshark.exit_code);
  } else {
    std::printf(
        "tshark / sm3capture: %.1fx the wall time, %.1fx the CPU time; tshark matched "
        "%llu replies (http.time values)\n",
        tshark.wall / median.wall, tshark.cpu / median.cpu,
        static_cast<unsigned long long>(tshark_values));
  }
  std::printf("sm3capture: %s\n", summary.empty() ? "(no summary line on stderr)"
                                                  : summary.c_str() + std::strlen("sm3capture: "));
  const bool match = records == totals.exchanges;
  std::printf("records written: %llu, exchanges generated: %llu, summary exchanges=%lld: %s\n",
              static_cast<unsigned long long>(records),
              static_cast<unsigned long long>(totals.exchanges), SummaryValue(summary, "exchanges"),
              match ? "ok" : "MISMATCH");
  std::remove(out.c_str());
  std::remove(err.c_str());
  return match ? 0 : 1;
}
