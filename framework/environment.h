#pragma once

// Framework lookups of directories and environment settings.
//
// Variables of the framework: Q7_HOME (home directory; default the parent of the executable's
// bin/ folder), Q7_CONFIG_DIR (default <home>config/), Q7_TRACE, Q7_TRACE_FILE,
// Q7_HTTP_ADDRESS, Q7_NODE_NAME. Directory answers always end in '/', since callers append
// file names directly.
//
// Thread safety: callable from any thread; reads the process environment and the q7.env file
// on every call (lookups are rare).

#include <string>

namespace fw {

// The folder holding the running executable, with a trailing '/'.
std::string ExecutableDirectory();

// Home directory: Q7_HOME of the process environment (a '/' appended when missing) or the
// parent of the executable's folder. Returns kOk, or kNotFound when neither can be determined.
int GetHomeDirectory(std::string* out);

// Configuration directory: Q7_CONFIG_DIR of the process environment (a '/' appended when
// missing) or <home>config/. Neither directory variable is read from q7.env, which lives here.
int GetConfigDirectory(std::string* out);

// Environment lookup: the process environment first (a variable set to "" counts), then
// NAME=VALUE lines of <configdir>q7.env ('#' at the start of a line makes a comment line;
// blanks around the name and the value are dropped; a value in matching double quotes loses
// them; a name defined twice takes its last value; other lines are skipped). KQ7_CLASSPATH set
// by neither answers the lib folder beside the executable's folder ("/opt/q7/lib" for
// "/opt/q7/bin/q7agent", no trailing '/'). Returns true and the value when found.
bool GetEnv(const char* name, std::string* value);

}  // namespace fw
