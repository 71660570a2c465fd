#include "tests/support/sm3_records.h"

#include <fstream>
#include <sstream>

namespace q7test {

int MethodCode(const std::string& method) {
  static const std::map<std::string, int> kCodes = {{"GET", 1},   {"POST", 2},    {"HEAD", 3},
                                                    {"PUT", 4},   {"OPTIONS", 5}, {"DELETE", 6},
                                                    {"TRACE", 7}, {"CONNECT", 8}};
  const auto it = kCodes.find(method);
  return it == kCodes.end() ? 0 : it->second;
}

std::vector<Record> ReadRecords(const std::string& path, std::string* error) {
  std::vector<Record> records;
  std::ifstream in(path);
  for (std::string line; std::getline(in, line);) {
    Record record;
    const size_t open = line.find('>');
    record.tag = open == std::string::npos || line[0] != '<' ? "" : line.substr(1, open - 1);
    const std::string close = "</" + record.tag + ">";
    if (record.tag.empty() || line.size() <= close.size() + open ||
        line.compare(line.size() - close.size(), close.size(), close) != 0) {
      *error += "not a record: " + line + "\n";
      continue;
    }
    std::string body = line.substr(open + 1, line.size() - close.size() - open - 1);
    std::stringstream parts(body);
    for (std::string field; std::getline(parts, field, '^');) {
      record.fields.push_back(field);
    }
    if (!body.empty() && body.back() == '^') {
      record.fields.emplace_back();
    }
    if (record.fields.size() != (record.tag == "audio" || record.tag == "video" ? 31u : 46u)) {
      *error += std::to_string(record.fields.size()) + " fields: " + line + "\n";
      continue;
    }
    records.push_back(std::move(record));
  }
  return records;
}

std::map<std::string, long> FinalCounters(const std::string& stderr_text,
                                          const std::string& opening) {
  const size_t line = stderr_text.rfind(opening);
  std::map<std::string, long> counters;
  if (line == std::string::npos) {
    return counters;
  }
  const size_t words_at = line + opening.find(' ') + 1;
  std::istringstream words(stderr_text.substr(words_at, stderr_text.find('\n', line) - words_at));
  for (std::string word; words >> word;) {
    const size_t eq = word.find('=');
    if (eq != std::string::npos) {
      counters[word.substr(0, eq)] = std::stol(word.substr(eq + 1));
    }
  }
  return counters;
}

}  // namespace q7test
