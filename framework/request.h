#pragma once

// A request on one table: what the framework asks of a table's agent object, and the rows the
// agent object hands back.
//
// Thread safety: none. A request is served by one thread at a time; the framework owns it for
// as long as the agent object that serves it.

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace fw {

// Comparison of a filter condition: the row's column value on the left, the condition's value
// on the right ("dintval GT 5" holds for a row whose dintval is 6).
enum class ConditionOp { kEQ, kNE, kLT, kLE, kGT, kGE };

// "EQ", "NE", ... for traces and messages.
std::string_view ConditionOpName(ConditionOp op);
// The operator named text ("EQ" ... "GE", any case); false when there is none.
bool ParseConditionOp(std::string_view text, ConditionOp* op);

// One filter condition of a request.
struct Condition {
  std::string column;  // attribute name, matched in any case
  ConditionOp op = ConditionOp::kEQ;
  std::string value;  // the value as text, also for integer columns
  // How many leading characters of value count; all of them when negative or beyond its size.
  int value_length = -1;
};

inline constexpr std::size_t kNoRowLimit = static_cast<std::size_t>(-1);

struct Request {
  int type = 0;                          // framework request type (3 sample, 4 situation)
  std::optional<std::string> situation;  // the situation's name; absent for plain samples
  std::vector<Condition> conditions;     // all must hold for a row to qualify
  // The framework keeps at most this many rows, the first that qualify; so without conditions
  // an agent object may stop once it has handed over this many.
  std::size_t row_limit = kNoRowLimit;

  // Rows handed over by the agent object, back to back in the order added. row_size is 0
  // until the first rows arrive; every later batch must have the same row size.
  std::size_t row_size = 0;
  std::vector<std::byte> rows;

  // How many rows the agent object has handed over.
  int row_count() const { return row_size == 0 ? 0 : static_cast<int>(rows.size() / row_size); }
};

// Appends count rows of row_size bytes, copied from *rows, to request->rows. Returns kOk, or
// kInvalidArgument (and appends nothing) for a null request, a negative count, null rows with a
// positive count, a zero row size, or a row size that differs from the earlier rows'.
int AddRows(Request* request, const void* rows, std::size_t row_size, int count);

}  // namespace fw
