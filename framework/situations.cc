#include "framework/situations.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <fstream>
#include <iterator>
#include <limits>
#include <memory>
#include <nlohmann/json.hpp>
#include <utility>

#include "framework/atomic_file.h"
#include "framework/mutex.h"
#include "framework/row_filter.h"
#include "framework/status.h"
#include "framework/table_manager.h"
#include "framework/tables.h"
#include "framework/trace.h"
#include "framework/webhook_sender.h"

namespace fw {
namespace {

constexpr char kUnit[] = "situations";
constexpr int kSituationRequestType = 4;

// A started situation: what was asked, and the request and agent object serving it.
struct Started {
  SituationInfo info;
  std::unique_ptr<Request> request;              // outlives agent
  std::unique_ptr<TableAgent> agent;             // created by the table's manager
  std::shared_ptr<const TableDefinition> table;  // keeps the manager alive for agent
};

struct Registry {
  Mutex mutex;
  std::vector<Started> started GUARDED_BY(mutex);  // in the order started
  std::string file GUARDED_BY(mutex);              // where the list is persisted; empty: nowhere
  SituationListener* listener GUARDED_BY(mutex) = nullptr;
};

Registry& TheRegistry() {
  static Registry registry;
  return registry;
}

bool ValidName(std::string_view name) {
  if (name.empty() || name.size() > kMaxSituationNameLength) {
    return false;
  }
  for (const char c : name) {
    const bool ok = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') ||
                    c == '_' || c == '-' || c == '.';
    if (!ok) {
      return false;
    }
  }
  return true;
}

// The range of an integer column of width bytes.
bool FitsColumn(std::int64_t value, int width) {
  if (width == 2) {
    return value >= std::numeric_limits<std::int16_t>::min() &&
           value <= std::numeric_limits<std::int16_t>::max();
  }
  return value >= std::numeric_limits<std::int32_t>::min() &&
         value <= std::numeric_limits<std::int32_t>::max();
}

bool ParseInteger(std::string_view text, std::int64_t* value) {
  const auto first = text.find_first_not_of(' ');
  const auto last = text.find_last_not_of(' ');
  if (first == std::string_view::npos) {
    return false;
  }
  text = text.substr(first, last - first + 1);
  if (!text.empty() && text.front() == '+') {
    text.remove_prefix(1);
  }
  const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), *value);
  return error == std::errc() && end == text.data() + text.size();
}

// Writes the list to the file, replaced whole: a crash leaves the old list or the new one,
// never half of one.
int Persist(const Registry& registry, std::string* error) REQUIRES(registry.mutex) {
  if (registry.file.empty()) {
    return kOk;
  }
  nlohmann::ordered_json list = nlohmann::ordered_json::array();
  for (const Started& s : registry.started) {
    list.push_back(SituationToJson(s.info));
  }
  const std::string text =
      list.dump(2, ' ', false, nlohmann::ordered_json::error_handler_t::replace) + "\n";
  if (ReplaceFile(registry.file, text, {0600, ""}, nullptr, error) != kOk) {
    Q7_TRACE(kUnit, kTraceError, "%s", error->c_str());
    return kIoError;
  }
  return kOk;
}

// Creates the request and agent object of a situation. Null agent when the table has no
// manager able to serve it.
Started Prepare(SituationInfo info, std::shared_ptr<const TableDefinition> table) {
  Started s;
  s.request = std::make_unique<Request>();
  s.request->type = kSituationRequestType;
  s.request->situation = info.name;
  s.request->conditions = info.conditions;
  s.agent = table->manager->CreateAgent(s.request.get());
  s.table = std::move(table);
  s.info = std::move(info);
  return s;
}

}  // namespace

nlohmann::ordered_json SituationToJson(const SituationInfo& info) {
  nlohmann::ordered_json conditions = nlohmann::ordered_json::array();
  for (const Condition& c : info.conditions) {
    conditions.push_back(
        {{"column", c.column}, {"op", std::string(ConditionOpName(c.op))}, {"value", c.value}});
  }
  nlohmann::ordered_json json = {
      {"name", info.name}, {"table", info.table}, {"conditions", std::move(conditions)}};
  if (info.alert.has_value()) {
    json["every"] = info.alert->every;
    json["for"] = info.alert->for_count;
    json["severity"] = info.alert->severity;
    json["webhook"] = info.alert->webhook;
  }
  return json;
}

