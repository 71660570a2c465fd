// The dashboard in a real browser: the agent serves it from its home, fed generated traffic;
// Debian's headless Chromium loads it over the DevTools protocol, and the test reads what the
// page rendered (its tables, its canvases' pixels) against the API, clicks through the
// drill-down as a user does, and fails on any console error, uncaught exception or failed load.
// Screenshots go to the build's test output directory.

#include <gtest/gtest.h>

#include <ctime>
#include <filesystem>
#include <map>
#include <nlohmann/json.hpp>
#include <string>
#include <vector>

#include "tests/agent_fixture.h"
#include "tests/support/catch_all_pattern.h"
#include "tests/support/headless_chromium.h"
#include "tests/support/sm3_records.h"
#include "tests/support/test_util.h"

namespace q7test {
namespace {

// Per canvas, the pixels drawn in colour (opaque, far from grey: bars and arcs, not axes or
// text; the legend's boxes alone stay well below the least a chart with data shows), and a hash
// of the whole picture, which tells whether a chart was drawn again with other data.
constexpr char kCanvases[] = R"JS((() => {
  const canvases = {};
  for (const canvas of document.querySelectorAll('canvas')) {
    const {data} = canvas.getContext('2d').getImageData(0, 0, canvas.width, canvas.height);
    let coloured = 0;
    let hash = 2166136261;
    for (let i = 0; i < data.length; i += 4) {
      const high = Math.max(data[i], data[i + 1], data[i + 2]);
      const low = Math.min(data[i], data[i + 1], data[i + 2]);
      coloured += data[i + 3] > 200 && high - low > 60 ? 1 : 0;
      hash = Math.imul(hash ^ (data[i] | data[i + 1] << 8 | data[i + 2] << 16), 16777619) >>> 0;
    }
    canvases[canvas.id] = {coloured, hash};
  }
  return canvases;
})())JS";
constexpr const char* kCharts[] = {"chart-outcomes", "chart-split", "chart-status"};
constexpr long kLeastColouredPixels = 2000;

// The rows of a rendered table as key (the row's data attribute) -> its request count.
std::string RenderedCounts(const std::string& table, const std::string& key) {
  return "Object.fromEntries([...document.querySelectorAll('#" + table +
         " tbody tr')].map((r) => [r.dataset." + key +
         ", r.querySelector('td:nth-child(2)').textContent.replace(/\\D/g, '')]))";
}

// The centre of the first element matching selector, scrolled into view, as [x, y].
std::string CentreOf(const std::string& selector) {
  return "(() => { const e = document.querySelector(" + nlohmann::json(selector).dump() +
         "); e.scrollIntoView({block: 'center'}); const r = e.getBoundingClientRect();"
         " return [r.x + r.width / 2, r.y + r.height / 2]; })()";
}

class DashboardE2ETest : public AgentE2ETest {
 protected:
  void SetUp() override {
    if (HeadlessChromium::Path().empty()) {
      GTEST_SKIP() << "chromium is not installed (apt-get install chromium)";
    }
    // The home's share/dashboard/, as make install lays it out.
    std::filesystem::create_directories(home_.path() + "share");
    std::filesystem::copy(Q7_DASHBOARD_DIR, home_.path() + "share/dashboard",
                          std::filesystem::copy_options::recursive);
    std::filesystem::create_directories(outputDir());
    extraEnv_["Q7_TRACE"] = "*=ERROR";
  }

  static std::string outputDir() { return std::string(Q7_TEST_OUTPUT_DIR) + "/dashboard/"; }

  // A browser of the test's own; the test fails at once when it cannot start.
  std::unique_ptr<HeadlessChromium> openBrowser() {
    std::string error;
    auto browser = std::make_unique<HeadlessChromium>(home_.path() + "chromium",
                                                      home_.path() + "chromium.log", &error);
    EXPECT_TRUE(browser->started()) << error << "\n" << readFile(home_.path() + "chromium.log");
    return browser;
  }

