#include "tools/q7ctl/alerts.h"

#include <ctime>
#include <string>

namespace q7ctl {
namespace {

std::string KeyText(const Json& key) {
  std::string text;
  if (!key.is_object()) {
    return CellText(key);
  }
  for (const auto& [column, value] : key.items()) {
    text += (text.empty() ? "" : " ") + column + "=" + CellText(value);
  }
  return text;
}

// The change's or alert's time: epoch seconds raw, else local "YYYY-MM-DD HH:MM:SS".
Json Time(const Json& item, const char* epoch_field, bool raw) {
  const auto it = item.find(epoch_field);
  if (it == item.end() || !it->is_number_integer()) {
    return Json();
  }
  if (raw) {
    return *it;
  }
  const std::time_t seconds = it->get<std::time_t>();
  std::tm local{};
  localtime_r(&seconds, &local);
  char text[32];
  std::strftime(text, sizeof(text), "%Y-%m-%d %H:%M:%S", &local);
  return text;
}

}  // namespace

Json OpenAlertRows(const Json& open, bool raw) {
  Json rows = Json::array();
  for (const Json& alert : open) {
    if (!alert.is_object()) {
      continue;
    }
    rows.push_back(Json::object({{"situation", alert.value("situation", Json())},
                                 {"severity", alert.value("severity", Json())},
                                 {"key", KeyText(alert.value("key", Json()))},
                                 {"since", Time(alert, "raised_at_epoch", raw)},
                                 {"seen", Time(alert, "seen_at_epoch", raw)}}));
  }
  return rows;
}

Json AlertChangeRows(const Json& changes, bool raw) {
  Json rows = Json::array();
  for (const Json& change : changes) {
    if (!change.is_object()) {
      continue;
    }
    rows.push_back(Json::object({{"sequence", change.value("sequence", Json())},
                                 {"at", Time(change, "at_epoch", raw)},
                                 {"kind", change.value("kind", Json())},
                                 {"situation", change.value("situation", Json())},
                                 {"severity", change.value("severity", Json())},
                                 {"key", KeyText(change.value("key", Json()))}}));
  }
  return rows;
}

bool IsAlertChange(const Json& event) {
  if (!event.is_object() || !event.contains("situation") || !event.contains("kind")) {
    return false;
  }
  const Json& kind = event["kind"];
  return kind == "raised" || kind == "cleared";
}

}  // namespace q7ctl
