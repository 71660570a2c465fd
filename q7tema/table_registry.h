#pragma once

// The 23 exported tables in the order the agent loader initialises them: the order of
// Q7_EXPORTED_TABLES (core/layouts/table_layouts.h), so a table is listed once.
//
// Thread safety: InitAllTables runs on the thread that runs the agent loader.

#include <array>
#include <cstddef>
#include <string_view>

#include "core/layouts/table_layouts.h"

namespace q7tema {

#define Q7_COUNT_TABLE(lower, exported, COLUMNS) +1
inline constexpr std::size_t kTableCount = 0 Q7_EXPORTED_TABLES(Q7_COUNT_TABLE);
#undef Q7_COUNT_TABLE

// kq7_<name>_init names, in load order.
#define Q7_LOWER_NAME(lower, exported, COLUMNS) std::string_view(#lower),
inline constexpr std::array<std::string_view, kTableCount> kTableLoadOrder = {
    Q7_EXPORTED_TABLES(Q7_LOWER_NAME)};
#undef Q7_LOWER_NAME

// Calls every table's kq7_<name>_init in load order, each registering its table with the
// framework. Returns how many were initialised.
int InitAllTables();

}  // namespace q7tema
