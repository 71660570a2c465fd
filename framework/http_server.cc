#include "framework/http_server.h"

#include <httplib.h>

#include <cerrno>
#include <chrono>
#include <cstring>
#include <nlohmann/json.hpp>
#include <optional>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "framework/agent_runtime.h"
#include "framework/alerts_api.h"
#include "framework/api_token.h"
#include "framework/events_api.h"
#include "framework/http_json.h"
#include "framework/metrics_api.h"
#include "framework/mutex.h"
#include "framework/runtime_state.h"
#include "framework/sample_query.h"
#include "framework/situations_api.h"
#include "framework/status.h"
#include "framework/table_sample.h"
#include "framework/tables.h"
#include "framework/trace.h"

namespace fw {
namespace {

constexpr char kUnit[] = "http";
constexpr std::size_t kMaxBodyBytes = 64 * 1024;
constexpr std::size_t kWorkerThreads = 16;
// Samples of more rows are sent in chunks of this many rows, each written as the last is sent.
constexpr int kStreamedRows = 512;

const auto kProcessStart = std::chrono::steady_clock::now();

// The API's own paths: reading them off loopback needs the token, whatever files are served.
bool IsApiPath(const std::string& path) {
  for (const char* prefix : {"/api", "/metrics", "/healthz"}) {
    if (path.rfind(prefix, 0) == 0) {
      return true;
    }
  }
  return false;
}

nlohmann::json AgentInfo() {
  nlohmann::json info;
  const auto uptime = std::chrono::duration_cast<std::chrono::seconds>(
      std::chrono::steady_clock::now() - kProcessStart);
  info["product"] = "Q7";
  info["version"] = ProductVersion();
  info["node_type"] = NodeType();
  info["host_name"] = HostName();
  info["origin_node"] = OriginNodeName();
  info["affinities"] = Affinities();
  info["uptime_seconds"] = uptime.count();
  std::function<void(nlohmann::json&)> provider;
  {
    MutexLock lock(State().mutex);
    provider = State().info_provider;
  }
  if (provider) {
    provider(info);
  }
  return info;
}

nlohmann::json Health() {
  nlohmann::json health{{"status", "ok"}};
  std::function<void(nlohmann::json&)> provider;
  {
    MutexLock lock(State().mutex);
    provider = State().health_provider;
  }
  if (provider) {
    provider(health);
  }
  return health;
}

nlohmann::json Tables() {
  nlohmann::json tables = nlohmann::json::array();
  for (const auto& table : ListTables()) {
    nlohmann::json columns = nlohmann::json::array();
    for (const ColumnInfo& column : table->columns) {
      columns.push_back({{"name", column.name},
                         {"type", column.type},
                         {"width", column.width},
                         {"offset", column.offset}});
    }
    tables.push_back({{"name", table->name}, {"columns", std::move(columns)}});
  }
  return nlohmann::json{{"tables", std::move(tables)}};
}

// GET /api/v1/tables/{TABLE}: one sample, filtered, limited and formatted as the query asks.
void ServeSample(const httplib::Request& req, httplib::Response& res) {
  const std::string name = req.matches[1];
  const std::shared_ptr<const TableDefinition> table = FindTable(name);
  if (table == nullptr) {
    ReplyError(res, 404, "no table named " + name);
    return;
  }
  std::string error;
  std::vector<Condition> conditions;
  for (std::size_t i = 0; i < req.get_param_value_count("where"); ++i) {
    Condition condition;
    if (ParseWhere(req.get_param_value("where", i), table->columns, &condition, &error) != kOk) {
      ReplyError(res, 400, error);
      return;
    }
    conditions.push_back(std::move(condition));
  }
  std::optional<std::size_t> limit;
  SampleFormat format = SampleFormat::kJson;
  for (const char* key : {"limit", "format"}) {
    if (req.get_param_value_count(key) > 1) {
      ReplyError(res, 400, std::string(key) + " given more than once");
      return;
    }
  }
  if (req.has_param("limit")) {
    std::size_t value = 0;
    if (ParseLimit(req.get_param_value("limit"), &value, &error) != kOk) {
      ReplyError(res, 400, error);
      return;
    }
    limit = value;
  }
  if (req.has_param("format") &&
      ParseSampleFormat(req.get_param_value("format"), &format, &error) != kOk) {
    ReplyError(res, 400, error);
    return;
  }

  // The limit goes into the sample itself, so that no row past it is copied or written.
  Sample sample;
  const int status =
      SampleTable(table->name, std::move(conditions), &sample, &error, limit.value_or(kNoRowLimit));
  if (status != kOk) {
    ReplyError(res, status == kNotFound ? 404 : 500, error);
    return;
  }
  if (format == SampleFormat::kCsv) {
    res.status = 200;
    res.set_content(SampleToCsv(sample), "text/csv");
  } else if (sample.row_count() <= kStreamedRows) {
    ReplyJsonText(res, 200, SampleToJsonText(sample));
  } else {
    // Written while it is sent: the client reads the first rows while the rest are written.
    struct Streamed {
      explicit Streamed(Sample s) : sample(std::move(s)), writer(sample) {}
      const Sample sample;
      SampleJsonWriter writer;
      std::string piece;
    };
    auto streamed = std::make_shared<Streamed>(std::move(sample));
    res.status = 200;
    res.set_chunked_content_provider(
        "application/json", [streamed](std::size_t, httplib::DataSink& sink) {
          streamed->piece.clear();
          if (!streamed->writer.Next(&streamed->piece, kStreamedRows)) {
            sink.done();
            return true;
          }
          return sink.write(streamed->piece.data(), streamed->piece.size());
        });
  }
}

}  // namespace

HttpServer::HttpServer() = default;

HttpServer::~HttpServer() {
  Stop();
}

bool HttpServer::ParseAddress(const std::string& address, std::string* host, int* port) {
  const auto colon = address.rfind(':');
  if (colon == std::string::npos || colon + 1 >= address.size()) {
    return false;
  }
  std::string h = address.substr(0, colon);
  if (h.size() >= 2 && h.front() == '[' && h.back() == ']') {
    h = h.substr(1, h.size() - 2);
  }
  if (h.empty()) {
    return false;
  }
  const std::string p = address.substr(colon + 1);
  if (p.size() > 5 || p.find_first_not_of("0123456789") != std::string::npos) {
    return false;
  }
  const int value = std::stoi(p);
  if (value > 65535) {
    return false;
  }
  *host = h;
  *port = value;
  return true;
}

void HttpServer::InstallRoutes(bool loopback) {
  httplib::Server& s = *server_;
  // Changes always need the token; on an address others can reach, so does reading, except
  // the dashboard's files, which hold no data (its requests to the API carry the token).
  s.set_pre_routing_handler([this, loopback](const httplib::Request& req, httplib::Response& res) {
    const bool change = req.method != "GET" && req.method != "HEAD";
    if (!change && !static_dir_.empty() && !IsApiPath(req.path)) {
      return httplib::Server::HandlerResponse::Unhandled;
    }
    if ((change || !loopback) &&
        !BearerMatches(req.get_header_value("Authorization"), api_token_)) {
      Q7_TRACE(kUnit, kTraceError, "%s %s refused: missing or wrong bearer token",
               req.method.c_str(), req.path.c_str());
      ReplyError(res, 401,
                 "this request needs \"Authorization: Bearer <token>\" with the token "
                 "in the configuration directory's q7_api_token");
      return httplib::Server::HandlerResponse::Handled;
    }
    return httplib::Server::HandlerResponse::Unhandled;
  });
  s.new_task_queue = [] { return new httplib::ThreadPool(kWorkerThreads); };
  s.set_keep_alive_timeout(1);
  s.set_payload_max_length(kMaxBodyBytes);
  s.set_error_handler([](const httplib::Request& req, httplib::Response& res) {
    // cpp-httplib's own replies (404 for unknown paths, 413 for big bodies) are not JSON.
    if (res.body.empty()) {
      std::string message = "HTTP status " + std::to_string(res.status);
      if (res.status == 404) {
        message = "no such endpoint: " + req.method + " " + req.path;
      } else if (res.status == 413) {
        message = "request body larger than 64 KiB";
      }
      ReplyError(res, res.status, message);
    }
  });
  s.set_exception_handler(
      [](const httplib::Request& req, httplib::Response& res, std::exception_ptr ep) {
        std::string what = "unknown error";
        try {
          std::rethrow_exception(ep);
        } catch (const std::exception& e) {
          what = e.what();
        } catch (...) {
        }
        Q7_TRACE(kUnit, kTraceError, "%s %s failed: %s", req.method.c_str(), req.path.c_str(),
                 what.c_str());
        ReplyError(res, 500, "internal error: " + what);
      });
  s.Get("/healthz",
        [](const httplib::Request&, httplib::Response& res) { ReplyJson(res, 200, Health()); });
  s.Get("/api/v1/agent",
        [](const httplib::Request&, httplib::Response& res) { ReplyJson(res, 200, AgentInfo()); });
  s.Get("/api/v1/tables",
        [](const httplib::Request&, httplib::Response& res) { ReplyJson(res, 200, Tables()); });
  s.Get(R"(/api/v1/tables/([A-Za-z0-9_]+))", ServeSample);
  InstallSituationRoutes(s);
  InstallEventRoutes(s);
  InstallMetricsRoutes(s);
  if (alerts_ != nullptr) {
    InstallAlertRoutes(s, alerts_);
  }
}

int HttpServer::Start(const std::string& address, std::string* error) {
  if (thread_.joinable()) {
    *error = "the HTTP server is already running";
    return kAlreadyRunning;
  }
  std::string host;
  int port = 0;
  if (!ParseAddress(address, &host, &port)) {
    *error = "\"" + address + "\" is not an address of the form host:port";
    return kInvalidArgument;
  }
  if (tls()) {
    auto secure = std::make_unique<httplib::SSLServer>(tls_certificate_.c_str(), tls_key_.c_str());
    if (!secure->is_valid()) {
      *error = "cannot load the TLS certificate " + tls_certificate_ + " and key " + tls_key_ +
               " (PEM files, the key matching the certificate)";
      return kInvalidArgument;
    }
    server_ = std::move(secure);
  } else {
    server_ = std::make_unique<httplib::Server>();
  }
  // The file handler runs before the routes, for files that exist; no-cache has browsers ask
  // again, so an upgraded dashboard is never mixed with an old one.
  if (!static_dir_.empty() &&
      !server_->set_mount_point("/", static_dir_, {{"Cache-Control", "no-cache"}})) {
    Q7_TRACE(kUnit, kTraceError, "cannot serve the files of %s: serving the API only",
             static_dir_.c_str());
    static_dir_.clear();
  }
  InstallRoutes(IsLoopbackHost(host));
  if (port == 0) {
    port = server_->bind_to_any_port(host.c_str());
    if (port < 0) {
      *error = "cannot bind any port on " + host;
      return kIoError;
    }
  } else if (!server_->bind_to_port(host.c_str(), port)) {
    *error = "cannot bind " + address + ": " + std::strerror(errno);
    return kIoError;
  }
  bound_address_ = std::string(tls() ? "https://" : "") +
                   (host.find(':') != std::string::npos ? "[" + host + "]" : host) + ":" +
                   std::to_string(port);
  thread_ = std::thread([this] {
    SetThreadName("HTTP Server");
    server_->listen_after_bind();
  });
  // stop() is ignored until the listen loop runs, so a stop right after Start would hang the
  // join: do not report success before the loop is up.
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(5);
  while (!server_->is_running() && std::chrono::steady_clock::now() < deadline) {
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }
  return kOk;
}

void HttpServer::Stop() {
  if (!thread_.joinable()) {
    return;
  }
  EndEventStreams(*server_);  // stop() waits for the worker threads that streams hold
  server_->stop();
  thread_.join();
}

}  // namespace fw
