#pragma once

// Where q7ctl finds the agent: the API address and the bearer token.
//
// The lookup follows the agent's own rules, so that q7ctl run from an agent home (or with the
// same Q7_HOME / Q7_CONFIG_DIR) talks to that agent without options:
//   home       = $Q7_HOME, else the parent of the executable's bin/ folder
//   config dir = $Q7_CONFIG_DIR, else <home>config/
//   address    = Q7_HTTP_ADDRESS from the process environment, else from <configdir>q7.env,
//                else the bound address the agent wrote to <home>logs/q7agent.addr,
//                else 127.0.0.1:7420. A configured port 0 means "the agent picked one", so the
//                .addr file wins over it.
//   token      = <configdir>q7_api_token, trimmed; none when the file is missing or empty.
//   scheme     = https when the agent has a certificate (Q7_TLS_CERT, from the environment or
//                q7.env) and the address names no scheme; the .addr file names it.
//   CA         = --cacert, else Q7_TLS_CACERT (environment or q7.env), else the system's.
//
// Everything the lookup reads from the process is behind Environment, so tests can run it
// against a temporary home without touching the real environment.

#include <functional>
#include <optional>
#include <string>

namespace q7ctl {

// The process facts the lookup depends on.
struct Environment {
  // Returns a process environment variable, or nullopt when it is not set.
  std::function<std::optional<std::string>(const std::string& name)> get;
  // Folder of the running executable, with a trailing '/'; may be empty when unknown.
  std::string executable_dir;

  // The real process: getenv and /proc/self/exe.
  static Environment Process();
};

// Where to connect and how to authenticate.
struct Connection {
  std::string url;    // "http://host:port", no trailing '/'
  std::string token;  // empty: send no Authorization header
  // PEM file of the CA (or the self-signed certificate) that signs the agent's certificate;
  // empty: the system's trusted CAs.
  std::string ca_certificate;
};

// NAME from the process environment, else from <configdir>q7.env; empty when in neither.
std::string AgentSetting(const Environment& env, const std::string& name);

// Home and configuration directories, each with a trailing '/'; empty when the home cannot be
// determined (no Q7_HOME and no executable path).
std::string HomeDirectory(const Environment& env);
std::string ConfigDirectory(const Environment& env);

// Looks NAME up in a q7.env file: NAME=VALUE lines, '#' comment lines, blanks around name and
// value dropped, a value in double quotes loses them, the last definition wins.
std::optional<std::string> EnvFileValue(const std::string& path, const std::string& name);

// The agent's API address as "host:port" by the precedence above. Fails (with *error set) only
// when the configured port is 0 and no .addr file tells which port the agent took.
bool ResolveAddress(const Environment& env, std::string* address, std::string* error);

// The token from <configdir>q7_api_token, trimmed of surrounding whitespace; empty if none.
std::string ResolveToken(const Environment& env);

// Turns "host:port" or a URL into a URL with a scheme ("http://" when none is given), without
// a trailing '/'. A wildcard host (0.0.0.0, [::]) becomes the matching loopback address, since
// an agent listening everywhere is reached locally through it.
std::string AddressToUrl(const std::string& address);

// The whole connection: url_override, token_override and ca_override, when not empty, win over
// the lookup.
bool ResolveConnection(const Environment& env, const std::string& url_override,
                       const std::string& token_override, const std::string& ca_override,
                       Connection* out, std::string* error);

}  // namespace q7ctl
