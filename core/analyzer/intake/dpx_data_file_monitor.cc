#include "core/analyzer/intake/dpx_data_file_monitor.h"

#include <sys/stat.h>

#include <cstring>
#include <memory>
#include <string>

#include "core/analyzer/intake/common.h"
#include "core/analyzer/intake/dpx_transaction.h"
#include "core/analyzer/intake/read_position.h"
#include "core/analyzer/intake/sm3_framing.h"
#include "core/analyzer/intake/sm3_parser.h"
#include "core/analyzer/intake/transaction_identity.h"
#include "core/config/cconfig.h"
#include "core/runtime/clog.h"
#include "core/runtime/misc.h"

namespace {

constexpr unsigned long kSummaryFlag = 2;
constexpr unsigned long kFlowFlag = 64;
constexpr int kStaticWaitSeconds = 30;
constexpr unsigned long kPauseMillis = 100;

}  // namespace

// The per-run state of record processing: the identity of the page the next objects belong
// to, and where records go. Lives on the monitor thread's stack for one run of Run.
class CDPXDataFileMonitor::RecordHandler : public CSM3RecordSink {
 public:
  RecordHandler(TransactionSink& sink, int excludeOutlierMillis)
      : sink(sink), excludeOutlierMillis(excludeOutlierMillis) {}
  ~RecordHandler() override { flush(); }
  RecordHandler(const RecordHandler&) = delete;
  RecordHandler& operator=(const RecordHandler&) = delete;

  bool processSM3Line(char* line, int recordType) override {
    // Stop the pass here: this record and the rest of the chunk are not consumed, so the
    // persisted offset makes the next start read them.
    if (sink.isShutdownRequested()) {
      flush();  // what this pass took before goes in: its bytes count as consumed
      refused = true;
      return false;
    }
    IntakeCounters& counters = sink.intakeCounters();
    counters.recordRead();
    std::unique_ptr<CDPXTransaction> transaction = createDPXTransaction(line, recordType);
    if (!transaction) {
      counters.recordUnparsed();
      return true;
    }
    if (!isValidTrans(*transaction, excludeOutlierMillis)) {
      counters.outlierDropped();
      CLOG::min("%s Ignoring transaction, determined to be \"invalid\"", "processSM3Line");
      return true;
    }
    // The parsed record is already a transaction of its own; queue it without a copy.
    transaction->setRecordType(recordType);
    doUUIDs(*transaction, &previousPage, &instanceCounter, &pageSeen);
    pending[pendingCount++] = _TYPED_TRANSACTION{TRANSACTION_KIND_DPX, transaction.release()};
    if (pendingCount == kBatch) {
      flush();
    }
    return true;
  }
  // Hands the records taken so far to the sink in one batch. Called when the batch is full and
  // at the end of every pass, so no record waits past the pass that read it.
  void flush() {
    if (pendingCount > 0) {
      sink.addBatch(pending, pendingCount);
      pendingCount = 0;
    }
  }
  bool wasRefused() const { return refused; }

 private:
  static constexpr size_t kBatch = 32;
  TransactionSink& sink;
  _TYPED_TRANSACTION pending[kBatch];
  size_t pendingCount = 0;
  bool refused = false;  // a record was refused: the sink is shutting down
  const int excludeOutlierMillis;
  CUUID previousPage;  // all zero until the first page
  int64_t instanceCounter = initialInstanceCounter();
  bool pageSeen = true;
};

CDPXDataFileMonitor::CDPXDataFileMonitor(const char* file, long long offset)
    : CDataFileMonitor("DPXDataFileMonitor", file) {
  static const char* const kWhere = "CDPXDataFileMonitor::CDPXDataFileMonitor";
  CLOG::trace(kFlowFlag, "%s ENTER [%s][%ld]\n", kWhere, file != nullptr ? file : "",
              static_cast<long>(offset));
  isStatic.store(false);
  completed.store(false);
  setLastProcessedOffset(offset);
  CLOG::trace(kFlowFlag, "%s EXIT \n", kWhere);
}

CDPXDataFileMonitor::~CDPXDataFileMonitor() = default;

void CDPXDataFileMonitor::waitForCompletion(int seconds) const {
  const long steps = static_cast<long>(seconds) * 1000 / static_cast<long>(kPauseMillis);
  for (long i = 0; i < steps && !completed.load(); ++i) {
    CMisc::sleep(kPauseMillis);
  }
}

