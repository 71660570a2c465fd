#include "core/analyzer/analysis/checkpoint_state.h"

#include <exception>
#include <nlohmann/json.hpp>

namespace {

constexpr int kDescriptionVersion = 1;

}  // namespace

std::string CheckpointState::encode() const {
  nlohmann::json j;
  j["version"] = kDescriptionVersion;
  j["sequence"] = sequence;
  j["interval"] = interval;
  j["written"] = written;
  j["position"] = {{"file", position.file},
                   {"device", position.device},
                   {"inode", position.inode},
                   {"offset", position.offset}};
  j["instanceLevel"] = instanceLevel;
  j["oldTransactions"] = oldTransactions;
  j["transactionsReceived"] = transactionsReceived;
  j["instanceFiles"] = nlohmann::json::array();
  for (const InstanceFileLength& f : instanceFiles) {
    j["instanceFiles"].push_back({{"stem", f.stem}, {"interval", f.interval}, {"bytes", f.bytes}});
  }
  j["patterns"] = nlohmann::json::array();
  for (const PatternCounter& p : patterns) {
    j["patterns"].push_back({{"situation", p.situationId},
                             {"application", p.applicationPattern},
                             {"transaction", p.transactionPattern},
                             {"matched", p.matched},
                             {"sampled", p.sampled}});
  }
  // Names from the file system need not be UTF-8: replace what is not, rather than throw.
  return j.dump(1, ' ', false, nlohmann::json::error_handler_t::replace);
}

bool CheckpointState::decode(std::string_view text, CheckpointState* state, std::string* why) {
  const nlohmann::json j = nlohmann::json::parse(text, nullptr, false);
  if (j.is_discarded() || !j.is_object()) {
    *why = "its description is not JSON";
    return false;
  }
  // The accessors throw on a missing key or a wrong type; any of them means a foreign file.
  try {
    if (j.at("version").get<int>() != kDescriptionVersion) {
      *why = "a description version this agent does not know";
      return false;
    }
    CheckpointState s;
    s.sequence = j.at("sequence").get<uint64_t>();
    s.interval = j.at("interval").get<int64_t>();
    s.written = j.at("written").get<int64_t>();
    const nlohmann::json& p = j.at("position");
    s.position.file = p.at("file").get<std::string>();
    s.position.device = p.at("device").get<uint64_t>();
    s.position.inode = p.at("inode").get<uint64_t>();
    s.position.offset = p.at("offset").get<long long>();
    s.instanceLevel = j.at("instanceLevel").get<int>();
    s.oldTransactions = j.at("oldTransactions").get<int32_t>();
    s.transactionsReceived = j.at("transactionsReceived").get<int32_t>();
    for (const nlohmann::json& f : j.at("instanceFiles")) {
      s.instanceFiles.push_back({f.at("stem").get<std::string>(), f.at("interval").get<int64_t>(),
                                 f.at("bytes").get<int64_t>()});
    }
    for (const nlohmann::json& c : j.at("patterns")) {
      s.patterns.push_back({c.at("situation").get<std::string>(),
                            c.at("application").get<std::string>(),
                            c.at("transaction").get<std::string>(), c.at("matched").get<uint32_t>(),
                            c.at("sampled").get<uint32_t>()});
    }
    if (s.interval < 0 || s.position.offset < 0) {
      *why = "a negative interval or offset";
      return false;
    }
    for (const InstanceFileLength& f : s.instanceFiles) {
      if (f.interval < 0 || f.bytes < 0 || f.stem.empty() ||
          f.stem.find('/') != std::string::npos) {
        *why = "an instance file length that cannot be";
        return false;
      }
    }
    *state = std::move(s);
    return true;
  } catch (const std::exception& e) {
    *why = std::string("its description is incomplete: ") + e.what();
    return false;
  }
}
