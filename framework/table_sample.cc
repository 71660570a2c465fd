#include "framework/table_sample.h"

#include <algorithm>
#include <utility>

#include "framework/row_filter.h"
#include "framework/status.h"
#include "framework/trace.h"

namespace fw {
namespace {

constexpr char kUnit[] = "tables";

struct ResolvedCondition {
  const ColumnInfo* column;  // into the table's columns
  const Condition* condition;
};

}  // namespace

void Sample::Truncate(std::size_t count) {
  if (table != nullptr && count < static_cast<std::size_t>(row_count())) {
    rows.resize(count * table->row_size);
  }
}

int SampleTable(std::string_view table, std::vector<Condition> conditions, Sample* sample,
                std::string* error, std::size_t limit, std::optional<std::string> situation) {
  std::shared_ptr<const TableDefinition> definition = FindTable(table);
  if (definition == nullptr) {
    *error = "no table named " + std::string(table);
    return kNotFound;
  }
  // Resolve columns before the agent runs: a bad condition should cost no sample.
  std::vector<ResolvedCondition> resolved;
  for (const Condition& condition : conditions) {
    const ColumnInfo* column = FindColumn(definition->columns, condition.column);
    if (column == nullptr) {
      *error = definition->name + " has no column " + condition.column;
      return kInvalidArgument;
    }
    resolved.push_back({column, &condition});
  }

  Request request;
  request.type = kSampleRequestType;
  request.situation = std::move(situation);
  request.conditions = conditions;
  request.row_limit = limit;
  {
    std::unique_ptr<TableAgent> agent = definition->manager->CreateAgent(&request);
    if (agent == nullptr) {
      *error = definition->name + "'s manager made no agent object";
      Q7_TRACE(kUnit, kTraceError, "sample refused: %s", error->c_str());
      return kInvalidArgument;
    }
    agent->TakeSampleConstructor();
    agent->TakeSample();
    agent->TakeSampleDestructor();
  }
  if (request.row_size != 0 && request.row_size != definition->row_size) {
    *error = definition->name + " handed over " + std::to_string(request.row_size) +
             "-byte rows, not " + std::to_string(definition->row_size);
    Q7_TRACE(kUnit, kTraceError, "sample refused: %s", error->c_str());
    return kInvalidArgument;
  }

  sample->table = definition;
  sample->rows.clear();
  const std::size_t size = definition->row_size;
  const int count = request.row_count();
  if (resolved.empty()) {
    // Every row qualifies: the request's rows become the sample's, not a copy of them.
    sample->rows = std::move(request.rows);
    sample->Truncate(limit);
  } else {
    for (int i = 0; i < count && static_cast<std::size_t>(sample->row_count()) < limit; ++i) {
      const std::byte* row = request.rows.data() + static_cast<std::size_t>(i) * size;
      const bool qualifies = std::none_of(resolved.begin(), resolved.end(), [&](const auto& r) {
        return RowFailsCondition(row, *r.column, *r.condition);
      });
      if (qualifies) {
        sample->rows.insert(sample->rows.end(), row, row + size);
      }
    }
  }
  Q7_TRACE(kUnit, kTraceDetail, "%s sampled: %d rows, %d kept", definition->name.c_str(), count,
           sample->row_count());
  return kOk;
}

}  // namespace fw
