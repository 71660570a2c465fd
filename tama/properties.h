#pragma once

// Properties: a string-to-string map that knows the file it is loaded from and stored to.
//
// File format: one "name=value" entry per line, split at the first '='; nothing is trimmed, so
// blanks around the '=' belong to the name or the value. Lines without '=' (comments included)
// and empty lines are ignored; a later line replaces an earlier value of the same name. Lines are
// read through a 4096-byte buffer: a line longer than 4095 characters, or one holding a zero
// byte, is skipped whole with an error trace naming the file and line.
//
// Thread safety: none of its own. The agent's one instance (AgentProperties) is written on the
// main thread during start-up and only read afterwards.

#include <map>
#include <string>
#include <vector>

class Properties {
 public:
  // Longest line, terminator excluded, that load accepts.
  static constexpr std::size_t kMaxLine = 4095;

  explicit Properties(std::string path) : path_(std::move(path)) {}

  // Empties the map, then reads the file. A file that cannot be opened leaves the map empty and
  // is not an error.
  void load();

  // Writes every entry in key order, each preceded by the header line, every line followed by a
  // zero byte (the layout other tools expect). Truncates the file first. Returns false when the
  // file cannot be written.
  bool store() const;

  // The value, or the empty string when the name is absent.
  std::string get(const std::string& name) const;
  void set(const std::string& name, const std::string& value) { map_[name] = value; }
  void remove(const std::string& name) { map_.erase(name); }
  std::vector<std::string> names() const;

  const std::map<std::string, std::string>& entries() const { return map_; }
  const std::string& path() const { return path_; }

 private:
  std::string path_;
  std::map<std::string, std::string> map_;
};
