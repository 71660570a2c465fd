// The rows of the two pattern tables: every registered pattern, in matching order, stamped with
// the sample time.

#include <cstring>
#include <string>
#include <vector>

#include "core/analyzer/dpx_analyzer.h"
#include "core/analyzer/situation_controller.h"
#include "framework/agent_runtime.h"
#include "framework/clock.h"

namespace {

constexpr int kSampleRequestType = 3;

// Copies a NUL-terminated text into a fixed column, zero-filled behind it.
template <size_t N>
void Column(char (&column)[N], const char* text) {
  const size_t length = strnlen(text, N);
  memcpy(column, text, length);
  memset(column + length, 0, N - length);
}

// A new[] array of one row per pattern, filled by fill(row, pattern); null when there is none.
template <typename Row, typename Pattern, typename Fill>
Row* PatternRows(int sampleType, const std::vector<Pattern>& patterns, int* count, Fill fill) {
  *count = 0;
  if (sampleType != kSampleRequestType || patterns.empty()) {
    return nullptr;
  }
  char now[17];
  TimeSince70ToMordel(fw::Now(), now);
  const std::string origin = fw::OriginNodeName();
  auto* rows = new Row[patterns.size()];
  for (size_t i = 0; i < patterns.size(); ++i) {
    Row& row = rows[i];
    memset(&row, 0, sizeof(row));
    Column(row.originnode, origin.c_str());
    memcpy(row.timestamp, now, sizeof(row.timestamp));
    memcpy(row.sampletime, now, sizeof(row.sampletime));
    fill(row, patterns[i]);
  }
  *count = static_cast<int>(patterns.size());
  return rows;
}

}  // namespace

kq7_q7txptns_data_t* CDPXAnalyzer::getTransactionPatterns(int sampleType, int* count) {
  return PatternRows<kq7_q7txptns_data_t>(
      sampleType, situations().getTransactionPatterns(), count,
      [](kq7_q7txptns_data_t& row, const TransactionPattern& p) {
        Column(row.applicatin, p.applicationName);
        Column(row.apppattern, p.applicationPattern);
        Column(row.transactn, p.transactionName);
        Column(row.transpattn, p.transactionPattern);
        row.aggapsuniq = p.aggappsuniq;
        row.aggtxsuniq = p.aggtxsuniq;
        row.collinstcs = p.collectInstances;
        row.sampercent = p.samplePercent;
        row.importance = p.importance;
        row.mrtthres = p.mrtthres;
      });
}

kq7_q7clntptns_data_t* CDPXAnalyzer::getClientPatterns(int sampleType, int* count) {
  return PatternRows<kq7_q7clntptns_data_t>(sampleType, situations().getClientPatterns(), count,
                                            [](kq7_q7clntptns_data_t& row, const ClientPattern& p) {
                                              Column(row.clientna, p.clientName);
                                              Column(row.clienthopt, p.hostNamePattern);
                                              Column(row.clientppt, p.ipAddressPattern);
                                              row.agguniqly = p.aggregateUniquely;
                                            });
}
