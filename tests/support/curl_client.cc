#include "tests/support/curl_client.h"

#include <sstream>

#include "tests/support/child_process.h"

namespace q7test {

namespace {

// True when this process may run programs at a real-time priority (root, or CAP_SYS_NICE).
bool RealtimeAllowed(const std::string& scratch_dir) {
  static const bool allowed =
      RunToEnd({"/usr/bin/chrt", "--fifo", "10", "/bin/true"}, scratch_dir + "/chrt.out",
               scratch_dir + "/chrt.out", nullptr, nullptr) == 0;
  return allowed;
}

}  // namespace

std::vector<nlohmann::json> RunCurl(const std::vector<CurlTransfer>& transfers,
                                    const std::string& scratch_dir, std::string* error) {
  // curl stamps an event when it gets to run, not when it happens: on a busy machine (a build,
  // tests in parallel) it may wait milliseconds for a CPU between a reply's arrival and its
  // read. At a real-time priority it runs as soon as it wakes, so its timings stay those of the
  // wire.
  std::vector<std::string> argv;
  if (RealtimeAllowed(scratch_dir)) {
    argv = {"/usr/bin/chrt", "--fifo", "10"};
  }
  argv.insert(argv.end(), {"/usr/bin/curl", "--silent", "--show-error"});
  for (size_t i = 0; i < transfers.size(); ++i) {
    if (i > 0) {
      argv.push_back("--next");  // options reset, connection kept
    }
    argv.insert(argv.end(), transfers[i].options.begin(), transfers[i].options.end());
    argv.insert(argv.end(),
                {"--write-out", "%{json}\\n", "--output", "/dev/null", transfers[i].url});
  }
  std::string out;
  std::string err;
  const int code = RunToEnd(argv, scratch_dir + "/curl.out", scratch_dir + "/curl.err", &out, &err);
  std::vector<nlohmann::json> results;
  std::istringstream lines(out);
  for (std::string line; std::getline(lines, line);) {
    results.push_back(nlohmann::json::parse(line, nullptr, false));
  }
  if (code != 0 || results.size() != transfers.size()) {
    *error = "curl exited with " + std::to_string(code) + " after " +
             std::to_string(results.size()) + " of " + std::to_string(transfers.size()) +
             " transfers: " + err;
  }
  return results;
}

}  // namespace q7test
