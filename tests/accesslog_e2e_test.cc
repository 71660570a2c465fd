// sm3logs on a real server's log: Debian's nginx on loopback (with a python3 backend, so that
// some lines carry an upstream time) writes the README's nginx-timed format while curl makes
// the traffic.
//
// Read with --read, every logged request is one record with nginx's own figures, to the
// millisecond. Followed under the agent through sm3ctl (MODE=accesslog), the pages reach the
// tables with curl's counts and statuses and nginx's times, and an agent restart with traffic
// while it was down neither loses nor repeats a line.

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/utsname.h>

#include <algorithm>
#include <chrono>
#include <cmath>
#include <filesystem>
#include <fstream>
#include <map>
#include <nlohmann/json.hpp>
#include <regex>
#include <set>
#include <sstream>
#include <string>
#include <vector>

#include "tests/agent_fixture.h"
#include "tests/agent_process.h"
#include "tests/support/child_process.h"
#include "tests/support/curl_client.h"
#include "tests/support/nginx_server.h"
#include "tests/support/scratch_dir.h"
#include "tests/support/sm3_records.h"

namespace q7test {
namespace {

using namespace std::chrono_literals;

constexpr char kSiteHost[] = "shop.test";

// The backend answers /slow after 200 ms and anything under /api/ at once.
constexpr char kUpstreamScript[] = R"PY(
import http.server, os, sys, time

class Handler(http.server.BaseHTTPRequestHandler):
    protocol_version = "HTTP/1.1"

    def log_message(self, *args):
        pass

