// sm3capture on real traffic: Debian's nginx (with a python3 backend for slow and chunked
// replies) on loopback, driven by curl.
//
// Recorded with tcpdump and read back with --read, every exchange tshark dissects must be one
// record, with tshark's method, URL, status and server time, the byte and packet counts of its
// TCP segments, timings that agree with the segments and with curl's own, and the page view it
// belongs to. Run live under the agent through sm3ctl, the pages reach the summary tables.

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
#include <random>
#include <set>
#include <string>
#include <tuple>
#include <vector>

#include "tests/agent_fixture.h"
#include "tests/agent_process.h"
#include "tests/support/child_process.h"
#include "tests/support/curl_client.h"
#include "tests/support/http_references.h"
#include "tests/support/nginx_server.h"
#include "tests/support/packet_recorder.h"
#include "tests/support/scratch_dir.h"
#include "tests/support/sm3_records.h"

namespace q7test {
namespace {

using namespace std::chrono_literals;

// The backend: /slow answers after 200 ms, /chunked in three chunks 30 ms apart, a POST with
// the size of its body.
constexpr char kUpstreamScript[] = R"PY(
import http.server, os, sys, time

class Handler(http.server.BaseHTTPRequestHandler):
    protocol_version = "HTTP/1.1"

    def log_message(self, *args):
        pass

    def head(self, extra):
        self.send_response(200)
        self.send_header("Content-Type", "text/plain")
        for name, value in extra:
            self.send_header(name, value)
        self.end_headers()

    def do_GET(self):
        if self.path.startswith("/slow"):
            time.sleep(0.2)
            body = b"slow answer\n"
            self.head([("Content-Length", str(len(body)))])
            self.wfile.write(body)
        elif self.path.startswith("/chunked"):
            self.head([("Transfer-Encoding", "chunked")])
            for i, part in enumerate([b"first part\n", b"middle part\n" * 50, b"last\n"]):
                if i > 0:
                    time.sleep(0.03)
                self.wfile.write(b"%x\r\n%s\r\n" % (len(part), part))
                self.wfile.flush()
            self.wfile.write(b"0\r\n\r\n")
        else:
            self.send_error(404)