  // Appends generated records stamped from now to the data file; their pages by application go
  // to pages_.
  void feed(const std::string& data, int records, int seed) {
    const std::string batch = home_.path() + "batch.sm3";
    std::string output;
    ASSERT_EQ(0, runProgram(SM3GEN_PATH,
                            {"--out", batch, "--records", std::to_string(records), "--sites", "3",
                             "--seed", std::to_string(seed), "--rate", "100000", "--start",
                             std::to_string(time(nullptr))},
                            {}, &output))
        << output;
    std::string error;
    for (const Record& record : ReadRecords(batch, &error)) {
      if (record.tag == "hpage") {
        ++pages_[ApplicationOf(record)];
      }
    }
    ASSERT_EQ("", error);
    std::ofstream(data + "/feed.sm3", std::ios::app) << readFile(batch);
  }

  // A sample's request counts summed by one column, as text (the page shows digits).
  std::map<std::string, std::string> requestsBy(const std::string& address, const std::string& path,
                                                const std::string& column) {
    int status = 0;
    const nlohmann::json body = get(address, path, &status);
    EXPECT_EQ(200, status) << path;
    std::map<std::string, long> sums;
    for (const auto& row : body["rows"]) {
      sums[row[column].get<std::string>()] += row["totreq"].get<long>();
    }
    std::map<std::string, std::string> texts;
    for (const auto& [key, sum] : sums) {
      texts[key] = std::to_string(sum);
    }
    return texts;
  }

  static std::map<std::string, std::string> asMap(const nlohmann::json& object) {
    return object.get<std::map<std::string, std::string>>();
  }

  static std::string where(const std::string& condition) {
    std::string encoded;
    for (const char c : condition) {
      encoded += c == ' ' ? "%20" : std::string(1, c);
    }
    return "?where=" + encoded;
  }

  std::map<std::string, long> pages_;
};

