#pragma once

// Output of q7ctl: rows (JSON objects, attribute -> value) as an aligned text table, CSV or
// pretty JSON.
//
// Columns are the attribute names in the order the rows list them (the agent sends a row's
// attributes in column order, so the JSON is kept ordered). A row missing an attribute gets an
// empty cell; attributes that only later rows have are appended as further columns.
//
// Thread safety: none needed; a writer belongs to one thread.

#include <cstddef>
#include <memory>
#include <nlohmann/json.hpp>
#include <ostream>
#include <string>
#include <vector>

namespace q7ctl {

using Json = nlohmann::ordered_json;

enum class OutputFormat { kTable, kJson, kCsv };

struct FormatOptions {
  OutputFormat format = OutputFormat::kTable;
  // Table output: text cells longer than max_width characters are cut to it, ending in "...",
  // unless wide is set. Numbers are never cut.
  bool wide = false;
  std::size_t max_width = 40;
  // Timestamps and percentages in readable forms (readable.h); the caller converts the rows.
  bool readable = false;
  // Table output: when not 0, columns are dropped from the right until a line fits this many
  // characters (the first column always stays).
  std::size_t max_line = 0;
};

// Parses "table", "json" or "csv".
bool ParseOutputFormat(const std::string& text, OutputFormat* out);

// The text of one cell: strings as they are, numbers and booleans as JSON writes them, null as
// nothing, arrays and objects as compact JSON.
std::string CellText(const Json& value);

// One CSV field, quoted (RFC 4180) when it holds a comma, a double quote, CR or LF.
std::string CsvField(const std::string& text);

// The column names of rows, in first-seen order.
std::vector<std::string> ColumnsOf(const Json& rows);

// Writes rows (a JSON array of objects) in the chosen format: the table with a header row, CSV
// with a header line, JSON as a pretty array. JSON output writes `items` (the reply's own
// objects, which may carry more than the rows, such as a table's column list) instead of rows
// when items is not null. An empty table or CSV prints nothing. Returns the number of columns
// that max_line left out.
std::size_t WriteRows(const Json& rows, const FormatOptions& options, std::ostream& out,
                      const Json& items = nullptr);

class TableLayout;

// Prints rows one at a time as they arrive (an event stream): the column set and widths are
// fixed by the first batch, the header is printed once, and later cells wider than their
// column widen only their own line. JSON output prints one compact object per line, since a
// stream never closes its array. "out" must outlive the writer.
class StreamWriter {
 public:
  StreamWriter(const FormatOptions& options, std::ostream& out);
  ~StreamWriter();

  StreamWriter(const StreamWriter&) = delete;
  StreamWriter& operator=(const StreamWriter&) = delete;

  // The first rows (may be empty): they fix the columns and widths and are printed.
  void Begin(const Json& rows);
  // One more row, flushed at once so that a reader of a pipe sees it. A row bringing new
  // attributes adds columns and prints the header again.
  void Write(const Json& row);

 private:
  void WriteOne(const Json& row);

  const FormatOptions options_;
  std::ostream& out_;
  std::unique_ptr<TableLayout> layout_;  // table output only; refers to options_
  std::vector<std::string> csv_columns_;
};

}  // namespace q7ctl
