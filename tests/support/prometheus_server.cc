#include "tests/support/prometheus_server.h"

#include <httplib.h>

#include <filesystem>
#include <fstream>
#include <sstream>

#include "tests/support/nginx_server.h"
#include "tests/support/test_util.h"

namespace q7test {
namespace {

std::string ReadAll(const std::string& path) {
  std::ifstream in(path);
  std::ostringstream text;
  text << in.rdbuf();
  return text.str();
}

}  // namespace

PrometheusServer::PrometheusServer(std::string dir) : dir_(std::move(dir)) {
  std::filesystem::create_directories(dir_);
}

PrometheusServer::~PrometheusServer() {
  if (process_ && process_->running()) {
    process_->signal(SIGTERM);
    process_->wait(std::chrono::seconds(5));
  }
}

void PrometheusServer::writeFile(const std::string& relative, const std::string& content) const {
  const std::filesystem::path path = dir_ + "/" + relative;
  std::filesystem::create_directories(path.parent_path());
  std::ofstream(path) << content;
}

std::string PrometheusServer::log() const {
  return ReadAll(dir_ + "/prometheus.log");
}

bool PrometheusServer::Start(const std::string& config, std::string* error) {
  writeFile("prometheus.yml", config);
  port_ = FreeLoopbackPort();
  process_ = std::make_unique<ChildProcess>(
      std::vector<std::string>{"/usr/bin/prometheus", "--config.file=" + dir_ + "/prometheus.yml",
                               "--storage.tsdb.path=" + dir_ + "/data",
                               "--web.listen-address=127.0.0.1:" + std::to_string(port_),
                               "--log.level=warn"},
      dir_ + "/prometheus.log", dir_ + "/prometheus.log");
  if (!process_->started()) {
    *error = "cannot run /usr/bin/prometheus (make deps installs it)";
    return false;
  }
  httplib::Client client("127.0.0.1", port_);
  client.set_connection_timeout(1);
  bool exited = false;
  const bool ready = PollUntil(
      [&] {
        exited = !process_->running();
        if (exited) {
          return true;
        }
        const auto res = client.Get("/-/ready");
        return res && res->status == 200;
      },
      std::chrono::seconds(30));
  if (ready && !exited) {
    return true;
  }
  *error = (exited ? "prometheus exited: " : "prometheus not ready within 30 s: ") + log();
  return false;
}

nlohmann::json PrometheusServer::query(const std::string& promql, std::string* error) const {
  httplib::Client client("127.0.0.1", port_);
  const auto res = client.Get("/api/v1/query", httplib::Params{{"query", promql}}, {});
  if (!res) {
    if (error != nullptr)
      *error = "no reply";
    return nlohmann::json::array();
  }
  const nlohmann::json body = nlohmann::json::parse(res->body, nullptr, false);
  if (res->status != 200 || !body.is_object() || body.value("status", "") != "success") {
    if (error != nullptr)
      *error = res->body;
    return nlohmann::json::array();
  }
  return body["data"]["result"];
}

nlohmann::json PrometheusServer::targets() const {
  httplib::Client client("127.0.0.1", port_);
  const auto res = client.Get("/api/v1/targets");
  nlohmann::json health = nlohmann::json::object();
  if (!res) {
    return health;
  }
  const nlohmann::json body = nlohmann::json::parse(res->body, nullptr, false);
  if (!body.is_object()) {
    return health;
  }
  for (const auto& target : body["data"]["activeTargets"]) {
    health[target.value("scrapeUrl", "")] = {{"health", target.value("health", "")},
                                             {"lastError", target.value("lastError", "")}};
  }
  return health;
}

}  // namespace q7test
