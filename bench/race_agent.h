#pragma once

// The agent's side of bench_logs_race: a q7agent in a home of its own that reads one data
// directory and keeps every application, transaction and client, its tables read over the HTTP
// API, and the test of when it has read a whole .sm3 file.
//
// Thread safety: none; the bench's main thread uses these.

#include <sys/types.h>

#include <cstdint>
#include <memory>
#include <nlohmann/json.hpp>
#include <optional>
#include <string>

#include "tests/agent_process.h"

namespace bench {

// The last record of an .sm3 file. The agent takes records in file order, so once its tables
// count this one, they count them all: for an object, when they count every object record of
// its URL; for a page, when they count every page.
struct FinalRecord {
  bool object = false;
  std::string url;          // an object's URL path
  int64_t url_objects = 0;  // object records of that URL in the whole file
};

// Reads the file once (mapped); nullopt when it cannot be read or is empty.
std::optional<FinalRecord> FindFinalRecord(const std::string& path);

// The agent in <root>/home/, reading <root>/home/data: one catch-all transaction pattern that
// keeps application and transaction names (slow above 2 s, no instance tracing); clients keep
// their own identity, as no client pattern is given.
class AgentHome {
 public:
  explicit AgentHome(const std::string& root) : home_(root + "/home/") {}
  ~AgentHome() = default;  // an agent still running is killed by its AgentProcess
  AgentHome(const AgentHome&) = delete;
  AgentHome& operator=(const AgentHome&) = delete;

  // The data directory, without a trailing '/'.
  std::string data() const { return home_ + "data"; }

  // Writes the configuration (with extraConfig's lines) and the pattern; false with *error
  // when the pattern is refused.
  bool Prepare(std::string* error, const std::string& extraConfig = "");
  // Starts the agent (DPX_NOSTART: no collector processes) and waits up to 20 s for its API;
  // returns its address, empty on failure.
  std::string Start();
  pid_t pid() const { return agent_->pid(); }
  // SIGTERM, then up to 15 s for the exit; false if it did not exit.
  bool Stop();
  // The agent's trace file (errors only, by default).
  std::string Trace() const;
  // The bearer token changes over the API need (created by the agent at its first start).
  std::string ApiToken() const;

 private:
  const std::string home_;  // with a trailing '/'
  std::unique_ptr<q7test::AgentProcess> agent_;
};

// One table sample over the API, query being "" or "?where=..."; null on failure.
nlohmann::json Sample(const std::string& address, const std::string& table,
                      const std::string& query = "");

// The sum of an integer column over a sample's rows (0 for a null sample).
int64_t SumColumn(const nlohmann::json& sample, const char* column);

}  // namespace bench
