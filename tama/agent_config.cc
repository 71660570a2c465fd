#include "tama/agent_config.h"

#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <limits>
#include <string>

#include "core/config/cconfig.h"
#include "core/messages/agent_message.h"
#include "framework/config_file.h"
#include "framework/environment.h"
#include "framework/status.h"
#include "framework/trace.h"
#include "tama/agent_globals.h"
#include "tama/agent_properties.h"

namespace {

constexpr const char* kUnit = "tama";
constexpr const char* kOutlierProperty = "KQ7EXCLUDEOUTLIERSECONDS";

// Bounded concatenation into a path buffer; longer text is cut at the buffer size.
void Compose(char (&dest)[kPathBufferSize], const std::string& a, const std::string& b = {},
             const std::string& c = {}) {
  std::snprintf(dest, kPathBufferSize, "%s%s%s", a.c_str(), b.c_str(), c.c_str());
}

// Fractional seconds to milliseconds, truncated toward zero. Out-of-range values saturate
// rather than overflow the conversion.
int SecondsToMillis(double seconds) {
  double millis = seconds * 1000.0;
  if (millis >= static_cast<double>(std::numeric_limits<int>::max())) {
    return std::numeric_limits<int>::max();
  }
  if (millis <= static_cast<double>(std::numeric_limits<int>::min())) {
    return std::numeric_limits<int>::min();
  }
  return static_cast<int>(millis);
}

void MergeConfigFile(const char* path) {
  fw::ConfigFile config;
  std::string error;
  if (fw::ConfigFile::Parse(path, &config, &error) != fw::kOk) {
    Q7_TRACE(kUnit, fw::kTraceError, "Error: unable to parse config file \"%s\".\n", path);
    // The parser's text carries the line number the operator needs.
    if (!error.empty()) {
      Q7_TRACE(kUnit, fw::kTraceError, "%s", error.c_str());
    }
    return;
  }
  const fw::ConfigInstance* instance = config.FindInstance("");
  if (instance == nullptr) {
    Q7_TRACE(kUnit, fw::kTraceError, "Error: config file syntax error - no instance found\"%s\".\n",
             path);
    return;
  }
  for (const fw::ConfigSection& section : instance->sections) {
    for (const fw::ConfigEntry& entry : section.entries) {
      AgentProperties::setAgentProperty(entry.name, entry.value);
      Q7_TRACE(kUnit, fw::kTraceDetail, "Got config value %s = %s", entry.name.c_str(),
               entry.value.c_str());
    }
  }
}

}  // namespace

void readAgentConfig() {
  Q7_FLOW(kUnit);
  std::string base_dir;
  std::string home;
  if (fw::GetHomeDirectory(&home) != fw::kOk) {
    Q7_TRACE(kUnit, fw::kTraceError, "Could not retrieve OXA base directory.");
  } else {
    Compose(KTX_MordelDir, home);
    // The home already ends in '/', so no separator goes between.
    base_dir = std::string(KTX_MordelDir) + "zorvan6";
    Q7_TRACE(kUnit, fw::kTraceDetail, "OXA base directory = %s", base_dir.c_str());
  }

  Compose(KQ1_BaseDir, base_dir);
  Q7_TRACE(kUnit, fw::kTraceDetail, "KQ1_BaseDir = %s", KQ1_BaseDir);

  std::string config_dir;
  if (fw::GetConfigDirectory(&config_dir) != fw::kOk) {
    config_dir.clear();
    Q7_TRACE(kUnit, fw::kTraceError, "Could not retrieve OXA config directory.");
  } else {
    Q7_TRACE(kUnit, fw::kTraceDetail, "OXA config directory = %s", config_dir.c_str());
  }

  Compose(KQ1_ConfigPath, config_dir, kq1_short_agent_name, "_q7.cfg");
  Q7_TRACE(kUnit, fw::kTraceDetail, "KQ1_ConfigPath = %s", KQ1_ConfigPath);
  Compose(KQ1_DetailsPath, config_dir, "q7details.properties");
  Q7_TRACE(kUnit, fw::kTraceDetail, "KQ1_DetailsPath = %s", KQ1_DetailsPath);

  AgentProperties::loadAgentProperties();
  AgentProperties::setAgentProperty("AgentBaseDir", KQ1_BaseDir);
  AgentProperties::setAgentProperty("AgentConfigDir", config_dir);
  AgentProperties::setAgentProperty("AgentType", kProductDisplayName);
  AgentProperties::setAgentProperty("AgentVersion", kq1_product_ver);

  std::string class_path;
  if (fw::GetEnv("KQ7_CLASSPATH", &class_path)) {
    Compose(KQ1_CLASSPATH, class_path);
    AgentProperties::setAgentProperty("AgentLibDir", KQ1_CLASSPATH);
    Compose(RT_BundlePath, KQ1_CLASSPATH, "/", "RTAgentMsgs");
    Q7_TRACE(kUnit, fw::kTraceDetail, "RT_BundlePath = %s", RT_BundlePath);
    AgentMessage::setResourceBundle(RT_BundlePath);
  }

  MergeConfigFile(KQ1_ConfigPath);
}

void doExcludeOutliers() {
  Q7_FLOW(kUnit);
  const std::string value = AgentProperties::getAgentProperty(kOutlierProperty);
  Q7_TRACE(kUnit, fw::kTraceDetail, "ExcludeOutlier string found in AgentProperties[%s].",
           value.c_str());

  // Leading digits only, so "2.5" means 2 seconds. C++20 defines the narrowing as modular.
  const int seconds = static_cast<int>(std::strtol(value.c_str(), nullptr, 10));
  if (seconds != 0) {
    Q7_TRACE(kUnit, fw::kTraceDetail, "Setting ExcludeOutlierSeconds to[%d].", seconds);
    CConfig::setExcludeOutlierSeconds(seconds);
    return;
  }

  // No whole seconds: perhaps a fraction such as 0.25. NaN is treated as 0.
  const double fraction = std::strtod(value.c_str(), nullptr);
  if (fraction == 0.0 || std::isnan(fraction)) {
    Q7_TRACE(kUnit, fw::kTraceDetail,
             "ExcludeOutlierSeconds string converts to 0.  NOT setting CConfig value.");
    return;
  }
  const int millis = SecondsToMillis(fraction);
  // clang-format off
  Q7_TRACE(kUnit, fw::kTraceDetail, "User seems to have given flat for ExcludeOutlierSeconds.  Setting Outlier millis to[%d].", millis);
  // clang-format on
  CConfig::setExcludeOutlierMillis(millis);
}
