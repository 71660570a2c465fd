#include "core/analyzer/intake/transaction_identity.h"

#include <cstring>
#include <ctime>
#include <string>

#include "core/analyzer/intake/dpx_transaction.h"
#include "core/runtime/clog.h"
#include "framework/agent_runtime.h"

namespace {

// Asked of the framework once per process: it names this agent for the life of the process.
const std::string& OriginNode() {
  static const std::string origin = fw::OriginNodeName();
  return origin;
}

bool IsObject(int recordType) {
  return recordType == SM3_RECORD_HOBJ || recordType == SM3_RECORD_AUDIO ||
         recordType == SM3_RECORD_VIDEO;
}

}  // namespace

void initDPXTransMD5(const char* originNode, const char* url, CMD5Generator& generator) {
  generator.Init();
  generator.Update(originNode, strlen(originNode));
  generator.Update(url, strlen(url));
}

int64_t initialInstanceCounter() {
  return static_cast<int64_t>(static_cast<uint64_t>(time(nullptr)) << 32);
}

void doUUIDs(CDPXTransaction& transaction, CUUID* previousPage, int64_t* instanceCounter,
             bool* pageSeen) {
  CMD5Generator generator;
  initDPXTransMD5(OriginNode().c_str(), transaction.getURL(), generator);
  const CUUID current = generator.getUUID();
  char text[kUUIDTextWidth];
  getUUIDToHexString(current, text);
  transaction.setCurrentUUID(text);
  transaction.setInstanceRoot(*instanceCounter);

  if (IsObject(transaction.getRecordType())) {
    char page[kUUIDTextWidth];
    getUUIDToHexString(*previousPage, page);
    transaction.setParentUUID(page);
    transaction.setRootUUID(page);
    transaction.setInstanceRoot(*pageSeen ? *instanceCounter - 1 : *instanceCounter);
    transaction.setControlFlags(TRANSACTION_CONTROL_OBJECT);
    return;
  }
  transaction.setRootUUID(text);
  transaction.setParentUUID("");
  ++*instanceCounter;
  *pageSeen = true;
  CLOG::max("Changing pprevHpageUUID, since we've come to a new hpage");
  *previousPage = current;
}
