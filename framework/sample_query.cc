#include "framework/sample_query.h"

#include <algorithm>
#include <array>
#include <cctype>
#include <charconv>
#include <cstdint>
#include <cstring>
#include <limits>
#include <utility>
#include <vector>

#include "framework/row_filter.h"
#include "framework/status.h"

namespace fw {

// Room a row's writing may overrun by: short pieces are copied in whole blocks of this size.
constexpr std::size_t kBlock = 32;

// How one member of a row object is written: the text before its value, and where the value is.
struct MemberPlan {
  // A piece of at most kBlock bytes kept in a block of its own, so that copying it is two moves
  // rather than a call (the writer leaves kBlock bytes of room past what it writes).
  struct ShortText {
    char bytes[kBlock] = {};
    std::size_t size = 0;
  };

  std::string prefix;      // ",\n" or "\n" (the first), indent, quoted name, ": "
  ShortText short_prefix;  // the same when it fits a block
  const ColumnInfo* column;
  bool text;
};

namespace {

// The same rule the row filter applies: optional blanks around a decimal that fits 64 bits.
bool IsWholeNumber(std::string_view text) {
  const auto first = text.find_first_not_of(' ');
  const auto last = text.find_last_not_of(' ');
  if (first == std::string_view::npos) {
    return false;
  }
  text = text.substr(first, last - first + 1);
  std::int64_t value = 0;
  const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), value);
  return error == std::errc() && end == text.data() + text.size();
}

std::string CsvField(std::string_view text) {
  if (text.find_first_of(",\"\r\n") == std::string_view::npos) {
    return std::string(text);
  }
  std::string quoted = "\"";
  for (char c : text) {
    quoted += c;
    if (c == '"') {
      quoted += '"';
    }
  }
  quoted += '"';
  return quoted;
}

using Json = nlohmann::ordered_json;

// A string as dump() writes it: quoted, escaped, invalid UTF-8 replaced.
std::string DumpedString(std::string_view text) {
  return Json(std::string(text)).dump(-1, ' ', false, Json::error_handler_t::replace);
}

// The bytes dump() copies unchanged: printable ASCII except the quote and the backslash.
constexpr std::array<bool, 256> kPlainJsonByte = [] {
  std::array<bool, 256> plain{};
  for (int c = 0x20; c < 0x80; ++c) {
    plain[c] = c != '"' && c != '\\';
  }
  return plain;
}();

bool IsPlainJsonText(std::string_view text) {
  return std::all_of(text.begin(), text.end(),
                     [](char c) { return kPlainJsonByte[static_cast<unsigned char>(c)]; });
}

// Text written through a pointer into room reserved ahead, since checking capacity per
// character would cost more than writing it. It holds one row of an answer at a time: written
// here in cache, then appended, the answer's megabytes are written to memory once.
class TextBuffer {
 public:
  // Room for n more bytes; valid until the next Reserve.
  char* Reserve(std::size_t n) {
    if (text_.size() - used_ < n) {
      text_.resize(std::max(text_.size() * 2, used_ + n));
    }
    return text_.data() + used_;
  }
  // Marks the text up to end (within the last Reserve) as written.
  void Commit(const char* end) { used_ = static_cast<std::size_t>(end - text_.data()); }
  std::string_view text() const { return {text_.data(), used_}; }
  void Clear() { used_ = 0; }

 private:
  std::string text_;
  std::size_t used_ = 0;
};

char* Put(char* at, std::string_view text) {
  std::memcpy(at, text.data(), text.size());
  return at + text.size();
}


char* Put(char* at, const MemberPlan::ShortText& text) {
  std::memcpy(at, text.bytes, kBlock);
  return at + text.size;
}

char* PutPrefix(char* at, const MemberPlan& member) {
  return member.short_prefix.size != 0 ? Put(at, member.short_prefix) : Put(at, member.prefix);
}

}  // namespace

int ParseWhere(std::string_view text, std::span<const ColumnInfo> columns, Condition* condition,
               std::string* error) {
  const auto first = text.find(' ');
  const auto second = first == std::string_view::npos ? first : text.find(' ', first + 1);
  if (second == std::string_view::npos) {
    *error = "where \"" + std::string(text) + "\" is not COLUMN OP VALUE";
    return kInvalidArgument;
  }
  const std::string_view column_name = text.substr(0, first);
  const std::string_view op_name = text.substr(first + 1, second - first - 1);
  const std::string_view value = text.substr(second + 1);

  const ColumnInfo* column = FindColumn(columns, column_name);
  if (column == nullptr) {
    *error = "where: unknown column \"" + std::string(column_name) + "\"";
    return kInvalidArgument;
  }
  ConditionOp op = ConditionOp::kEQ;
  if (!ParseConditionOp(op_name, &op)) {
    *error = "where: unknown operator \"" + std::string(op_name) + "\" (EQ NE LT LE GT GE)";
    return kInvalidArgument;
  }
  if (!IsTextColumn(*column) && !IsWholeNumber(value)) {
    *error = "where: " + std::string(column->name) + " is an integer column, \"" +
             std::string(value) + "\" is not a whole number";
    return kInvalidArgument;
  }
  *condition = Condition{column->name, op, std::string(value), -1};
  return kOk;
}

int ParseLimit(std::string_view text, std::size_t* limit, std::string* error) {
  std::size_t value = 0;
  const auto [end, parse_error] = std::from_chars(text.data(), text.data() + text.size(), value);
  if (text.empty() || parse_error != std::errc() || end != text.data() + text.size()) {
    *error = "limit \"" + std::string(text) + "\" is not a non-negative whole number";
    return kInvalidArgument;
  }
  *limit = value;
  return kOk;
}

