#include "core/analyzer/dpx_analyzer.h"

#include <algorithm>
#include <atomic>
#include <cstring>
#include <mutex>
#include <string>
#include <thread>

#include "core/analyzer/analysis/summary_fold.h"
#include "core/analyzer/intake/dpx_file_manager.h"
#include "core/analyzer/intake/dpx_transaction.h"
#include "core/analyzer/situation_controller.h"
#include "core/config/cconfig.h"
#include "core/history/checkpoint_file.h"
#include "core/history/checkpoint_writer.h"
#include "core/history/history_store.h"
#include "core/history/instance_file.h"
#include "core/history/state_file.h"
#include "core/layouts/table_layouts.h"
#include "core/messages/agent_message.h"
#include "core/runtime/clog.h"
#include "framework/clock.h"

namespace {

// The queue wait of one pass: rollover and shutdown are noticed within it.
constexpr long kQueueWaitMillis = 5000;
// The queue wait while the feeder is being stopped.
constexpr long kShutdownWaitMillis = 50;
// Every this many rollovers the old history files are removed.
constexpr int kCleanupEveryRollovers = 12;

CDPXAnalyzer::Paths DefaultPaths() {
  CDPXAnalyzer::Paths paths;
  paths.historyDirectory = CConfig::getDpxOdiDataDirectory();
  paths.stateFile = std::string(CConfig::getBaseDirectory()) + "/q7state.properties";
  paths.dataDirectory = CConfig::getDpxDataDirectory();
  const std::string checkpoint = std::string(CConfig::getBaseDirectory()) + "/q7checkpoint.dat";
  (CConfig::getCheckpointSeconds() > 0 ? paths.checkpointFile : paths.retiredCheckpointFile) =
      checkpoint;
  return paths;
}

std::once_flag g_once;
CDPXAnalyzer* g_instance = nullptr;             // created once, lives for the process
std::atomic<CDPXAnalyzer*> g_started{nullptr};  // g_instance once its thread was started

}  // namespace

CDPXAnalyzer* CDPXAnalyzer::GetInstanceNoStart() {
  std::call_once(g_once, [] { g_instance = new CDPXAnalyzer(DefaultPaths()); });
  return g_instance;
}

CDPXAnalyzer* CDPXAnalyzer::GetInstance() {
  static std::once_flag started;
  CDPXAnalyzer* analyzer = GetInstanceNoStart();
  std::call_once(started, [analyzer] {
    analyzer->Start();
    g_started.store(analyzer);
  });
  return analyzer;
}

CDPXAnalyzer* CDPXAnalyzer::GetInstanceIfStarted() {
  return g_started.load();
}

CDPXAnalyzer::CDPXAnalyzer(Paths p)
    : CAnalyzer(p.historyDirectory.c_str()),
      CvelThread("Analyzer"),
      paths(std::move(p)),
      history(std::make_unique<history::HistoryStore>(paths.historyDirectory)),
      state(std::make_unique<history::StateFile>(paths.stateFile)),
      cache(std::make_unique<IntervalCache>(*history)),
      instanceFile(std::make_unique<history::InstanceFile>(paths.historyDirectory, "q7txins",
                                                           sizeof(kq7_q7txins_data_t))),
      subInstanceFile(std::make_unique<history::InstanceFile>(paths.historyDirectory, "q7subtxins",
                                                              sizeof(kq7_q7subtxins_data_t))),
      requestMetrics(
          std::make_unique<RequestMetrics>(static_cast<size_t>(CConfig::getMetricsMaxSeries()))),
      summaryFolds(std::make_unique<SummaryFolds>()) {
  state->load();
  if (!paths.checkpointFile.empty()) {
    checkpointFile = std::make_unique<history::CheckpointFile>(paths.checkpointFile);
    checkpointWriter = std::make_unique<history::CheckpointWriter>(*checkpointFile);
  }
}

CDPXAnalyzer::~CDPXAnalyzer() {
  // Records still queued are the analyzer's: a drained queue is the rule, but free what is left.
  _TYPED_TRANSACTION item;
  while (newQueue && !newQueue->IsEmpty() && newQueue->Get(item, 0) == 0) {
    delete item.transaction;
  }
}

bool CDPXAnalyzer::rolloverDue() const {
  CvelMutexLock lock(treeMutex);
  return cache->active() ? isNewOverTimeInterval(referenceInterval) : isNewOverTimeInterval();
}

