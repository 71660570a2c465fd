#include "tama/properties.h"

#include <cstdio>
#include <memory>

#include "framework/trace.h"

namespace {

constexpr const char* kUnit = "tama";
// Written before every entry; the zero byte after each line is part of the format.
constexpr char kHeader[] = "# Created by the RT Properties class\n";

struct FileCloser {
  void operator()(std::FILE* f) const { std::fclose(f); }
};
using FilePtr = std::unique_ptr<std::FILE, FileCloser>;

enum class LineState { kOk, kTooLong, kHasNul };

// Reads one line without its '\n' (nor the zero bytes that store() puts before a line). Returns
// false at end of file with nothing read. Reading goes on to the end of an overlong line so that
// its tail is never taken for a line of its own.
bool ReadLine(std::FILE* f, std::string* line, LineState* state) {
  line->clear();
  *state = LineState::kOk;
  int c;
  bool any = false;
  while ((c = std::getc(f)) != EOF) {
    any = true;
    if (c == '\n') {
      break;
    }
    if (c == '\0' && line->empty()) {
      continue;  // the terminator store() writes after each line
    }
    if (c == '\0' && *state == LineState::kOk) {
      *state = LineState::kHasNul;
    }
    if (line->size() < Properties::kMaxLine) {
      line->push_back(static_cast<char>(c));
    } else {
      *state = LineState::kTooLong;
    }
  }
  return any;
}

}  // namespace

void Properties::load() {
  map_.clear();
  FilePtr file(std::fopen(path_.c_str(), "rb"));
  if (!file) {
    return;
  }
  std::string line;
  LineState state;
  int line_number = 0;
  while (ReadLine(file.get(), &line, &state)) {
    ++line_number;
    if (state == LineState::kTooLong) {
      Q7_TRACE(kUnit, fw::kTraceError,
               "Skipping line %d of properties file \"%s\": longer than %zu characters",
               line_number, path_.c_str(), kMaxLine);
      continue;
    }
    if (state == LineState::kHasNul) {
      Q7_TRACE(kUnit, fw::kTraceError,
               "Skipping line %d of properties file \"%s\": it holds a zero byte", line_number,
               path_.c_str());
      continue;
    }
    std::size_t eq = line.find('=');
    if (eq == std::string::npos) {
      continue;
    }
    map_[line.substr(0, eq)] = line.substr(eq + 1);
  }
}

bool Properties::store() const {
  FilePtr file(std::fopen(path_.c_str(), "wb"));
  if (!file) {
    return false;
  }
  bool ok = true;
  for (const auto& [name, value] : map_) {
    std::string record(kHeader, sizeof(kHeader));  // header text and its zero byte
    record += name;
    record += '=';
    record += value;
    record += '\n';
    record += '\0';
    ok = ok && std::fwrite(record.data(), 1, record.size(), file.get()) == record.size();
  }
  return std::fclose(file.release()) == 0 && ok;
}

std::string Properties::get(const std::string& name) const {
  auto it = map_.find(name);
  return it == map_.end() ? std::string() : it->second;
}

std::vector<std::string> Properties::names() const {
  std::vector<std::string> out;
  out.reserve(map_.size());
  for (const auto& entry : map_) {
    out.push_back(entry.first);
  }
  return out;
}