void CDPXDataFileMonitor::waitUntilFinished(int seconds) const {
  waitForCompletion(seconds);
  // Stopping it now would skip the rest of its file for good, since reading goes on with newer
  // files: a reader held up by a busy analyzer is waited for, unless the agent is stopping.
  while (!completed.load() && sink != nullptr && !sink->isShutdownRequested()) {
    CLOG::min("%s [%s] is still being read after %d s; waiting for the rest",
              "CDPXDataFileMonitor::waitUntilFinished", getFile(), seconds);
    waitForCompletion(seconds);
  }
}

bool CDPXDataFileMonitor::isValidTrans(const CDPXTransaction& transaction,
                                       int excludeOutlierMillis) {
  if (excludeOutlierMillis < 0 || transaction.getTotalResponseTime() < excludeOutlierMillis) {
    return true;
  }
  CLOG::min("%s Trans is NOT valid.  totalResponseTime[%d] excludeOutlierMillis[%d]",
            "CDPXDataFileMonitor::isValidTrans", transaction.getTotalResponseTime(),
            excludeOutlierMillis);
  return false;
}

bool CDPXDataFileMonitor::getNewLegacyFilename(const char* file, char* newName, int size) {
  std::string prefix = file;
  const size_t dot = prefix.find('.');
  if (dot != std::string::npos) {
    prefix.resize(dot);
  }
  CLOG::min("Prefix [%s]", prefix.c_str());
  _FILE_INFO_LL* const list = CCommon::findFiles(CConfig::getDpxDataDirectory(), "*.sm3");
  const char* best = nullptr;
  for (const _FILE_INFO_LL* node = list; node != nullptr; node = node->next) {
    const char* name = node->fileName;
    if (std::strncmp(name, prefix.c_str(), prefix.size()) == 0 &&
        std::strchr(name, '-') != nullptr && (best == nullptr || std::strcmp(name, best) > 0)) {
      best = name;
    }
  }
  const bool found = best != nullptr && size > 0;
  if (found) {
    const size_t n = std::min(std::strlen(best), static_cast<size_t>(size - 1));
    std::memcpy(newName, best, n);
    newName[n] = '\0';
  }
  CCommon::deleteFoundFiles(list);
  return found;
}

std::unique_ptr<CDPXDataFileMonitor> CDPXDataFileMonitor::processStatically(
    const char* file, long long offset, int excludeOutlierMillis, TransactionSink* sink) {
  auto monitor = std::make_unique<CDPXDataFileMonitor>(file, offset);
  monitor->setStatic();
  monitor->setExcludeOutlierMillis(excludeOutlierMillis);
  monitor->setSink(sink);
  monitor->Start();
  monitor->waitUntilFinished(kStaticWaitSeconds);
  monitor->Shutdown();
  monitor->Join();
  return monitor;
}

bool CDPXDataFileMonitor::handleLegacyDPXRename() {
  if (isStatic.load()) {
    return false;
  }
  bool renamed = false;
  long long size = 0;
  if (!CMisc::getFileSize64(getFile(), &size)) {
    CLOG::min("File [%s] is no longer present, must of been renamed or deleted.", getFile());
    renamed = true;
  } else if (size < getReadToOffset()) {
    CLOG::min("File [%s] is smaller [%lld] than expected [%lld], must of been renamed", getFile(),
              size, getReadToOffset());
    renamed = true;
  } else if (identityChanged()) {
    // Caught even when the new file has already grown past the offset, which the size cannot
    // tell.
    CLOG::min("File [%s] is another file than the one read so far, must of been renamed",
              getFile());
    renamed = true;
  }
  if (renamed) {
    // The file under the live name now: read from 0 once the renamed files are done, and the
    // end of them (what follows was renamed after it, which this same handling finds).
    struct stat live {};
    const bool haveLive = ::stat(getFile(), &live) == 0;
    const uint64_t liveDevice = haveLive ? static_cast<uint64_t>(live.st_dev) : 0;
    const uint64_t liveInode = haveLive ? static_cast<uint64_t>(live.st_ino) : 0;
    // The file read so far, found by its identity; else the newest renamed name.
    char newName[kFileInfoMaxPath + 1];
    const std::string same =
        FindFileByIdentity(CConfig::getDpxDataDirectory(), getReadDevice(), getReadInode());
    bool found = !same.empty() && same.size() < sizeof(newName);
    if (found) {
      std::memcpy(newName, same.c_str(), same.size() + 1);
    } else {
      found = getNewLegacyFilename(getFile(), newName, sizeof(newName));
    }
    if (found) {
      CLOG::min(
          "Found new file name [%s] for previous file [%s]. Will process any remaining "
          "records.",
          newName, getFile());
      processStatically(newName, getLastProcessedOffset(), getExcludeOutlierMillis(), sink);
      processLaterRenames(newName, liveDevice, liveInode);
    }
    setLastProcessedOffset(0);
    setReadIdentity(liveDevice, liveInode);
  }
  return renamed;
}

