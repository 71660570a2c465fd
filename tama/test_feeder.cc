#include "tama/test_feeder.h"

#include <cstdlib>
#include <fstream>
#include <iterator>
#include <memory>
#include <string>

#include "core/analyzer/dpx_analyzer.h"
#include "core/analyzer/sm3_framing.h"
#include "core/analyzer/sm3_parser.h"
#include "core/analyzer/transaction_identity.h"
#include "core/runtime/cvel_thread.h"
#include "framework/trace.h"

namespace tama {
namespace {

class Sink : public CSM3RecordSink {
 public:
  bool processSM3Line(char* line, int recordType) override {
    std::unique_ptr<CDPXTransaction> t = createDPXTransaction(line, recordType);
    if (t) {
      t->setRecordType(recordType);
      doUUIDs(*t, &previous_, &counter_, &pageSeen_);
      CDPXAnalyzer::GetInstanceNoStart()->add({TRANSACTION_KIND_DPX, t.release()});
    }
    return true;
  }

 private:
  CUUID previous_;
  int64_t counter_ = initialInstanceCounter();
  bool pageSeen_ = true;
};

class FileFeeder : public CAnalyzerFeeder, public CvelThread {
 public:
  explicit FileFeeder(std::string path) : CvelThread("TestFeeder"), path_(std::move(path)) {}
  void start() override { Start(); }
  void shutdownAndJoin() override { Join(); }

 protected:
  void Run() override {
    std::ifstream in(path_, std::ios::binary);
    std::string contents((std::istreambuf_iterator<char>(in)), {});
    fw::TracePrintfAlways("tama", fw::kTraceSummary, "TestFeeder", "feeding %zu bytes of %s",
                          contents.size(), path_.c_str());
    Sink sink;
    processDPXContents(contents.data(), static_cast<long>(contents.size()), false, sink);
  }

 private:
  const std::string path_;
};

}  // namespace

void installTestFeeder() {
  const char* path = std::getenv("Q7_TEST_FEED_FILE");
  if (path == nullptr || *path == '\0') {
    return;
  }
  const std::string file = path;
  CDPXAnalyzer::setFeederFactory([file](const char*) -> std::unique_ptr<CAnalyzerFeeder> {
    return std::make_unique<FileFeeder>(file);
  });
}

}  // namespace tama
