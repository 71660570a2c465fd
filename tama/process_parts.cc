#include <algorithm>
#include <cstddef>
#include <nlohmann/json.hpp>
#include <tuple>

#include "core/analyzer/dpx_analyzer.h"
#include "core/history/history_store.h"
#include "core/messages/agent_message.h"
#include "q7tema/pattern_tables.h"
#include "q7tema/row_query.h"
#include "tama/agent.h"
#include "tama/agent_details.h"
#include "tama/service_monitor.h"

// The parts of the q7agent process, and the binding of the tables to the analyzer.

namespace tama {

namespace {

// Each exported table the analyzer answers samples through its query (the over-time
// pairings kept only as history have no table).
void installRowQueries() {
#define Q7_ROW_QUERY(name)                                                       \
  q7tema::SetRowQuery<kq7_q7##name##_data_t>([](int sampleType, int* count) {    \
    return CDPXAnalyzer::GetInstanceNoStart()->get_tbl##name(sampleType, count); \
  });
// Queries that copy no more rows than the sample wants.
#define Q7_LIMITED_ROW_QUERY(name)                                                          \
  q7tema::SetLimitedRowQuery<kq7_q7##name##_data_t>(                                        \
      [](int sampleType, std::size_t limit, int* count) {                                   \
        return CDPXAnalyzer::GetInstanceNoStart()->get_tbl##name(sampleType, count, limit); \
      });
#define Q7_ROW_QUERY_EXPORTED(name) Q7_LIMITED_ROW_QUERY(name)
#define Q7_ROW_QUERY_HISTORY_ONLY(name)
#define Q7_OVER_TIME_QUERY(name, Row, keys, Tree, EXPORT) Q7_ROW_QUERY_##EXPORT(name)
#define Q7_SUMMARY_QUERY(name, Row, keys, overTime) Q7_LIMITED_ROW_QUERY(name)
#define Q7_CURRENT_QUERY(name, overTime, COLUMNS) Q7_LIMITED_ROW_QUERY(name)
  Q7_ANALYZER_TABLES(Q7_OVER_TIME_QUERY, Q7_SUMMARY_QUERY, Q7_CURRENT_QUERY, Q7_ROW_QUERY)
#undef Q7_CURRENT_QUERY
#undef Q7_SUMMARY_QUERY
#undef Q7_OVER_TIME_QUERY
#undef Q7_ROW_QUERY_HISTORY_ONLY
#undef Q7_ROW_QUERY_EXPORTED
#undef Q7_ROW_QUERY
#undef Q7_LIMITED_ROW_QUERY
  q7tema::SetRowQuery<kq7_q7agntdts_data_t>(&getAgentDetailRows);
  q7tema::SetRowQuery<kq7_q7agntmsgs_data_t>(&getAgentMessageRows);
  q7tema::SetRowQuery<kq7_q7txptns_data_t>([](int sampleType, int* count) {
    return CDPXAnalyzer::GetInstanceNoStart()->getTransactionPatterns(sampleType, count);
  });
  q7tema::SetRowQuery<kq7_q7clntptns_data_t>([](int sampleType, int* count) {
    return CDPXAnalyzer::GetInstanceNoStart()->getClientPatterns(sampleType, count);
  });
}

// Situations on the pattern tables reach the analyzer's situation controller.
void installPatternHooks() {
  q7tema::PatternHooks hooks;
  hooks.registerTransaction = [](const char* situation, const char* applicationName,
                                 const char* applicationPattern, const char* transactionName,
                                 const char* transactionPattern, int16_t aggapsuniq,
                                 int16_t aggtxsuniq, int16_t collinstcs, int32_t sampercent,
                                 int32_t mrtthres, int16_t importance) {
    return CDPXAnalyzer::GetInstanceNoStart()->newTransactionPattern(
        situation, applicationName, applicationPattern, transactionName, transactionPattern,
        aggapsuniq, aggtxsuniq, collinstcs, sampercent, mrtthres, importance);
  };
  hooks.deregisterTransaction = [](const char* situation) {
    return CDPXAnalyzer::GetInstanceNoStart()->removeTransactionPattern(situation);
  };
  hooks.registerClient = [](const char* situation, const char* clientName,
                            const char* hostNamePattern, const char* ipAddressPattern,
                            int16_t agguniqly) {
    return CDPXAnalyzer::GetInstanceNoStart()->newClientPattern(
        situation, clientName, hostNamePattern, ipAddressPattern, agguniqly);
  };
  hooks.deregisterClient = [](const char* situation) {
    return CDPXAnalyzer::GetInstanceNoStart()->removeClientPattern(situation);
  };
  hooks.sendMessage = [](const char* key, int severity, const char* situation) {
    AgentMessage::sendMessage(key, severity, {situation});
  };
  q7tema::SetPatternHooks(std::move(hooks));
}

