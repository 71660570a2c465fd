// q7load: the agent under load as an operator runs it. A real q7agent ingests a live data file
// that this program appends to at --rate records per second (rolling it as the collector does),
// while --clients clients sample its tables and events over the HTTP API, --requests requests in
// all spread over --seconds, and one more client holds the events stream open. Afterwards it
// says whether every request succeeded, the longest time ingestion made no progress while
// records were waiting, how the agent's resident memory moved after the first minute, and
// whether every record appended was processed.
//
// The records are a pool made once by sm3gen and replayed in a loop, each stamped with the
// time it is appended, so the agent sees live traffic; rolled files are removed once the agent
// reads a later one, so a long run needs little disk.
//
// With --alert-every N (seconds) it also starts five alerting situations sampled every N
// seconds, whose webhook is a receiver that takes each POST and never answers, and says whether
// the sampler kept its pace and what became of the alert changes: alerting, and a receiver that
// hangs, must cost ingestion nothing.
//
// Usage: q7load [--rate N] [--seconds N] [--clients N] [--requests N] [--interval-minutes N]
//               [--alert-every N]
// Exit status: 0 when every check holds, 1 when one fails, 2 on a bad command line.

#include <dirent.h>
#include <httplib.h>
#include <signal.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <map>
#include <memory>
#include <mutex>
#include <nlohmann/json.hpp>
#include <random>
#include <sstream>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "bench/race_agent.h"
#include "collector/common/live_file.h"
#include "tests/agent_process.h"

namespace {

using Clock = std::chrono::steady_clock;
using namespace std::chrono_literals;

struct Options {
  double rate = 200000;
  int seconds = 120;
  int clients = 20;
  int requests = 1000;
  int intervalMinutes = 0;  // 0: the agent's default
  int alertEvery = 0;       // seconds between alert samples; 0: no alerting situations
  int64_t pool = 400000;    // records generated once and replayed
};

double SecondsSince(Clock::time_point from) {
  return std::chrono::duration<double>(Clock::now() - from).count();
}

// The pool of records, each with where its time fields start: "^EPOCH^YYYY-MM-DD^HH:MM:SS^"
// are fields 5 to 7 after the tag, the same width in every record.
class RecordPool {
 public:
  bool Load(const std::string& path, std::string* error) {
    std::ifstream in(path, std::ios::binary);
    text_.assign(std::istreambuf_iterator<char>(in), {});
    for (size_t at = 0; at < text_.size();) {
      const size_t end = text_.find('\n', at);
      if (end == std::string::npos) {
        break;
      }
      size_t field = at;
      for (int i = 0; i < 5 && field != std::string::npos; ++i) {
        field = text_.find('^', field + 1);
      }
      if (field == std::string::npos || field + 1 + kStampBytes > end) {
        *error = "a record without its time fields at byte " + std::to_string(at);
        return false;
      }
      records_.push_back({at, end + 1 - at, field + 1 - at});
      at = end + 1;
    }
    if (records_.empty()) {
      *error = "no records in " + path;
      return false;
    }
    return true;
  }
  size_t size() const { return records_.size(); }
  double averageBytes() const { return static_cast<double>(text_.size()) / records_.size(); }
  // Record i of the pool, stamped with stamp ("EPOCH^YYYY-MM-DD^HH:MM:SS") in place.
  std::string_view Stamped(size_t i, std::string_view stamp) {
    const Record& r = records_[i];
    std::memcpy(text_.data() + r.at + r.stampAt, stamp.data(), kStampBytes);
    return std::string_view(text_).substr(r.at, r.bytes);
  }
  static std::string Stamp(time_t t) {
    char text[40];
    tm utc{};
    gmtime_r(&t, &utc);
    std::snprintf(text, sizeof(text), "%lld^", static_cast<long long>(t));
    std::strftime(text + std::strlen(text), sizeof(text) - std::strlen(text), "%Y-%m-%d^%H:%M:%S",
                  &utc);
    return text;
  }

