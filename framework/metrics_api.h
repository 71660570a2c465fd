#pragma once

// The metrics endpoints of the HTTP API, served from what the agent provides:
//   GET /api/v1/latency   percentiles and apdex per application or transaction:
//                         ?by=application|transaction (default application),
//                         ?window=interval|summary (default summary), ?where=COLUMN OP VALUE
//                         (repeatable, ANDed) on any column of the answer
//   GET /metrics          the Prometheus text exposition (0.0.4)
// Without a provider (no agent registered one) both answer 503.
//
// Thread safety: the setters from any thread (the agent sets them at start-up and clears them
// before it goes); the handlers run on the server's pool threads and call a copy of the
// provider outside any lock.

#include <cstdint>
#include <functional>
#include <string>
#include <vector>

#include "framework/prometheus_text.h"

namespace httplib {
class Server;
}

namespace fw {

// One key's latency over a window.
struct LatencyRow {
  std::string application;
  std::string transaction;  // empty when by application
  std::uint64_t requests = 0;
  double p50_ms = 0;
  double p90_ms = 0;
  double p95_ms = 0;
  double p99_ms = 0;
  double max_ms = 0;
  double apdex = 1;
  std::int32_t threshold_ms = 0;
};

struct LatencyQuery {
  bool by_transaction = false;
  bool summary = true;
};

using LatencyProvider = std::function<std::vector<LatencyRow>(const LatencyQuery&)>;
using MetricsProvider = std::function<void(PrometheusText&)>;

void SetLatencyProvider(LatencyProvider provider);
void SetMetricsProvider(MetricsProvider provider);
// The framework's own series (alerts, webhooks), written after the agent's; the main loop sets
// and clears it.
void SetFrameworkMetrics(MetricsProvider provider);

void InstallMetricsRoutes(httplib::Server& server);

}  // namespace fw