// The overview shows every application with the API's request counts (those of the generated
// traffic), the three charts are drawn, a click on an application lists its transactions and a
// click on a transaction its embedded objects, each as the API counts them, and a phone's
// screen needs no sideways scrolling; the page reports no error throughout.
TEST_F(DashboardE2ETest, ShowsWhatTheApiGivesAndDrillsDown) {
  const std::string data = useDataDirectory();
  registerCatchAllPattern();
  const std::string address = start();
  feed(data, 1500, 31);
  ASSERT_TRUE(waitForIntakeIdle(address, data + "/feed.sm3", 20s));

  const auto apps = requestsBy(address, "/api/v1/tables/Q7APPSM", "applicatin");
  std::map<std::string, std::string> truth;
  for (const auto& [app, n] : pages_) {
    truth[app] = std::to_string(n);
  }
  ASSERT_EQ(truth, apps) << "the API itself disagrees with the generated traffic";

  auto browser = openBrowser();
  ASSERT_TRUE(browser->started());
  std::string error;
  ASSERT_TRUE(browser->SetViewport(1280, 900, false, &error)) << error;
  ASSERT_TRUE(browser->Navigate("http://" + address + "/", &error)) << error;
  ASSERT_TRUE(browser->WaitUntil("document.body.dataset.refreshes >= 1", 15s))
      << ::testing::PrintToString(browser->errors());

  auto rendered = browser->Evaluate(RenderedCounts("apps", "app"), &error);
  ASSERT_TRUE(rendered) << error;
  EXPECT_EQ(apps, asMap(*rendered));
  const auto overview = browser->Evaluate(kCanvases, &error);
  ASSERT_TRUE(overview) << error;
  for (const char* chart : kCharts) {
    EXPECT_GE((*overview)[chart].value("coloured", 0L), kLeastColouredPixels) << chart << " blank";
  }
  EXPECT_TRUE(browser->Screenshot(outputDir() + "dashboard.png", &error)) << error;

  // The busiest application, clicked as a user does.
  const auto first =
      browser->Evaluate("document.querySelector('#apps tbody tr').dataset.app", &error);
  ASSERT_TRUE(first && first->is_string()) << error;
  const std::string app = first->get<std::string>();
  auto at = browser->Evaluate(CentreOf("#apps tbody tr td:nth-child(2)"), &error);
  ASSERT_TRUE(at) << error;
  ASSERT_TRUE(browser->Click((*at)[0], (*at)[1], &error)) << error;
  ASSERT_TRUE(browser->WaitUntil(
      "!document.getElementById('detail').hidden && document.getElementById('detail-name')"
      ".textContent === " +
          nlohmann::json(app).dump() +
          " && document.querySelectorAll('#transactions tbody tr').length > 0",
      3s));
  // The charts turned to the application, drawn again in place.
  const auto detail = browser->Evaluate(kCanvases, &error);
  ASSERT_TRUE(detail) << error;
  for (const char* chart : kCharts) {
    EXPECT_GE((*detail)[chart].value("coloured", 0L), kLeastColouredPixels) << chart << " blank";
    EXPECT_NE((*overview)[chart]["hash"], (*detail)[chart]["hash"]) << chart << " not redrawn";
  }
  const auto transactions =
      requestsBy(address, "/api/v1/tables/Q7TXSM" + where("applicatin EQ " + app), "transactn");
  rendered = browser->Evaluate(RenderedCounts("transactions", "transaction"), &error);
  ASSERT_TRUE(rendered) << error;
  const auto shown = asMap(*rendered);
  EXPECT_EQ(std::min<std::size_t>(50, transactions.size()), shown.size());
  for (const auto& [name, requests] : shown) {
    EXPECT_EQ(transactions.count(name) ? transactions.at(name) : "absent", requests) << name;
  }

  // The first transaction whose pages had embedded objects, clicked: its objects as the API
  // counts them for those pages.
  int status = 0;
  std::string tx;
  std::map<std::string, std::string> objects;
  for (const auto& [name, requests] : shown) {
    const nlohmann::json rows = get(address,
                                    "/api/v1/tables/Q7TXSM" + where("applicatin EQ " + app) + "&" +
                                        where("transactn EQ " + name).substr(1),
                                    &status)["rows"];
    const std::string root = rows.empty() ? "" : rows[0]["rootuuid"].get<std::string>();
    objects =
        requestsBy(address, "/api/v1/tables/Q7SUBTXSM" + where("rootuuid EQ " + root), "transactn");
    if (!objects.empty()) {
      tx = name;
      break;
    }
  }
  ASSERT_FALSE(tx.empty()) << "no transaction of " << app << " has embedded objects";
  at = browser->Evaluate(
      CentreOf("#transactions tr[data-transaction=" + nlohmann::json(tx).dump() + "] a"), &error);
  ASSERT_TRUE(at) << error;
  ASSERT_TRUE(browser->Click((*at)[0], (*at)[1], &error)) << error;
  ASSERT_TRUE(browser->WaitUntil(
      "document.getElementById('subtransactions-of').textContent === " +
          nlohmann::json("of " + tx).dump() +
          " && document.querySelectorAll('#subtransactions tbody tr').length > 0",
      3s));
  rendered = browser->Evaluate(RenderedCounts("subtransactions", "object"), &error);
  ASSERT_TRUE(rendered) << error;
  EXPECT_EQ(std::min<std::size_t>(20, objects.size()), rendered->size());
  for (const auto& [name, requests] : asMap(*rendered)) {
    EXPECT_EQ(objects.count(name) ? objects.at(name) : "absent", requests) << name;
  }
  EXPECT_TRUE(browser->Screenshot(outputDir() + "dashboard-detail.png", &error)) << error;

  // An alert on every application with a request: the alert list shows each, as the API does.
  std::string reply;
  ASSERT_EQ(201, send(address, "PUT", "/api/v1/situations/Busy",
                      R"({"table": "Q7APPSM", "conditions": [{"column": "totreq", "op": "GE",
                          "value": "1"}], "every": 1, "severity": "critical"})",
                      token(), &reply))
      << reply;
  std::size_t open = 0;
  ASSERT_TRUE(waitFor(
      [&] {
        open = get(address, "/api/v1/alerts", &status)["open"].size();
        return open > 0 && open == get(address, "/api/v1/tables/Q7APPSM", &status)["rows"].size();
      },
      10s));
  EXPECT_TRUE(
      browser->WaitUntil("document.querySelectorAll('#alerts tbody tr.alert.critical')"
                         ".length === " +
                             std::to_string(open),
                         10s));

  // A phone: the page fits its width (wide tables scroll in their own boxes).
  ASSERT_TRUE(browser->SetViewport(390, 844, true, &error)) << error;
  EXPECT_TRUE(
      browser->WaitUntil("new Promise((done) => requestAnimationFrame(() => "
                         "done(document.documentElement.scrollWidth <= window.innerWidth)))",
                         5s));
  EXPECT_TRUE(browser->Screenshot(outputDir() + "dashboard-phone.png", &error)) << error;

  EXPECT_TRUE(browser->errors().empty()) << ::testing::PrintToString(browser->errors());
  stopWith(SIGTERM);
}

