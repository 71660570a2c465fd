#include "core/analyzer/rows/keyed_row.h"

namespace rows {

const char* KeySource(const CTransaction& t, Key key) {
  switch (key) {
    case Key::kApplication:
      return t.getApplicationName();
    case Key::kServer:
      return t.getServerName();
    case Key::kClient:
      return t.getClientName();
    case Key::kTransaction:
      return t.getTransactionName();
    case Key::kClientIP:
      return t.getClientIPAddress();
    case Key::kServerIP:
      return t.getServerIPAddress();
    case Key::kHostname:
      return t.getClientHostname();
    case Key::kParentId:
      return t.getParentUUID();
    case Key::kCurrentId:
      return t.getCurrentUUID();
  }
  return "";
}

}  // namespace rows
