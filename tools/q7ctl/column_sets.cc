#include "tools/q7ctl/column_sets.h"

#include <algorithm>
#include <cctype>
#include <initializer_list>
#include <map>
#include <string_view>

namespace q7ctl {
namespace {

std::string Lower(std::string_view text) {
  std::string out(text);
  std::transform(out.begin(), out.end(), out.begin(),
                 [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
  return out;
}

std::vector<std::string> Join(std::initializer_list<std::string_view> keys,
                              const std::vector<std::string>& figures) {
  std::vector<std::string> out(keys.begin(), keys.end());
  out.insert(out.end(), figures.begin(), figures.end());
  return out;
}

// What every aggregate row says about its key: requests, their outcome, the average response
// time (oatime) and where it went, against the threshold.
const std::vector<std::string>& Figures() {
  static const std::vector<std::string> figures = {"totreq",     "pcgood",   "pcslow",   "pcfail",
                                                   "pcavail",    "oatime",   "servtime", "netwtime",
                                                   "clienttime", "mrtthres", "maxrtt"};
  return figures;
}

const std::map<std::string, std::vector<std::string>>& Sets() {
  // Over-time tables lead with the interval (timestamp); summaries and current intervals have
  // one period, so their timestamp would only repeat.
  static const std::map<std::string, std::vector<std::string>> sets = {
      {"q7agntdts", {"property", "value", "timestamp"}},
      {"q7agntmsgs", {"msgdattime", "severity", "msgid", "msgtext", "component"}},
      {"q7appcs", Join({"applicatin"}, Figures())},
      {"q7appsm", Join({"applicatin"}, Figures())},
      {"q7appot", Join({"timestamp", "applicatin"}, Figures())},
      {"q7clntapp", Join({"client", "applicatin"}, Figures())},
      {"q7clntcs", Join({"client", "hostname"}, Figures())},
      {"q7clntot", Join({"timestamp", "client", "hostname"}, Figures())},
      {"q7clntptns", {"clientna", "clienthopt", "clientppt", "agguniqly", "timestamp"}},
      {"q7clntsm", Join({"client", "hostname"}, Figures())},
      {"q7clntsrv", Join({"client", "server"}, Figures())},
      {"q7srvappsm", Join({"server", "applicatin"}, Figures())},
      {"q7srvcs", Join({"server"}, Figures())},
      {"q7srvot", Join({"timestamp", "server"}, Figures())},
      {"q7srvsm", Join({"server"}, Figures())},
      {"q7subtxot", Join({"timestamp", "transactn"}, Figures())},
      {"q7subtxsm", Join({"transactn"}, Figures())},
      {"q7subtxins",
       {"timestamp", "transactn", "resptime", "statuscode", "url", "ipsrcaddr", "servtime",
        "netwtime", "clienttime"}},
      {"q7txcs", Join({"applicatin", "transactn", "client", "server"}, Figures())},
      {"q7txins",
       {"timestamp", "applicatin", "transactn", "resptime", "statuscode", "url", "ipsrcaddr",
        "servtime", "netwtime", "clienttime"}},
      {"q7txot", Join({"timestamp", "applicatin", "transactn", "client", "server"}, Figures())},
      {"q7txptns",
       {"applicatin", "apppattern", "transactn", "transpattn", "mrtthres", "aggapsuniq",
        "aggtxsuniq", "collinstcs", "sampercent", "importance"}},
      {"q7txsm", Join({"applicatin", "transactn", "client", "server"}, Figures())},
  };
  return sets;
}

}  // namespace

std::vector<std::string> DefaultColumns(const std::string& table) {
  const auto it = Sets().find(Lower(table));
  return it == Sets().end() ? std::vector<std::string>() : it->second;
}

Json SelectColumns(const Json& rows, const std::vector<std::string>& columns,
                   std::vector<std::string>* unknown) {
  // Each wanted name as the rows spell it.
  std::map<std::string, std::string> spelled;
  for (const std::string& name : ColumnsOf(rows)) {
    spelled.emplace(Lower(name), name);
  }
  std::vector<std::string> keep;
  for (const std::string& column : columns) {
    const auto it = spelled.find(Lower(column));
    if (it == spelled.end()) {
      unknown->push_back(column);
    } else if (std::find(keep.begin(), keep.end(), it->second) == keep.end()) {
      keep.push_back(it->second);
    }
  }
  Json out = Json::array();
  for (const Json& row : rows) {
    Json selected = Json::object();
    if (row.is_object()) {
      for (const std::string& name : keep) {
        const auto cell = row.find(name);
        if (cell != row.end()) {
          selected[name] = *cell;
        }
      }
    }
    out.push_back(std::move(selected));
  }
  return out;
}

}  // namespace q7ctl
