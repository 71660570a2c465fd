#include "q7tema/pattern_tables.h"

#include <algorithm>
#include <array>
#include <cctype>
#include <cstdint>
#include <limits>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "framework/mutex.h"
#include "framework/trace.h"
#include "q7tema/row_query.h"

namespace q7tema {
namespace {

constexpr char kUnit[] = "tables";
constexpr int kSampleRequestType = 3;
constexpr int kSituationRequestType = 4;
// Severity of the message sent when a situation defines no pattern.
constexpr int kPatternErrorSeverity = 3;

struct HookSlot {
  fw::Mutex mutex;
  PatternHooks hooks GUARDED_BY(mutex);
};

HookSlot& Slot() {
  static HookSlot slot;
  return slot;
}

PatternHooks Hooks() {
  fw::MutexLock lock(Slot().mutex);
  return Slot().hooks;
}

bool SameColumn(std::string_view a, std::string_view b) {
  if (a.size() != b.size()) {
    return false;
  }
  for (std::size_t i = 0; i < a.size(); ++i) {
    if (std::toupper(static_cast<unsigned char>(a[i])) !=
        std::toupper(static_cast<unsigned char>(b[i]))) {
      return false;
    }
  }
  return true;
}

// The condition's value as the framework gives it, trailing padding dropped.
std::string ValueText(const fw::Condition& condition) {
  std::string value = condition.value_length < 0
                          ? condition.value
                          : condition.value.substr(
                                0, static_cast<std::size_t>(std::max(0, condition.value_length)));
  while (!value.empty() && value.back() == ' ') {
    value.pop_back();
  }
  return value;
}

// Index of column among names, or -1.
template <std::size_t N>
int IndexOf(const std::array<const char*, N>& names, std::string_view column) {
  for (std::size_t i = 0; i < N; ++i) {
    if (SameColumn(names[i], column)) {
      return static_cast<int>(i);
    }
  }
  return -1;
}

// The settings one pattern needs, gathered condition by condition: text columns first, then
// numbers. A pattern is complete when every one is set.
template <std::size_t Texts, std::size_t Numbers>
struct Settings {
  std::array<std::optional<std::string>, Texts> texts;
  std::array<std::optional<int32_t>, Numbers> numbers;

