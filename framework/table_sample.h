#pragma once

// Serving one sample of a registered table: the framework asks the table's agent object for
// its rows (a request of type 3) and keeps those that satisfy every filter condition. The
// framework filters, not the agent object, so every table filters alike.
//
// Thread safety: SampleTable may be called from any thread; it holds no lock while the table's
// agent object works. A Sample is plain data.

#include <cstddef>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "framework/request.h"
#include "framework/tables.h"

namespace fw {

// The request type of a sample served over HTTP.
inline constexpr int kSampleRequestType = 3;

// The rows of one sample.
struct Sample {
  std::shared_ptr<const TableDefinition> table;  // the sampled table; its columns describe rows
  std::vector<std::byte> rows;                   // back to back, table->row_size bytes each

  int row_count() const {
    return table == nullptr || table->row_size == 0
               ? 0
               : static_cast<int>(rows.size() / table->row_size);
  }
  // Row index (0 <= index < row_count()); points into rows.
  const void* row(int index) const {
    return rows.data() + static_cast<std::size_t>(index) * table->row_size;
  }
  // Keeps at most the first count rows.
  void Truncate(std::size_t count);
};

// Takes one sample of the table named table (any case) and keeps the rows for which every
// condition holds, the first limit of them at most. Returns kOk and fills *sample; kNotFound when
// no such table is registered; kInvalidArgument when a condition names a column the table does not
// have, the manager made no agent object, or the agent object handed over rows of another size than
// the table's. *error says why on failure. A situation's sample carries its name in the request.
int SampleTable(std::string_view table, std::vector<Condition> conditions, Sample* sample,
                std::string* error, std::size_t limit = kNoRowLimit,
                std::optional<std::string> situation = std::nullopt);

}  // namespace fw