 private:
  static constexpr size_t kStampBytes = 10 + 1 + 10 + 1 + 8;
  struct Record {
    size_t at, bytes, stampAt;
  };
  std::string text_;
  std::vector<Record> records_;
};

// What the agent says about its intake, polled by the watcher.
struct AgentState {
  int64_t taken = 0;
  int64_t processed = 0;  // processed and ignored
  int64_t queueDepth = 0;
  std::string file;
  nlohmann::json counters;
};

bool ReadAgent(httplib::Client& client, AgentState* state) {
  const auto res = client.Get("/api/v1/agent");
  if (!res || res->status != 200) {
    return false;
  }
  const nlohmann::json body = nlohmann::json::parse(res->body, nullptr, false);
  if (!body.is_object() || !body.contains("counters")) {
    return false;
  }
  state->counters = body["counters"];
  state->taken = state->counters.value("transactions_taken", int64_t{0});
  state->processed = state->counters.value("transactions_processed", int64_t{0}) +
                     state->counters.value("transactions_ignored", int64_t{0});
  state->queueDepth = state->counters.value("queue_depth", int64_t{0});
  state->file = state->counters.value("file", std::string());
  return true;
}

long long ResidentKiB(pid_t pid) {
  std::ifstream status("/proc/" + std::to_string(pid) + "/status");
  for (std::string line; std::getline(status, line);) {
    if (line.rfind("VmRSS:", 0) == 0) {
      return std::atoll(line.c_str() + 6);
    }
  }
  return -1;
}

// The rolled file's number (<stem>-NNNN.sm3), -1 for the live file or another name.
long RolledNumber(const std::string& name) {
  const size_t dash = name.rfind('-');
  if (dash == std::string::npos || name.size() < 4 || name.substr(name.size() - 4) != ".sm3") {
    return -1;
  }
  return std::atol(name.c_str() + dash + 1);
}

// Appends pool records to the live file at the rate, each stamped with the current second.
class Feeder {
 public:
  Feeder(RecordPool& pool, const std::string& dir, double rate)
      : pool_(pool), dir_(dir), rate_(rate) {}

  void Run(const std::atomic<bool>& stop) {
    collector::LiveFile live({dir_, "traffic", 256ull << 20, 0});
    std::string error;
    if (!live.Open(Clock::now(), &error)) {
      std::fprintf(stderr, "feeder: %s\n", error.c_str());
      failed_ = true;
      return;
    }
    const auto began = Clock::now();
    size_t next = 0;
    while (!stop.load()) {
      const auto now = Clock::now();
      const int64_t due =
          static_cast<int64_t>(rate_ * std::chrono::duration<double>(now - began).count());
      const std::string stamp = RecordPool::Stamp(time(nullptr));
      int64_t written = written_.load();
      for (; written < due && !stop.load(std::memory_order_relaxed); ++written) {
        const std::string_view record = pool_.Stamped(next, stamp);
        next = (next + 1) % pool_.size();
        if (!live.Append(record, now, &error)) {
          std::fprintf(stderr, "feeder: %s\n", error.c_str());
          failed_ = true;
          return;
        }
      }
      if (!live.Flush(&error)) {
        std::fprintf(stderr, "feeder: %s\n", error.c_str());
        failed_ = true;
        return;
      }
      written_.store(written);
      std::this_thread::sleep_for(5ms);
    }
  }

  // Removes rolled files numbered below the one the agent reads (when it reads a rolled one)
  // or all of them but the newest (when it reads the live file).
  void RemoveRead(const std::string& reading) {
    const long current = RolledNumber(std::filesystem::path(reading).filename());
    long newest = -1;
    std::vector<std::pair<long, std::string>> rolled;
    for (const auto& entry : std::filesystem::directory_iterator(dir_)) {
      const long n = RolledNumber(entry.path().filename());
      if (n >= 0) {
        rolled.emplace_back(n, entry.path());
        newest = std::max(newest, n);
      }
    }
    for (const auto& [n, path] : rolled) {
      if (current >= 0 ? n < current : n < newest) {
        std::filesystem::remove(path);
      }
    }
  }

  int64_t written() const { return written_.load(); }
  bool failed() const { return failed_.load(); }

