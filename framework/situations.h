#pragma once

// Situations: named, long-lived requests on a table. Starting one hands its conditions to the
// table's agent object as a request of type 4 (TakeSampleConstructor); stopping it calls
// TakeSampleDestructor. On the pattern tables this is how operators define patterns; on row
// tables a situation alerts (alert_sampler.h), told through the SituationListener.
//
// The started situations are persisted, in the order they were started, in
// <configdir>q7_situations.json (written to a temporary file, then renamed). At the next start
// they are restored without being re-run: their effects (the patterns) come back through the
// agent's own files. Stopping the agent never stops a situation.
//
// Thread safety: every function may be called from any thread; starts and stops are serialised,
// so a table's agent objects see one situation change at a time.

#include <nlohmann/json.hpp>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "framework/request.h"
#include "framework/tables.h"

namespace fw {

// How a situation on a row table alerts: the framework samples the table with the situation's
// conditions every `every` seconds, and a row key that matched in `for_count` consecutive
// samples raises an alert of this severity, POSTed to the webhook when there is one.
struct AlertSettings {
  int every = 60;
  int for_count = 1;
  std::string severity = "warning";
  std::string webhook;  // http(s) URL; empty: none
};

// A situation as started: its name, table (as the registry spells it) and conditions; alert
// settings for a situation on a row table, none on a table that defines patterns.
struct SituationInfo {
  std::string name;
  std::string table;
  std::vector<Condition> conditions;
  std::optional<AlertSettings> alert;
};

// {"name": ..., "table": ..., "conditions": [{"column", "op", "value"}, ...]} and, for an
// alerting situation, "every", "for", "severity" and "webhook": as the API shows a situation
// and the situations file keeps it.
nlohmann::ordered_json SituationToJson(const SituationInfo& info);

// The shortest interval between samples of an alerting situation, and the longest severity.
inline constexpr int kMinAlertEvery = 1;
inline constexpr std::size_t kMaxSeverityLength = 32;

// Reads "every", "for", "severity" and "webhook" of a situation's JSON (the API's body or the
// situations file's entry) for its table: a row table always alerts (defaults for what is
// absent); a table that defines patterns takes none of them. Returns kOk with *out set (nullopt
// for a pattern table), or kInvalidArgument with *error naming the problem.
int ParseAlertSettings(const nlohmann::json& item, const TableDefinition& table,
                       std::optional<AlertSettings>* out, std::string* error);

// Told of every start and stop, under the registry's lock: it must not call back into the
// situation functions. Set by the main loop before the API starts.
class SituationListener {
 public:
  virtual ~SituationListener() = default;
  virtual void SituationStarted(const SituationInfo& info) = 0;
  virtual void SituationStopped(const std::string& name) = 0;
};

// Null: nobody is told.
void SetSituationListener(SituationListener* listener);

// The longest situation name.
inline constexpr std::size_t kMaxSituationNameLength = 64;

// A condition as an operator writes it, before it is checked against the table.
struct ConditionText {
  std::string column;
  std::string op;  // EQ NE LT LE GT GE, any case
  std::string value;
};

// Checks name, table and conditions: the table must exist, every column must be one of its
// columns, the operator one of EQ..GE, a text value no longer than its column, an integer value
// a whole number within its column's range. Returns kOk with the checked situation in *out, or
// kInvalidArgument (kNotFound for an unknown table) with *error naming the problem.
int CheckSituation(std::string_view name, std::string_view table,
                   const std::vector<ConditionText>& conditions, SituationInfo* out,
                   std::string* error);

// Starts a checked situation, replacing a started one of the same name (whose agent object is
// then dropped without its destructor: the new start already replaced what the old one did).
// Persists the list. Returns kOk, *replaced telling whether one was replaced; kIoError when the
// list could not be written (the situation runs all the same; *error says so).
int StartSituation(SituationInfo situation, bool* replaced, std::string* error);

// Stops the situation of that name and persists the list. kNotFound when none is started.
int StopSituation(std::string_view name, std::string* error);

// The started situations, in the order they were started.
std::vector<SituationInfo> ListSituations();

// Where the list is persisted; empty: nowhere (the default until the main loop sets it).
void SetSituationsFile(const std::string& path);

// Reads the persisted list and keeps each situation as started, creating its agent object
// without running it (the listener is told of each). Situations whose table is unknown are dropped
// with a trace. A file that does not parse is traced, kept aside as "<file>.bad" and nothing is
// restored. Returns how many situations were restored.
int RestoreSituations();

// Drops every situation without stopping it, and forgets the file and the listener (tests and
// shutdown).
void ResetSituations();

}  // namespace fw
