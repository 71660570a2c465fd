#include "tama/agent_details.h"

#include <cstring>
#include <string>
#include <vector>

#include "framework/agent_runtime.h"
#include "framework/clock.h"
#include "tama/agent_properties.h"

namespace {

template <size_t N>
void Column(char (&column)[N], const std::string& text) {
  const size_t length = std::min(text.size(), N);
  memcpy(column, text.data(), length);
  memset(column + length, 0, N - length);
}

}  // namespace

kq7_q7agntdts_data_t* getAgentDetailRows(int sampleType, int* count) {
  *count = 0;
  if (sampleType != 3) {
    return nullptr;
  }
  const std::vector<std::string> names = AgentProperties::getPropertyNames();
  if (names.empty()) {
    return nullptr;
  }
  char now[17];
  TimeSince70ToMordel(fw::Now(), now);
  const std::string origin = fw::OriginNodeName();
  auto* rows = new kq7_q7agntdts_data_t[names.size()];
  for (size_t i = 0; i < names.size(); ++i) {
    kq7_q7agntdts_data_t& row = rows[i];
    Column(row.originnode, origin);
    memcpy(row.timestamp, now, sizeof(row.timestamp));
    Column(row.property, names[i]);
    Column(row.value, AgentProperties::getAgentProperty(names[i]));
    memcpy(row.sampletime, now, sizeof(row.sampletime));
  }
  *count = static_cast<int>(names.size());
  return rows;
}