int ParseAlertSettings(const nlohmann::json& item, const TableDefinition& table,
                       std::optional<AlertSettings>* out, std::string* error) {
  static constexpr const char* kFields[] = {"every", "for", "severity", "webhook"};
  if (table.defines_patterns) {
    for (const char* field : kFields) {
      if (item.contains(field)) {
        *error = std::string("\"") + field + "\" is for alerts, and " + table.name +
                 " defines patterns: alerts sample a row table";
        return kInvalidArgument;
      }
    }
    out->reset();
    return kOk;
  }
  AlertSettings settings;
  for (const auto& [field, target] :
       {std::pair<const char*, int*>{"every", &settings.every}, {"for", &settings.for_count}}) {
    if (!item.contains(field)) {
      continue;
    }
    const nlohmann::json& value = item[field];
    if (!value.is_number_integer() || value.get<long long>() < 1 ||
        value.get<long long>() > 86400) {
      *error = std::string("\"") + field + "\" must be a whole number from 1 to 86400" +
               (std::string(field) == "every" ? " (seconds)" : " (samples)");
      return kInvalidArgument;
    }
    *target = static_cast<int>(value.get<long long>());
  }
  if (item.contains("severity")) {
    if (!item["severity"].is_string() || item["severity"].get<std::string>().empty() ||
        item["severity"].get<std::string>().size() > kMaxSeverityLength) {
      *error = "\"severity\" must be a text of 1 to " + std::to_string(kMaxSeverityLength) +
               " characters";
      return kInvalidArgument;
    }
    settings.severity = item["severity"].get<std::string>();
  }
  if (item.contains("webhook") &&
      !(item["webhook"].is_string() && item["webhook"].get<std::string>().empty())) {
    WebhookUrl url;
    if (!item["webhook"].is_string() ||
        !ParseWebhookUrl(item["webhook"].get<std::string>(), &url, error)) {
      if (!item["webhook"].is_string()) {
        *error = "\"webhook\" must be a text, an http:// or https:// URL";
      }
      return kInvalidArgument;
    }
    settings.webhook = item["webhook"].get<std::string>();
  }
  *out = std::move(settings);
  return kOk;
}

void SetSituationListener(SituationListener* listener) {
  Registry& registry = TheRegistry();
  MutexLock lock(registry.mutex);
  registry.listener = listener;
}

int CheckSituation(std::string_view name, std::string_view table_name,
                   const std::vector<ConditionText>& conditions, SituationInfo* out,
                   std::string* error) {
  if (!ValidName(name)) {
    *error = "situation name \"" + std::string(name) + "\" must be 1 to " +
             std::to_string(kMaxSituationNameLength) + " letters, digits, '_', '-' or '.'";
    return kInvalidArgument;
  }
  const std::shared_ptr<const TableDefinition> table = FindTable(table_name);
  if (table == nullptr) {
    *error = "no table named \"" + std::string(table_name) + "\"";
    return kNotFound;
  }
  SituationInfo info;
  info.name = std::string(name);
  info.table = table->name;
  for (std::size_t i = 0; i < conditions.size(); ++i) {
    const ConditionText& text = conditions[i];
    const std::string where = "condition " + std::to_string(i + 1) + ": ";
    const ColumnInfo* column = FindColumn(table->columns, text.column);
    if (column == nullptr) {
      *error = where + "table " + table->name + " has no column \"" + text.column + "\"";
      return kInvalidArgument;
    }
    Condition condition;
    condition.column = column->name;
    if (!ParseConditionOp(text.op, &condition.op)) {
      *error = where + "unknown operator \"" + text.op + "\" (EQ NE LT LE GT GE)";
      return kInvalidArgument;
    }
    if (IsTextColumn(*column)) {
      if (text.value.size() > static_cast<std::size_t>(column->width)) {
        *error = where + "value for " + column->name + " is " + std::to_string(text.value.size()) +
                 " bytes, the column holds " + std::to_string(column->width);
        return kInvalidArgument;
      }
    } else {
      std::int64_t value = 0;
      if (!ParseInteger(text.value, &value)) {
        *error = where + column->name + " is an integer column, \"" + text.value +
                 "\" is not a whole number";
        return kInvalidArgument;
      }
      if (!FitsColumn(value, column->width)) {
        *error = where + "value " + text.value + " is out of range for " + column->name;
        return kInvalidArgument;
      }
    }
    condition.value = text.value;
    info.conditions.push_back(std::move(condition));
  }
  *out = std::move(info);
  return kOk;
}

int StartSituation(SituationInfo info, bool* replaced, std::string* error) {
  const std::shared_ptr<const TableDefinition> table = FindTable(info.table);
  if (table == nullptr) {
    *error = "no table named \"" + info.table + "\"";
    return kNotFound;
  }
  Registry& registry = TheRegistry();
  MutexLock lock(registry.mutex);
  Started fresh = Prepare(std::move(info), table);
  if (fresh.agent == nullptr) {
    *error = "table " + table->name + " cannot serve a situation";
    return kInvalidArgument;
  }
  Q7_TRACE(kUnit, kTraceSummary, "starting situation %s on %s with %zu conditions",
           fresh.info.name.c_str(), table->name.c_str(), fresh.info.conditions.size());
  const std::string name = fresh.info.name;
  fresh.agent->TakeSampleConstructor();
  *replaced = false;
  for (Started& s : registry.started) {
    if (s.info.name == fresh.info.name) {
      s = std::move(fresh);
      *replaced = true;
      break;
    }
  }
  if (!*replaced) {
    registry.started.push_back(std::move(fresh));
  }
  if (registry.listener != nullptr) {
    for (const Started& s : registry.started) {
      if (s.info.name == name) {
        registry.listener->SituationStarted(s.info);
      }
    }
  }
  return Persist(registry, error);
}