void CDPXAnalyzer::startRun() {
  situations().loadPatternsIfNewer();
  updateCurrentOverTimeInterval();
  cleanupOldFiles();
  CvelMutexLock lock(treeMutex);
  // The current interval's rows saved by an earlier run stay the current trees, so a restart
  // within an interval keeps its data; a checkpoint, when there is one, is newer.
  recovered = recoverFromCheckpoint();
  if (!checkpointFile) {
    retireCheckpoint();
  }
  if (!recovered) {
    cache->loadCurrent(getCurrentOverTimeInterval());
  }
  referenceInterval = getCurrentOverTimeInterval();
  rolloverCount = 0;
  lastCheckpointAt = fw::Now();
  restored = true;
}

void CDPXAnalyzer::rollover() {
  CvelMutexLock lock(treeMutex);
  cache->flush();
  if (cache->active()) {
    cache->deactivate(getCurrentOverTimeInterval());
  }
  if (oldTransactions > 0) {
    AgentMessage::sendMessage(
        "OLD_TRANSACTIONS_WARNING", 5,
        {std::to_string(oldTransactions), std::to_string(transactionsReceived)});
  }
  oldTransactions = 0;
  transactionsReceived = 0;
  const long ended = getCurrentOverTimeInterval();
  const bool saved = saveIntervalData(ended);
  // The saved interval joins every summary's history: the folds kept are stale, so free them.
  summaryFolds->clear();
  updateCurrentOverTimeInterval();
  auto fresh = std::make_unique<COverTimeTrees>();
  if (CConfig::getReportZeroRecords()) {
    fresh->seedZeroRows(cache->trees(), getCurrentOverTimeInterval());
  }
  std::unique_ptr<COverTimeTrees> endedRows = cache->replaceCurrent(std::move(fresh));
  if (!saved) {
    // A full disk, say: the rows are kept and saved again before the next checkpoint.
    CLOG::error("Interval[%ld] could not be saved; its %ld rows are kept to save again", ended,
                endedRows->totalRows());
    unsaved.emplace_back(ended, std::move(endedRows));
  }
  referenceInterval = getCurrentOverTimeInterval();
  // The ended interval's rows are saved with the records after the last checkpoint in them;
  // the next checkpoint, at the next position noted, makes them final.
  checkpointDue = true;
  if (++rolloverCount % kCleanupEveryRollovers == 0) {
    cleanupOldFiles();
  }
  situations().loadPatternsIfNewer();
}

void CDPXAnalyzer::finishRun() {
  {
    CvelMutexLock lock(treeMutex);
    cache->flush();
    cache->discard();
    saveUnsaved();
    saveAllData(getCurrentOverTimeInterval());
    flushInstanceFile();
    flushSubInstanceFile();
  }
  // A clean stop is a last checkpoint: the next start resumes exactly here.
  writeCheckpoint();
  state->save();
}