 private:
  RecordPool& pool_;  // its stamps are rewritten as records are appended
  const std::string dir_;
  const double rate_;
  std::atomic<int64_t> written_{0};
  std::atomic<bool> failed_{false};
};

// Request outcomes of all clients.
class Outcomes {
 public:
  void Add(const std::string& what, double millis, const std::string& failure) {
    std::lock_guard<std::mutex> lock(mutex_);
    millis_.push_back(millis);
    slowest_.emplace_back(millis, what);
    std::sort(slowest_.rbegin(), slowest_.rend());
    if (slowest_.size() > 5) {
      slowest_.pop_back();
    }
    if (!failure.empty()) {
      failures_.push_back(what + ": " + failure);
    }
  }
  void Report(int* requests, int* failed) {
    std::lock_guard<std::mutex> lock(mutex_);
    std::sort(millis_.begin(), millis_.end());
    const auto at = [this](double q) {
      return millis_.empty()
                 ? 0.0
                 : millis_[std::min(millis_.size() - 1, static_cast<size_t>(q * millis_.size()))];
    };
    std::printf("requests: %zu, failed %zu; latency median %.1f ms, p99 %.1f ms, max %.1f ms\n",
                millis_.size(), failures_.size(), at(0.5), at(0.99),
                millis_.empty() ? 0.0 : millis_.back());
    for (const auto& [ms, what] : slowest_) {
      std::printf("  slow: %.1f ms %s\n", ms, what.c_str());
    }
    for (size_t i = 0; i < failures_.size() && i < 10; ++i) {
      std::printf("  failed: %s\n", failures_[i].c_str());
    }
    *requests = static_cast<int>(millis_.size());
    *failed = static_cast<int>(failures_.size());
  }

 private:
  std::mutex mutex_;
  std::vector<double> millis_;
  std::vector<std::string> failures_;
  std::vector<std::pair<double, std::string>> slowest_;  // the five slowest, slowest first
};

// One sampling client: a request every period, starting at a random point of the first one.
// As a dashboard asks: mostly a page of a table (?limit=1000), some whole samples of the
// application, agent and pattern tables, some of the recent events. Whole samples of the
// per-URL tables are hundreds of megabytes of JSON at this traffic, which no dashboard asks for.
void Sample(const std::string& address, const std::vector<std::string>& tables, double period,
            unsigned seed, const std::atomic<bool>& stop, Outcomes* outcomes) {
  httplib::Client client("http://" + address);
  client.set_connection_timeout(5);
  client.set_read_timeout(30);
  std::vector<std::string> small;
  for (const std::string& table : tables) {
    if (table.find("APP") != std::string::npos || table.find("AGNT") != std::string::npos ||
        table.find("PTNS") != std::string::npos) {
      small.push_back(table);
    }
  }
  std::mt19937 random(seed);
  std::uniform_real_distribution<double> unit(0, 1);
  auto next = Clock::now() + std::chrono::duration_cast<Clock::duration>(
                                 std::chrono::duration<double>(period * unit(random)));
  while (!stop.load()) {
    std::this_thread::sleep_until(next);
    if (stop.load()) {
      break;
    }
    next += std::chrono::duration_cast<Clock::duration>(std::chrono::duration<double>(period));
    const double pick = unit(random);
    std::string path;
    const char* key = "rows";
    if (pick < 0.1) {
      path = "/api/v1/events?limit=100";
      key = "events";
    } else if (pick < 0.25) {
      path = "/api/v1/tables/" + small[random() % small.size()];
    } else {
      path = "/api/v1/tables/" + tables[random() % tables.size()] + "?limit=1000";
    }
    const auto began = Clock::now();
    const auto res = client.Get(path.c_str());
    const double millis = SecondsSince(began) * 1e3;
    std::string failure;
    if (!res) {
      failure = httplib::to_string(res.error());
    } else if (res->status != 200) {
      failure = "HTTP " + std::to_string(res->status) + " " + res->body.substr(0, 200);
    } else {
      const nlohmann::json body = nlohmann::json::parse(res->body, nullptr, false);
      if (!body.is_object() || !body.contains(key)) {
        failure = "not a sample: " + res->body.substr(0, 200);
      }
    }
    outcomes->Add(path, millis, failure);
  }
}

bool ParseOptions(int argc, char** argv, Options* o) {
  for (int i = 1; i + 1 < argc; i += 2) {
    const std::string flag = argv[i];
    const double value = std::atof(argv[i + 1]);
    if (flag == "--rate") {
      o->rate = value;
    } else if (flag == "--seconds") {
      o->seconds = static_cast<int>(value);
    } else if (flag == "--clients") {
      o->clients = static_cast<int>(value);
    } else if (flag == "--requests") {
      o->requests = static_cast<int>(value);
    } else if (flag == "--interval-minutes") {
      o->intervalMinutes = static_cast<int>(value);
    } else if (flag == "--alert-every") {
      o->alertEvery = static_cast<int>(value);
    } else {
      return false;
    }
  }
  return argc % 2 == 1 && o->rate > 0 && o->seconds >= 10 && o->clients > 0 &&
         o->requests >= o->clients && o->intervalMinutes >= 0 && o->alertEvery >= 0;
}

// A webhook receiver that takes each POST and holds it without an answer until Release: the
// receiver that hangs, whose deliveries must wait without holding anything else up.
class HangingReceiver {
 public:
  HangingReceiver() {
    server_.Post("/hook", [this](const httplib::Request&, httplib::Response& res) {
      held_.fetch_add(1);
      std::unique_lock<std::mutex> lock(mutex_);
      released_cv_.wait(lock, [this] { return released_; });
      res.status = 204;
    });
    port_ = server_.bind_to_any_port("127.0.0.1");
    thread_ = std::thread([this] { server_.listen_after_bind(); });
  }
  ~HangingReceiver() {
    Release();
    server_.stop();
    thread_.join();
  }
  HangingReceiver(const HangingReceiver&) = delete;
  HangingReceiver& operator=(const HangingReceiver&) = delete;

