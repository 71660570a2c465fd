#include "q7tema/exported_tables.h"

#include <memory>
#include <string>
#include <utility>

#include "framework/tables.h"

namespace q7tema {
namespace {

// The registry traces a refusal (a second registration, say); the loader goes on either way.
template <typename Row>
void RegisterWithFramework() {
  using Layout = TableLayout<Row>;
  fw::TableDefinition definition;
  definition.name = std::string(Layout::kName);
  definition.columns.assign(Layout::kColumns.begin(), Layout::kColumns.end());
  definition.row_size = sizeof(Row);
  definition.manager = std::make_unique<TableManager<Row>>();
  fw::RegisterTable(std::move(definition));
}

}  // namespace
}  // namespace q7tema

#define Q7_DEFINE_TABLE(lower, exported, COLUMNS)            \
  template class q7tema::TableBase<kq7_##lower##_data_t>;    \
  template class q7tema::TableAgent<kq7_##lower##_data_t>;   \
  template class q7tema::TableManager<kq7_##lower##_data_t>; \
  void kq7_##lower##_init() {                                \
    q7tema::RegisterWithFramework<kq7_##lower##_data_t>();   \
  }

Q7_EXPORTED_TABLES(Q7_DEFINE_TABLE)

#undef Q7_DEFINE_TABLE