// Off loopback the page itself loads without a token, asks for it when the API answers 401,
// sends it from then on and keeps it for the next visit.
TEST_F(DashboardE2ETest, AsksForTheTokenOffLoopbackAndKeepsIt) {
  extraEnv_["Q7_HTTP_ADDRESS"] = "0.0.0.0:0";
  const std::string address = start();
  const std::string url = "http://127.0.0.1" + address.substr(address.rfind(':')) + "/";
  auto browser = openBrowser();
  ASSERT_TRUE(browser->started());
  std::string error;
  ASSERT_TRUE(browser->Navigate(url, &error)) << error;
  ASSERT_TRUE(browser->WaitUntil("document.getElementById('token-dialog').open", 10s));
  ASSERT_TRUE(browser->Evaluate(
      "document.getElementById('token-input').value = " + nlohmann::json(token()).dump() +
          "; document.querySelector('#token-dialog button[value=save]')"
          ".click(); true",
      &error))
      << error;
  EXPECT_TRUE(browser->WaitUntil("document.body.dataset.refreshes >= 1", 10s));

  ASSERT_TRUE(browser->Navigate(url, &error)) << error;
  EXPECT_TRUE(browser->WaitUntil("document.body.dataset.refreshes >= 1", 10s));
  EXPECT_EQ(false, browser->Evaluate("document.getElementById('token-dialog').open", &error));
  // The first visit's refused API requests are the only failures.
  EXPECT_FALSE(browser->errors().empty());
  for (const std::string& failure : browser->errors()) {
    EXPECT_NE(std::string::npos, failure.find("401")) << failure;
  }
  stopWith(SIGTERM);
}

// The checks bite: a page whose chart library is missing reports errors and renders nothing.
TEST_F(DashboardE2ETest, ABrokenPageIsCaught) {
  std::filesystem::remove(home_.path() + "share/dashboard/vendor/chart.min.js");
  const std::string address = start();
  auto browser = openBrowser();
  ASSERT_TRUE(browser->started());
  std::string error;
  ASSERT_TRUE(browser->Navigate("http://" + address + "/", &error)) << error;
  EXPECT_TRUE(PollUntil(
      [&] { return browser->Evaluate("0", &error) && browser->errors().size() >= 2; }, 10s))
      << ::testing::PrintToString(browser->errors());
  EXPECT_EQ(false, browser->Evaluate("document.body.dataset.refreshes >= 1", &error));
  stopWith(SIGTERM);
}

}  // namespace
}  // namespace q7test
