// libFuzzer target over the collector record path: a chunk cut into records and each record
// parsed into a transaction with its identity, the fast header search checked against the
// literal one, and the input taken whole as a page line and as an object line.

#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "core/analyzer/intake/sm3_framing.h"
#include "core/analyzer/intake/sm3_parser.h"
#include "core/analyzer/intake/transaction_identity.h"
#include "framework/trace.h"

namespace {

class ParsingSink : public CSM3RecordSink {
 public:
  bool processSM3Line(char* line, int recordType) override {
    if (auto t = createDPXTransaction(line, recordType)) {
      t->setRecordType(recordType);
      doUUIDs(*t, &previous_, &counter_, &pageSeen_);
    }
    return true;
  }

 private:
  CUUID previous_;
  int64_t counter_ = int64_t{1} << 32;
  bool pageSeen_ = true;
};

void CheckHeaderSearch(char* buffer) {
  char* h1 = nullptr;
  char* t1 = nullptr;
  char* h2 = nullptr;
  char* t2 = nullptr;
  int hl1 = 0, tl1 = 0, type1 = 0, hl2 = 0, tl2 = 0, type2 = 0;
  const int fast = sm3_internal::findHeaderQuiet(buffer, &h1, &t1, &hl1, &tl1, &type1);
  const int literal = sm3_internal::findHeaderLiteral(buffer, &h2, &t2, &hl2, &tl2, &type2);
  if (fast != literal || h1 != h2 || t1 != t2 || hl1 != hl2 || tl1 != tl2 || type1 != type2) {
    abort();
  }
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  // Error traces are written whatever the masks say; keep them off the terminal.
  std::string error;
  fw::TraceOpen("sm3_fuzz_trace.log", 1 << 20, 1, &error);
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  std::vector<char> chunk(data, data + size);
  chunk.push_back('\0');
  CheckHeaderSearch(chunk.data());

  ParsingSink sink;
  const long length = static_cast<long>(size);
  const long consumed = processDPXContents(chunk.data(), length, length == MAX_BUFFER, sink);
  if (consumed < 0 || consumed > length) {
    abort();
  }

  std::vector<char> line(data, data + size);
  line.push_back('\0');
  processHSM3Line(line.data());
  processAVSM3Line(line.data());
  return 0;
}
