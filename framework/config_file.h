#pragma once

// The framework configuration file: INI syntax read with inih.
//
//   entries before any header   -> section "" of the unnamed instance
//   [SECTION]                   -> a section of the unnamed instance ("")
//   [INSTANCE:SECTION]          -> a section of the named instance
//
// Instances, sections and entries keep their file order. An instance exists once a header or
// an entry names it; a header repeated later reopens its section, whose new entries follow the
// earlier ones. A line of 200 characters or more, a NUL byte, a section name longer than 49
// characters and a continuation line under an entry name longer than 49 characters are parse
// failures naming the line (inih would otherwise split, stop or cut silently).
//
// Thread safety: a ConfigFile is a plain value; parse on one thread, read from any.

#include <string>
#include <string_view>
#include <vector>

namespace fw {

struct ConfigEntry {
  std::string name;
  std::string value;
};

struct ConfigSection {
  std::string name;
  std::vector<ConfigEntry> entries;
};

struct ConfigInstance {
  std::string name;
  std::vector<ConfigSection> sections;
};

class ConfigFile {
 public:
  // Maximum line length, terminator excluded, that inih reads whole.
  static constexpr std::size_t kMaxLine = 199;

  // Parses a file. Returns kOk; kIoError when it cannot be read; kParseError on a syntax
  // error. On failure *error (when non-null) names the file, the line number and the reason.
  static int Parse(const std::string& path, ConfigFile* out, std::string* error);
  // Parses text; errors as above without a file name.
  static int ParseText(std::string_view text, ConfigFile* out, std::string* error);

  // The instance of that name, or null.
  const ConfigInstance* FindInstance(std::string_view name) const;
  const std::vector<ConfigInstance>& instances() const { return instances_; }

 private:
  friend struct ConfigFileBuilder;
  std::vector<ConfigInstance> instances_;
};

}  // namespace fw
