#pragma once

// Test helper: web traffic made by Debian's curl, with curl's own account of every transfer
// (its -w "%{json}" object: local_port, response_code, time_pretransfer, time_starttransfer,
// time_total, size_request, size_download, ...), the client's view to compare a capture with.

#include <nlohmann/json.hpp>
#include <string>
#include <vector>

namespace q7test {

// One transfer: its URL and the curl options that apply to it alone ("-I", "-e", REFERER,
// "-H", "Host: ...", "--data-binary", BODY, ...).
struct CurlTransfer {
  std::string url;
  std::vector<std::string> options;
};

// Makes the transfers in order in one curl invocation, so that curl reuses one keep-alive
// connection for all of them when it can. Returns curl's JSON object per transfer, in order;
// fewer (with the reason in *error) when curl failed. scratch_dir holds curl's output files.
std::vector<nlohmann::json> RunCurl(const std::vector<CurlTransfer>& transfers,
                                    const std::string& scratch_dir, std::string* error);

}  // namespace q7test
