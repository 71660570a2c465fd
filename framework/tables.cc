#include "framework/tables.h"

#include <algorithm>
#include <cctype>
#include <utility>

#include "framework/mutex.h"
#include "framework/status.h"
#include "framework/trace.h"

namespace fw {
namespace {

constexpr char kUnit[] = "tables";

struct Registry {
  // Definitions are immutable once in the list, so a caller may use a pointer it got without
  // the lock.
  Mutex mutex;
  std::vector<std::shared_ptr<const TableDefinition>> tables GUARDED_BY(mutex);
};

Registry& TheRegistry() {
  static Registry registry;
  return registry;
}

bool SameName(std::string_view a, std::string_view b) {
  return a.size() == b.size() && std::equal(a.begin(), a.end(), b.begin(), [](char x, char y) {
           return std::tolower(static_cast<unsigned char>(x)) ==
                  std::tolower(static_cast<unsigned char>(y));
         });
}

// Empty when the column fits its table, else why not.
std::string ColumnProblem(const ColumnInfo& column, std::size_t row_size) {
  if (column.name == nullptr || column.name[0] == '\0') {
    return "a column has no name";
  }
  const std::string name = column.name;
  switch (column.type) {
    case kColumnTypeInt32:
      if (column.width != 4) {
        return name + " is a 32-bit integer of width " + std::to_string(column.width);
      }
      break;
    case kColumnTypeInt16:
      if (column.width != 2) {
        return name + " is a 16-bit integer of width " + std::to_string(column.width);
      }
      break;
    case kColumnTypeString:
    case kColumnTypeLongText:
      break;
    default:
      return name + " has the unknown type " + std::to_string(column.type);
  }
  if (column.width <= 0 || column.offset < 0 ||
      static_cast<std::size_t>(column.offset) + static_cast<std::size_t>(column.width) > row_size) {
    return name + " does not lie within the " + std::to_string(row_size) + "-byte row";
  }
  return "";
}

}  // namespace

int RegisterTable(TableDefinition definition) {
  std::string problem;
  if (definition.name.empty()) {
    problem = "no name";
  } else if (definition.columns.empty()) {
    problem = "no columns";
  } else if (definition.manager == nullptr) {
    problem = "no manager";
  }
  for (const ColumnInfo& column : definition.columns) {
    if (problem.empty()) {
      problem = ColumnProblem(column, definition.row_size);
    }
  }
  if (!problem.empty()) {
    Q7_TRACE(kUnit, kTraceError, "table \"%s\" refused: %s", definition.name.c_str(),
             problem.c_str());
    return kInvalidArgument;
  }

  Registry& registry = TheRegistry();
  MutexLock lock(registry.mutex);
  for (const auto& table : registry.tables) {
    if (SameName(table->name, definition.name)) {
      Q7_TRACE(kUnit, kTraceError, "table %s refused: it is already registered",
               definition.name.c_str());
      return kAlreadyExists;
    }
  }
  Q7_TRACE(kUnit, kTraceDetail, "table %s registered: %zu columns, %zu-byte rows",
           definition.name.c_str(), definition.columns.size(), definition.row_size);
  registry.tables.push_back(std::make_shared<const TableDefinition>(std::move(definition)));
  return kOk;
}

std::shared_ptr<const TableDefinition> FindTable(std::string_view name) {
  Registry& registry = TheRegistry();
  MutexLock lock(registry.mutex);
  for (const auto& table : registry.tables) {
    if (SameName(table->name, name)) {
      return table;
    }
  }
  return nullptr;
}

std::vector<std::shared_ptr<const TableDefinition>> ListTables() {
  Registry& registry = TheRegistry();
  MutexLock lock(registry.mutex);
  return registry.tables;
}

const ColumnInfo* FindColumn(std::span<const ColumnInfo> columns, std::string_view name) {
  for (const ColumnInfo& column : columns) {
    if (SameName(column.name, name)) {
      return &column;
    }
  }
  return nullptr;
}

void ResetTablesForTesting() {
  Registry& registry = TheRegistry();
  MutexLock lock(registry.mutex);
  registry.tables.clear();
}

}  // namespace fw
