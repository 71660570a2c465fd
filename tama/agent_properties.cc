#include "tama/agent_properties.h"

#include <memory>

#include "tama/agent_globals.h"
#include "tama/properties.h"

namespace {

// Null until loadAgentProperties; see the header for the threading rule.
std::unique_ptr<Properties>& Map() {
  static std::unique_ptr<Properties> map;
  return map;
}

}  // namespace

void AgentProperties::loadAgentProperties() {
  auto map = std::make_unique<Properties>(KQ1_DetailsPath);
  map->load();
  Map() = std::move(map);
}

std::string AgentProperties::getAgentProperty(const std::string& name) {
  return Map() ? Map()->get(name) : std::string();
}

void AgentProperties::setAgentProperty(const std::string& name, const std::string& value) {
  if (Map()) {
    Map()->set(name, value);
  }
}

void AgentProperties::removeAgentProperty(const std::string& name) {
  if (Map()) {
    Map()->remove(name);
  }
}

std::vector<std::string> AgentProperties::getPropertyNames() {
  return Map() ? Map()->names() : std::vector<std::string>();
}

bool AgentProperties::storeAgentProperties() {
  return Map() && Map()->store();
}

void AgentProperties::resetForTesting() {
  Map().reset();
}
