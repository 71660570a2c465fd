#include "q7tema/exported_tables.h"

#include <map>
#include <memory>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "framework/tables.h"

namespace q7tema {
namespace {

// The columns that tell a table's rows apart, for alerts: the aggregate tables' keys, an
// instance's identifiers, an agent property's or message's name.
std::vector<std::string> KeyColumns(std::string_view table) {
  static const std::map<std::string_view, std::vector<std::string>> keys = {
      {"Q7AGNTDTS", {"property"}},
      {"Q7AGNTMSGS", {"msgid"}},
      {"Q7APPOT", {"applicatin"}},
      {"Q7APPSM", {"applicatin"}},
      {"Q7APPCS", {"applicatin"}},
      {"Q7CLNTAPP", {"client", "applicatin"}},
      {"Q7CLNTOT", {"client"}},
      {"Q7CLNTSM", {"client"}},
      {"Q7CLNTCS", {"client"}},
      {"Q7CLNTSRV", {"client", "server"}},
      {"Q7SRVAPPSM", {"server", "applicatin"}},
      {"Q7SRVOT", {"server"}},
      {"Q7SRVSM", {"server"}},
      {"Q7SRVCS", {"server"}},
      {"Q7TXOT", {"applicatin", "transactn", "client", "server"}},
      {"Q7TXSM", {"applicatin", "transactn", "client", "server"}},
      {"Q7TXCS", {"applicatin", "transactn", "client", "server"}},
      {"Q7TXINS", {"applicatin", "transactn", "rootuuid"}},
      {"Q7SUBTXOT", {"transactn", "rootuuid", "curruuid"}},
      {"Q7SUBTXSM", {"transactn", "rootuuid", "curruuid"}},
      {"Q7SUBTXINS", {"transactn", "rootuuid", "curruuid"}},
  };
  const auto it = keys.find(table);
  return it == keys.end() ? std::vector<std::string>() : it->second;
}

// The registry traces a refusal (a second registration, say); the loader goes on either way.
template <typename Row>
void RegisterWithFramework() {
  using Layout = TableLayout<Row>;
  fw::TableDefinition definition;
  definition.name = std::string(Layout::kName);
  definition.columns.assign(Layout::kColumns.begin(), Layout::kColumns.end());
  definition.row_size = sizeof(Row);
  definition.manager = std::make_unique<TableManager<Row>>();
  definition.key_columns = KeyColumns(Layout::kName);
  // A situation on a pattern table registers patterns rather than alerting.
  definition.defines_patterns = Layout::kName == "Q7TXPTNS" || Layout::kName == "Q7CLNTPTNS";
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
