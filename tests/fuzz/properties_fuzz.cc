// libFuzzer target over the two "name=value" files the agent reads at start-up: the input is
// taken whole as the properties file (through AgentProperties, bound to KQ1_DetailsPath) and as
// the state file (history::StateFile).
//
// Beyond not crashing, it checks that what is stored reads back as what was held:
// - the properties, stored and loaded again, are the same map, and no name holds a '=', a line
//   break or a zero byte;
// - the state file, loaded and saved, then loaded and saved again, gives the same bytes.

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <map>
#include <string>
#include <vector>

#include "core/history/state_file.h"
#include "tama/agent_globals.h"
#include "tama/agent_properties.h"
#include "tests/fuzz/fuzz_support.h"

namespace {

void Check(bool ok, const char* what) {
  if (!ok) {
    fuzzing::Fail("properties_fuzz", what);
  }
}

std::string Root() {
  return fuzzing::ScratchDirectory();
}

std::string ReadFile(const std::string& path) {
  std::string text;
  std::FILE* f = std::fopen(path.c_str(), "rb");
  Check(f != nullptr, "cannot open a saved file");
  char buffer[4096];
  size_t n;
  while ((n = std::fread(buffer, 1, sizeof(buffer), f)) > 0) {
    text.append(buffer, n);
  }
  std::fclose(f);
  return text;
}

std::map<std::string, std::string> AgentPropertyMap() {
  std::map<std::string, std::string> map;
  for (const std::string& name : AgentProperties::getPropertyNames()) {
    map[name] = AgentProperties::getAgentProperty(name);
  }
  return map;
}

void CheckProperties(const uint8_t* data, size_t size) {
  const std::string path = Root() + "/q7details.properties";
  fuzzing::WriteWholeFile(path, data, size);
  AgentProperties::loadAgentProperties();
  const std::map<std::string, std::string> loaded = AgentPropertyMap();
  for (const auto& [name, value] : loaded) {
    Check(name.find_first_of(std::string("=\n\0", 3)) == std::string::npos,
          "a property name holding '=', a line break or a zero byte");
    Check(value.find_first_of(std::string("\n\0", 2)) == std::string::npos,
          "a property value holding a line break or a zero byte");
  }
  Check(AgentProperties::storeAgentProperties(), "the properties cannot be stored");
  AgentProperties::loadAgentProperties();
  Check(AgentPropertyMap() == loaded, "stored properties read back differently");
}

void CheckStateFile(const uint8_t* data, size_t size) {
  const std::string path = Root() + "/q7state.properties";
  fuzzing::WriteWholeFile(path, data, size);
  history::StateFile state(path);
  Check(state.load(), "the state file cannot be read");
  Check(state.save(), "the state file cannot be saved");
  const std::string first = ReadFile(path);
  Check(state.load(), "a saved state file cannot be read");
  Check(state.save(), "a reloaded state file cannot be saved");
  Check(ReadFile(path) == first, "a saved state file reads back differently");
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  fuzzing::QuietTraces("properties_fuzz_trace.log");
  std::snprintf(KQ1_DetailsPath, sizeof(KQ1_DetailsPath), "%s/q7details.properties",
                Root().c_str());
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  CheckProperties(data, size);
  CheckStateFile(data, size);
  return 0;
}