  std::string url() const { return "http://127.0.0.1:" + std::to_string(port_) + "/hook"; }
  long held() const { return held_.load(); }
  void Release() {
    {
      std::lock_guard<std::mutex> lock(mutex_);
      released_ = true;
    }
    released_cv_.notify_all();
  }

 private:
  httplib::Server server_;
  int port_ = 0;
  std::thread thread_;
  std::atomic<long> held_{0};
  std::mutex mutex_;
  std::condition_variable released_cv_;
  bool released_ = false;  // guarded by mutex_
};

// What an operator would alert on: the example situations' conditions on the application
// tables, and two on the large per-transaction and per-server tables, one of which matches
// every application so that changes (and webhook calls) happen at all.
struct AlertSituation {
  const char* name;
  const char* table;
  const char* conditions;
};
constexpr AlertSituation kAlertSituations[] = {
    {"LoadAvailability", "Q7APPSM",
     R"([{"column": "pcavail", "op": "LT", "value": "95000"},
         {"column": "totreq", "op": "GE", "value": "20"}])"},
    {"LoadSlow", "Q7APPCS", R"([{"column": "pcslow", "op": "GT", "value": "20000"}])"},
    {"LoadEveryApplication", "Q7APPSM", R"([{"column": "totreq", "op": "GE", "value": "1"}])"},
    {"LoadTransactionFailures", "Q7TXSM",
     R"([{"column": "pcfail", "op": "GT", "value": "50000"},
         {"column": "totreq", "op": "GE", "value": "10"}])"},
    {"LoadServerTime", "Q7SRVSM", R"([{"column": "oatime", "op": "GT", "value": "2000"}])"},
};

// Starts the alerting situations; false (having said why) when the agent refuses one.
bool StartAlertSituations(httplib::Client& api, const std::string& token, int every,
                          const std::string& webhook) {
  for (const AlertSituation& s : kAlertSituations) {
    const std::string body = std::string(R"({"table": ")") + s.table + R"(", "conditions": )" +
                             s.conditions + R"(, "every": )" + std::to_string(every) +
                             R"(, "for": 1, "severity": "warning", "webhook": ")" + webhook +
                             R"("})";
    const auto res = api.Put(("/api/v1/situations/" + std::string(s.name)).c_str(),
                             {{"Authorization", "Bearer " + token}}, body, "application/json");
    if (!res || (res->status != 200 && res->status != 201)) {
      std::fprintf(stderr, "situation %s refused: %s\n", s.name,
                   res ? (std::to_string(res->status) + " " + res->body).c_str()
                       : httplib::to_string(res.error()).c_str());
      return false;
    }
  }
  return true;
}

// The agent's alerting series from /metrics, by name (with labels); empty on failure.
std::map<std::string, double> AlertMetrics(httplib::Client& api) {
  std::map<std::string, double> values;
  const auto res = api.Get("/metrics");
  if (!res || res->status != 200) {
    return values;
  }
  std::istringstream lines(res->body);
  for (std::string line; std::getline(lines, line);) {
    if (line.rfind("q7_alert", 0) == 0 || line.rfind("q7_webhook", 0) == 0) {
      const size_t space = line.rfind(' ');
      values[line.substr(0, space)] = std::atof(line.c_str() + space + 1);
    }
  }
  return values;
}

}  // namespace

