#pragma once

// Test support: generating a stream in memory, and a strict, independent reading of the
// bytes, so tests check the output itself rather than the generator's view of it. Header-only.

#include <nlohmann/json.hpp>
#include <string>
#include <string_view>
#include <vector>

#include "collector/sm3gen/record_stream.h"

namespace sm3gen::testing {

// One line of output.
struct Line {
  std::string junk;                 // bytes before the first '<'
  std::string tag;                  // header tag name ("hpage"), empty when the line has no '<'
  std::string trailer;              // trailer tag name, empty when the line ends without one
  std::vector<std::string> fields;  // the text between the tags split at '^'
  std::string content;              // the text between the tags
  std::string eol;                  // "\n", "\r\n", or "" for a last line without one
};

inline std::vector<std::string> SplitFields(std::string_view content) {
  std::vector<std::string> fields;
  size_t begin = 0;
  while (true) {
    const size_t caret = content.find('^', begin);
    fields.emplace_back(content.substr(begin, caret - begin));
    if (caret == std::string_view::npos) {
      return fields;
    }
    begin = caret + 1;
  }
}

inline std::vector<Line> ReadLines(std::string_view bytes) {
  std::vector<Line> lines;
  size_t begin = 0;
  while (begin < bytes.size()) {
    const size_t newline = bytes.find('\n', begin);
    std::string_view text = bytes.substr(begin, newline - begin);
    Line line;
    if (newline != std::string_view::npos) {
      line.eol = "\n";
      if (!text.empty() && text.back() == '\r') {
        text.remove_suffix(1);
        line.eol = "\r\n";
      }
    }
    const size_t open = text.find('<');
    line.junk = std::string(text.substr(0, open));
    if (open != std::string_view::npos) {
      const size_t close = text.find('>', open);
      line.tag = std::string(text.substr(open + 1, close - open - 1));
      std::string_view rest = text.substr(close + 1);
      const std::string trailer = "</" + line.tag + ">";
      if (rest.ends_with(trailer)) {
        line.trailer = line.tag;
        rest.remove_suffix(trailer.size());
      }
      line.content = std::string(rest);
      line.fields = SplitFields(rest);
    }
    lines.push_back(std::move(line));
    begin = newline == std::string_view::npos ? bytes.size() : newline + 1;
  }
  return lines;
}

// Bytes and truth of a stream of records, optionally followed by a cut-off one.
struct Generated {
  std::string bytes;
  nlohmann::json truth;
};

inline Generated Generate(const ModelOptions& model, const StreamOptions& stream, int64_t records,
                          bool truncate_tail = false) {
  RecordStream generator(model, stream);
  Generated out;
  for (int64_t i = 0; i < records; ++i) {
    generator.AppendRecord(&out.bytes);
  }
  if (truncate_tail) {
    generator.AppendTruncatedRecord(&out.bytes);
  }
  out.truth = generator.truth().ToJson();
  return out;
}

}  // namespace sm3gen::testing
