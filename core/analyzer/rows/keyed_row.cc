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

int32_t CounterPercent(int32_t counter, int32_t n) {
  // Most status counters of a row are 0; skipping the extended-precision division for them
  // (whose truncating conversion stalls the x87 unit) gives the same 0 much sooner.
  if (n == 0 || counter == 0) {
    return 0;
  }
  return static_cast<int32_t>(static_cast<long double>(counter) / n * 100000.0L);
}

int32_t PerRequest(int64_t sum, int32_t n) {
  return n == 0 ? 0 : static_cast<int32_t>(sum / n);
}

}  // namespace rows