int StopSituation(std::string_view name, std::string* error) {
  Registry& registry = TheRegistry();
  MutexLock lock(registry.mutex);
  for (auto it = registry.started.begin(); it != registry.started.end(); ++it) {
    if (it->info.name == name) {
      Q7_TRACE(kUnit, kTraceSummary, "stopping situation %s on %s", it->info.name.c_str(),
               it->info.table.c_str());
      it->agent->TakeSampleDestructor();
      const std::string stopped = it->info.name;
      registry.started.erase(it);
      if (registry.listener != nullptr) {
        registry.listener->SituationStopped(stopped);
      }
      return Persist(registry, error);
    }
  }
  *error = "no situation named \"" + std::string(name) + "\" is started";
  return kNotFound;
}

std::vector<SituationInfo> ListSituations() {
  Registry& registry = TheRegistry();
  MutexLock lock(registry.mutex);
  std::vector<SituationInfo> out;
  out.reserve(registry.started.size());
  for (const Started& s : registry.started) {
    out.push_back(s.info);
  }
  return out;
}

void SetSituationsFile(const std::string& path) {
  Registry& registry = TheRegistry();
  MutexLock lock(registry.mutex);
  registry.file = path;
}

int RestoreSituations() {
  Registry& registry = TheRegistry();
  MutexLock lock(registry.mutex);
  if (registry.file.empty()) {
    return 0;
  }
  std::ifstream in(registry.file, std::ios::binary);
  if (!in) {
    Q7_TRACE(kUnit, kTraceDetail, "no situations to restore (%s)", registry.file.c_str());
    return 0;
  }
  const std::string text((std::istreambuf_iterator<char>(in)), {});
  const nlohmann::json list = nlohmann::json::parse(text, nullptr, false);
  std::string problem;
  if (list.is_discarded() || !list.is_array()) {
    problem = "is not a JSON array";
  }
  std::vector<Started> restored;
  for (std::size_t i = 0; problem.empty() && i < list.size(); ++i) {
    const nlohmann::json& item = list[i];
    if (!item.is_object() || !item.contains("name") || !item["name"].is_string() ||
        !item.contains("table") || !item["table"].is_string() || !item.contains("conditions") ||
        !item["conditions"].is_array()) {
      problem = "entry " + std::to_string(i + 1) + " lacks name, table or conditions";
      break;
    }
    std::vector<ConditionText> conditions;
    for (const nlohmann::json& c : item["conditions"]) {
      if (!c.is_object() || !c.value("column", nlohmann::json()).is_string() ||
          !c.value("op", nlohmann::json()).is_string() ||
          !c.value("value", nlohmann::json()).is_string()) {
        problem = "entry " + std::to_string(i + 1) + " has a malformed condition";
        break;
      }
      conditions.push_back({c["column"], c["op"], c["value"]});
    }
    if (!problem.empty()) {
      break;
    }
    SituationInfo info;
    std::string error;
    if (CheckSituation(item["name"].get<std::string>(), item["table"].get<std::string>(),
                       conditions, &info, &error) != kOk ||
        ParseAlertSettings(item, *FindTable(info.table), &info.alert, &error) != kOk) {
      Q7_TRACE(kUnit, kTraceError, "%s: not restoring situation %s: %s", registry.file.c_str(),
               item["name"].get<std::string>().c_str(), error.c_str());
      continue;
    }
    Started s = Prepare(std::move(info), FindTable(item["table"].get<std::string>()));
    if (s.agent != nullptr) {
      restored.push_back(std::move(s));
    }
  }
  if (!problem.empty()) {
    const std::string aside = SetFileAside(registry.file);
    TracePrintfAlways(kUnit, kTraceError, __func__,
                      "%s %s; kept aside as %s, no situations restored", registry.file.c_str(),
                      problem.c_str(), aside.empty() ? "(could not be moved)" : aside.c_str());
    return 0;
  }
  for (Started& s : restored) {
    Q7_TRACE(kUnit, kTraceSummary, "restored situation %s on %s", s.info.name.c_str(),
             s.info.table.c_str());
    registry.started.push_back(std::move(s));
    if (registry.listener != nullptr) {
      registry.listener->SituationStarted(registry.started.back().info);
    }
  }
  return static_cast<int>(restored.size());
}

void ResetSituations() {
  Registry& registry = TheRegistry();
  MutexLock lock(registry.mutex);
  registry.started.clear();
  registry.file.clear();
  registry.listener = nullptr;
}

}  // namespace fw
