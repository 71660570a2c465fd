#include "framework/config_file.h"

#include <fcntl.h>
#include <ini.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <utility>

#include "framework/status.h"
#include "framework/trace.h"

namespace fw {
namespace {

constexpr char kUnit[] = "framework";
// inih keeps section names in a 50-byte buffer and cuts longer ones silently.
constexpr std::size_t kMaxSectionName = 49;
// inih keeps the last entry's name in a 50-byte buffer for continuation lines, cut the same way.
constexpr std::size_t kMaxContinuedName = 49;

class FileDescriptor {
 public:
  explicit FileDescriptor(int fd) : fd_(fd) {}
  ~FileDescriptor() {
    if (fd_ >= 0) {
      close(fd_);
    }
  }
  FileDescriptor(const FileDescriptor&) = delete;
  FileDescriptor& operator=(const FileDescriptor&) = delete;
  int get() const { return fd_; }

 private:
  int fd_;
};

bool ReadWholeFile(const std::string& path, std::string* text, std::string* reason) {
  FileDescriptor fd(open(path.c_str(), O_RDONLY | O_CLOEXEC));
  if (fd.get() < 0) {
    *reason = std::strerror(errno);
    return false;
  }
  char buffer[8192];
  while (true) {
    const ssize_t n = read(fd.get(), buffer, sizeof(buffer));
    if (n == 0) {
      return true;
    }
    if (n < 0) {
      if (errno == EINTR) {
        continue;
      }
      *reason = std::strerror(errno);
      return false;
    }
    text->append(buffer, static_cast<std::size_t>(n));
  }
}

// One line of text without its "\n" or "\r\n".
std::string_view LineAt(std::string_view text, std::size_t pos, std::size_t* next) {
  std::size_t end = text.find('\n', pos);
  *next = end == std::string_view::npos ? text.size() : end + 1;
  if (end == std::string_view::npos) {
    end = text.size();
  }
  std::string_view line = text.substr(pos, end - pos);
  if (!line.empty() && line.back() == '\r') {
    line.remove_suffix(1);
  }
  return line;
}

bool IsSpace(char c) {
  return c == ' ' || c == '\t' || c == '\v' || c == '\f' || c == '\r';
}

}  // namespace

// Builds a ConfigFile while inih reads the text: inih pulls lines through ReadLine and reports
// entries through Handle.
struct ConfigFileBuilder {
  std::string_view text;
  std::size_t pos = 0;
  int line_number = 0;
  bool after_entry = false;         // inih treats an indented line after an entry as a continuation
  std::size_t entry_name_size = 0;  // of the last entry, which a continuation line continues
  int error_line = 0;               // first line this builder rejected itself
  std::string error_reason;
  ConfigFile result;

  ConfigSection* Section(std::string_view header) {
    const std::size_t colon = header.find(':');
    const std::string_view instance_name =
        colon == std::string_view::npos ? std::string_view() : header.substr(0, colon);
    const std::string_view section_name =
        colon == std::string_view::npos ? header : header.substr(colon + 1);
    ConfigInstance* instance = nullptr;
    for (ConfigInstance& candidate : result.instances_) {
      if (candidate.name == instance_name) {
        instance = &candidate;
        break;
      }
    }
    if (instance == nullptr) {
      instance = &result.instances_.emplace_back();
      instance->name = instance_name;
    }
    for (ConfigSection& section : instance->sections) {
      if (section.name == section_name) {
        return &section;
      }
    }
    ConfigSection& section = instance->sections.emplace_back();
    section.name = section_name;
    return &section;
  }

  void Reject(const char* reason) {
    if (error_line == 0) {
      error_line = line_number;
      error_reason = reason;
    }
  }

  // Sections without entries never reach the handler, so headers are noted here, as inih will
  // read them: first non-blank '[', up to the first ']' before an inline ';' comment.
  void NoteHeader(std::string_view line) {
    if (line_number == 1 && line.substr(0, 3) == "\xEF\xBB\xBF") {
      line.remove_prefix(3);
    }
    std::size_t start = 0;
    while (start < line.size() && IsSpace(line[start])) {
      ++start;
    }
    if (start == line.size() || line[start] != '[' || (start > 0 && after_entry)) {
      return;
    }
    bool was_space = false;
    for (std::size_t i = start + 1; i < line.size(); ++i) {
      if (line[i] == ']') {
        const std::string_view name = line.substr(start + 1, i - start - 1);
        if (name.size() > kMaxSectionName) {
          Reject("section name longer than 49 characters");
          return;
        }
        Section(name);
        after_entry = false;
        return;
      }
      if (was_space && line[i] == ';') {
        return;  // no ']' before the comment: inih reports the syntax error
      }
      was_space = IsSpace(line[i]);
    }
  }