void CDPXAnalyzer::Run() {
  static const char* const kWhere = "CDPXAnalyzer::Run";
  // The checkpoint is read first: it says where the file manager resumes.
  startRun();
  if (!paths.dataDirectory.empty()) {
    auto manager = std::make_unique<CDPXFileManager>();
    manager->setDirToWatch(paths.dataDirectory.c_str());
    manager->setSink(this);
    if (recovered) {
      // Even with no file named: the checkpoint was taken before anything was read, and
      // "DPXLastFile" may be newer than it.
      position = LocateReadPosition(resumeAt, paths.dataDirectory.c_str());
      manager->resumeAt(position.file.c_str(), position.offset, position.device, position.inode);
    } else {
      position = {manager->getLastProcessedFileName(), 0, 0, manager->getLastProcessedOffset()};
    }
    feeder = std::move(manager);
    feeder->start();
  }
  bool shutdownSeen = false;
  // Stops the feeder at shutdown. It runs beside this loop because a reader may be blocked on
  // the full queue, which only this loop empties.
  std::thread feederStopper;
  std::atomic<bool> feederStopped{false};
  // Items are taken a batch at a time: one lock and one wake-up of the readers per batch.
  constexpr unsigned long kBatch = 32;
  _TYPED_TRANSACTION batch[kBatch];
  long batchSize = 0;
  long batchNext = 0;
  for (;;) {
    if (isShutdownRequested()) {
      if (!shutdownSeen) {
        shutdownSeen = true;
        CLOG::min("%s, Shutting down", kWhere);
        if (feeder) {
          feederStopper = std::thread([this, &feederStopped] {
            feeder->shutdownAndJoin();
            feederStopped.store(true);
          });
        } else {
          feederStopped.store(true);
        }
      }
      // Once the feeder has stopped nothing more arrives, so an empty queue is the end.
      if (feederStopped.load() && newQueue->IsEmpty() && batchNext == batchSize) {
        if (feederStopper.joinable()) {
          feederStopper.join();
        }
        finishRun();
        return;
      }
    }
    if (batchNext == batchSize) {
      // While the feeder stops, wait briefly so its end is noticed at once.
      const long wait = shutdownSeen ? kShutdownWaitMillis : kQueueWaitMillis;
      batchSize = std::max(0L, newQueue->GetBatch(batch, kBatch, wait));
      batchNext = 0;
    }
    _TYPED_TRANSACTION item;
    if (batchNext < batchSize) {
      item = batch[batchNext++];
    }
    heldItems.store(batchSize - batchNext);
    if (item.transaction != nullptr && item.type == TRANSACTION_KIND_POSITION) {
      notePosition(static_cast<const CPositionMark*>(item.transaction)->position());
      delete item.transaction;
      continue;
    }
    // An item without a transaction only wakes the loop (Shutdown queues one).
    const bool got = item.transaction != nullptr;
    if (got && item.type != TRANSACTION_KIND_DPX) {
      CLOG::min(
          "This transaction of type[%d] is not for this Analyzer[%d], it needs to be converted",
          static_cast<int>(item.type), static_cast<int>(TRANSACTION_KIND_DPX));
      // No other record kind is produced by this agent, so none can be converted.
      CLOG::min("Failed to convert trans of type[%d] to [%d].  This transaction will be ignored.\n",
                static_cast<int>(item.type), static_cast<int>(TRANSACTION_KIND_DPX));
      delete item.transaction;
      item.transaction = nullptr;
    }
    if (rolloverDue()) {
      rollover();
    }
    if (got && item.transaction != nullptr) {
      CLOG::med("Got a Transaction, Processing");
      processTransaction(*static_cast<CDPXTransaction*>(item.transaction), &lastInstanceLevel);
      delete item.transaction;
    }
    if (got) {
      transactionsTaken.fetch_add(1);
    }
  }
}

void CDPXAnalyzer::printPerformanceStats() const {
  const int32_t processed = getTransactionsProcessed();
  CLOG::min("Transactions Processed                 : %d", processed);
  CLOG::min("Transactions Ignored                   : %d", getTransactionsIgnored());
  CLOG::min("Total time Processing Transactions     : %d",
            static_cast<int>(totalProcessingTime.load()));
  if (processed > 0) {
    CLOG::min("Average Time processing per transaction: %8.3f ms",
              static_cast<double>(totalProcessingTime.load()) / processed);
  } else {
    CLOG::min("Average Time processing per transaction: 0.00 ms");
  }
}

void CDPXAnalyzer::flushInstanceFiles() {
  CvelMutexLock lock(treeMutex);
  flushInstanceFile();
  flushSubInstanceFile();
}

void CDPXAnalyzer::flushInstanceFile() {
  instanceFile->flush();
}
void CDPXAnalyzer::flushSubInstanceFile() {
  subInstanceFile->flush();
}

bool CDPXAnalyzer::saveIntervalData(long interval) {
  const bool saved = cache->trees().save(*history, interval);
  flushInstanceFile();
  flushSubInstanceFile();
  return saved;
}

bool CDPXAnalyzer::saveUnsaved() {
  while (!unsaved.empty()) {
    auto& [interval, rows] = unsaved.front();
    if (!rows->save(*history, interval)) {
      return false;  // traced by the store
    }
    CLOG::min("Interval[%ld] saved after all (%ld rows)", interval, rows->totalRows());
    unsaved.erase(unsaved.begin());
    summaryFolds->clear();
  }
  return true;
}

void CDPXAnalyzer::saveAllData(long interval) {
  saveIntervalData(interval);
}

void CDPXAnalyzer::cleanupOldFiles() {
  history->cleanupOldFiles(fw::Now(), static_cast<long>(CConfig::getSummaryInterval()) * 3600);
}
