#include "q7tema/exported_tables.h"

#include <array>
#include <memory>
#include <string>
#include <string_view>
#include <utility>

#include "framework/tables.h"
#include "q7tema/table_registry.h"

namespace q7tema {
namespace {

#define Q7_LOWER_NAME(lower, exported, COLUMNS) #lower,
constexpr std::array<std::string_view, kTableLoadOrder.size()> kExportedOrder = {
    Q7_EXPORTED_TABLES(Q7_LOWER_NAME)};
#undef Q7_LOWER_NAME
static_assert(kExportedOrder == kTableLoadOrder,
              "Q7_EXPORTED_TABLES must list the tables in load order");

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

namespace q7tema {

int RegisterExportedTableInits() {
  int accepted = 0;
#define Q7_REGISTER_INIT(lower, exported, COLUMNS) \
  accepted += RegisterTableInit(#lower, kq7_##lower##_init) ? 1 : 0;
  Q7_EXPORTED_TABLES(Q7_REGISTER_INIT)
#undef Q7_REGISTER_INIT
  return accepted;
}

}  // namespace q7tema
