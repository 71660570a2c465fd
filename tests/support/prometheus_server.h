#pragma once

// Test helper: Debian's prometheus run by a test, on a free loopback port with its storage in a
// scratch directory, scraping what the test's configuration names; and its query API.
//
// Stopped and reaped when destroyed. Not thread-safe.

#include <chrono>
#include <memory>
#include <nlohmann/json.hpp>
#include <string>

#include "tests/support/child_process.h"

namespace q7test {

class PrometheusServer {
 public:
  // dir: a directory of the test's own; the configuration, rules and storage go below it.
  explicit PrometheusServer(std::string dir);
  ~PrometheusServer();
  PrometheusServer(const PrometheusServer&) = delete;
  PrometheusServer& operator=(const PrometheusServer&) = delete;

  // Writes config as prometheus.yml in the directory (rule files it names are relative to it:
  // write them with writeFile first), starts prometheus and waits until it is ready. False with
  // the reason in *error (and the end of its log) otherwise.
  bool Start(const std::string& config, std::string* error);
  // Writes a file below the directory.
  void writeFile(const std::string& relative, const std::string& content) const;
  const std::string& dir() const { return dir_; }

  // An instant query's data.result (an array; empty when the query failed, with the reason in
  // *error when given).
  nlohmann::json query(const std::string& promql, std::string* error = nullptr) const;
  // The scrape targets' health ("up", "down", "unknown") by scrape URL.
  nlohmann::json targets() const;
  std::string log() const;

 private:
  std::string dir_;
  int port_ = 0;
  std::unique_ptr<ChildProcess> process_;
};

}  // namespace q7test
