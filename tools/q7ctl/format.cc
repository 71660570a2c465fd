#include "tools/q7ctl/format.h"

#include <algorithm>

namespace q7ctl {
namespace {

constexpr char kEllipsis[] = "...";
constexpr std::size_t kColumnGap = 2;

std::string Dump(const Json& value, int indent = -1) {
  // The agent's text is meant to be UTF-8, but a collector can hand it anything: replace
  // invalid bytes rather than fail the whole output.
  return value.dump(indent, ' ', false, Json::error_handler_t::replace);
}

// Characters as a terminal shows them: one per UTF-8 code point (continuation bytes excluded).
std::size_t DisplayWidth(const std::string& text) {
  return static_cast<std::size_t>(std::count_if(text.begin(), text.end(), [](char c) {
    return (static_cast<unsigned char>(c) & 0xC0) != 0x80;
  }));
}

// Cuts text to max_width characters ending in "...", never inside a UTF-8 sequence.
std::string Truncate(const std::string& text, std::size_t max_width) {
  const std::size_t ellipsis = sizeof(kEllipsis) - 1;
  max_width = std::max(max_width, ellipsis + 1);
  if (DisplayWidth(text) <= max_width) {
    return text;
  }
  std::size_t keep = max_width - ellipsis;
  std::size_t end = 0;
  while (end < text.size()) {
    const bool starts_char = (static_cast<unsigned char>(text[end]) & 0xC0) != 0x80;
    if (starts_char && keep-- == 0) {
      break;
    }
    ++end;
  }
  return text.substr(0, end) + kEllipsis;
}

// A table cell must stay on one line: control characters are shown escaped.
std::string EscapeControls(const std::string& text) {
  std::string out;
  out.reserve(text.size());
  for (const char c : text) {
    switch (c) {
      case '\n':
        out += "\\n";
        break;
      case '\r':
        out += "\\r";
        break;
      case '\t':
        out += "\\t";
        break;
      default:
        out += static_cast<unsigned char>(c) < 0x20 ? '?' : c;
    }
  }
  return out;
}

// Numbers, and percentages q7ctl made readable ("12.5%"), align right and are never cut.
bool IsNumeric(const Json& value) {
  if (value.is_number()) {
    return true;
  }
  if (!value.is_string()) {
    return false;
  }
  const std::string& text = value.get_ref<const std::string&>();
  return text.size() >= 2 && text.back() == '%' &&
         text.find_first_not_of("-0123456789.") == text.size() - 1;
}

const Json& Cell(const Json& row, const std::string& column) {
  static const Json kNull;
  if (!row.is_object()) {
    return kNull;
  }
  const auto it = row.find(column);
  return it == row.end() ? kNull : *it;
}

}  // namespace

// Column widths and alignment of an aligned text table.
class TableLayout {
 public:
  explicit TableLayout(const FormatOptions& options) : options_(options) {}

  const std::vector<std::string>& columns() const { return columns_; }

  // Adds the row's new attributes as columns; true when there were any.
  bool AddColumns(const Json& row) {
    bool added = false;
    if (row.is_object()) {
      for (const auto& [name, value] : row.items()) {
        if (std::find(columns_.begin(), columns_.end(), name) == columns_.end()) {
          columns_.push_back(name);
          widths_.push_back(DisplayWidth(name));
          numbers_.push_back(0);
          texts_.push_back(0);
          added = true;
        }
      }
    }
    return added;
  }

  // Widens the columns to fit the row.
  void Fit(const Json& row) {
    for (std::size_t i = 0; i < columns_.size(); ++i) {
      const Json& value = Cell(row, columns_[i]);
      widths_[i] = std::max(widths_[i], DisplayWidth(Text(value)));
      if (IsNumeric(value)) {
        ++numbers_[i];
      } else if (!value.is_null()) {
        ++texts_[i];
      }
    }
  }

  // Drops columns from the right until a line fits max_line characters; returns how many.
  std::size_t Narrow(std::size_t max_line) {
    std::size_t dropped = 0;
    while (columns_.size() > 1 && LineWidth() > max_line) {
      columns_.pop_back();
      widths_.pop_back();
      numbers_.pop_back();
      texts_.pop_back();
      ++dropped;
    }
    return dropped;
  }

  std::string Header() const {
    std::vector<std::pair<std::string, bool>> cells;
    for (std::size_t i = 0; i < columns_.size(); ++i) {
      // A column of numbers gets its name over the numbers' right edge.
      cells.emplace_back(columns_[i], numbers_[i] > 0 && texts_[i] == 0);
    }
    return Line(cells);
  }

  std::string Row(const Json& row) const {
    std::vector<std::pair<std::string, bool>> cells;
    for (const std::string& column : columns_) {
      const Json& value = Cell(row, column);
      cells.emplace_back(Text(value), IsNumeric(value));
    }
    return Line(cells);
  }

 private:
  std::size_t LineWidth() const {
    std::size_t width = 0;
    for (const std::size_t w : widths_) {
      width += w;
    }
    return width + kColumnGap * (widths_.empty() ? 0 : widths_.size() - 1);
  }

  std::string Text(const Json& value) const {
    std::string text = EscapeControls(CellText(value));
    if (IsNumeric(value) || options_.wide) {
      return text;
    }
    return Truncate(text, options_.max_width);
  }

  // cells: text and right-alignment. The last cell is not padded: no trailing blanks.
  std::string Line(const std::vector<std::pair<std::string, bool>>& cells) const {
    std::string line;
    for (std::size_t i = 0; i < cells.size(); ++i) {
      const auto& [text, right] = cells[i];
      const std::size_t width = DisplayWidth(text);
      const std::size_t pad = widths_[i] > width ? widths_[i] - width : 0;
      const bool last = i + 1 == cells.size();
      if (right) {
        line.append(pad, ' ').append(text);
      } else {
        line.append(text);
        if (!last) {
          line.append(pad, ' ');
        }
      }
      if (!last) {
        line.append(kColumnGap, ' ');
      }
    }
    // Empty cells at the end would leave the gaps before them.
    line.erase(line.find_last_not_of(' ') + 1);
    return line;
  }

