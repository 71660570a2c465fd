// libFuzzer target over what the HTTP API reads from a request, without a socket: a sample's
// where, limit and format parameters, the row filter a where becomes, and the body of a
// situation PUT, which is only reachable through the server's routes and so goes through an
// httplib::Server reading the request from memory. The 23 tables are registered as the agent
// registers them, so wheres and situations meet real columns.
//
// Beyond not crashing, it checks:
// - a where that parses names the table's column as the table spells it, keeps the value after
//   the second blank, and gives a condition the row filter can decide: on a row built from the
//   input, exactly one of LT, EQ and GT holds and each operator is the negation of its opposite;
// - a limit parses exactly when it is digits within 64 bits, to the number those digits say;
// - a situation that starts replies with a body which, sent back as the PUT body, replaces it
//   with the same situation;
// - a latency query is answered 200 or 400, with only rows the agent gave (all of them with no
//   where), and a label value from the input stays inside its one line of /metrics text.
//
// Input: two header bytes, then text.
//   byte 0 % 4: 0 a where (up to the first line break, then the row's bytes), 1 a limit and a
//               format (the text), 2 a situation PUT (name up to the first line break, then
//               the body), 3 a latency query string and a label value (the text)
//   byte 1: the table the where runs on

#include <httplib.h>

#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <nlohmann/json.hpp>
#include <string>
#include <string_view>
#include <vector>

#include "framework/metrics_api.h"
#include "framework/prometheus_text.h"
#include "framework/request.h"
#include "framework/row_filter.h"
#include "framework/sample_query.h"
#include "framework/situations.h"
#include "framework/situations_api.h"
#include "framework/status.h"
#include "framework/tables.h"
#include "q7tema/table_registry.h"
#include "tests/fuzz/fuzz_support.h"