  static char* ReadLine(char* str, int num, void* stream) {
    auto* self = static_cast<ConfigFileBuilder*>(stream);
    if (self->pos >= self->text.size() || self->error_line != 0) {
      return nullptr;
    }
    std::size_t next = 0;
    const std::string_view line = LineAt(self->text, self->pos, &next);
    self->pos = next;
    ++self->line_number;
    // Lengths were checked before parsing; this only guards a differently built inih.
    if (num <= 0 || line.size() >= static_cast<std::size_t>(num)) {
      self->Reject("line too long");
      return nullptr;
    }
    std::memcpy(str, line.data(), line.size());
    str[line.size()] = '\0';
    self->NoteHeader(line);
    if (self->IsContinuation(line) && self->entry_name_size > kMaxContinuedName) {
      self->Reject("continuation line of a name longer than 49 characters");
    }
    return str;
  }

  // As inih tells one: after an entry, indented, neither blank nor a comment.
  bool IsContinuation(std::string_view line) const {
    if (!after_entry || line.empty() || !IsSpace(line[0])) {
      return false;
    }
    std::size_t start = 0;
    while (start < line.size() && IsSpace(line[start])) {
      ++start;
    }
    return start < line.size() && line[start] != ';' && line[start] != '#';
  }

  static int Handle(void* user, const char* section, const char* name, const char* value) {
    auto* self = static_cast<ConfigFileBuilder*>(user);
    // inih passes a null value only when built to allow names without one.
    self->Section(section)->entries.push_back({name, value != nullptr ? value : ""});
    self->after_entry = name[0] != '\0';
    self->entry_name_size = std::strlen(name);
    return 1;
  }
};

namespace {

// Parses text into *out; on failure returns kParseError and "line N: reason" in *message.
int ParseInto(std::string_view text, ConfigFile* out, std::string* message) {
  // inih would split a long line silently and stop at a NUL byte, so both fail here first.
  int bad_line = 0;
  std::string reason;
  int line_number = 0;
  for (std::size_t pos = 0, next = 0; pos < text.size(); pos = next) {
    ++line_number;
    const std::string_view line = LineAt(text, pos, &next);
    if (line.find('\0') != std::string_view::npos) {
      bad_line = line_number;
      reason = "NUL byte in text";
      break;
    }
    if (line.size() > ConfigFile::kMaxLine) {
      bad_line = line_number;
      reason = "line of 200 characters or more";
      break;
    }
  }

  ConfigFileBuilder builder;
  if (reason.empty()) {
    builder.text = text;
    const int inih_line = ini_parse_stream(&ConfigFileBuilder::ReadLine, &builder,
                                           &ConfigFileBuilder::Handle, &builder);
    if (builder.error_line != 0) {
      bad_line = builder.error_line;
      reason = builder.error_reason;
    } else if (inih_line > 0) {
      bad_line = inih_line;
      reason = "syntax error";
    } else if (inih_line < 0) {
      bad_line = builder.line_number;
      reason = "inih could not allocate its line buffer";
    }
  }
  if (!reason.empty()) {
    *message = "line " + std::to_string(bad_line) + ": " + reason;
    return kParseError;
  }
  *out = std::move(builder.result);
  return kOk;
}

}  // namespace

int ConfigFile::Parse(const std::string& path, ConfigFile* out, std::string* error) {
  std::string text;
  std::string message;
  int rc = kOk;
  if (!ReadWholeFile(path, &text, &message)) {
    message = "cannot read config file " + path + ": " + message;
    rc = kIoError;
  } else if ((rc = ParseInto(text, out, &message)) != kOk) {
    message = "config file " + path + " " + message;
  }
  if (rc != kOk) {
    Q7_TRACE(kUnit, kTraceError, "%s", message.c_str());
    if (error != nullptr) {
      *error = message;
    }
  }
  return rc;
}

int ConfigFile::ParseText(std::string_view text, ConfigFile* out, std::string* error) {
  std::string message;
  const int rc = ParseInto(text, out, &message);
  if (rc != kOk) {
    Q7_TRACE(kUnit, kTraceError, "config text %s", message.c_str());
    if (error != nullptr) {
      *error = message;
    }
  }
  return rc;
}

const ConfigInstance* ConfigFile::FindInstance(std::string_view name) const {
  for (const ConfigInstance& instance : instances_) {
    if (instance.name == name) {
      return &instance;
    }
  }
  return nullptr;
}

}  // namespace fw