int ParseSampleFormat(std::string_view text, SampleFormat* format, std::string* error) {
  if (text == "json") {
    *format = SampleFormat::kJson;
  } else if (text == "csv") {
    *format = SampleFormat::kCsv;
  } else {
    *error = "format \"" + std::string(text) + "\" is neither json nor csv";
    return kInvalidArgument;
  }
  return kOk;
}

nlohmann::ordered_json SampleToJson(const Sample& sample) {
  nlohmann::ordered_json rows = nlohmann::ordered_json::array();
  for (int i = 0; i < sample.row_count(); ++i) {
    const void* row = sample.row(i);
    nlohmann::ordered_json object = nlohmann::ordered_json::object();
    for (const ColumnInfo& column : sample.table->columns) {
      if (IsTextColumn(column)) {
        object[column.name] = std::string(ColumnText(row, column));
      } else {
        object[column.name] = ColumnInteger(row, column);
      }
    }
    rows.push_back(std::move(object));
  }
  nlohmann::ordered_json body;
  body["table"] = sample.table->name;
  body["rows"] = std::move(rows);
  return body;
}

SampleJsonWriter::SampleJsonWriter(const Sample& sample) : sample_(sample) {
  // One member per distinct column name, placed where the name first appears and holding the
  // last such column's value: what assigning every column into an ordered object leaves.
  for (const ColumnInfo& column : sample.table->columns) {
    const std::string_view name = column.name;
    auto same = std::find_if(members_.begin(), members_.end(),
                             [&](const MemberPlan& m) { return m.column->name == name; });
    if (same != members_.end()) {
      same->column = &column;
      same->text = IsTextColumn(column);
    } else {
      members_.push_back({"      " + DumpedString(name) + ": ", {}, &column, IsTextColumn(column)});
    }
  }
  // A row's text when every value takes the plain path, and the overrun room; anything longer
  // reserves again.
  row_bound_ = 16 + kBlock;
  for (std::size_t m = 0; m < members_.size(); ++m) {
    MemberPlan& member = members_[m];
    member.prefix.insert(0, m == 0 ? "\n" : ",\n");
    if (member.prefix.size() <= kBlock) {
      std::memcpy(member.short_prefix.bytes, member.prefix.data(), member.prefix.size());
      member.short_prefix.size = member.prefix.size();
    }
    row_bound_ += member.prefix.size() +
                  (member.text ? static_cast<std::size_t>(member.column->width) + 2 : 11);
  }
}

SampleJsonWriter::~SampleJsonWriter() = default;

bool SampleJsonWriter::Next(std::string* out, int max_rows) {
  const int count = sample_.row_count();
  if (next_row_ < 0) {
    *out += "{\n  \"table\": " + DumpedString(sample_.table->name) + ",\n  \"rows\": ";
    next_row_ = 0;
    if (count == 0) {
      *out += "[]\n}\n";
      next_row_ = count + 1;
      return true;
    }
    *out += "[\n";
  }
  if (next_row_ > count) {
    return false;
  }
  TextBuffer row_text;
  const int last = std::min(count, next_row_ + std::max(max_rows, 1));
  for (int i = next_row_; i < last; ++i) {
    const char* row = static_cast<const char*>(sample_.row(i));
    char* at = row_text.Reserve(row_bound_);
    at = Put(at, i == 0 ? std::string_view("    {") : std::string_view(",\n    {"));
    if (members_.empty()) {
      at = Put(at, "}");
    }
    for (const MemberPlan& member : members_) {
      at = PutPrefix(at, member);
      const ColumnInfo& column = *member.column;
      if (!member.text) {
        at = std::to_chars(at, at + 11, ColumnInteger(row, column)).ptr;
        continue;
      }
      const std::string_view text = ColumnText(row, column);
      if (IsPlainJsonText(text)) {
        *at++ = '"';
        at = Put(at, text);
        *at++ = '"';
        continue;
      }
      const std::string dumped = DumpedString(text);
      row_text.Commit(at);
      at = Put(row_text.Reserve(dumped.size() + row_bound_), dumped);
    }
    if (!members_.empty()) {
      at = Put(at, "\n    }");
    }
    row_text.Commit(at);
    if (i == next_row_) {
      // Rows are alike in size: the first tells how much the rest will take.
      out->reserve(out->size() + row_text.text().size() * static_cast<std::size_t>(last - i) * 9 / 8 +
                   16);
    }
    *out += row_text.text();
    row_text.Clear();
  }
  next_row_ = last;
  if (next_row_ == count) {
    *out += "\n  ]\n}\n";
    next_row_ = count + 1;
  }
  return true;
}

std::string SampleToJsonText(const Sample& sample) {
  SampleJsonWriter writer(sample);
  std::string out;
  while (writer.Next(&out, std::numeric_limits<int>::max())) {
  }
  return out;
}

std::string SampleToCsv(const Sample& sample) {
  std::string out;
  const auto& columns = sample.table->columns;
  for (std::size_t c = 0; c < columns.size(); ++c) {
    out += (c == 0 ? "" : ",") + CsvField(columns[c].name);
  }
  out += '\n';
  for (int i = 0; i < sample.row_count(); ++i) {
    const void* row = sample.row(i);
    for (std::size_t c = 0; c < columns.size(); ++c) {
      if (c != 0) {
        out += ',';
      }
      out += IsTextColumn(columns[c]) ? CsvField(ColumnText(row, columns[c]))
                                      : std::to_string(ColumnInteger(row, columns[c]));
    }
    out += '\n';
  }
  return out;
}

}  // namespace fw
