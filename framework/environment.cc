#include "framework/environment.h"

#include <limits.h>
#include <unistd.h>

#include <cstdlib>
#include <fstream>
#include <string_view>

#include "framework/status.h"
#include "framework/trace.h"

namespace fw {
namespace {

constexpr char kUnit[] = "framework";

std::string WithSlash(std::string dir) {
  if (dir.empty() || dir.back() != '/') {
    dir.push_back('/');
  }
  return dir;
}

// "/opt/q7/bin/" -> "/opt/q7/"; the root is its own parent.
std::string ParentDirectory(std::string dir) {
  while (dir.size() > 1 && dir.back() == '/') {
    dir.pop_back();
  }
  const std::size_t slash = dir.rfind('/');
  if (slash == std::string::npos) {
    return "";
  }
  return dir.substr(0, slash + 1);
}

// A process variable counts when set, even to an empty text.
bool ProcessEnv(const char* name, std::string* value) {
  const char* text = std::getenv(name);
  if (text == nullptr) {
    return false;
  }
  *value = text;
  return true;
}

std::string_view Trim(std::string_view text) {
  while (!text.empty() && (text.front() == ' ' || text.front() == '\t')) {
    text.remove_prefix(1);
  }
  while (!text.empty() && (text.back() == ' ' || text.back() == '\t' || text.back() == '\r')) {
    text.remove_suffix(1);
  }
  return text;
}

// Looks name up in a q7.env file. A name defined twice takes its last value, as when the file
// is sourced by a shell. Lines that are not NAME=VALUE are skipped.
bool EnvFileLookup(const std::string& path, std::string_view name, std::string* value) {
  std::ifstream in(path);
  if (!in) {
    return false;  // no q7.env is the normal case
  }
  bool found = false;
  std::string line;
  int line_number = 0;
  while (std::getline(in, line)) {
    ++line_number;
    const std::string_view text = Trim(line);
    if (text.empty() || text.front() == '#') {
      continue;
    }
    const std::size_t eq = text.find('=');
    const std::string_view key = eq == std::string_view::npos ? "" : Trim(text.substr(0, eq));
    if (key.empty() || key.find_first_of(" \t") != std::string_view::npos) {
      Q7_TRACE(kUnit, kTraceDetail, "%s line %d ignored: not NAME=VALUE", path.c_str(),
               line_number);
      continue;
    }
    if (key != name) {
      continue;
    }
    std::string_view val = Trim(text.substr(eq + 1));
    if (val.size() >= 2 && val.front() == '"' && val.back() == '"') {
      val = val.substr(1, val.size() - 2);
    }
    value->assign(val);
    found = true;
  }
  return found;
}

}  // namespace

std::string ExecutableDirectory() {
  char path[PATH_MAX];
  const ssize_t n = readlink("/proc/self/exe", path, sizeof(path) - 1);
  if (n <= 0) {
    return "";
  }
  const std::string_view exe(path, static_cast<std::size_t>(n));
  const std::size_t slash = exe.rfind('/');
  if (slash == std::string_view::npos) {
    return "";
  }
  return std::string(exe.substr(0, slash + 1));
}

int GetHomeDirectory(std::string* out) {
  std::string home;
  if (ProcessEnv("Q7_HOME", &home) && !home.empty()) {
    *out = WithSlash(std::move(home));
    return kOk;
  }
  const std::string parent = ParentDirectory(ExecutableDirectory());
  if (parent.empty()) {
    return kNotFound;
  }
  *out = parent;
  return kOk;
}

int GetConfigDirectory(std::string* out) {
  // Only the process environment: q7.env itself lives in this directory.
  std::string dir;
  if (ProcessEnv("Q7_CONFIG_DIR", &dir) && !dir.empty()) {
    *out = WithSlash(std::move(dir));
    return kOk;
  }
  std::string home;
  const int rc = GetHomeDirectory(&home);
  if (rc != kOk) {
    return rc;
  }
  *out = home + "config/";
  return kOk;
}

bool GetEnv(const char* name, std::string* value) {
  if (name == nullptr || *name == '\0') {
    return false;
  }
  if (ProcessEnv(name, value)) {
    return true;
  }
  std::string config_dir;
  if (GetConfigDirectory(&config_dir) == kOk && EnvFileLookup(config_dir + "q7.env", name, value)) {
    return true;
  }
  // Messages must never be dropped for want of a bundle: both the build and the install put
  // it in lib/ beside bin/.
  if (std::string_view(name) == "KQ7_CLASSPATH") {
    const std::string parent = ParentDirectory(ExecutableDirectory());
    if (!parent.empty()) {
      *value = parent + "lib";
      return true;
    }
  }
  return false;
}

}  // namespace fw