    def do_GET(self):
        if self.path.startswith("/slow"):
            time.sleep(0.2)
        body = b"answer\n"
        self.send_response(200)
        self.send_header("Content-Type", "text/plain")
        self.send_header("Content-Length", str(len(body)))
        self.end_headers()
        self.wfile.write(body)

server = http.server.ThreadingHTTPServer(("127.0.0.1", 0), Handler)
with open(sys.argv[1] + ".tmp", "w") as f:
    f.write("%d\n" % server.server_address[1])
os.rename(sys.argv[1] + ".tmp", sys.argv[1])
server.serve_forever()
)PY";

constexpr char kLocations[] = R"NGINX(
    location = /moved { return 301 /about.html; }
    location /slow { proxy_pass http://@BACKEND@; }
    location /api/ { proxy_pass http://@BACKEND@; }
)NGINX";

// One line of nginx's timed log, as the test reads it (by a regular expression, independently
// of sm3logs's parser).
struct LoggedRequest {
  std::string client;
  std::string method;
  std::string target;
  int status = 0;
  long body_bytes = 0;
  std::string referer;  // empty for "-"
  std::string user_agent;
  long request_ms = 0;
  long upstream_ms = -1;  // -1 for "-"
  std::string describe() const { return method + " " + target; }
};

// nginx writes a '"' or a control character inside a quoted field as \xHH.
std::string Unescaped(const std::string& text) {
  std::string out;
  for (size_t i = 0; i < text.size(); ++i) {
    if (text.compare(i, 2, "\\x") == 0 && i + 3 < text.size()) {
      out += static_cast<char>(std::stoi(text.substr(i + 2, 2), nullptr, 16));
      i += 3;
    } else {
      out += text[i];
    }
  }
  return out;
}

// nginx writes times as seconds with three decimals: exact in milliseconds.
long Millis(const std::string& seconds) {
  return std::lround(std::stod(seconds) * 1000);
}

std::vector<LoggedRequest> ReadTimedLog(const std::string& path) {
  static const std::regex kLine(
      R"re(^(\S+) - \S+ \[[^\]]+\] "(\S+) (\S+) [^"]*" (\d+) (\d+) "([^"]*)" "([^"]*)" ([0-9.]+) (\S+)$)re");
  std::vector<LoggedRequest> requests;
  std::istringstream lines(readFile(path));
  for (std::string line; std::getline(lines, line);) {
    std::smatch m;
    if (!std::regex_match(line, m, kLine)) {
      ADD_FAILURE() << "unexpected line in nginx's log: " << line;
      continue;
    }
    LoggedRequest r;
    r.client = m[1];
    r.method = m[2];
    r.target = m[3];
    r.status = std::stoi(m[4]);
    r.body_bytes = std::stol(m[5]);
    r.referer = m[6] == "-" ? "" : Unescaped(m[6]);
    r.user_agent = m[7] == "-" ? "" : Unescaped(m[7]);
    r.request_ms = Millis(m[8]);
    r.upstream_ms = m[9] == "-" ? -1 : Millis(m[9]);
    requests.push_back(std::move(r));
  }
  return requests;
}

class AccesslogE2ETest : public AgentE2ETest {
 protected:
  void SetUp() override {
    std::string error;
    upstream_ = std::make_unique<PythonUpstream>(lab_.file("upstream"), kUpstreamScript);
    ASSERT_TRUE(upstream_->WaitUntilServing(&error)) << error;
    nginx_ = std::make_unique<NginxServer>(lab_.path());
    const auto write = [&](const std::string& name, const std::string& bytes) {
      std::ofstream(nginx_->root() + "/" + name, std::ios::binary) << bytes;
    };
    write("index.html", "<html><link rel=stylesheet href=style.css><img src=logo.png></html>\n");
    write("about.html", "<html><link rel=stylesheet href=style.css>about us</html>\n");
    write("style.css", "body { margin: 0 }\n");
    write("app.js", "console.log('ready');\n");
    write("logo.png", std::string(6000, 'x'));
    std::string locations = kLocations;
    for (size_t at; (at = locations.find("@BACKEND@")) != std::string::npos;) {
      locations.replace(at, 9, "127.0.0.1:" + std::to_string(upstream_->port()));
    }
    ASSERT_TRUE(nginx_->Start(locations, &error)) << error;
  }

  // Runs curl's transfers (each a session of its own) and waits until nginx has logged them:
  // nginx writes a line once the reply is sent, which may be just after curl has it.
  void Browse(const std::vector<std::vector<CurlTransfer>>& sessions) {
    size_t count = ReadTimedLog(nginx_->timed_log_path()).size();
    std::string error;
    for (const auto& session : sessions) {
      const std::vector<nlohmann::json> results = RunCurl(session, lab_.path(), &error);
      ASSERT_EQ(session.size(), results.size()) << error;
      count += session.size();
    }
    ASSERT_TRUE(
        waitFor([&] { return ReadTimedLog(nginx_->timed_log_path()).size() == count; }, 10s))
        << readFile(nginx_->timed_log_path());
  }

  // A view of index.html with three objects, one of about.html with one, a page from the
  // backend, an API call, a 404 and a redirect; about.html once more, on its own.
  std::vector<std::vector<CurlTransfer>> Traffic() const {
    const std::string base = nginx_->base_url();
    const std::string index = base + "/index.html";
    const std::string about = base + "/about.html";
    return {{{index, {}},
             {base + "/style.css", {"--referer", index}},
             {base + "/app.js", {"--referer", index}},
             {base + "/logo.png", {"--referer", index}}},
            {{about, {"--user-agent", "Mozilla/5.0 (quoted \"agent\")"}},
             {base + "/style.css", {"--referer", about}}},
            {{base + "/slow/report", {}}, {base + "/api/items?page=2", {}}},
            {{base + "/no/such/page.html", {}}, {base + "/moved", {}}, {about, {}}}};
  }

  std::unique_ptr<PythonUpstream> upstream_;
  std::unique_ptr<NginxServer> nginx_;
  ScratchDir lab_;
};

// Every logged request is one record with nginx's figures: times to the millisecond, server
// time the upstream's where nginx had one, the view's objects right after their page.
TEST_F(AccesslogE2ETest, ReadsNginxLogExactly) {
  Browse(Traffic());
  const std::vector<LoggedRequest> logged = ReadTimedLog(nginx_->timed_log_path());
  ASSERT_EQ(11u, logged.size());

  const std::string out = lab_.file("log.sm3");
  std::string err;
  ASSERT_EQ(0,
            RunToEnd({SM3LOGS_PATH, "--format", "nginx-timed", "--read", nginx_->timed_log_path(),
                      "--out", out, "--host", kSiteHost, "--server-address", "127.0.0.1",
                      "--server-port", std::to_string(nginx_->port())},
                     lab_.file("logs.out"), lab_.file("logs.err"), nullptr, &err))
      << err;
  const std::map<std::string, long> counters = FinalCounters(err, "sm3logs: lines=");
  const auto counter = [&](const char* name) {
    return counters.count(name) > 0 ? counters.at(name) : -1;
  };
  EXPECT_EQ(11, counter("lines")) << err;
  EXPECT_EQ(0, counter("bad_lines")) << err;
  EXPECT_EQ(11, counter("records")) << err;
  EXPECT_EQ(4, counter("objects")) << err;
  EXPECT_EQ(0, counter("orphan_objects")) << err;

  std::string malformed;
  const std::vector<Record> records = ReadRecords(out, &malformed);
  EXPECT_EQ("", malformed);
  ASSERT_EQ(logged.size(), records.size());

  // Each line to its record, by method and URL in log order (about.html twice, style.css twice).
  std::multimap<std::string, const Record*> by_request;
  for (const Record& r : records) {
    by_request.emplace(std::to_string(r.number(kMethod)) + " " + r.text(kUrl), &r);
  }
  std::map<const Record*, const LoggedRequest*> line_of;
  for (const LoggedRequest& line : logged) {
    const auto found = by_request.find(std::to_string(MethodCode(line.method)) + " " + line.target);
    ASSERT_NE(by_request.end(), found) << "no record of " << line.describe();
    const Record& r = *found->second;
    line_of[&r] = &line;
    by_request.erase(found);
    const std::string what = line.describe();
    EXPECT_EQ(line.request_ms, r.exchangeMs()) << what;
    // nginx may log an upstream time above its own request time (separate clocks, each
    // rounded): the server's share is then the whole.
    EXPECT_EQ(line.upstream_ms >= 0 ? std::min(line.upstream_ms, line.request_ms) : line.request_ms,
              r.number(kServerMs))
        << what;
    EXPECT_EQ(r.exchangeMs() - r.number(kServerMs), r.number(kNetworkMs)) << what;
    EXPECT_EQ(r.number(kTotalMs), r.number(kServerMs) + r.number(kNetworkMs) + r.number(kLoadMs))
        << what;
    EXPECT_EQ(line.status, r.number(kStatus)) << what;
    EXPECT_EQ(line.body_bytes, r.number(kReplyBytes)) << what;
    EXPECT_EQ(line.client, r.text(kClientAddress)) << what;
    EXPECT_EQ("127.0.0.1", r.text(kServerAddress)) << what;
    EXPECT_EQ(nginx_->port(), r.number(kServerPort)) << what;
    EXPECT_EQ(kSiteHost, r.text(kHost)) << what;
    EXPECT_EQ(line.referer.empty() ? "N/A" : line.referer, r.text(kReferer)) << what;
    EXPECT_EQ(line.user_agent, r.text(kUserAgent)) << what;
    EXPECT_EQ("HTTP/1.1", r.text(kProtocol)) << what;
    const std::string query = r.text(kQuery);
    EXPECT_EQ(line.target, r.text(kPath) + r.text(kFile) + (query.empty() ? "" : "?" + query))
        << what;
  }

  // The views: each object after the page its Referer names, counted in its page's record; the
  // rest pages of their own.
  const std::string base = nginx_->base_url();
  std::map<std::string, std::multiset<std::string>> views;
  const Record* page = nullptr;
  long objects_seen = 0;
  const auto close_view = [&] {
    if (page != nullptr) {
      EXPECT_EQ(objects_seen, page->number(kObjectCount)) << page->describe();
    }
  };
  for (const Record& r : records) {
    if (r.tag == "hpage") {
      close_view();
      page = &r;
      objects_seen = 0;
      views[r.text(kUrl)];
      continue;
    }
    EXPECT_EQ("hobj", r.tag) << r.describe();
    ASSERT_NE(nullptr, page) << r.describe() << " before any page";
    EXPECT_EQ(base + page->text(kUrl), r.text(kReferer)) << r.describe();
    views[page->text(kUrl)].insert(r.text(kUrl));
    ++objects_seen;
  }
  close_view();
  EXPECT_EQ((std::multiset<std::string>{"/style.css", "/app.js", "/logo.png"}),
            views["/index.html"]);
  EXPECT_EQ(std::multiset<std::string>{"/style.css"}, views["/about.html"]);
  EXPECT_EQ(1u, views.count("/slow/report"));
  EXPECT_EQ(1u, views.count("/api/items?page=2"));
}

// The agent follows nginx's log through sm3ctl: curl's pages reach Q7APPSM and Q7TXSM with
// their statuses and nginx's times; traffic while the agent is down is read after its restart,
// each line exactly once.
TEST_F(AccesslogE2ETest, SupervisedFollowsLogAcrossRestart) {
  const std::string data = useDataDirectory();
  const std::string dpx = base() + "dpx/";
  superviseCollectorWith("MODE=accesslog\nLOG_PATH=" + nginx_->timed_log_path() +
                         "\nFORMAT=nginx-timed\nLOGS_OPTIONS='--host " + kSiteHost +
                         " --server-address 127.0.0.1'\nDATA_DIR=" + data +
                         "\nSTEM=weblog\nBIN_DIR=" +
                         std::filesystem::path(SM3LOGS_PATH).parent_path().string() + "\n");
  registerCatchAllPattern();

  struct utsname names {};
  uname(&names);
  const std::string agent = std::string(names.nodename).substr(0, 24);
  const std::string logs_pid = dpx + "linux/zelt_" + agent + ".pid";
  const std::string logs_trace = dpx + "linux/zelt_" + agent + ".log";
  std::string address = start();
  ASSERT_TRUE(waitFor([&] { return !readFile(logs_pid).empty(); }, 15s))
      << readFile(logs_trace) << trace();

  // Pages per transaction (URL) with their highest total time, and per application the status
  // buckets, from the logged lines the way the agent should count them.
  struct Figures {
    std::map<std::string, long> pages;
    std::map<std::string, long> max_ms;
    std::vector<long> buckets;  // totreq, num2xx, num3xx, num404
    bool operator==(const Figures&) const = default;
  };
  const auto expected = [&] {
    Figures f;
    f.buckets.assign(4, 0);
    for (const LoggedRequest& line : ReadTimedLog(nginx_->timed_log_path())) {
      const bool object =
          line.target == "/style.css" || line.target == "/app.js" || line.target == "/logo.png";
      if (object) {
        continue;
      }
      ++f.pages[line.target];
      // Pages with objects add a load time measured between second-resolution time stamps;
      // only pages alone have nginx's time as their total.
      if (line.target != "/index.html" && line.target != "/about.html") {
        f.max_ms[line.target] = std::max(f.max_ms[line.target], line.request_ms);
      }
      ++f.buckets[0];
      f.buckets[1] += line.status / 100 == 2;
      f.buckets[2] += line.status / 100 == 3;
      f.buckets[3] += line.status == 404;
    }
    return f;
  };
  const auto tables = [&] {
    Figures f;
    f.buckets.assign(4, 0);
    int status = 0;
    // Each body is kept in a variable: a range-for over a member of a temporary dangles.
    const nlohmann::json apps = get(address, "/api/v1/tables/Q7APPSM", &status);
    for (const auto& row : apps["rows"]) {
      EXPECT_EQ(kSiteHost, row["applicatin"].get<std::string>());
      f.buckets[0] += row["totreq"].get<long>();
      f.buckets[1] += row["num2xx"].get<long>();
      f.buckets[2] += row["num3xx"].get<long>();
      f.buckets[3] += row["num404"].get<long>();
    }
    const nlohmann::json transactions = get(address, "/api/v1/tables/Q7TXSM", &status);
    for (const auto& row : transactions["rows"]) {
      const std::string url = row["transactn"].get<std::string>();
      f.pages[url] += row["totreq"].get<long>();
      if (url != "/index.html" && url != "/about.html") {
        f.max_ms[url] = std::max(f.max_ms[url], row["maxrtt"].get<long>());
      }
    }
    return f;
  };

  // Waits until the tables show what the log says, then shows any difference.
  const auto expect_tables_agree = [&] {
    const Figures want = expected();
    Figures got;
    EXPECT_TRUE(waitFor(
        [&] {
          got = tables();
          return got == want;
        },
        30s))
        << readFile(logs_trace);
    EXPECT_EQ(want.pages, got.pages);
    EXPECT_EQ(want.max_ms, got.max_ms);
    EXPECT_EQ(want.buckets, got.buckets);
    return want;
  };

  Browse(Traffic());
  // The last view closes 5 s after its page ended; the agent looks every 5 s.
  Figures want = expect_tables_agree();
  EXPECT_EQ(7, want.buckets[0]);
  EXPECT_GE(want.max_ms["/slow/report"], 200);

  // Down: the agent stops sm3logs, which keeps its place in the log; nginx goes on.
  stopWith(SIGTERM);
  ASSERT_FALSE(HasFatalFailure());
  EXPECT_FALSE(std::filesystem::exists(logs_pid));
  const std::string base_url = nginx_->base_url();
  Browse({{{base_url + "/slow/night", {}}, {base_url + "/about.html", {}}},
          {{base_url + "/gone.html", {}}}});

  // Up again: the lines logged while down are read once; none before them is read again (the
  // summaries keep what was counted before the stop).
  address = start();
  want = expect_tables_agree();
  EXPECT_EQ(10, want.buckets[0]);

  // Every line is in the data directory's records exactly once, in the log's order.
  stopWith(SIGTERM);
  std::vector<std::string> record_urls;
  std::vector<std::filesystem::path> files;
  for (const auto& entry : std::filesystem::directory_iterator(data)) {
    if (entry.path().extension() == ".sm3") {
      files.push_back(entry.path());
    }
  }
  std::sort(files.begin(), files.end());
  for (const auto& file : files) {
    std::string malformed;
    for (const Record& r : ReadRecords(file.string(), &malformed)) {
      record_urls.push_back(r.text(kUrl));
    }
    EXPECT_EQ("", malformed) << file;
  }
  std::vector<std::string> logged_urls;
  for (const LoggedRequest& line : ReadTimedLog(nginx_->timed_log_path())) {
    logged_urls.push_back(line.target);
  }
  EXPECT_EQ(std::multiset<std::string>(logged_urls.begin(), logged_urls.end()),
            std::multiset<std::string>(record_urls.begin(), record_urls.end()));
  const std::map<std::string, long> counters =
      FinalCounters(readFile(logs_trace), "sm3logs: lines=");
  EXPECT_EQ(0, counters.count("bad_lines") ? counters.at("bad_lines") : -1) << readFile(logs_trace);
}

// A line of the nginx-timed format at `when` (seconds since 1970), 10 ms long.
std::string TimedLine(const std::string& client, time_t when, const std::string& target,
                      const std::string& referer) {
  struct tm tm {};
  gmtime_r(&when, &tm);
  char stamp[64];
  strftime(stamp, sizeof(stamp), "%d/%b/%Y:%H:%M:%S +0000", &tm);
  return client + " - - [" + stamp + "] \"GET " + target + " HTTP/1.1\" 200 100 \"" +
         (referer.empty() ? "-" : referer) + "\" \"test\" 0.010 -\n";
}

// The saved offset of a follower state file; -1 while there is none.
long SavedOffset(const std::string& state) {
  const std::string text = readFile(state);
  const size_t at = text.find("\noffset ");
  return at == std::string::npos ? -1 : std::stol(text.substr(at + 8));
}

std::multiset<std::string> RecordUrls(const std::string& path) {
  std::string malformed;
  std::multiset<std::string> urls;
  for (const Record& r : ReadRecords(path, &malformed)) {
    urls.insert(r.text(kUrl));
  }
  EXPECT_EQ("", malformed) << path;
  return urls;
}

// sm3logs --follow killed with SIGKILL: the position it saved while running lies before the
// lines whose records were still held (an object waiting for its page), so the restart writes those
// again (and the lines after them) and skips nothing; the lines before them are not written twice.
TEST(AccesslogFollowTest, KilledFollowerSkipsNothing) {
  ScratchDir lab;
  const std::string log = lab.file("access.log");
  const std::string state = lab.file("access.state");
  const time_t now = time(nullptr);
  const auto append = [&](const std::string& text) {
    std::ofstream(log, std::ios::binary | std::ios::app) << text;
  };
  // Pages without a Referer are written at once.
  append(TimedLine("192.0.2.1", now - 600, "/a.html", "") +
         TimedLine("192.0.2.2", now - 600, "/b.html", "") +
         TimedLine("192.0.2.3", now - 600, "/c.html", ""));
  const long first_lines = static_cast<long>(std::filesystem::file_size(log));
  const auto follow = [&](const std::string& out) {
    return std::make_unique<ChildProcess>(
        std::vector<std::string>{SM3LOGS_PATH, "--format", "nginx-timed", "--follow", log,
                                 "--state", state, "--from-start", "--out", out, "--host",
                                 kSiteHost, "--stats", "1"},
        out + ".err", out + ".err");
  };
  const std::string out1 = lab.file("first.sm3");
  auto first = follow(out1);
  ASSERT_TRUE(waitFor([&] { return RecordUrls(out1).size() == 3; }, 10s))
      << readFile(out1 + ".err");
  ASSERT_TRUE(waitFor([&] { return SavedOffset(state) == first_lines; }, 10s)) << readFile(state);

  // An object whose page was not seen waits 30 s for it; the page after it is out at once.
  append(TimedLine("192.0.2.4", now, "/held.css", "http://shop.test/unseen.html") +
         TimedLine("192.0.2.5", now - 600, "/after.html", ""));
  ASSERT_TRUE(waitFor([&] { return RecordUrls(out1).count("/after.html") == 1; }, 10s));
  // Two counter lines after it: a save was due at least once since.
  const auto stats_lines = [&] {
    const std::string err = readFile(out1 + ".err");
    size_t n = 0;
    for (size_t at = 0; (at = err.find("stats: lines=5 ", at)) != std::string::npos; ++at) {
      ++n;
    }
    return n;
  };
  ASSERT_TRUE(waitFor([&] { return stats_lines() >= 2; }, 10s)) << readFile(out1 + ".err");
  first->signal(SIGKILL);
  first->wait(5s);
  EXPECT_EQ(first_lines, SavedOffset(state));

  const std::string out2 = lab.file("second.sm3");
  auto second = follow(out2);
  ASSERT_TRUE(waitFor([&] { return RecordUrls(out2).count("/after.html") == 1; }, 10s))
      << readFile(out2 + ".err");
  second->signal(SIGTERM);
  const auto status = second->wait(10s);
  ASSERT_TRUE(status.has_value());
  EXPECT_TRUE(WIFEXITED(*status) && WEXITSTATUS(*status) == 0) << readFile(out2 + ".err");
  EXPECT_EQ((std::multiset<std::string>{"/a.html", "/b.html", "/c.html", "/after.html"}),
            RecordUrls(out1));
  EXPECT_EQ((std::multiset<std::string>{"/held.css", "/after.html"}), RecordUrls(out2));
  EXPECT_EQ(static_cast<long>(std::filesystem::file_size(log)), SavedOffset(state));
}

}  // namespace
}  // namespace q7test
