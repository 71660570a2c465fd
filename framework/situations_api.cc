#include "framework/situations_api.h"

#include <httplib.h>

#include <nlohmann/json.hpp>
#include <string>
#include <vector>

#include "framework/http_json.h"
#include "framework/situations.h"
#include "framework/status.h"
#include "framework/tables.h"

namespace fw {
namespace {

// The name part of the paths: anything up to the next '/', checked by CheckSituation.
constexpr char kNamedPath[] = R"(/api/v1/situations/([^/]+))";

// Reads the body of a PUT into *json, table and conditions; false with *error naming the
// problem.
bool ParseBody(const std::string& body, nlohmann::json* parsed, std::string* table,
               std::vector<ConditionText>* conditions, std::string* error) {
  *parsed = nlohmann::json::parse(body, nullptr, false);
  const nlohmann::json& json = *parsed;
  if (json.is_discarded()) {
    *error = "the body is not valid JSON";
    return false;
  }
  if (!json.is_object() || !json.contains("table") || !json["table"].is_string()) {
    *error = "the body must be an object with a \"table\" text";
    return false;
  }
  *table = json["table"].get<std::string>();
  if (!json.contains("conditions")) {
    return true;
  }
  if (!json["conditions"].is_array()) {
    *error = "\"conditions\" must be an array";
    return false;
  }
  for (std::size_t i = 0; i < json["conditions"].size(); ++i) {
    const nlohmann::json& c = json["conditions"][i];
    const std::string where = "condition " + std::to_string(i + 1) + ": ";
    if (!c.is_object() || !c.contains("column") || !c["column"].is_string() ||
        !c.contains("value")) {
      *error = where + "needs a \"column\" text and a \"value\"";
      return false;
    }
    ConditionText text;
    text.column = c["column"].get<std::string>();
    text.op = "EQ";
    if (c.contains("op")) {
      if (!c["op"].is_string()) {
        *error = where + "\"op\" must be a text";
        return false;
      }
      text.op = c["op"].get<std::string>();
    }
    // Numbers may come as JSON numbers or as text; the column decides what is valid.
    if (c["value"].is_string()) {
      text.value = c["value"].get<std::string>();
    } else if (c["value"].is_number_integer()) {
      text.value = std::to_string(c["value"].get<long long>());
    } else {
      *error = where + "\"value\" must be a text or a whole number";
      return false;
    }
    conditions->push_back(std::move(text));
  }
  return true;
}

void List(const httplib::Request&, httplib::Response& res) {
  nlohmann::ordered_json list = nlohmann::ordered_json::array();
  for (const SituationInfo& info : ListSituations()) {
    list.push_back(SituationToJson(info));
  }
  ReplyJson(res, 200, nlohmann::ordered_json{{"situations", std::move(list)}});
}

void Start(const httplib::Request& req, httplib::Response& res) {
  const std::string name = req.matches[1];
  nlohmann::json json;
  std::string table;
  std::vector<ConditionText> conditions;
  std::string error;
  if (!ParseBody(req.body, &json, &table, &conditions, &error)) {
    ReplyError(res, 400, error);
    return;
  }
  SituationInfo info;
  if (CheckSituation(name, table, conditions, &info, &error) != kOk ||
      ParseAlertSettings(json, *FindTable(info.table), &info.alert, &error) != kOk) {
    ReplyError(res, 400, error);
    return;
  }
  bool replaced = false;
  const nlohmann::ordered_json body = SituationToJson(info);
  const int started = StartSituation(std::move(info), &replaced, &error);
  if (started == kIoError) {
    ReplyError(res, 500, "situation " + name + " started but not saved: " + error);
    return;
  }
  if (started != kOk) {
    ReplyError(res, 400, error);
    return;
  }
  ReplyJson(res, replaced ? 200 : 201, body);
}

void Stop(const httplib::Request& req, httplib::Response& res) {
  const std::string name = req.matches[1];
  std::string error;
  const int stopped = StopSituation(name, &error);
  if (stopped == kNotFound) {
    ReplyError(res, 404, error);
  } else if (stopped != kOk) {
    ReplyError(res, 500, "situation " + name + " stopped but not saved: " + error);
  } else {
    ReplyJson(res, 200, nlohmann::json{{"stopped", name}});
  }
}

}  // namespace

void InstallSituationRoutes(httplib::Server& server) {
  server.Get("/api/v1/situations", List);
  server.Put(kNamedPath, Start);
  server.Delete(kNamedPath, Stop);
}

}  // namespace fw
