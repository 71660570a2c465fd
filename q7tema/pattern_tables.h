#pragma once

// The two pattern tables, Q7TXPTNS and Q7CLNTPTNS: sampling them lists the registered
// transaction and client patterns, and a situation on them defines patterns. The situation's
// conditions carry the pattern's settings column by column; every complete set of settings
// registers one pattern under the situation's name, and stopping the situation removes them.
//
// The patterns live in the analyzer's situation controller; this side reaches it through the
// hooks the agent process installs (SetPatternHooks), and gets sample rows through the row
// query of each table (SetRowQuery).
//
// Thread safety: the hooks may be set and called from any thread; an agent object is used by
// one thread at a time.

#include <cstdint>
#include <functional>

#include "core/layouts/table_layouts.h"
#include "q7tema/table_agent.h"

namespace q7tema {

// What registering and removing patterns does in the agent process.
struct PatternHooks {
  std::function<bool(const char* situation, const char* applicationName,
                     const char* applicationPattern, const char* transactionName,
                     const char* transactionPattern, int16_t aggapsuniq, int16_t aggtxsuniq,
                     int16_t collinstcs, int32_t sampercent, int32_t mrtthres, int16_t importance)>
      registerTransaction;
  std::function<bool(const char* situation)> deregisterTransaction;
  std::function<bool(const char* situation, const char* clientName, const char* hostNamePattern,
                     const char* ipAddressPattern, int16_t agguniqly)>
      registerClient;
  std::function<bool(const char* situation)> deregisterClient;
  // Sends an operator message (key, severity, the situation name).
  std::function<void(const char* key, int severity, const char* situation)> sendMessage;
};

void SetPatternHooks(PatternHooks hooks);

// A filter value as an integer: at most length characters of text (all of it when length is
// negative), leading blanks, an optional sign and decimal digits; no digits give 0.
int32_t getFilterIntValue(const char* text, int length);

// Hand a pattern to the situation controller, or take a situation's patterns away. False when
// nothing is installed to take them or the controller refused.
bool registerTransactionPattern(const char* situation, const char* applicationName,
                                const char* applicationPattern, const char* transactionName,
                                const char* transactionPattern, int16_t aggapsuniq,
                                int16_t aggtxsuniq, int16_t collinstcs, int32_t sampercent,
                                int32_t mrtthres, int16_t importance);
bool deregisterTransactionPattern(const char* situation);
bool registerClientPattern(const char* situation, const char* clientName,
                           const char* hostNamePattern, const char* ipAddressPattern,
                           int16_t agguniqly);
bool deregisterClientPattern(const char* situation);

template <>
class TableAgent<kq7_q7txptns_data_t> : public TableBase<kq7_q7txptns_data_t> {
 public:
  using TableBase<kq7_q7txptns_data_t>::TableBase;
  // Type 4: registers the situation's patterns.
  void TakeSampleConstructor() override;
  // Type 3: the registered transaction patterns as rows.
  void TakeSample() override;
  // Removes the situation's patterns.
  void TakeSampleDestructor() override;
};

template <>
class TableAgent<kq7_q7clntptns_data_t> : public TableBase<kq7_q7clntptns_data_t> {
 public:
  using TableBase<kq7_q7clntptns_data_t>::TableBase;
  void TakeSampleConstructor() override;
  void TakeSample() override;
  void TakeSampleDestructor() override;
};

}  // namespace q7tema