  bool textsComplete() const {
    for (const auto& t : texts) {
      if (!t) {
        return false;
      }
    }
    return true;
  }
  bool complete() const {
    for (const auto& n : numbers) {
      if (!n) {
        return false;
      }
    }
    return textsComplete();
  }
};

// Traces the request's situation name as every pattern-table call does; the name or null.
const char* TraceSituation(const char* where, const fw::Request& request) {
  if (!request.situation) {
    Q7_TRACE(kUnit, fw::kTraceDetail, "%s SituationName() returned NULL, sampleType[%d]", where,
             request.type);
    return nullptr;
  }
  Q7_TRACE(kUnit, fw::kTraceDetail, "%s Situation name is [%s] sampleType[%d]", where,
           request.situation->c_str(), request.type);
  return request.situation->c_str();
}

void ReportNothingAdded(const char* situation, const char* const* missing, std::size_t count) {
  fw::TracePrintfAlways(
      kUnit, fw::kTraceWarning, __func__,
      "Warning: pattern was not added because not all required columns were defined for "
      "sitation %s",
      situation);
  for (std::size_t i = 0; i < count; ++i) {
    if (missing[i] != nullptr) {
      fw::TracePrintfAlways(kUnit, fw::kTraceWarning, __func__, "%s", missing[i]);
    }
  }
}

void SendPatternError(const char* key, const char* situation) {
  const PatternHooks hooks = Hooks();
  if (hooks.sendMessage) {
    hooks.sendMessage(key, kPatternErrorSeverity, situation);
  }
}

// Sample rows of Row from its row query; only a sample request (type 3) yields any.
template <typename Row>
void AddPatternRows(TableBase<Row>& agent) {
  if (agent.request()->type != kSampleRequestType) {
    return;
  }
  const RowQuery<Row> query = RowQueryFor<Row>();
  if (!query) {
    return;
  }
  int count = 0;
  const std::unique_ptr<Row[]> rows(query(agent.request()->type, &count));
  if (rows != nullptr && count >= 1) {
    agent.AddData(rows.get(), count);
  }
}

}  // namespace

void SetPatternHooks(PatternHooks hooks) {
  fw::MutexLock lock(Slot().mutex);
  Slot().hooks = std::move(hooks);
}

int32_t getFilterIntValue(const char* text, int length) {
  if (text == nullptr) {
    return 0;
  }
  const std::string_view all(text);
  std::string_view value =
      length < 0 ? all : all.substr(0, std::min(all.size(), static_cast<std::size_t>(length)));
  while (!value.empty() && value.front() == ' ') {
    value.remove_prefix(1);
  }
  bool negative = false;
  if (!value.empty() && (value.front() == '+' || value.front() == '-')) {
    negative = value.front() == '-';
    value.remove_prefix(1);
  }
  int64_t result = 0;
  for (const char c : value) {
    if (c < '0' || c > '9') {
      break;
    }
    // Saturate rather than wrap: a huge threshold stays huge.
    result = std::min<int64_t>(result * 10 + (c - '0'),
                               static_cast<int64_t>(std::numeric_limits<int32_t>::max()) + 1);
  }
  result = negative ? -result : result;
  return static_cast<int32_t>(std::clamp<int64_t>(result, std::numeric_limits<int32_t>::min(),
                                                  std::numeric_limits<int32_t>::max()));
}

bool registerTransactionPattern(const char* situation, const char* applicationName,
                                const char* applicationPattern, const char* transactionName,
                                const char* transactionPattern, int16_t aggapsuniq,
                                int16_t aggtxsuniq, int16_t collinstcs, int32_t sampercent,
                                int32_t mrtthres, int16_t importance) {
  const PatternHooks hooks = Hooks();
  return hooks.registerTransaction &&
         hooks.registerTransaction(situation, applicationName, applicationPattern, transactionName,
                                   transactionPattern, aggapsuniq, aggtxsuniq, collinstcs,
                                   sampercent, mrtthres, importance);
}

bool deregisterTransactionPattern(const char* situation) {
  const PatternHooks hooks = Hooks();
  return hooks.deregisterTransaction && hooks.deregisterTransaction(situation);
}

bool registerClientPattern(const char* situation, const char* clientName,
                           const char* hostNamePattern, const char* ipAddressPattern,
                           int16_t agguniqly) {
  const PatternHooks hooks = Hooks();
  return hooks.registerClient &&
         hooks.registerClient(situation, clientName, hostNamePattern, ipAddressPattern, agguniqly);
}

bool deregisterClientPattern(const char* situation) {
  const PatternHooks hooks = Hooks();
  return hooks.deregisterClient && hooks.deregisterClient(situation);
}

// ---- The two tables ----

namespace {

// What one pattern table's situations are made of: the text and number columns, the numbers
// that default when only the texts are given, the trace line for each missing text, and how a
// complete set is registered and a situation's patterns removed.
template <std::size_t Texts, std::size_t Numbers>
struct PatternTable {
  using Set = Settings<Texts, Numbers>;
  std::array<const char*, Texts> texts;
  std::array<const char*, Numbers> numbers;
  std::array<int32_t, Numbers> defaults;
  std::array<const char*, Texts> missing;
  const char* errorKey;  // the operator message when the situation defines nothing
  bool (*add)(const char* situation, const Set& settings);
  bool (*remove)(const char* situation);
};

// A situation defines patterns: each complete set of settings registers one at once; only the
// texts register one with the defaults; nothing registered is reported.
template <std::size_t Texts, std::size_t Numbers>
void DefinePatterns(const PatternTable<Texts, Numbers>& table, const char* situation,
                    const std::vector<fw::Condition>& conditions) {
  using Set = Settings<Texts, Numbers>;
  // A situation started again replaces what it defined before.
  table.remove(situation);
  Set settings;
  bool attempted = false;
  bool added = false;
  for (const fw::Condition& condition : conditions) {
    if (const int t = IndexOf(table.texts, condition.column); t >= 0) {
      settings.texts[static_cast<std::size_t>(t)] = ValueText(condition);
    } else if (const int n = IndexOf(table.numbers, condition.column); n >= 0) {
      settings.numbers[static_cast<std::size_t>(n)] =
          getFilterIntValue(condition.value.c_str(), condition.value_length);
    }
    if (settings.complete()) {
      attempted = true;
      added = table.add(situation, settings) || added;
      settings = Set();
    }
  }
  if (!attempted && settings.textsComplete()) {
    for (std::size_t i = 0; i < Numbers; ++i) {
      settings.numbers[i] = settings.numbers[i].value_or(table.defaults[i]);
    }
    attempted = true;
    added = table.add(situation, settings);
  }
  if (!attempted) {
    std::array<const char*, Texts> missing{};
    for (std::size_t i = 0; i < Texts; ++i) {
      missing[i] = settings.texts[i] ? nullptr : table.missing[i];
    }
    ReportNothingAdded(situation, missing.data(), missing.size());
  }
  if (!added) {
    SendPatternError(table.errorKey, situation);
  }
}

bool AddTransactionPattern(const char* situation, const Settings<4, 6>& s) {
  return registerTransactionPattern(
      situation, s.texts[0]->c_str(), s.texts[1]->c_str(), s.texts[2]->c_str(), s.texts[3]->c_str(),
      static_cast<int16_t>(*s.numbers[0]), static_cast<int16_t>(*s.numbers[1]),
      static_cast<int16_t>(*s.numbers[2]), *s.numbers[3], *s.numbers[5],
      static_cast<int16_t>(*s.numbers[4]));
}

bool AddClientPattern(const char* situation, const Settings<3, 1>& s) {
  return registerClientPattern(situation, s.texts[0]->c_str(), s.texts[1]->c_str(),
                               s.texts[2]->c_str(), static_cast<int16_t>(*s.numbers[0]));
}

const PatternTable<4, 6> kTransactionTable = {
    {"APPLICATIN", "APPPATTERN", "TRANSACTN", "TRANSPATTN"},
    {"AGGAPSUNIQ", "AGGTXSUNIQ", "COLLINSTCS", "SAMPERCENT", "IMPORTANCE", "MRTTHRES"},
    {0, 1, 0, 100, 99, 10000000},
    {"\t Application Name was not defined", "\t Application Pattern was not defined",
     "\t Transaction Name was not defined", "\t Transaction Pattern was not defined"},
    "RT_AGENT_TRANSACTION_PATTERN_ERROR",
    &AddTransactionPattern,
    &deregisterTransactionPattern};

const PatternTable<3, 1> kClientTable = {
    {"CLIENTNA", "CLIENTHOPT", "CLIENTPPT"},
    {"AGGUNIQLY"},
    {0},
    {"\t Client Name was not defined", "\t Client Host Name Pattern was not defined",
     "\t Client IP Pattern was not defined"},
    "RT_AGENT_CLIENT_PATTERN_ERROR",
    &AddClientPattern,
    &deregisterClientPattern};

// The three calls of a pattern table's agent object; where names it in traces.
template <typename Row, std::size_t Texts, std::size_t Numbers>
void Construct(TableBase<Row>& agent, const PatternTable<Texts, Numbers>& table,
               const char* where) {
  const fw::Request& r = *agent.request();
  const char* situation = TraceSituation(where, r);
  if (r.type == kSituationRequestType && situation != nullptr) {
    DefinePatterns(table, situation, r.conditions);
  }
}

template <typename Row, std::size_t Texts, std::size_t Numbers>
void Destruct(TableBase<Row>& agent, const PatternTable<Texts, Numbers>& table, const char* where) {
  if (const char* situation = TraceSituation(where, *agent.request())) {
    table.remove(situation);
  }
}

}  // namespace

void TableAgent<kq7_q7txptns_data_t>::TakeSampleConstructor() {
  Construct(*this, kTransactionTable, "kq7_q7txptns_agent::TakeSampleConstructor");
}

void TableAgent<kq7_q7txptns_data_t>::TakeSample() {
  TraceSituation("kq7_q7txptns_agent::TakeSample", *request());
  AddPatternRows(*this);
}

void TableAgent<kq7_q7txptns_data_t>::TakeSampleDestructor() {
  Destruct(*this, kTransactionTable, "kq7_q7txptns_agent::TakeSampleDestructor");
}

void TableAgent<kq7_q7clntptns_data_t>::TakeSampleConstructor() {
  Construct(*this, kClientTable, "kq7_q7clntptns_agent::TakeSampleConstructor");
}

void TableAgent<kq7_q7clntptns_data_t>::TakeSample() {
  TraceSituation("kq7_q7clntptns_agent::TakeSample", *request());
  AddPatternRows(*this);
}

void TableAgent<kq7_q7clntptns_data_t>::TakeSampleDestructor() {
  Destruct(*this, kClientTable, "kq7_q7clntptns_agent::TakeSampleDestructor");
}

}  // namespace q7tema