namespace {

void Check(bool ok, const char* what) {
  if (!ok) {
    fuzzing::Fail("api_fuzz", what);
  }
}

// ---- Sample parameters ----

void CheckWhere(const fw::TableDefinition& table, std::string_view input) {
  const size_t line_end = std::min(input.find('\n'), input.size());
  const std::string_view text = input.substr(0, line_end);
  // The row's bytes follow, zero-padded to its size.
  const std::string_view bytes = input.substr(std::min(line_end + 1, input.size()));
  std::vector<char> row(table.row_size, '\0');
  std::memcpy(row.data(), bytes.data(), std::min(bytes.size(), row.size()));

  fw::Condition condition;
  std::string error;
  if (fw::ParseWhere(text, table.columns, &condition, &error) != fw::kOk) {
    Check(!error.empty(), "a where refused without a reason");
    return;
  }
  const size_t first = text.find(' ');
  const size_t second = text.find(' ', first + 1);
  const fw::ColumnInfo* column = fw::FindColumn(table.columns, text.substr(0, first));
  Check(column != nullptr && condition.column == column->name,
        "a where's column is not the table's column");
  Check(condition.value == text.substr(second + 1), "a where's value is not its text's");
  fw::ConditionOp op;
  Check(fw::ParseConditionOp(fw::ConditionOpName(condition.op), &op) && op == condition.op,
        "an operator's name does not parse back to it");

  const auto holds = [&](fw::ConditionOp o) {
    fw::Condition c = condition;
    c.op = o;
    return !fw::RowFailsCondition(row.data(), *column, c);
  };
  const bool lt = holds(fw::ConditionOp::kLT);
  const bool eq = holds(fw::ConditionOp::kEQ);
  const bool gt = holds(fw::ConditionOp::kGT);
  Check(int{lt} + int{eq} + int{gt} == 1, "a parsed where is not decided on a row");
  Check(holds(fw::ConditionOp::kNE) == !eq && holds(fw::ConditionOp::kGE) == !lt &&
            holds(fw::ConditionOp::kLE) == !gt,
        "an operator is not the negation of its opposite");
}

void CheckLimitAndFormat(std::string_view text) {
  size_t limit = 0;
  std::string error;
  const bool parsed = fw::ParseLimit(text, &limit, &error) == fw::kOk;
  const bool digits =
      !text.empty() && text.find_first_not_of("0123456789") == std::string_view::npos;
  std::string_view significant = text.substr(std::min(text.find_first_not_of('0'), text.size()));
  if (digits && significant.empty()) {
    significant = "0";
  }
  const bool fits = significant.size() < 20 ||
                    (significant.size() == 20 && significant <= "18446744073709551615");
  Check(parsed == (digits && fits), "a limit accepted or refused against its digits");
  Check(!parsed || std::to_string(limit) == significant, "a limit parsed to another number");

  fw::SampleFormat format;
  fw::ParseSampleFormat(text, &format, &error);
}

// ---- Situations through the routes ----

// A server whose requests come from memory, answered into the same buffer.
class InMemoryServer : public httplib::Server {
 public:
  // Returns the status and sets *body from the response to request_text.
  int Serve(const std::string& request_text, std::string* body) {
    httplib::detail::BufferStream stream;
    stream.write(request_text.data(), request_text.size());
    bool closed = false;
    process_request(stream, true, closed, nullptr);
    const std::string response = stream.get_buffer().substr(request_text.size());
    int status = 0;
    if (std::sscanf(response.c_str(), "HTTP/1.1 %d", &status) != 1) {
      return 0;
    }
    const size_t start = response.find("\r\n\r\n");
    *body = start == std::string::npos ? std::string() : response.substr(start + 4);
    return status;
  }
};

std::string PutRequest(std::string_view name, std::string_view body) {
  std::string text = "PUT /api/v1/situations/";
  for (const char c : name) {
    char hex[4];
    std::snprintf(hex, sizeof(hex), "%%%02X", static_cast<unsigned char>(c));
    text += hex;
  }
  text += " HTTP/1.1\r\nHost: fuzz\r\nContent-Type: application/json\r\nContent-Length: ";
  text += std::to_string(body.size());
  text += "\r\n\r\n";
  text += body;
  return text;
}

void CheckSituationPut(InMemoryServer& server, std::string_view input) {
  const size_t line_end = input.find('\n');
  const std::string_view name = input.substr(0, line_end);
  const std::string_view body =
      line_end == std::string_view::npos ? std::string_view() : input.substr(line_end + 1);

  std::string reply;
  const int status = server.Serve(PutRequest(name, body), &reply);
  Check(status == 201 || status == 400 || status == 404, "a PUT answered with another status");
  if (status != 201) {
    fw::ResetSituations();
    return;
  }
  const std::vector<fw::SituationInfo> started = fw::ListSituations();
  Check(started.size() == 1 && started[0].name == name, "a started situation is not listed");

  std::string again;
  Check(server.Serve(PutRequest(name, reply), &again) == 200,
        "a situation's reply does not replace it when sent back");
  Check(nlohmann::json::parse(again, nullptr, false) == nlohmann::json::parse(reply),
        "a situation's reply sent back gives another situation");
  fw::ResetSituations();
}

// ---- Latency and metrics through the routes ----

std::vector<fw::LatencyRow> LatencyRows() {
  std::vector<fw::LatencyRow> rows;
  for (const char* app : {"Shop", "News", "a b", ""}) {
    for (const char* tx : {"/", "/cart?x=1", "All"}) {
      fw::LatencyRow row;
      row.application = app;
      row.transaction = tx;
      row.requests = rows.size() * 7;
      row.p50_ms = 10.5 * static_cast<double>(rows.size());
      row.p90_ms = row.p95_ms = row.p99_ms = row.max_ms = 2 * row.p50_ms;
      row.apdex = 1.0 / static_cast<double>(rows.size() + 1);
      row.threshold_ms = 500;
      rows.push_back(row);
    }
  }
  return rows;
}

void CheckLatencyQuery(InMemoryServer& server, std::string_view input) {
  std::string request = "GET /api/v1/latency?";
  for (const char c : input) {
    // Bytes that would end the request line are sent encoded; the rest as they come.
    if (c == ' ' || c == '\r' || c == '\n' || c == '\0' || c == '#') {
      char hex[4];
      std::snprintf(hex, sizeof(hex), "%%%02X", static_cast<unsigned char>(c));
      request += hex;
    } else {
      request += c;
    }
  }
  request += " HTTP/1.1\r\nHost: fuzz\r\n\r\n";
  std::string reply;
  const int status = server.Serve(request, &reply);
  Check(status == 200 || status == 400, "a latency query answered with another status");
  if (status == 200) {
    const nlohmann::json body = nlohmann::json::parse(reply, nullptr, false);
    Check(body.is_object() && body["rows"].is_array(), "a latency answer without rows");
    Check(body["rows"].size() <= LatencyRows().size(), "a latency answer with rows of its own");
    // (A where may hide behind percent-encoding.)
    if (input.find("where") == std::string_view::npos &&
        input.find('%') == std::string_view::npos) {
      Check(body["rows"].size() == LatencyRows().size(), "rows lost without a where");
    }
  }

  fw::PrometheusText text;
  text.sample("q7_fuzz", {{"label", input}}, 1);
  const std::string& line = text.text();
  Check(std::count(line.begin(), line.end(), '\n') == 1 && line.back() == '\n',
        "a label value broke its line");
  Check(line.rfind("} 1\n") == line.size() - 4, "a label value broke out of its quotes");
}

InMemoryServer& Server() {
  static InMemoryServer* server = [] {
    auto* s = new InMemoryServer;
    fw::InstallSituationRoutes(*s);
    fw::InstallMetricsRoutes(*s);
    fw::SetLatencyProvider([](const fw::LatencyQuery&) { return LatencyRows(); });
    return s;
  }();
  return *server;
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  fuzzing::QuietTraces("api_fuzz_trace.log");
  q7tema::InitAllTables();
  Server();
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size < 2) {
    return 0;
  }
  const std::vector<std::shared_ptr<const fw::TableDefinition>> tables = fw::ListTables();
  Check(!tables.empty(), "no table registered");
  const std::string_view text(reinterpret_cast<const char*>(data) + 2, size - 2);
  switch (data[0] % 4) {
    case 0:
      CheckWhere(*tables[data[1] % tables.size()], text);
      break;
    case 1:
      CheckLimitAndFormat(text);
      break;
    case 2:
      CheckSituationPut(Server(), text);
      break;
    default:
      CheckLatencyQuery(Server(), text);
      break;
  }
  return 0;
}
