#include "core/analyzer/intake/dpx_transaction.h"

#include <cstring>

#include "core/runtime/clog.h"

namespace {

bool IsIPv6(const char* address) {
  return strchr(address, ':') != nullptr;
}

}  // namespace

CDPXTransaction::CDPXTransaction() : recordType_(0) {
  memset(&entry_, 0, sizeof(entry_));
}

CDPXTransaction::CDPXTransaction(const SM3_HPAGE_ENTRY& entry) : entry_(entry), recordType_(0) {
  adoptEntry();
}

void CDPXTransaction::adoptEntry() {
  static const char* const kWhere = "CDPXTransaction::CDPXTransaction(SM3_HPAGE_ENTRY)";
  if (entry_.iNetworkTime < 0) {
    CLOG::min("%s input iNetworkTime[%ld] is negative", kWhere,
              static_cast<long>(entry_.iNetworkTime));
    CLOG::min("%s setting saved iNetowrkTime to 0", kWhere);
    entry_.iNetworkTime = 0;
  }
  setTrueTransType(TRUE_TRANS_TYPE_DPX);

  // The entry's texts are not guaranteed terminated when built elsewhere than by the parser.
  entry_.szURLHostName[sizeof(entry_.szURLHostName) - 1] = '\0';
  entry_.szURL[sizeof(entry_.szURL) - 1] = '\0';
  entry_.szIPSourceAddress[sizeof(entry_.szIPSourceAddress) - 1] = '\0';
  entry_.szIPDestinationAddress[sizeof(entry_.szIPDestinationAddress) - 1] = '\0';

  const char* server = entry_.szIPDestinationAddress;
  const char* client = entry_.szIPSourceAddress;
  setApplicationName(entry_.szURLHostName[0] != '\0' ? entry_.szURLHostName : server);
  setTransactionName(entry_.szURL);
  setServerName(server);
  setServerHostname(server);
  if (IsIPv6(server)) {
    setServerIPv6Address(server);
  } else {
    setServerIPAddress(server);
  }
  setClientName(client);
  setClientHostname(client);
  if (IsIPv6(client)) {
    setClientIPv6Address(client);
  } else {
    setClientIPAddress(client);
  }
}

void CDPXTransaction::dump() const {
  CLOG::med("CDPXTransaction record type[%d] true trans type[%d] control flags[%d]\n", recordType_,
            getTrueTransType(), getControlFlags());
  CLOG::med("  application[%s] transaction[%s]\n", getApplicationName(), getTransactionName());
  CLOG::med("  client[%s] host[%s] ip[%s] ipv6[%s]\n", getClientName(), getClientHostname(),
            getClientIPAddress(), getClientIPv6Address());
  CLOG::med("  server[%s] host[%s] ip[%s] ipv6[%s]\n", getServerName(), getServerHostname(),
            getServerIPAddress(), getServerIPv6Address());
  CLOG::med("  root[%.32s] parent[%.32s] current[%.32s] instance root[%lld]\n", getRootUUID(),
            getParentUUID(), getCurrentUUID(), static_cast<long long>(getInstanceRoot()));
  CLOG::med("  importance[%d] min threshold[%d] agg by[%d]\n", getImportance(), getMinThreshold(),
            getAggBy());
  dumpSM3Record(&entry_, 0x10);
}
