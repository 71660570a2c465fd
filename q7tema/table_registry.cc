#include "q7tema/table_registry.h"

#include <string>

#include "framework/trace.h"

namespace q7tema {
namespace {

constexpr char kUnit[] = "tables";

std::array<TableInitFunction, kTableLoadOrder.size()>& Inits() {
  static std::array<TableInitFunction, kTableLoadOrder.size()> inits{};
  return inits;
}

}  // namespace

bool RegisterTableInit(std::string_view name, TableInitFunction init) {
  for (std::size_t i = 0; i < kTableLoadOrder.size(); ++i) {
    if (kTableLoadOrder[i] == name) {
      Inits()[i] = init;
      return true;
    }
  }
  return false;
}

int InitAllTables() {
  int initialised = 0;
  std::string absent;
  for (std::size_t i = 0; i < kTableLoadOrder.size(); ++i) {
    const std::string name(kTableLoadOrder[i]);
    if (Inits()[i] == nullptr) {
      absent += (absent.empty() ? "" : " ") + name;
      continue;
    }
    Q7_TRACE(kUnit, fw::kTraceDetail, "kq7_%s_init", name.c_str());
    Inits()[i]();
    ++initialised;
  }
  if (!absent.empty()) {
    Q7_TRACE(kUnit, fw::kTraceSummary, "tables not available in this build: %s", absent.c_str());
  }
  return initialised;
}

void ResetTableInitsForTesting() {
  Inits().fill(nullptr);
}

}  // namespace q7tema
