#include "framework/metrics_api.h"

#include <httplib.h>

#include <array>
#include <charconv>
#include <cmath>
#include <nlohmann/json.hpp>
#include <string_view>
#include <utility>

#include "framework/http_json.h"
#include "framework/mutex.h"
#include "framework/request.h"
#include "framework/runtime_state.h"
#include "framework/sample_query.h"
#include "framework/status.h"
#include "framework/tables.h"

namespace fw {
namespace {

// The answer's columns, which ?where may name. Parsed as text; the numeric ones compare as
// numbers (LatencyValue).
constexpr std::array<const char*, 10> kLatencyColumns = {
    "application", "transaction", "requests", "p50_ms", "p90_ms",
    "p95_ms",      "p99_ms",      "max_ms",   "apdex",  "threshold_ms"};

std::vector<ColumnInfo> LatencyColumns() {
  std::vector<ColumnInfo> columns;
  for (const char* name : kLatencyColumns) {
    columns.push_back({name, kColumnTypeString, 128, 0});
  }
  return columns;
}

// Rounded to a microsecond: the sketch answers within 1 %, more digits say nothing.
double Millis(double value) {
  return std::round(value * 1000.0) / 1000.0;
}

double NumberOf(const LatencyRow& row, std::string_view column) {
  if (column == "requests")
    return static_cast<double>(row.requests);
  if (column == "p50_ms")
    return Millis(row.p50_ms);
  if (column == "p90_ms")
    return Millis(row.p90_ms);
  if (column == "p95_ms")
    return Millis(row.p95_ms);
  if (column == "p99_ms")
    return Millis(row.p99_ms);
  if (column == "max_ms")
    return Millis(row.max_ms);
  if (column == "apdex")
    return std::round(row.apdex * 10000.0) / 10000.0;
  return row.threshold_ms;
}

template <class T>
bool Holds(ConditionOp op, const T& left, const T& right) {
  switch (op) {
    case ConditionOp::kEQ:
      return left == right;
    case ConditionOp::kNE:
      return left != right;
    case ConditionOp::kLT:
      return left < right;
    case ConditionOp::kLE:
      return left <= right;
    case ConditionOp::kGT:
      return left > right;
    case ConditionOp::kGE:
      return left >= right;
  }
  return false;
}

bool ParseNumber(const std::string& text, double* value) {
  const char* end = text.data() + text.size();
  const auto [ptr, ec] = std::from_chars(text.data(), end, *value);
  return ec == std::errc() && ptr == end && std::isfinite(*value);
}

// A parsed condition with its number, for the numeric columns.
struct LatencyCondition {
  Condition condition;
  double number = 0;
  bool text = false;
};

bool Matches(const LatencyRow& row, const LatencyCondition& c) {
  if (c.text) {
    const std::string& value =
        c.condition.column == "application" ? row.application : row.transaction;
    return Holds<std::string_view>(c.condition.op, value, c.condition.value);
  }
  return Holds(c.condition.op, NumberOf(row, c.condition.column), c.number);
}

// In the order an operator reads them, not sorted by name.
nlohmann::ordered_json RowJson(const LatencyRow& row, bool byTransaction) {
  nlohmann::ordered_json out{{"application", row.application}};
  if (byTransaction) {
    out["transaction"] = row.transaction;
  }
  out["requests"] = row.requests;
  for (const char* column : {"p50_ms", "p90_ms", "p95_ms", "p99_ms", "max_ms", "apdex"}) {
    out[column] = NumberOf(row, column);
  }
  out["threshold_ms"] = row.threshold_ms;
  return out;
}

// One value of a parameter that may be given once, or def when absent; false (with a 400
// reply) when it is given twice or is not one of allowed.
bool OneOf(const httplib::Request& req, httplib::Response& res, const char* key,
           std::initializer_list<const char*> allowed, std::string* value) {
  if (req.get_param_value_count(key) > 1) {
    ReplyError(res, 400, std::string(key) + " given more than once");
    return false;
  }
  if (!req.has_param(key)) {
    return true;
  }
  const std::string given = req.get_param_value(key);
  std::string names;
  for (const char* name : allowed) {
    if (given == name) {
      *value = given;
      return true;
    }
    names += names.empty() ? name : std::string(", ") + name;
  }
  ReplyError(res, 400, std::string(key) + " must be one of " + names + ", not \"" + given + "\"");
  return false;
}

void ServeLatency(const httplib::Request& req, httplib::Response& res) {
  std::string by = "application";
  std::string window = "summary";
  if (!OneOf(req, res, "by", {"application", "transaction"}, &by) ||
      !OneOf(req, res, "window", {"interval", "summary"}, &window)) {
    return;
  }
  const LatencyQuery query{by == "transaction", window == "summary"};
  static const std::vector<ColumnInfo> columns = LatencyColumns();
  std::vector<LatencyCondition> conditions;
  for (std::size_t i = 0; i < req.get_param_value_count("where"); ++i) {
    LatencyCondition c;
    std::string error;
    if (ParseWhere(req.get_param_value("where", i), columns, &c.condition, &error) != kOk) {
      ReplyError(res, 400, error);
      return;
    }
    c.text = c.condition.column == "application" || c.condition.column == "transaction";
    if (c.condition.column == "transaction" && !query.by_transaction) {
      ReplyError(res, 400, "transaction can be filtered only with by=transaction");
      return;
    }
    if (!c.text && !ParseNumber(c.condition.value, &c.number)) {
      ReplyError(res, 400,
                 c.condition.column + " compares with a number, not \"" + c.condition.value + "\"");
      return;
    }
    conditions.push_back(std::move(c));
  }
  LatencyProvider provider;
  {
    MutexLock lock(State().mutex);
    provider = State().latency_provider;
  }
  if (!provider) {
    ReplyError(res, 503, "latency figures are not available: the analyzer is not running");
    return;
  }
  nlohmann::ordered_json rows = nlohmann::ordered_json::array();
  for (const LatencyRow& row : provider(query)) {
    bool keep = true;
    for (const LatencyCondition& c : conditions) {
      keep = keep && Matches(row, c);
    }
    if (keep) {
      rows.push_back(RowJson(row, query.by_transaction));
    }
  }
  ReplyJson(res, 200,
            nlohmann::ordered_json{{"by", by}, {"window", window}, {"rows", std::move(rows)}});
}

void ServeMetrics(const httplib::Request&, httplib::Response& res) {
  MetricsProvider provider;
  MetricsProvider framework;
  {
    MutexLock lock(State().mutex);
    provider = State().metrics_provider;
    framework = State().framework_metrics;
  }
  if (!provider) {
    ReplyError(res, 503, "metrics are not available: no agent is running");
    return;
  }
  PrometheusText text;
  provider(text);
  if (framework) {
    framework(text);
  }
  res.status = 200;
  res.set_content("", 0, "text/plain; version=0.0.4; charset=utf-8");
  res.body = text.take();
}

}  // namespace

void SetLatencyProvider(LatencyProvider provider) {
  MutexLock lock(State().mutex);
  State().latency_provider = std::move(provider);
}

void SetFrameworkMetrics(MetricsProvider provider) {
  MutexLock lock(State().mutex);
  State().framework_metrics = std::move(provider);
}

void SetMetricsProvider(MetricsProvider provider) {
  MutexLock lock(State().mutex);
  State().metrics_provider = std::move(provider);
}

void InstallMetricsRoutes(httplib::Server& server) {
  server.Get("/api/v1/latency", ServeLatency);
  server.Get("/metrics", ServeMetrics);
}

}  // namespace fw