  const FormatOptions& options_;
  std::vector<std::string> columns_;
  std::vector<std::size_t> widths_;   // characters
  std::vector<std::size_t> numbers_;  // cells holding numbers, per column
  std::vector<std::size_t> texts_;    // cells holding anything else but null, per column
};

namespace {

std::string CsvLine(const std::vector<std::string>& columns, const Json& row) {
  std::string line;
  for (std::size_t i = 0; i < columns.size(); ++i) {
    if (i > 0) {
      line += ',';
    }
    line += CsvField(CellText(Cell(row, columns[i])));
  }
  return line;
}

std::string CsvHeader(const std::vector<std::string>& columns) {
  std::string line;
  for (std::size_t i = 0; i < columns.size(); ++i) {
    line += (i > 0 ? "," : "") + CsvField(columns[i]);
  }
  return line;
}

}  // namespace

bool ParseOutputFormat(const std::string& text, OutputFormat* out) {
  if (text == "table") {
    *out = OutputFormat::kTable;
  } else if (text == "json") {
    *out = OutputFormat::kJson;
  } else if (text == "csv") {
    *out = OutputFormat::kCsv;
  } else {
    return false;
  }
  return true;
}

std::string CellText(const Json& value) {
  if (value.is_string()) {
    return value.get<std::string>();
  }
  if (value.is_null()) {
    return "";
  }
  return Dump(value);
}

std::string CsvField(const std::string& text) {
  if (text.find_first_of(",\"\r\n") == std::string::npos) {
    return text;
  }
  std::string out = "\"";
  for (const char c : text) {
    if (c == '"') {
      out += '"';
    }
    out += c;
  }
  out += '"';
  return out;
}

std::vector<std::string> ColumnsOf(const Json& rows) {
  std::vector<std::string> columns;
  for (const Json& row : rows) {
    if (!row.is_object()) {
      continue;
    }
    for (const auto& [name, value] : row.items()) {
      if (std::find(columns.begin(), columns.end(), name) == columns.end()) {
        columns.push_back(name);
      }
    }
  }
  return columns;
}

std::size_t WriteRows(const Json& rows, const FormatOptions& options, std::ostream& out,
                      const Json& items) {
  switch (options.format) {
    case OutputFormat::kJson:
      out << Dump(items.is_null() ? rows : items, 2) << '\n';
      return 0;
    case OutputFormat::kCsv: {
      if (rows.empty()) {
        return 0;
      }
      const std::vector<std::string> columns = ColumnsOf(rows);
      // Lines end in LF, not RFC 4180's CRLF: the output goes to Unix pipes and files.
      out << CsvHeader(columns) << '\n';
      for (const Json& row : rows) {
        out << CsvLine(columns, row) << '\n';
      }
      return 0;
    }
    case OutputFormat::kTable: {
      if (rows.empty()) {
        return 0;
      }
      TableLayout layout(options);
      for (const Json& row : rows) {
        layout.AddColumns(row);
      }
      for (const Json& row : rows) {
        layout.Fit(row);
      }
      const std::size_t dropped = options.max_line > 0 ? layout.Narrow(options.max_line) : 0;
      out << layout.Header() << '\n';
      for (const Json& row : rows) {
        out << layout.Row(row) << '\n';
      }
      return dropped;
    }
  }
  return 0;
}

StreamWriter::StreamWriter(const FormatOptions& options, std::ostream& out)
    : options_(options), out_(out) {
  if (options_.format == OutputFormat::kTable) {
    layout_ = std::make_unique<TableLayout>(options_);
  }
}

StreamWriter::~StreamWriter() = default;

void StreamWriter::Begin(const Json& rows) {
  if (layout_ != nullptr) {
    for (const Json& row : rows) {
      layout_->AddColumns(row);
    }
    for (const Json& row : rows) {
      layout_->Fit(row);
    }
    if (!rows.empty()) {
      out_ << layout_->Header() << '\n';
    }
  } else if (options_.format == OutputFormat::kCsv) {
    csv_columns_ = ColumnsOf(rows);
    if (!rows.empty()) {
      out_ << CsvHeader(csv_columns_) << '\n';
    }
  }
  for (const Json& row : rows) {
    WriteOne(row);
  }
  out_.flush();
}

void StreamWriter::Write(const Json& row) {
  if (layout_ != nullptr) {
    if (layout_->AddColumns(row)) {
      layout_->Fit(row);
      out_ << layout_->Header() << '\n';
    }
  } else if (options_.format == OutputFormat::kCsv) {
    const std::size_t before = csv_columns_.size();
    for (const std::string& column : ColumnsOf(Json::array({row}))) {
      if (std::find(csv_columns_.begin(), csv_columns_.end(), column) == csv_columns_.end()) {
        csv_columns_.push_back(column);
      }
    }
    if (csv_columns_.size() != before) {
      out_ << CsvHeader(csv_columns_) << '\n';
    }
  }
  WriteOne(row);
  out_.flush();
}

void StreamWriter::WriteOne(const Json& row) {
  switch (options_.format) {
    case OutputFormat::kJson:
      out_ << Dump(row) << '\n';
      break;
    case OutputFormat::kCsv:
      out_ << CsvLine(csv_columns_, row) << '\n';
      break;
    case OutputFormat::kTable:
      out_ << layout_->Row(row) << '\n';
      break;
  }
}

}  // namespace q7ctl