void describeAnalyzer(nlohmann::json& out) {
  CDPXAnalyzer* const analyzer = CDPXAnalyzer::GetInstanceIfStarted();
  if (analyzer == nullptr) {
    out["state"] = "not started";
    out["counters"] = nlohmann::json::object();
    return;
  }
  const int thread = analyzer->GetState();
  // "starting" until the run has restored its saved data: the tables are not whole before.
  out["state"] = thread == CvelThread::kStateRunning ? (analyzer->isShutdownRequested() ? "stopping"
                                                        : analyzer->isRestored()        ? "running"
                                                                                 : "starting")
                 : thread == CvelThread::kStateFinished ? "stopped"
                                                        : "not started";
  const IntakeCounters::Snapshot intake = analyzer->intakeCounters().snapshot();
  const CDPXAnalyzer::CheckpointStats& checkpoints = analyzer->getCheckpointStats();
  out["counters"] = {{"records_read", intake.recordsRead},
                     {"records_unparsed", intake.recordsUnparsed},
                     {"outliers_dropped", intake.outliersDropped},
                     {"transactions_processed", analyzer->getTransactionsProcessed()},
                     {"transactions_ignored", analyzer->getTransactionsIgnored()},
                     {"transactions_taken", analyzer->getTransactionsTaken()},
                     {"queue_depth", analyzer->getQueueDepth()},
                     {"checkpoints_written", checkpoints.written.load()},
                     {"checkpoint_pause_ms_max", checkpoints.longestCopyMillis.load()},
                     {"checkpoint_write_ms_max", checkpoints.longestWriteMillis.load()},
                     {"file", intake.file},
                     {"offset", intake.offset}};
}

// Each key of a book as a row of the latency API, by application then transaction.
std::vector<fw::LatencyRow> latencyRows(const fw::LatencyQuery& query) {
  std::vector<fw::LatencyRow> rows;
  CDPXAnalyzer* const analyzer = CDPXAnalyzer::GetInstanceIfStarted();
  if (analyzer == nullptr) {
    return rows;
  }
  const LatencyBook book = analyzer->getLatency(query.summary);
  const LatencyBook::Entries& entries =
      query.by_transaction ? book.transactions() : book.applications();
  rows.reserve(entries.size());
  for (const auto& [key, entry] : entries) {
    fw::LatencyRow row;
    const auto [application, transaction] = LatencyBook::splitKey(key);
    row.application = application;
    row.transaction = transaction;
    const LatencySketch& sketch = entry.sketch;
    row.requests = sketch.count();
    row.p50_ms = sketch.quantile(0.50);
    row.p90_ms = sketch.quantile(0.90);
    row.p95_ms = sketch.quantile(0.95);
    row.p99_ms = sketch.quantile(0.99);
    row.max_ms = sketch.max();
    row.apdex = entry.apdex();
    row.threshold_ms = entry.thresholdMillis;
    rows.push_back(std::move(row));
  }
  std::sort(rows.begin(), rows.end(), [](const fw::LatencyRow& a, const fw::LatencyRow& b) {
    return std::tie(a.application, a.transaction) < std::tie(b.application, b.transaction);
  });
  return rows;
}

void writeAnalyzerMetrics(fw::PrometheusText& out) {
  CDPXAnalyzer* const analyzer = CDPXAnalyzer::GetInstanceIfStarted();
  if (analyzer == nullptr) {
    return;
  }
  analyzer->getRequestMetrics().write(out);
  out.family("q7_history_write_seconds_total", "counter",
             "Time spent writing the over-time history files.");
  out.sample("q7_history_write_seconds_total", {}, history::HistoryStore::writeSeconds());
}

}  // namespace

AgentParts ProcessParts() {
  installRowQueries();
  installPatternHooks();
  AgentParts parts;
  parts.start_analyzer = [] { CDPXAnalyzer::GetInstance(); };
  parts.shutdown_analyzer = [] { CDPXAnalyzer::GetInstanceNoStart()->Shutdown(); };
  parts.join_analyzer = [] { CDPXAnalyzer::GetInstanceNoStart()->Join(); };
  parts.describe_analyzer = &describeAnalyzer;
  parts.describe_latency = &latencyRows;
  parts.write_analyzer_metrics = &writeAnalyzerMetrics;
  parts.make_collector_monitor = &makeServiceMonitor;
  parts.send_agent_message = [](const char* key, int severity,
                                const std::vector<std::string>& args) {
    AgentMessage::sendMessage(key, severity, args);
  };
  return parts;
}

}  // namespace tama
