// libFuzzer target over the configuration file: the input is the host configuration file's text.
// It is parsed as text, then read by the agent's start-up path (readAgentConfig from a home and
// configuration directory of its own, doExcludeOutliers, applyAgentProperties) into the agent
// properties and CConfig.
//
// Beyond not crashing, it checks:
// - a file that parses, written back as headers and "name=value" lines, parses to the same
//   instances, sections and entries (skipped where an entry line cannot say what a continuation
//   line did: a line too long under a long name, or a value holding " ;", which inih keeps on
//   a continuation line and cuts as a comment on an entry line; nor where a section of an
//   unnamed instance named with a colon needs a header longer than inih keeps);
// - the agent properties hold, for every entry of the unnamed instance, its last value, and
//   nothing else but the fixed properties when the file does not parse;
// - the intervals CConfig ends with are never 0, which the setters replace.

#include <stdlib.h>

#include <cctype>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <map>
#include <set>
#include <string>
#include <string_view>

#include "core/config/cconfig.h"
#include "framework/config_file.h"
#include "framework/status.h"
#include "tama/agent_config.h"
#include "tama/agent_globals.h"
#include "tama/agent_properties.h"
#include "tama/startup.h"
#include "tests/fuzz/fuzz_support.h"

namespace {

void Check(bool ok, const char* what) {
  if (!ok) {
    fuzzing::Fail("config_fuzz", what);
  }
}

std::string Root() {
  return fuzzing::ScratchDirectory();
}

// The longest header text inih keeps whole.
constexpr size_t kMaxHeader = 49;

bool HoldsInlineComment(const std::string& value) {
  for (size_t i = 1; i < value.size(); ++i) {
    if (value[i] == ';' && std::isspace(static_cast<unsigned char>(value[i - 1]))) {
      return true;
    }
  }
  return false;
}

// Every section under a header of its own, so instance order and empty sections survive.
// *fits: false when some entry cannot be written so that it reads back the same.
std::string WriteBack(const fw::ConfigFile& config, bool* fits) {
  std::string text;
  *fits = true;
  const auto add_line = [&](const std::string& line) {
    *fits = *fits && line.size() <= fw::ConfigFile::kMaxLine;
    text += line;
    text += '\n';
  };
  for (const fw::ConfigInstance& instance : config.instances()) {
    for (const fw::ConfigSection& section : instance.sections) {
      // The colon also when an unnamed instance's section name holds one.
      const bool colon = !instance.name.empty() || section.name.find(':') != std::string::npos;
      const std::string header = colon ? instance.name + ":" + section.name : section.name;
      *fits = *fits && header.size() <= kMaxHeader;
      add_line("[" + header + "]");
      for (const fw::ConfigEntry& entry : section.entries) {
        *fits = *fits && !HoldsInlineComment(entry.value);
        add_line(entry.name + "=" + entry.value);
      }
    }
  }
  return text;
}

bool SameEntries(const fw::ConfigFile& a, const fw::ConfigFile& b) {
  if (a.instances().size() != b.instances().size()) {
    return false;
  }
  for (size_t i = 0; i < a.instances().size(); ++i) {
    const fw::ConfigInstance& x = a.instances()[i];
    const fw::ConfigInstance& y = b.instances()[i];
    if (x.name != y.name || x.sections.size() != y.sections.size()) {
      return false;
    }
    for (size_t j = 0; j < x.sections.size(); ++j) {
      const fw::ConfigSection& s = x.sections[j];
      const fw::ConfigSection& t = y.sections[j];
      if (s.name != t.name || s.entries.size() != t.entries.size()) {
        return false;
      }
      for (size_t k = 0; k < s.entries.size(); ++k) {
        if (s.entries[k].name != t.entries[k].name || s.entries[k].value != t.entries[k].value) {
          return false;
        }
      }
    }
  }
  return true;
}

// What readAgentConfig sets whatever the file holds.
const std::set<std::string> kFixedProperties = {"AgentBaseDir", "AgentConfigDir", "AgentType",
                                                "AgentVersion", "AgentLibDir"};

void CheckAgentProperties(const fw::ConfigFile* parsed) {
  std::map<std::string, std::string> expected;
  if (parsed != nullptr) {
    if (const fw::ConfigInstance* instance = parsed->FindInstance("")) {
      for (const fw::ConfigSection& section : instance->sections) {
        for (const fw::ConfigEntry& entry : section.entries) {
          expected[entry.name] = entry.value;
        }
      }
    }
  }
  for (const std::string& name : AgentProperties::getPropertyNames()) {
    const auto it = expected.find(name);
    if (it == expected.end()) {
      Check(kFixedProperties.count(name) == 1, "a property that no entry set");
    } else {
      Check(AgentProperties::getAgentProperty(name) == it->second,
            "a property without its entry's last value");
      expected.erase(it);
    }
  }
  Check(expected.empty(), "an entry of the unnamed instance missing from the properties");
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  fuzzing::QuietTraces("config_fuzz_trace.log");
  std::filesystem::create_directories(Root() + "/home");
  std::filesystem::create_directories(Root() + "/config");
  setenv("Q7_HOME", (Root() + "/home/").c_str(), 1);
  setenv("Q7_CONFIG_DIR", (Root() + "/config/").c_str(), 1);
  // No message bundle: opening one on every run would cost more than the rest.
  setenv("KQ7_CLASSPATH", (Root() + "/lib").c_str(), 1);
  std::strcpy(kq1_short_agent_name, "fuzz");
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const std::string_view text(reinterpret_cast<const char*>(data), size);
  fw::ConfigFile parsed;
  std::string error;
  const bool parses = fw::ConfigFile::ParseText(text, &parsed, &error) == fw::kOk;
  if (parses) {
    bool fits = false;
    const std::string written = WriteBack(parsed, &fits);
    if (fits) {
      fw::ConfigFile again;
      Check(fw::ConfigFile::ParseText(written, &again, &error) == fw::kOk,
            "a configuration written back does not parse");
      Check(SameEntries(parsed, again), "a configuration written back parses differently");
    }
  } else {
    Check(error.rfind("line ", 0) == 0, "a parse error that names no line");
  }

  fuzzing::WriteWholeFile(Root() + "/config/fuzz_q7.cfg", data, size);
  AgentProperties::resetForTesting();
  CConfig::resetForTesting();
  readAgentConfig();
  CheckAgentProperties(parses ? &parsed : nullptr);
  doExcludeOutliers();
  // Directories stay inside the scratch tree whatever the file names.
  AgentProperties::setAgentProperty("AgentBaseDir", Root() + "/base");
  AgentProperties::setAgentProperty("KQ7DPXLOGPATH", Root() + "/dpx");
  applyAgentProperties();
  Check(CConfig::getOverTimeInterval() != 0 && CConfig::getSummaryInterval() != 0,
        "an interval of 0 kept");
  return 0;
}
