#include "q7tema/table_registry.h"

#include "framework/trace.h"
#include "q7tema/exported_tables.h"

namespace q7tema {

int InitAllTables() {
  int initialised = 0;
#define Q7_INIT_TABLE(lower, exported, COLUMNS)                      \
  Q7_TRACE("tables", fw::kTraceDetail, "%s", "kq7_" #lower "_init"); \
  kq7_##lower##_init();                                              \
  ++initialised;
  Q7_EXPORTED_TABLES(Q7_INIT_TABLE)
#undef Q7_INIT_TABLE
  return initialised;
}

}  // namespace q7tema