    def do_POST(self):
        body = self.rfile.read(int(self.headers.get("Content-Length", "0")))
        answer = b"got %d bytes\n" % len(body)
        self.head([("Content-Length", str(len(answer)))])
        self.wfile.write(answer)

server = http.server.ThreadingHTTPServer(("127.0.0.1", 0), Handler)
with open(sys.argv[1] + ".tmp", "w") as f:
    f.write("%d\n" % server.server_address[1])
os.rename(sys.argv[1] + ".tmp", sys.argv[1])
server.serve_forever()
)PY";

// nginx's locations: a redirect, the large object at 16 MB/s (about 65 ms), and what the backend
// answers. Replies of unknown length go to an HTTP/1.1 client chunked, and unbuffered chunks
// go out as they come.
constexpr char kLocations[] = R"NGINX(
    location = /moved { return 301 /about.html; }
    location = /big.bin { limit_rate 16m; }
    location /slow { proxy_pass http://@BACKEND@; }
    location /api/ { proxy_pass http://@BACKEND@; }
    location /chunked {
      proxy_pass http://@BACKEND@;
      proxy_http_version 1.1;
      proxy_buffering off;
    }
)NGINX";

using ExchangeKey = std::tuple<int, int, std::string>;  // client port, method code, URL

// Deterministic filler of n bytes.
std::string Filler(size_t n, unsigned seed) {
  std::mt19937 random(seed);
  std::string bytes(n, '\0');
  for (char& c : bytes) {
    c = static_cast<char>('a' + random() % 26);
  }
  return bytes;
}

class CaptureE2ETest : public AgentE2ETest {
 protected:
  void SetUp() override {
    if (const std::string reason = CaptureUnavailableReason(); !reason.empty()) {
      GTEST_SKIP() << reason;
    }
    std::string error;
    upstream_ = std::make_unique<PythonUpstream>(lab_.file("upstream"), kUpstreamScript);
    ASSERT_TRUE(upstream_->WaitUntilServing(&error)) << error;
    nginx_ = std::make_unique<NginxServer>(lab_.path());
    WriteSite(nginx_->root());
    std::string locations = kLocations;
    for (size_t at; (at = locations.find("@BACKEND@")) != std::string::npos;) {
      locations.replace(at, 9, "127.0.0.1:" + std::to_string(upstream_->port()));
    }
    ASSERT_TRUE(nginx_->Start(locations, &error)) << error;
  }

  // Two pages and the objects they name.
  static void WriteSite(const std::string& root) {
    auto write = [&](const std::string& name, const std::string& bytes) {
      std::ofstream(root + "/" + name, std::ios::binary) << bytes;
    };
    write("index.html",
          "<html><head><link rel=stylesheet href=style.css><script src=app.js></script></head>"
          "<body><img src=logo.png><a href=big.bin>data</a></body></html>\n");
    write("about.html",
          "<html><head><link rel=stylesheet href=style.css></head>"
          "<body><img src=logo.png>about us</body></html>\n");
    write("style.css", "body { margin: 0 }\n/* " + Filler(4000, 1) + " */\n");
    write("app.js", "console.log('ready');\n");
    write("logo.png", Filler(6000, 2));
    write("big.bin", Filler(1 << 20, 3));
  }

  // The .sm3 records sm3capture writes for a pcap file, with its final counters.
  std::vector<Record> CaptureFile(const std::string& pcap, std::map<std::string, long>* counters) {
    const std::string out = lab_.file("capture.sm3");
    std::string err;
    const int code =
        RunToEnd({SM3CAPTURE_PATH, "--read", pcap, "--out", out}, lab_.file("capture.stdout"),
                 lab_.file("capture.stderr"), nullptr, &err);
    EXPECT_EQ(0, code) << err;
    *counters = FinalCounters(err);
    EXPECT_FALSE(counters->empty()) << "no final counters in: " << err;
    std::string malformed;
    std::vector<Record> records = ReadRecords(out, &malformed);
    EXPECT_EQ("", malformed);
    return records;
  }

  std::unique_ptr<PythonUpstream> upstream_;
  std::unique_ptr<NginxServer> nginx_;
  ScratchDir lab_;
};

// What curl measured, compared with the record of the same transfer: curl's clock starts at
// the transfer, before the SYN of a new connection (name lookup aside, of a literal address)
// and just before the request on a reused one ("pretransfer"). (Its byte counts are left out:
// size_request misses a body sent after "100 Continue", size_download counts chunked bodies
// decoded; the segments give the bytes exactly.) After an interim reply curl's first byte is
// that reply's, so its server time says nothing then.
void ExpectAgreesWithCurl(const nlohmann::json& transfer, const Record& record, bool interim) {
  const auto ms = [&](const char* name) { return transfer[name].get<double>() * 1000; };
  const auto near = [](double expected, double actual) {
    return std::abs(expected - actual) <= 2 + 0.02 * expected;
  };
  const bool fresh = transfer["num_connects"].get<int>() > 0;
  const double exchange =
      ms("time_total") - (fresh ? ms("time_namelookup") : ms("time_pretransfer"));
  const double server = ms("time_starttransfer") - ms("time_pretransfer");
  EXPECT_TRUE(near(exchange, record.exchangeMs()))
      << record.describe() << ": curl " << exchange << " ms, record " << record.exchangeMs();
  EXPECT_TRUE(interim || near(server, record.number(kServerMs)))
      << record.describe() << ": curl's server time " << server << " ms, record "
      << record.number(kServerMs);
  EXPECT_EQ(transfer["response_code"].get<int>(), record.number(kStatus)) << record.describe();
}

// Every exchange tshark sees is one record with its figures; pages hold the objects that name
// them; curl's timings agree.
TEST_F(CaptureE2ETest, RecordedRealTraffic) {
  const std::string pcap = lab_.file("traffic.pcap");
  PacketRecorder recorder("lo",
                          "tcp port " + std::to_string(nginx_->port()) + " or tcp port " +
                              std::to_string(upstream_->port()),
                          pcap);
  std::string error;
  ASSERT_TRUE(recorder.Start(&error)) << error;

  const std::string base = nginx_->base_url();
  const std::string index = base + "/index.html";
  const std::string about = base + "/about.html";
  const std::vector<std::vector<CurlTransfer>> sessions = {
      // A page and its objects over one keep-alive connection, the last one large.
      {{index, {}},
       {base + "/style.css", {"--referer", index}},
       {base + "/app.js", {"--referer", index}},
       {base + "/logo.png", {"--referer", index}},
       {base + "/big.bin", {"--referer", index}}},
      {{about, {}},
       {base + "/style.css", {"--referer", about}},
       {base + "/logo.png", {"--referer", about}}},
      {{index, {"--head"}}},
      {{base + "/api/echo?id=7", {"--data-binary", Filler(3000, 4)}}},
      // The body waits for nginx's "100 Continue", which does not end the exchange.
      {{base + "/api/echo?id=8",
        {"--header", "Expect: 100-continue", "--data-binary", Filler(2000, 5)}}},
      {{base + "/no/such/page.html", {}}, {base + "/moved", {}}},
      // Chunked (through nginx as well as from the backend), then a slow reply on the same
      // connection: the chunked body's end must be found to see the next exchange.
      {{base + "/chunked", {}}, {base + "/slow", {}}},
  };
  std::vector<nlohmann::json> transfers;
  for (const auto& session : sessions) {
    const auto results = RunCurl(session, lab_.path(), &error);
    ASSERT_EQ(session.size(), results.size()) << error;
    transfers.insert(transfers.end(), results.begin(), results.end());
  }
  // Every connection closed on the record: nothing is left in flight when tcpdump stops.
  std::set<int> curl_ports;
  for (const nlohmann::json& transfer : transfers) {
    curl_ports.insert(transfer["local_port"].get<int>());
  }
  ASSERT_TRUE(waitFor([&] { return ConnectionsEnded(pcap, curl_ports); }, 10s));
  EXPECT_EQ(0, recorder.Stop(&error)) << error;

  const std::vector<Reference> references = ReferenceExchanges(pcap, lab_.path(), &error);
  ASSERT_TRUE(error.empty()) << error;
  // curl's 15 requests and the 4 nginx passes on to the backend; one 100 Continue.
  ASSERT_EQ(15u + 4u, references.size());
  EXPECT_EQ(1, std::count_if(references.begin(), references.end(),
                             [](const Reference& r) { return r.interim; }));
  for (const Reference& ref : references) {
    EXPECT_EQ(ref.uri == "/chunked", ref.chunked) << ref.describe();
    if (ref.uri == "/slow") {
      EXPECT_GE(ref.server_ms.value_or(0), 200) << ref.describe();
    }
  }

  std::map<std::string, long> counters;
  const std::vector<Record> records = CaptureFile(pcap, &counters);
  const auto counter = [&](const char* name) {
    return counters.count(name) > 0 ? counters.at(name) : -1;
  };
  EXPECT_EQ(references.size(), records.size());
  EXPECT_EQ(static_cast<long>(records.size()), counter("exchanges"));
  EXPECT_EQ(counter("exchanges"), counter("pages") + counter("objects"));
  for (const char* zero :
       {"unmatched_requests", "unmatched_responses", "gaps", "non_http", "midstream",
        "dropped_heads", "lost_framing", "orphan_objects", "records_lost"}) {
    EXPECT_EQ(0, counter(zero)) << zero;
  }

  // Each exchange is one record.
  std::map<ExchangeKey, std::vector<size_t>> by_key;
  for (size_t i = 0; i < records.size(); ++i) {
    const Record& r = records[i];
    by_key[{static_cast<int>(r.number(kClientPort)), static_cast<int>(r.number(kMethod)),
            r.text(kUrl)}]
        .push_back(i);
  }
  std::vector<const Record*> matched(references.size(), nullptr);
  for (size_t i = 0; i < references.size(); ++i) {
    const Reference& ref = references[i];
    const auto found = by_key.find({ref.client_port, MethodCode(ref.method), ref.uri});
    if (found == by_key.end() || found->second.size() != 1) {
      ADD_FAILURE() << ref.describe() << " is in "
                    << (found == by_key.end() ? 0 : found->second.size()) << " records";
      continue;
    }
    const Record& r = records[found->second[0]];
    matched[i] = &r;
    const std::string what = ref.describe();
    EXPECT_EQ(ref.status, r.number(kStatus)) << what;
    EXPECT_EQ("127.0.0.1", r.text(kClientAddress)) << what;
    EXPECT_EQ("127.0.0.1", r.text(kServerAddress)) << what;
    EXPECT_EQ(ref.server_port, r.number(kServerPort)) << what;
    EXPECT_EQ(ref.host, r.text(kHost)) << what;
    EXPECT_EQ(ref.referer.empty() ? "N/A" : ref.referer, r.text(kReferer)) << what;
    EXPECT_EQ(ref.user_agent, r.text(kUserAgent)) << what;
    EXPECT_EQ(ref.server, r.text(kServer)) << what;
    EXPECT_EQ("HTTP/1.1", r.text(kProtocol)) << what;
    if (ref.server_ms) {
      EXPECT_NEAR(*ref.server_ms, r.number(kServerMs), 1.0) << what;
    }
    // tshark has no server time after an interim reply; the segments always do.
    EXPECT_NEAR((ref.first_reply - ref.last_request) * 1000, r.number(kServerMs), 1.0) << what;
    // Figures from the segments.
    EXPECT_EQ(ref.request_bytes, r.number(kRequestBytes)) << what;
    EXPECT_EQ(ref.reply_bytes, r.number(kReplyBytes)) << what;
    EXPECT_EQ(ref.request_bytes + ref.reply_bytes, r.number(kTotalBytes)) << what;
    EXPECT_EQ(ref.request_packets, r.number(kRequestPackets)) << what;
    EXPECT_EQ(ref.reply_packets, r.number(kReplyPackets)) << what;
    EXPECT_EQ(ref.request_acks, r.number(kRequestAcks)) << what;
    EXPECT_EQ(ref.reply_acks, r.number(kReplyAcks)) << what;
    EXPECT_NEAR((ref.last_reply - ref.start) * 1000, r.exchangeMs(), 1.0) << what;
    EXPECT_EQ(static_cast<long>(ref.start), r.number(kStartSeconds)) << what;
    EXPECT_EQ(r.number(kTotalMs), r.number(kServerMs) + r.number(kNetworkMs) + r.number(kLoadMs))
        << what;
    // The URL's parts: the path to its last '/', the file after it, the query without its '?'.
    const std::string query = r.text(kQuery);
    EXPECT_EQ(ref.uri, r.text(kPath) + r.text(kFile) + (query.empty() ? "" : "?" + query)) << what;
  }

  // Page views: index.html with its four objects, about.html with two, every other exchange a
  // page of its own; each object right after its page, and the page's load time reaching the
  // end of its last object.
  const std::map<std::string, std::set<std::string>> kViews = {
      {"/index.html", {"/style.css", "/app.js", "/logo.png", "/big.bin"}},
      {"/about.html", {"/style.css", "/logo.png"}}};
  std::map<std::string, std::multiset<std::string>> seen_views;
  const Record* page = nullptr;
  for (const Record& r : records) {
    if (r.tag == "hpage") {
      page = &r;
      seen_views[r.text(kUrl)];
      continue;
    }
    EXPECT_EQ("hobj", r.tag) << r.describe();
    ASSERT_NE(nullptr, page) << r.describe() << " before any page";
    EXPECT_EQ(base + page->text(kUrl), r.text(kReferer)) << r.describe();
    EXPECT_EQ(page->text(kClientPort), r.text(kClientPort)) << r.describe();
    EXPECT_EQ(0, r.number(kLoadMs)) << r.describe();
    seen_views[page->text(kUrl)].insert(r.text(kUrl));
  }
  for (const auto& [url, objects] : kViews) {
    EXPECT_EQ(std::multiset<std::string>(objects.begin(), objects.end()), seen_views[url]) << url;
  }
  for (size_t i = 0; i < references.size(); ++i) {
    const Record* r = matched[i];
    if (r == nullptr || r->tag != "hpage") {
      continue;
    }
    const auto view = kViews.find(r->text(kUrl));
    const bool has_view = view != kViews.end() && references[i].method == "GET";
    EXPECT_EQ(has_view ? view->second.size() : 0u, static_cast<size_t>(r->number(kObjectCount)))
        << r->describe();
    double view_end = references[i].last_reply;
    for (size_t j = 0; has_view && j < references.size(); ++j) {
      if (references[j].referer == base + r->text(kUrl) &&
          references[j].client_port == references[i].client_port) {
        view_end = std::max(view_end, references[j].last_reply);
      }
    }
    EXPECT_NEAR((view_end - references[i].last_reply) * 1000, r->number(kLoadMs), 1.0)
        << r->describe();
  }

  // curl's view of each of its transfers.
  for (const nlohmann::json& transfer : transfers) {
    const std::string url = transfer["url_effective"].get<std::string>().substr(base.size());
    const auto found = by_key.find({transfer["local_port"].get<int>(),
                                    MethodCode(transfer["method"].get<std::string>()), url});
    ASSERT_NE(by_key.end(), found) << "no record of curl's " << transfer.dump();
    const auto reference = std::find_if(references.begin(), references.end(), [&](auto& r) {
      return r.client_port == std::get<0>(found->first) && r.uri == url;
    });
    ASSERT_NE(references.end(), reference) << transfer.dump();
    ExpectAgreesWithCurl(transfer, records[found->second.front()], reference->interim);
  }
}

// The agent runs sm3capture on lo through sm3ctl (MODE=capture); nginx's pages and 404s for
// two host names reach the summary tables with their counts and status buckets.
TEST_F(CaptureE2ETest, SupervisedOnLoopback) {
  const std::string data = useDataDirectory();
  const std::string dpx = base() + "dpx/";
  // The filter holds blanks and quotes, as an operator writes it.
  superviseCollectorWith("MODE=capture\nINTERFACE=lo\nFILTER='tcp port " +
                         std::to_string(nginx_->port()) + "'\nDATA_DIR=" + data +
                         "\nSTEM=traffic\nBIN_DIR=" +
                         std::filesystem::path(SM3CAPTURE_PATH).parent_path().string() + "\n");
  registerCatchAllPattern();
  const std::string address = start();

  // The capture process keeps its pid file from the moment it captures.
  struct utsname names {};
  uname(&names);
  const std::string agent = std::string(names.nodename).substr(0, 24);
  const std::string capture_pid = dpx + "linux/zelt_" + agent + ".pid";
  const std::string capture_log = dpx + "linux/zelt_" + agent + ".log";
  ASSERT_TRUE(waitFor([&] { return !readFile(capture_pid).empty(); }, 15s))
      << readFile(capture_log) << trace();

  // Four pages and a 404 on shop.test, one page and two 404s on news.test.
  const std::string base_url = nginx_->base_url();
  std::vector<CurlTransfer> transfers;
  const auto add = [&](const std::string& host, const std::string& path) {
    transfers.push_back({base_url + path, {"--header", "Host: " + host}});
  };
  for (const char* path : {"/index.html", "/about.html", "/index.html?from=mail", "/about.html"}) {
    add("shop.test", path);
  }
  add("shop.test", "/basket.html");
  add("news.test:8080", "/index.html");
  add("news.test:8080", "/today.html");
  add("news.test:8080", "/yesterday.html");
  std::string error;
  ASSERT_EQ(transfers.size(), RunCurl(transfers, lab_.path(), &error).size()) << error;

  struct Expected {
    long total, ok, not_found;
  };
  const std::map<std::string, Expected> expected = {{"shop.test", {5, 4, 1}},
                                                    {"news.test", {3, 1, 2}}};
  // Rows per application: {totreq, num2xx, num404}.
  const auto figures = [&](const std::string& table) {
    int status = 0;
    const nlohmann::json body = get(address, "/api/v1/tables/" + table, &status);
    std::map<std::string, std::vector<long>> rows;
    for (const auto& row : body["rows"]) {
      auto& sums = rows[row["applicatin"].get<std::string>()];
      sums.resize(3);
      sums[0] += row["totreq"].get<long>();
      sums[1] += row["num2xx"].get<long>();
      sums[2] += row["num404"].get<long>();
    }
    return rows;
  };
  std::map<std::string, std::vector<long>> wanted;
  for (const auto& [app, e] : expected) {
    wanted[app] = {e.total, e.ok, e.not_found};
  }
  // The last page's view closes 5 s after it ended; the agent looks every 5 s.
  std::map<std::string, std::vector<long>> apps;
  EXPECT_TRUE(waitFor(
      [&] {
        apps = figures("Q7APPSM");
        return apps == wanted;
      },
      30s))
      << readFile(capture_log);
  EXPECT_EQ(wanted, apps);
  EXPECT_EQ(wanted, figures("Q7TXSM"));

  // The agent stops the writer and the capture process, which reports what it saw.
  agent_->signal(SIGTERM);
  const auto status = agent_->wait(20s);
  ASSERT_TRUE(status.has_value()) << "agent did not exit";
  EXPECT_TRUE(WIFEXITED(*status) && WEXITSTATUS(*status) == 0);
  EXPECT_FALSE(std::filesystem::exists(capture_pid));
  const std::map<std::string, long> counters = FinalCounters(readFile(capture_log));
  EXPECT_EQ(8, counters.count("exchanges") ? counters.at("exchanges") : -1)
      << readFile(capture_log);
}

}  // namespace
}  // namespace q7test
