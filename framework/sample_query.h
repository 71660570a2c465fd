#pragma once

// The query parameters of a table sample over HTTP (where, limit, format) and the two forms of
// its answer. Kept apart from the server so both can be tested without a socket.
//
//   where=COLUMN OP VALUE   COLUMN an attribute name in any case; OP one of EQ NE LT LE GT GE
//                           in any case; VALUE everything after the second blank
//   limit=N                 at most N rows, counted after filtering
//   format=json|csv
//
// Thread safety: pure functions of their arguments.

#include <cstddef>
#include <nlohmann/json.hpp>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "framework/request.h"
#include "framework/table_sample.h"
#include "framework/tables.h"

namespace fw {

enum class SampleFormat { kJson, kCsv };

// Parses "COLUMN OP VALUE" against a table's columns into *condition (column spelled as the
// table spells it). Returns kOk, or kInvalidArgument with *error naming the problem: fewer than
// three parts, a column the table lacks, an unknown operator, or a value that is not a whole
// number for an integer column.
int ParseWhere(std::string_view text, std::span<const ColumnInfo> columns, Condition* condition,
               std::string* error);

// Parses a non-negative decimal row count. Returns kOk or kInvalidArgument with *error.
int ParseLimit(std::string_view text, std::size_t* limit, std::string* error);

// Parses "json" or "csv". Returns kOk or kInvalidArgument with *error.
int ParseSampleFormat(std::string_view text, SampleFormat* format, std::string* error);

// {"table": NAME, "rows": [{attribute: value, ...}, ...]}: attributes in column order, text
// without its padding, integers as numbers. Text is copied byte for byte; dump it with a
// replacing error handler, since rows need not be valid UTF-8.
nlohmann::ordered_json SampleToJson(const Sample& sample);

// SampleToJson(sample) as an HTTP reply carries it: dumped with an indent of 2 and the
// replacing error handler, then "\n". Written straight from the rows, without the document
// tree, which costs far more than the text for samples of thousands of rows.
std::string SampleToJsonText(const Sample& sample);

struct MemberPlan;

// Writes SampleToJsonText(sample) in pieces, so that a large reply can go out while the rest of
// it is written. The sample must outlive the writer. Not thread-safe; one reply's thread uses it.
class SampleJsonWriter {
 public:
  explicit SampleJsonWriter(const Sample& sample);
  ~SampleJsonWriter();
  SampleJsonWriter(const SampleJsonWriter&) = delete;
  SampleJsonWriter& operator=(const SampleJsonWriter&) = delete;

  // Appends the next piece to *out: the opening with up to max_rows rows (at least one), then
  // up to max_rows more at a time, the closing with the last. False, appending nothing, once
  // everything is written.
  bool Next(std::string* out, int max_rows);

 private:
  const Sample& sample_;
  std::vector<MemberPlan> members_;
  std::size_t row_bound_ = 0;
  int next_row_ = -1;  // -1 before the opening; row_count() + 1 after the closing
};

// A header line of attribute names, then one line per row, each ended by '\n'. Fields holding a
// comma, a quote or a line end are quoted, with quotes doubled.
std::string SampleToCsv(const Sample& sample);

}  // namespace fw
