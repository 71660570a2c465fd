#pragma once

// The four classes of every exported table, stamped out from Q7_EXPORTED_TABLES:
//
//   void kq7_<table>_init();       registers the table with the framework's table registry
//   kq7_<table>_manager            q7tema::TableManager over the table's row type
//   kq7_<table>_base               q7tema::TableBase over the table's row type
//   kq7_<table>_agent              q7tema::TableAgent, derived from kq7_<table>_base
//
// The templates are instantiated once, in exported_tables.cc. To give one table behaviour of
// its own, specialise TableAgent<kq7_<table>_data_t> in a header included above the
// declarations below (the pattern tables do so in pattern_tables.h).
//
// Thread safety: the init functions run on the agent loader's thread; see the class headers.

#include "q7tema/pattern_tables.h"
#include "q7tema/table_manager.h"

#define Q7_DECLARE_TABLE_CLASSES(lower, exported, COLUMNS)                  \
  using kq7_##lower##_manager = q7tema::TableManager<kq7_##lower##_data_t>; \
  using kq7_##lower##_base = q7tema::TableBase<kq7_##lower##_data_t>;       \
  using kq7_##lower##_agent = q7tema::TableAgent<kq7_##lower##_data_t>;     \
  extern template class q7tema::TableBase<kq7_##lower##_data_t>;            \
  extern template class q7tema::TableAgent<kq7_##lower##_data_t>;           \
  extern template class q7tema::TableManager<kq7_##lower##_data_t>;         \
  void kq7_##lower##_init();

Q7_EXPORTED_TABLES(Q7_DECLARE_TABLE_CLASSES)

#undef Q7_DECLARE_TABLE_CLASSES