int main(int argc, char** argv) {
  Options options;
  if (!ParseOptions(argc, argv, &options)) {
    std::fprintf(stderr,
                 "usage: %s [--rate N (200000)] [--seconds N (120, at least 10)] [--clients N "
                 "(20)] [--requests N (1000, at least one a client)] [--interval-minutes N "
                 "(the agent's default)] [--alert-every N (0: no alerting situations)]\n",
                 argv[0]);
    return 2;
  }
  signal(SIGPIPE, SIG_IGN);
  q7test::TempHome root;
  bench::AgentHome agent(root.path());
  std::string error;
  const std::string extra =
      options.intervalMinutes > 0
          ? "KQ7OVERTIMEINTERVAL=" + std::to_string(options.intervalMinutes) + "\n"
          : "";
  if (!agent.Prepare(&error, extra)) {
    std::fprintf(stderr, "%s\n", error.c_str());
    return 1;
  }

  // The pool, made once per run by sm3gen.
  const std::string poolPath = root.path() + "pool.sm3";
  std::string output;
  if (q7test::runProgram(SM3GEN_PATH,
                         {"--out", poolPath, "--records", std::to_string(options.pool), "--seed",
                          "20261127", "--sites", "8", "--rate", "1000"},
                         {}, &output) != 0) {
    std::fprintf(stderr, "sm3gen failed: %s\n", output.c_str());
    return 1;
  }
  RecordPool pool;
  if (!pool.Load(poolPath, &error)) {
    std::fprintf(stderr, "%s\n", error.c_str());
    return 1;
  }
  std::filesystem::remove(poolPath);

  const std::string address = agent.Start();
  if (address.empty()) {
    std::fprintf(stderr, "the agent did not start:\n%s\n", agent.Trace().c_str());
    return 1;
  }
  httplib::Client api("http://" + address);
  api.set_read_timeout(30);
  // The tables are there once the agent has finished starting.
  std::vector<std::string> tables;
  q7test::waitFor(
      [&] {
        const auto res = api.Get("/api/v1/tables");
        const nlohmann::json body =
            res && res->status == 200 ? nlohmann::json::parse(res->body, nullptr, false) : nullptr;
        if (body.is_object() && body.contains("tables")) {
          for (const auto& table : body["tables"]) {
            tables.push_back(table.value("name", ""));
          }
        }
        return !tables.empty();
      },
      30s);
  if (tables.empty()) {
    std::fprintf(stderr, "no tables from %s\n", address.c_str());
    return 1;
  }
  std::printf(
      "q7load: %.0f records/s (pool of %zu, %.0f bytes each) for %d s; %d clients sampling %zu "
      "tables and events, %d requests in all; one events stream\n",
      options.rate, pool.size(), pool.averageBytes(), options.seconds, options.clients,
      tables.size(), options.requests);
  std::fflush(stdout);

  // The alerting situations, with the receiver that never answers.
  std::unique_ptr<HangingReceiver> receiver;
  std::map<std::string, double> alertsBefore;
  if (options.alertEvery > 0) {
    receiver = std::make_unique<HangingReceiver>();
    if (!StartAlertSituations(api, agent.ApiToken(), options.alertEvery, receiver->url())) {
      return 1;
    }
    alertsBefore = AlertMetrics(api);
    std::printf("alerting: %zu situations sampled every %d s; their webhook never answers\n",
                std::size(kAlertSituations), options.alertEvery);
    std::fflush(stdout);
  }

  std::atomic<bool> stop{false};
  Feeder feeder(pool, agent.data(), options.rate);
  const auto began = Clock::now();
  std::thread feeding([&] { feeder.Run(stop); });

  Outcomes outcomes;
  std::vector<std::thread> clients;
  const double period = static_cast<double>(options.seconds) * options.clients / options.requests;
  for (int c = 0; c < options.clients; ++c) {
    clients.emplace_back(
        [&, c] { Sample(address, tables, period, static_cast<unsigned>(c + 1), stop, &outcomes); });
  }
  // The events stream, held for the whole run (and opened again should it end).
  std::atomic<long> streamed{0};
  std::atomic<int> streamOpens{0};
  httplib::Client streamClient("http://" + address);
  streamClient.set_read_timeout(60);
  std::thread stream([&] {
    while (!stop.load()) {
      streamClient.Get(
          "/api/v1/events/stream",
          [&](const httplib::Response& response) {
            streamOpens.fetch_add(response.status == 200 ? 1 : 0);
            return true;
          },
          [&](const char* data, size_t n) {
            streamed.fetch_add(static_cast<long>(std::count(data, data + n, '\n')));
            return !stop.load();
          });
    }
  });

  // The watcher: the agent's intake every 100 ms, its memory every second.
  AgentState state;
  int64_t lastTaken = -1;
  double firstTaken = -1;
  std::vector<long long> rssSeries;  // every 30 s
  double nextSeries = 0;
  Clock::time_point lastProgress = began;
  double longestStall = 0;
  double stallAt = 0;
  std::vector<long long> rssAfterMinute;  // each second's, KiB
  int watcherFailures = 0;
  double nextMemory = 0;
  double nextRemoval = 0;
  while (SecondsSince(began) < options.seconds) {
    std::this_thread::sleep_for(100ms);
    const double t = SecondsSince(began);
    if (!ReadAgent(api, &state)) {
      ++watcherFailures;
      continue;
    }
    if (state.taken > 0 && firstTaken < 0) {
      firstTaken = t;  // the agent found the live file: from here on it must keep pace
    }
    if (state.taken != lastTaken) {
      lastTaken = state.taken;
      lastProgress = Clock::now();
    } else if (firstTaken >= 0 && feeder.written() > state.taken + 1000) {
      // Records were waiting and none was taken.
      const double stalled = SecondsSince(lastProgress);
      if (stalled > longestStall) {
        longestStall = stalled;
        stallAt = t;
      }
    }
    if (t >= nextMemory) {
      nextMemory = t + 1;
      const long long rss = ResidentKiB(agent.pid());
      if (t >= nextSeries) {
        nextSeries += 30;
        rssSeries.push_back(rss);
      }
      if (t >= 60) {
        rssAfterMinute.push_back(rss);
      }
    }
    if (t >= nextRemoval) {
      nextRemoval = t + 1;
      feeder.RemoveRead(state.file);
    }
  }
  stop.store(true);
  const double ran = SecondsSince(began);
  const std::map<std::string, double> alertsAfter =
      options.alertEvery > 0 ? AlertMetrics(api) : std::map<std::string, double>();
  streamClient.stop();
  for (std::thread& client : clients) {
    client.join();
  }
  feeding.join();
  const int64_t written = feeder.written();
  stream.join();

  // Catch-up: everything appended is processed.
  const auto catchUp = Clock::now();
  q7test::waitFor(
      [&] { return ReadAgent(api, &state) && state.processed >= written && state.queueDepth == 0; },
      300s);
  const double caughtUp = SecondsSince(catchUp);
  const nlohmann::json counters = state.counters;

  int requests = 0;
  int failed = 0;
  std::printf(
      "ingested: %lld records appended in %.1f s (%.0f/s); %lld processed, %.1f s to catch "
      "up after the run\n",
      static_cast<long long>(written), ran, written / ran, static_cast<long long>(state.processed),
      caughtUp);
  outcomes.Report(&requests, &failed);
  std::printf("events stream: opened %d time(s), %ld lines\n", streamOpens.load(), streamed.load());
  std::printf(
      "first record taken %.1f s after the live file began; longest ingestion stall since: %.2f "
      "s (at %.0f s); watcher polls failed: %d\n",
      firstTaken, longestStall, stallAt, watcherFailures);
  // The level is the median of 30 seconds' readings: a checkpoint's copy of the rows lives a
  // moment every KQ7CHECKPOINTSECONDS, and a rollover's save another; those are the peaks.
  const auto median = [](std::vector<long long> v) {
    std::sort(v.begin(), v.end());
    return v.empty() ? -1LL : v[v.size() / 2];
  };
  const size_t window = std::min<size_t>(30, rssAfterMinute.size());
  const long long levelAtMinute = median({rssAfterMinute.begin(), rssAfterMinute.begin() + window});
  const long long levelAtEnd = median({rssAfterMinute.end() - window, rssAfterMinute.end()});
  const long long peak =
      rssAfterMinute.empty() ? -1 : *std::max_element(rssAfterMinute.begin(), rssAfterMinute.end());
  std::printf(
      "agent resident memory after the first minute: level %.1f MiB at first, %.1f MiB at the "
      "end; peak %.1f MiB\n",
      levelAtMinute / 1024.0, levelAtEnd / 1024.0, peak / 1024.0);
  std::printf("agent resident memory every 30 s (MiB):");
  for (const long long rss : rssSeries) {
    std::printf(" %.0f", rss / 1024.0);
  }
  std::printf("\n");
  std::printf("checkpoints: %lld written, longest pause %lld ms, longest write %lld ms\n",
              counters.value("checkpoints_written", 0LL),
              counters.value("checkpoint_pause_ms_max", 0LL),
              counters.value("checkpoint_write_ms_max", 0LL));
  // Alerting kept its pace: the sampler took (nearly) every sample due over the run.
  bool alertPace = true;
  if (options.alertEvery > 0) {
    const auto delta = [&](const std::string& name) {
      const auto after = alertsAfter.find(name);
      const auto before = alertsBefore.find(name);
      return (after == alertsAfter.end() ? 0 : after->second) -
             (before == alertsBefore.end() ? 0 : before->second);
    };
    const auto value = [&](const std::string& name) {
      const auto at = alertsAfter.find(name);
      return at == alertsAfter.end() ? -1.0 : at->second;
    };
    const double due = std::size(kAlertSituations) * ran / options.alertEvery;
    const double samples = delta("q7_alert_samples_total");
    alertPace = samples >= due * 0.9;
    std::printf(
        "alerting: %.0f samples taken of %.0f due, %.0f failed; %.0f changes, %.0f open at the "
        "end\n",
        samples, due, delta("q7_alert_sample_failures_total"), delta("q7_alert_changes_total"),
        value("q7_alerts_open"));
    std::printf(
        "webhook: %ld POSTs held by the receiver; %.0f changes waiting, %.0f dropped from the "
        "full queue, %.0f attempts failed\n",
        receiver->held(), value("q7_webhook_pending"),
        value("q7_webhook_deliveries_total{result=\"dropped_full\"}"),
        value("q7_webhook_attempts_failed_total"));
  }
  agent.Stop();
  if (receiver) {
    receiver->Release();
  }
  const std::string trace = agent.Trace();
  const long errors = std::count(trace.begin(), trace.end(), '\n');
  // Its ERROR records, the first few shown: under load there should be none.
  std::istringstream lines(trace);
  std::vector<std::string> failures;
  for (std::string line; std::getline(lines, line);) {
    if (line.find(" ERROR ") != std::string::npos) {
      failures.push_back(line);
    }
  }
  std::printf("agent trace: %ld records, %zu of them ERROR\n", errors, failures.size());
  for (size_t i = 0; i < failures.size() && i < 3; ++i) {
    std::printf("  %s\n", failures[i].c_str());
  }

  // The checks the run is for.
  const bool allProcessed = state.processed >= written;
  const bool rateHeld = written >= static_cast<int64_t>(options.rate * ran * 0.98);
  const bool noFailure =
      failed == 0 && watcherFailures == 0 && requests >= options.requests * 9 / 10;
  const bool noStall = longestStall <= 1.0;
  // Flat: after the first minute the agent's level grows by no more than a tenth.
  // Judged on runs of at least 90 s, which have 30 readings after the first minute.
  const bool judged = rssAfterMinute.size() >= 30;
  const bool flat = !judged || levelAtEnd <= levelAtMinute * 11 / 10;
  std::printf(
      "%s rate held | %s every request answered | %s no stall over 1 s | %s memory flat "
      "after the first minute | %s every record processed | %s alert samples on time\n",
      rateHeld ? "PASS" : "FAIL", noFailure ? "PASS" : "FAIL", noStall ? "PASS" : "FAIL",
      !judged ? "n/a"
      : flat  ? "PASS"
              : "FAIL",
      allProcessed ? "PASS" : "FAIL",
      options.alertEvery == 0 ? "n/a"
      : alertPace             ? "PASS"
                              : "FAIL");
  return rateHeld && noFailure && noStall && flat && allProcessed && alertPace && !feeder.failed()
             ? 0
             : 1;
}
