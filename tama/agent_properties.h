#pragma once

// AgentProperties: the process-wide property map of the agent, bound to the properties file
// (KQ1_DetailsPath). readAgentConfig loads it and merges the fixed properties and the
// configuration file into it; the agent-details table reports every entry.
//
// Thread safety: loaded and written only on the main thread during start-up, before any worker
// thread starts; afterwards every thread may read it without a lock. Lookups before
// loadAgentProperties see an empty map, and writes before it are ignored.

#include <string>
#include <vector>

class AgentProperties {
 public:
  AgentProperties() = delete;

  // Creates the map bound to KQ1_DetailsPath and loads it (a missing file gives an empty map).
  // A second call replaces the map.
  static void loadAgentProperties();
  // The value, or the empty string when the name is absent or nothing is loaded.
  static std::string getAgentProperty(const std::string& name);
  static void setAgentProperty(const std::string& name, const std::string& value);
  static void removeAgentProperty(const std::string& name);
  // Every name in key order; empty when nothing is loaded.
  static std::vector<std::string> getPropertyNames();
  // Writes the map back to its file. Returns false when nothing is loaded or the write fails.
  static bool storeAgentProperties();

  // Drops the map, as at process start.
  static void resetForTesting();
};
