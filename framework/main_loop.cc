// The framework main loop.

#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <string>
#include <vector>

#include "framework/agent_runtime.h"
#include "framework/alert_book.h"
#include "framework/alert_sampler.h"
#include "framework/api_token.h"
#include "framework/atomic_file.h"
#include "framework/environment.h"
#include "framework/http_server.h"
#include "framework/metrics_api.h"
#include "framework/mutex.h"
#include "framework/runtime_state.h"
#include "framework/situations.h"
#include "framework/status.h"
#include "framework/trace.h"

namespace {

constexpr char kUnit[] = "framework";
constexpr char kDefaultHttpAddress[] = "127.0.0.1:7420";

// Writes the bound address where tests and q7ctl find it, replaced whole, so a reader never
// sees half a line.
void WriteAddressFile(const std::string& path, const std::string& address) {
  std::string error;
  if (fw::ReplaceFile(path, address + "\n", {}, nullptr, &error) != fw::kOk) {
    Q7_TRACE(kUnit, fw::kTraceError, "%s", error.c_str());
  }
}

std::string AddressFilePath() {
  std::string home;
  if (fw::GetHomeDirectory(&home) != fw::kOk) {
    return "";
  }
  const std::string logs = home + "logs/";
  ::mkdir(logs.c_str(), 0755);
  return logs + "q7agent.addr";
}

// An API others can reach over plain HTTP gives away the token with every change it accepts.
void WarnIfPlainOffLoopback(const fw::HttpServer& server, const std::string& address) {
  std::string host;
  int port = 0;
  if (!server.tls() && fw::HttpServer::ParseAddress(address, &host, &port) &&
      !fw::IsLoopbackHost(host)) {
    fw::TracePrintfAlways(kUnit, fw::kTraceWarning, __func__,
                          "Warning: the HTTP API on %s is reachable from other hosts over plain "
                          "HTTP: the bearer token and every reply travel in clear. Set "
                          "Q7_TLS_CERT and Q7_TLS_KEY to serve HTTPS.",
                          server.bound_address().c_str());
  }
}

// True once the agent says its analyzer has restored its saved data (health "analyzer" is
// "running", not "starting"); true without an agent's word.
bool AgentRestored() {
  std::function<void(nlohmann::json&)> provider;
  {
    fw::MutexLock lock(fw::State().mutex);
    provider = fw::State().health_provider;
  }
  if (!provider) {
    return true;
  }
  nlohmann::json health = nlohmann::json::object();
  provider(health);
  return health.value("analyzer", "running") != "starting";
}

// Situations stopped, or dropped from the list, while the agent was down: their open alerts
// clear now rather than stay open for good.
void ForgetStoppedAlertSituations(const fw::AlertBook& alerts, fw::AlertSampler* sampler) {
  const std::vector<fw::SituationInfo> started = fw::ListSituations();
  for (const std::string& name : alerts.Situations()) {
    const bool alerting = std::any_of(started.begin(), started.end(), [&](const auto& info) {
      return info.name == name && info.alert.has_value();
    });
    if (!alerting) {
      sampler->SituationStopped(name);
    }
  }
}

// The dashboard's files, <home>share/dashboard/, when they are installed; without them the
// API is served alone, which is no fault (a build tree or a home laid out by hand).
void ServeDashboard(fw::HttpServer* server) {
  std::string home;
  if (fw::GetHomeDirectory(&home) != fw::kOk) {
    return;
  }
  const std::string dir = home + "share/dashboard/";
  struct stat st {};
  if (::stat(dir.c_str(), &st) != 0 || !S_ISDIR(st.st_mode)) {
    Q7_TRACE(kUnit, fw::kTraceSummary, "no dashboard in %s: serving the API only", dir.c_str());
    return;
  }
  server->ServeStatic(dir);
  Q7_TRACE(kUnit, fw::kTraceSummary, "dashboard served from %s", dir.c_str());
}

}  // namespace