void CDPXDataFileMonitor::processLaterRenames(const char* renamed, uint64_t liveDevice,
                                              uint64_t liveInode) {
  std::string prefix = getFile();
  const size_t dot = prefix.find('.');
  if (dot != std::string::npos) {
    prefix.resize(dot);
  }
  _FILE_INFO_LL* const list =
      CCommon::sortFilesByName(CCommon::findFiles(CConfig::getDpxDataDirectory(), "*.sm3"));
  for (const _FILE_INFO_LL* node = list; node != nullptr; node = node->next) {
    const char* name = node->fileName;
    struct stat st {};
    if (liveInode != 0 && ::stat(name, &st) == 0 &&
        static_cast<uint64_t>(st.st_dev) == liveDevice &&
        static_cast<uint64_t>(st.st_ino) == liveInode) {
      break;  // the live file, renamed meanwhile: it and what follows are found from it
    }
    if (std::strncmp(name, prefix.c_str(), prefix.size()) == 0 && std::strchr(name, '-') &&
        std::strcmp(name, getFile()) != 0 && CCommon::newerFile(name, renamed)) {
      CLOG::min("Found [%s], renamed after [%s] and never read. Will process its records.", name,
                renamed);
      processStatically(name, 0, getExcludeOutlierMillis(), sink);
    }
  }
  CCommon::deleteFoundFiles(list);
}

void CDPXDataFileMonitor::Run() {
  static const char* const kWhere = "CDPXDataFileMonitor::Run()";
  completed.store(false);
  if (sink == nullptr) {
    CLOG::min("%s No sink for [%s]; nothing read.", kWhere, getFile());
    completed.store(true);
    return;
  }
  RecordHandler handler(*sink, getExcludeOutlierMillis());
  sink->intakeCounters().reading(getFile(), getLastProcessedOffset());
  while (!isShutdownRequested()) {
    // Taken before looking for updates: a monitor turned static during this pass (a rollover)
    // may have missed what was appended just before, so it looks once more before stopping.
    const bool staticAtStart = isStatic.load();
    if (identityChanged() && !staticAtStart) {
      handleLegacyDPXRename();
    }
    // A static monitor whose name now holds another file has nothing more of its own to read.
    bool updates = anyUpdates() && !(staticAtStart && identityChanged());
    if (!updates) {
      const bool renamed = handleLegacyDPXRename();
      if (renamed) {
        updates = anyUpdates();
      }
      if (!renamed || !updates) {
        CMisc::sleep(kPauseMillis);
      }
    }
    if (updates) {
      long length = 0;
      long long end = 0;
      std::unique_ptr<char[]> chunk = getNewFileContents(&length, &end);
      if (chunk) {
        CLOG::trace(kSummaryFlag, "%s Read in some new file contents!", kWhere);
        CLOG::trace(kSummaryFlag, "%s Old offset[%lld] read to offset[%lld]", kWhere,
                    getLastProcessedOffset(), end);
        const long consumed =
            processDPXContents(chunk.get(), length, length == MAX_BUFFER, handler);
        handler.flush();
        if (consumed != length) {
          CLOG::med("only processed %u of %u bytes!", static_cast<unsigned>(consumed),
                    static_cast<unsigned>(length));
        }
        advanceLastProcessedOffset(consumed);
        sink->intakeCounters().reading(getFile(), getLastProcessedOffset());
        if (consumed > 0) {
          sink->markPosition(
              {getFile(), getReadDevice(), getReadInode(), getLastProcessedOffset()});
        }
      } else {
        CLOG::trace(kFlowFlag, "Failed to read in any new file contents");
      }
    }
    if (staticAtStart && !updates) {
      Shutdown();
    }
    if (handler.wasRefused()) {
      interrupted.store(true);
      // Nothing more can be handed over; a static monitor would only spin on the same chunk
      // until its owner gave up waiting.
      if (isStatic.load()) {
        Shutdown();
      } else {
        CMisc::sleep(kPauseMillis);  // the owner's stop follows shortly
      }
    }
  }
  completed.store(true);
}
