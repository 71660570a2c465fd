#pragma once

// The framework's table registry: every exported table with its columns, row size and manager
// object, in registration order. The agent loader registers the tables on the main thread while
// HTTP threads may already list them.
//
// Thread safety: every function may be called from any thread. Registered tables are never
// changed and stay alive as long as someone holds their pointer.

#include <cstddef>
#include <memory>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "framework/table_manager.h"

namespace fw {

// Column type codes.
inline constexpr int kColumnTypeString = 9;     // fixed-width text, unterminated when full
inline constexpr int kColumnTypeInt32 = 3;      // int32_t, width 4
inline constexpr int kColumnTypeInt16 = 5;      // int16_t, width 2
inline constexpr int kColumnTypeLongText = 12;  // fixed-width long text

// What a column description lookup answers for an index outside the columns.
inline constexpr int kBadColumnIndex = 0x21060007;

// One column of a table's row layout.
struct ColumnInfo {
  const char* name = "";  // attribute name, lower case; must stay alive (a string literal)
  int type = 0;           // one of the kColumnType codes; 0 in an empty description
  int width = 0;          // bytes in the row
  int offset = 0;         // bytes from the start of the row
};

// A table as registered.
struct TableDefinition {
  std::string name;                       // exported name, "Q7APPOT"
  std::vector<ColumnInfo> columns;        // in row order
  std::size_t row_size = 0;               // bytes per row
  std::unique_ptr<TableManager> manager;  // the table's manager, owned by the registry
  // The columns whose values tell rows apart for alerts (applicatin; applicatin, transactn,
  // client and server ...), in this order. Empty: every text column.
  std::vector<std::string> key_columns;
  // A situation on the table defines patterns (its start registers them) instead of alerting.
  bool defines_patterns = false;
};

// Registers a table after the ones registered before. Returns kOk; kInvalidArgument for an
// empty name, no columns, no manager, a column with an unknown type, a wrong integer width or
// a place outside row_size; kAlreadyExists when a table of that name (in any case) is
// registered. A refusal is traced at error class and destroys the definition.
int RegisterTable(TableDefinition definition);

// The table of that name, matched in any case; null when there is none.
std::shared_ptr<const TableDefinition> FindTable(std::string_view name);

// Every registered table, in registration order.
std::vector<std::shared_ptr<const TableDefinition>> ListTables();

// The column of that name, matched in any case; null when there is none. The pointer is into
// columns.
const ColumnInfo* FindColumn(std::span<const ColumnInfo> columns, std::string_view name);

// Forgets every table (tests only).
void ResetTablesForTesting();

}  // namespace fw
