#include "tools/q7ctl/config.h"

#include <limits.h>
#include <unistd.h>

#include <cstdlib>
#include <fstream>
#include <sstream>
#include <string_view>

namespace q7ctl {
namespace {

constexpr char kDefaultAddress[] = "127.0.0.1:7420";

std::string WithSlash(std::string dir) {
  if (!dir.empty() && dir.back() != '/') {
    dir.push_back('/');
  }
  return dir;
}

// "/opt/q7/bin/" -> "/opt/q7/".
std::string ParentDirectory(std::string dir) {
  while (dir.size() > 1 && dir.back() == '/') {
    dir.pop_back();
  }
  const std::size_t slash = dir.rfind('/');
  return slash == std::string::npos ? "" : dir.substr(0, slash + 1);
}

std::string_view Trim(std::string_view text) {
  constexpr std::string_view kBlanks = " \t\r\n";
  const std::size_t first = text.find_first_not_of(kBlanks);
  if (first == std::string_view::npos) {
    return {};
  }
  return text.substr(first, text.find_last_not_of(kBlanks) - first + 1);
}

// The first line of a file, trimmed; nullopt when the file cannot be read.
std::optional<std::string> FirstLine(const std::string& path) {
  std::ifstream in(path);
  if (!in) {
    return std::nullopt;
  }
  std::string line;
  std::getline(in, line);
  return std::string(Trim(line));
}

// True when address ends in ":0", the agent's "pick a free port".
bool HasPortZero(const std::string& address) {
  const std::size_t colon = address.rfind(':');
  return colon != std::string::npos && address.substr(colon + 1) == "0";
}

}  // namespace

Environment Environment::Process() {
  Environment env;
  env.get = [](const std::string& name) -> std::optional<std::string> {
    const char* value = std::getenv(name.c_str());
    if (value == nullptr) {
      return std::nullopt;
    }
    return std::string(value);
  };
  char path[PATH_MAX];
  const ssize_t n = readlink("/proc/self/exe", path, sizeof(path) - 1);
  if (n > 0) {
    const std::string exe(path, static_cast<std::size_t>(n));
    env.executable_dir = exe.substr(0, exe.rfind('/') + 1);
  }
  return env;
}

std::string HomeDirectory(const Environment& env) {
  if (const auto home = env.get("Q7_HOME"); home && !home->empty()) {
    return WithSlash(*home);
  }
  return ParentDirectory(env.executable_dir);
}

std::string ConfigDirectory(const Environment& env) {
  if (const auto dir = env.get("Q7_CONFIG_DIR"); dir && !dir->empty()) {
    return WithSlash(*dir);
  }
  const std::string home = HomeDirectory(env);
  return home.empty() ? "" : home + "config/";
}

std::optional<std::string> EnvFileValue(const std::string& path, const std::string& name) {
  std::ifstream in(path);
  std::optional<std::string> found;
  std::string line;
  while (std::getline(in, line)) {
    const std::string_view text = Trim(line);
    if (text.empty() || text.front() == '#') {
      continue;
    }
    const std::size_t eq = text.find('=');
    if (eq == std::string_view::npos || Trim(text.substr(0, eq)) != name) {
      continue;
    }
    std::string_view value = Trim(text.substr(eq + 1));
    if (value.size() >= 2 && value.front() == '"' && value.back() == '"') {
      value = value.substr(1, value.size() - 2);
    }
    found = std::string(value);  // keep going: the last definition wins, as in a shell
  }
  return found;
}

bool ResolveAddress(const Environment& env, std::string* address, std::string* error) {
  std::optional<std::string> configured = env.get("Q7_HTTP_ADDRESS");
  const std::string config_dir = ConfigDirectory(env);
  if ((!configured || configured->empty()) && !config_dir.empty()) {
    configured = EnvFileValue(config_dir + "q7.env", "Q7_HTTP_ADDRESS");
  }
  if (configured && configured->empty()) {
    configured.reset();  // an empty setting means the agent's default, as the agent reads it
  }
  const std::string home = HomeDirectory(env);
  const std::string addr_file = home.empty() ? "" : home + "logs/q7agent.addr";
  if (configured && !HasPortZero(*configured)) {
    *address = *configured;
    return true;
  }
  if (!addr_file.empty()) {
    if (const auto bound = FirstLine(addr_file); bound && !bound->empty()) {
      *address = *bound;
      return true;
    }
  }
  if (configured) {
    *error = "the agent is configured to pick its own port (Q7_HTTP_ADDRESS=" + *configured +
             ") but " + (addr_file.empty() ? "its address file" : addr_file) +
             " does not exist: is the agent running? (or give --url)";
    return false;
  }
  *address = kDefaultAddress;
  return true;
}

std::string ResolveToken(const Environment& env) {
  const std::string config_dir = ConfigDirectory(env);
  if (config_dir.empty()) {
    return "";
  }
  std::ifstream in(config_dir + "q7_api_token");
  if (!in) {
    return "";
  }
  std::ostringstream text;
  text << in.rdbuf();
  return std::string(Trim(text.str()));
}

std::string AddressToUrl(const std::string& address) {
  std::string url = address.find("://") == std::string::npos ? "http://" + address : address;
  while (!url.empty() && url.back() == '/') {
    url.pop_back();
  }
  const std::size_t host_start = url.find("://") + 3;
  for (const auto& [wildcard, loopback] :
       {std::pair<std::string_view, std::string_view>{"0.0.0.0:", "127.0.0.1:"},
        {"[::]:", "[::1]:"}}) {
    if (url.compare(host_start, wildcard.size(), wildcard) == 0) {
      url.replace(host_start, wildcard.size(), loopback);
    }
  }
  return url;
}

std::string AgentSetting(const Environment& env, const std::string& name) {
  std::optional<std::string> value = env.get(name);
  const std::string config_dir = ConfigDirectory(env);
  if ((!value || value->empty()) && !config_dir.empty()) {
    value = EnvFileValue(config_dir + "q7.env", name);
  }
  return value.value_or("");
}

bool ResolveConnection(const Environment& env, const std::string& url_override,
                       const std::string& token_override, const std::string& ca_override,
                       Connection* out, std::string* error) {
  std::string address = url_override;
  if (address.empty() && !ResolveAddress(env, &address, error)) {
    return false;
  }
  // An agent given a certificate serves only HTTPS; a configured address has no scheme.
  if (url_override.empty() && address.find("://") == std::string::npos &&
      !AgentSetting(env, "Q7_TLS_CERT").empty()) {
    address = "https://" + address;
  }
  out->url = AddressToUrl(address);
  out->token = token_override.empty() ? ResolveToken(env) : token_override;
  out->ca_certificate = ca_override.empty() ? AgentSetting(env, "Q7_TLS_CACERT") : ca_override;
  return true;
}

}  // namespace q7ctl
