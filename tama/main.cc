// q7agent process entry: command line, tracing, then the agent's life in CtMain.

#include <malloc.h>
#include <unistd.h>

#include <CLI/CLI.hpp>
#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <string>

#include "framework/agent_runtime.h"
#include "framework/trace.h"
#include "framework/trace_setup.h"
#include "tama/ct_main.h"

namespace {

constexpr char kUnit[] = "tama";

constexpr char kFooter[] = R"(Environment (options above set the same variables):
  Q7_HOME          home directory (default: the parent of the executable's bin/)
  Q7_CONFIG_DIR    configuration directory (default: <home>config/)
  Q7_TRACE         trace masks, e.g. "*=ERROR tama=ALL analyzer=DETAIL|SUMMARY"
                   (classes DEBUG SUMMARY DETAIL FLOW ERROR ALL NONE, or hex)
  Q7_TRACE_FILE    trace destination (default <home>logs/q7agent.log; "-" = stderr)
  Q7_HTTP_ADDRESS  HTTP API address (default 127.0.0.1:7420; port 0 picks one and
                   writes it to <home>logs/q7agent.addr)
  Q7_NODE_NAME     origin node name (default <short host>:Q7)
  DPX_NOSTART      when set, collector processes are neither started nor stopped
  DPX_ZERORECORDS  when set, quiet keys are reported with zero records
  MALLOC_ARENA_MAX glibc's memory arenas (default here: one per core)
Files:
  <configdir><host>_q7.cfg         framework configuration (KQ7DPXLOGPATH, ...)
  <configdir>q7details.properties  agent properties (NAME=VALUE lines)
  <configdir>q7.env                NAME=VALUE lines for framework variables
  <configdir>q7_api_token          bearer token for API changes (created at first start)
  <configdir>q7_situations.json    the started situations (kept across restarts)
  <base>/dpx/sm3ctl                the collector's control script (<base> = <home>zorvan6)
The agent runs in the foreground until SIGINT or SIGTERM.)";

void setEnvFromOption(const char* name, const std::string& value) {
  if (!value.empty()) {
    ::setenv(name, value.c_str(), 1);
  }
}

// By default glibc gives each thread that allocates an arena of its own, up to eight per core,
// and an arena keeps what it once held: under load the HTTP workers' arenas kept the memory of
// big samples and summary folds, and the agent grew by 400 MiB it never used again. One arena
// per core keeps it flat at no cost in throughput; MALLOC_ARENA_MAX still decides when set.
void limitMallocArenas() {
  if (std::getenv("MALLOC_ARENA_MAX") == nullptr) {
    ::mallopt(M_ARENA_MAX, static_cast<int>(std::max(2L, ::sysconf(_SC_NPROCESSORS_ONLN))));
  }
}

}  // namespace

int main(int argc, char** argv) {
  limitMallocArenas();
  CLI::App app{"q7agent: response-time monitoring agent for web traffic seen by the collector",
               "q7agent"};
  app.set_version_flag("--version", std::string("q7agent ") + fw::ProductVersion());
  app.footer(kFooter);
  std::string home, configDir, trace, traceFile, httpAddress;
  bool noCollector = false;
  app.add_option("--home", home, "Home directory (sets Q7_HOME)");
  app.add_option("--config-dir", configDir, "Configuration directory (sets Q7_CONFIG_DIR)");
  app.add_option("--trace", trace, "Trace masks (sets Q7_TRACE)");
  app.add_option("--trace-file", traceFile, "Trace destination, - for stderr (sets Q7_TRACE_FILE)");
  app.add_option("--http-address", httpAddress, "HTTP API host:port (sets Q7_HTTP_ADDRESS)");
  app.add_flag("--no-collector", noCollector,
               "Do not start or stop the collector processes (sets DPX_NOSTART)");
  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError& e) {
    return app.exit(e);
  }
  setEnvFromOption("Q7_HOME", home);
  setEnvFromOption("Q7_CONFIG_DIR", configDir);
  setEnvFromOption("Q7_TRACE", trace);
  setEnvFromOption("Q7_TRACE_FILE", traceFile);
  setEnvFromOption("Q7_HTTP_ADDRESS", httpAddress);
  if (noCollector) {
    ::setenv("DPX_NOSTART", "1", 1);
  }

  fw::SetThreadName("Main Thread");
  std::string error;
  if (fw::StartTracing(&error) != 0) {
    std::fprintf(stderr, "q7agent: %s\n", error.c_str());
  }
  Q7_FLOW(kUnit);
  const int result = CtMain(argc, argv);
  Q7_TRACE(kUnit, fw::kTraceSummary, "CtMain returned %d", result);
  fw::TraceFlush();
  return 0;
}