int kunmain(int /*argc*/, char** /*argv*/) {
  Q7_FLOW(kUnit);
  fw::AgentLoader loader = nullptr;
  {
    fw::MutexLock lock(fw::State().mutex);
    loader = fw::State().loader;
  }
  if (loader != nullptr) {
    const int rc = loader();
    Q7_TRACE(kUnit, fw::kTraceDetail, "agent loader returned %d", rc);
  } else {
    Q7_TRACE(kUnit, fw::kTraceError, "no agent loader is registered");
  }

  std::string error;
  std::string config_dir;
  std::string token;
  const bool has_config = fw::GetConfigDirectory(&config_dir) == fw::kOk;
  if (has_config) {
    ::mkdir(config_dir.c_str(), 0755);  // a first start in a fresh home
  }
  // Alerts: situations on row tables are sampled by the sampler, which the situations tell of
  // every start and stop; open alerts and recent changes are kept in the book's file.
  fw::AlertBook alerts(has_config ? config_dir + "q7_alerts.json" : "");
  if (alerts.Load(&error) != fw::kOk) {
    fw::TracePrintfAlways(kUnit, fw::kTraceError, __func__, "%s", error.c_str());
  }
  fw::WebhookSender webhooks;
  fw::AlertSampler sampler(&alerts, &webhooks, AgentRestored);
  fw::SetSituationListener(&sampler);
  if (has_config) {
    fw::SetSituationsFile(config_dir + "q7_situations.json");
    const int restored = fw::RestoreSituations();
    Q7_TRACE(kUnit, fw::kTraceSummary, "%d situations restored", restored);
    ForgetStoppedAlertSituations(alerts, &sampler);
    if (fw::LoadOrCreateApiToken(config_dir + "q7_api_token", &token, &error) != fw::kOk) {
      // Reading still works on a loopback address; changes are refused until this is fixed.
      fw::TracePrintfAlways(kUnit, fw::kTraceError, __func__, "%s", error.c_str());
    }
  } else {
    fw::TracePrintfAlways(kUnit, fw::kTraceWarning, __func__,
                          "no configuration directory: situations are not kept across restarts "
                          "and the API accepts no changes");
  }

  std::string address;
  if (!fw::GetEnv("Q7_HTTP_ADDRESS", &address) || address.empty()) {
    address = kDefaultHttpAddress;
  }
  sampler.Start();
  fw::SetFrameworkMetrics([&sampler](fw::PrometheusText& text) { sampler.WriteMetrics(text); });
  fw::HttpServer server;
  server.SetApiToken(token);
  server.ServeAlerts(&alerts);
  ServeDashboard(&server);
  std::string address_file;
  std::string certificate;
  std::string key;
  const bool hasCertificate = fw::GetEnv("Q7_TLS_CERT", &certificate) && !certificate.empty();
  const bool hasKey = fw::GetEnv("Q7_TLS_KEY", &key) && !key.empty();
  if (hasCertificate != hasKey) {
    // Never fall back to plain HTTP when TLS was asked for: the token would travel in clear.
    fw::TracePrintfAlways(kUnit, fw::kTraceError, __func__,
                          "HTTP API not started: Q7_TLS_CERT and Q7_TLS_KEY must be set "
                          "together (certificate and private key, PEM)");
  } else {
    if (hasCertificate) {
      server.UseTls(certificate, key);
    }
    if (server.Start(address, &error) == fw::kOk) {
      Q7_TRACE(kUnit, fw::kTraceSummary, "HTTP API listening on %s",
               server.bound_address().c_str());
      WarnIfPlainOffLoopback(server, address);
      address_file = AddressFilePath();
      if (!address_file.empty()) {
        WriteAddressFile(address_file, server.bound_address());
      }
    } else {
      // The agent still collects and keeps history without its API; say so loudly.
      fw::TracePrintfAlways(kUnit, fw::kTraceError, __func__,
                            "HTTP API not started (Q7_HTTP_ADDRESS=%s): %s", address.c_str(),
                            error.c_str());
    }
  }

  {
    fw::RuntimeState& state = fw::State();
    fw::MutexLock lock(state.shutdown_mutex);
    state.shutdown_cv.Wait(state.shutdown_mutex, [&state]() REQUIRES(state.shutdown_mutex) {
      return state.shutdown_requested;
    });
  }
  Q7_TRACE(kUnit, fw::kTraceSummary, "main loop leaving: stopping the HTTP API");
  server.Stop();
  if (!address_file.empty()) {
    std::remove(address_file.c_str());
  }
  // Stopping the agent never stops a situation: drop them without their destructors. Open
  // alerts stay open in their file for the next start.
  fw::ResetSituations();
  fw::SetFrameworkMetrics(nullptr);
  sampler.Stop();
  webhooks.Stop();
  return 0;
}
