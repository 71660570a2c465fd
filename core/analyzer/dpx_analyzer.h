#pragma once

// CDPXAnalyzer: the analyzer of web transactions, a process-wide singleton. Its thread is the
// transaction queue's only consumer: it processes each transaction into the current interval's
// over-time trees, rolls the trees over at every interval boundary (saving them as history),
// swaps a past interval's rows in (a cache) for transactions that belong to it, and at shutdown
// drains the queue and saves everything. Behind each pass's records the readers queue a
// position mark; at those marks it takes its checkpoints (checkpointing.cc), from which a start
// after a crash resumes exactly.
//
// Threads: GetInstance/GetInstanceNoStart from any thread (the first call creates the object);
// add() from intake threads; the queries, visitTrees and flushInstanceFiles from framework
// threads; the rest from the analyzer thread. The tree lock (private, taken by those entry
// points) guards the trees, the cache state and the instance files.

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <utility>
#include <vector>

#include "core/analyzer/analysis/interval_cache.h"
#include "core/analyzer/analysis/over_time_trees.h"
#include "core/analyzer/analysis/request_metrics.h"
#include "core/analyzer/analysis/table_queries.h"
#include "core/analyzer/analyzer.h"
#include "core/analyzer/intake/read_position.h"
#include "core/runtime/cvel_mutex.h"
#include "core/runtime/cvel_thread.h"
#include "framework/thread_annotations.h"

class CDPXTransaction;
struct InstancePatterns;
struct SummaryFolds;
template <class Value>
class HistoryCache;
template <class SummaryRow>
class HistoryFold;
namespace history {
class CheckpointFile;
class HistoryStore;
class CheckpointWriter;
class InstanceFile;
class StateFile;
}  // namespace history

class CDPXAnalyzer : public CAnalyzer, public CvelThread {
 public:
  // Directories the analyzer works in. The defaults come from CConfig.
  struct Paths {
    std::string historyDirectory;  // over-time history, instance and pattern files
    std::string stateFile;         // the last-history-sent state
    std::string dataDirectory;     // where the collector writes; empty: no file manager
    std::string checkpointFile;    // the checkpoint; empty: none taken or read
    // With checkpoints off, where an earlier run's checkpoint may lie: it is removed at start,
    // since loading it once checkpoints are on again would undo everything saved since.
    std::string retiredCheckpointFile;
  };

  // The singleton, created on first use; GetInstance also starts its thread.
  static CDPXAnalyzer* GetInstance();
  static CDPXAnalyzer* GetInstanceNoStart();
  // The singleton once GetInstance has started it, else null; never creates it, so status
  // requests during start-up cannot build it before its settings are read.
  static CDPXAnalyzer* GetInstanceIfStarted();

  // A free-standing analyzer (tests and benchmarks); the process uses the singleton.
  explicit CDPXAnalyzer(Paths paths);
  ~CDPXAnalyzer() override;

  // Processes one transaction (see transaction_processing.cc). instanceLevel carries the
  // instance level of the last page to the objects that follow it.
  void processTransaction(CDPXTransaction& transaction, short* instanceLevel);

  // The rollover test and the rollover itself, as Run does them each pass.
  bool rolloverDue() const;
  void rollover();

  void printPerformanceStats() const;

  // ---- Table queries (table_queries.cc). Each returns a new[] array of table rows the caller
  // releases with delete[], and their count through count (null with 0). Only sample type 3
  // yields rows. The public ones take the tree lock, flush the cache and stamp sampletime; the
  // inner ones (i_get_tbl...) run with the lock held. Summary, over-time and current-status
  // queries answer only the first limit rows when given one, and copy no more. ----
#define Q7_DECLARE_OVER_TIME_QUERY(name, Row, keys, Tree, EXPORT)                          \
  kq7_q7##name##_data_t* get_tbl##name(int sampleType, int* count,                         \
                                       std::size_t limit = static_cast<std::size_t>(-1));  \
  kq7_q7##name##_data_t* i_get_tbl##name(int sampleType, int* count, bool currentOnly,     \
                                         std::size_t limit = static_cast<std::size_t>(-1)) \
      REQUIRES(treeMutex);
#define Q7_DECLARE_QUERY(name)                                      \
  kq7_q7##name##_data_t* get_tbl##name(int sampleType, int* count); \
  kq7_q7##name##_data_t* i_get_tbl##name(int sampleType, int* count) REQUIRES(treeMutex);
#define Q7_DECLARE_SUMMARY_QUERY(name, Row, keys, overTime)        \
  kq7_q7##name##_data_t* get_tbl##name(int sampleType, int* count, \
                                       std::size_t limit = static_cast<std::size_t>(-1));
  // Current-status rows: the current interval's over-time rows without aggby.
#define Q7_DECLARE_CURRENT_QUERY(name, overTime, COLUMNS)          \
  kq7_q7##name##_data_t* get_tbl##name(int sampleType, int* count, \
                                       std::size_t limit = static_cast<std::size_t>(-1));
  Q7_ANALYZER_TABLES(Q7_DECLARE_OVER_TIME_QUERY, Q7_DECLARE_SUMMARY_QUERY, Q7_DECLARE_CURRENT_QUERY,
                     Q7_DECLARE_QUERY)
#undef Q7_DECLARE_CURRENT_QUERY
#undef Q7_DECLARE_SUMMARY_QUERY
#undef Q7_DECLARE_QUERY
#undef Q7_DECLARE_OVER_TIME_QUERY

  // The registered patterns as pattern-table rows, in matching order (pattern_rows.cc). Only
  // sample type 3 yields rows; new[] arrays as above. Any thread.
  kq7_q7txptns_data_t* getTransactionPatterns(int sampleType, int* count);
  kq7_q7clntptns_data_t* getClientPatterns(int sampleType, int* count);

  // The latency book of the current interval, or (summary) of the summary period: its saved
  // intervals, those whose save failed and the current one, merged oldest first
  // (latency_queries.cc). Any thread.
  LatencyBook getLatency(bool summary) EXCLUDES(treeMutex);

  // A copy of the page requests counted since the start, for /metrics. Any thread.
  RequestMetrics getRequestMetrics() const EXCLUDES(treeMutex);

  // Intervals in the summary period: summary hours x 60 / over-time minutes.
  static int summaryIntervals();

  // Calls visit(trees) with the tree lock held: the trees processing updates (a past
  // interval's while one is swapped in). For tests and diagnostics; any thread.
  template <class Visit>
  void visitTrees(Visit visit) EXCLUDES(treeMutex) {
    CvelMutexLock lock(treeMutex);
    visit(cache->trees());
  }
  // Writes the instance files' buffered records; any thread.
  void flushInstanceFiles() EXCLUDES(treeMutex);
  history::HistoryStore& historyStore() {
    return *history;
  }
  int getRolloverCount() const {
    return rolloverCount;
  }

  // Start-of-run work (interval, cleanup, the current interval's rows: the checkpoint's when
  // there is one, else the saved ones) and end-of-run work (save everything, a last
  // checkpoint), as Run does them; tests drive them directly.
  void startRun();
  void finishRun();

  // ---- Checkpoints (checkpointing.cc). Analyzer thread. ----
  // Takes note that every record before position is processed (a CPositionMark), and takes a
  // checkpoint when one is due.
  void notePosition(const ReadPosition& position);
  // Saves the checkpoint now: the current interval's rows, the position noted last, the
  // instance files' lengths and the patterns' counters. Waits for it (and for one being
  // written). False (traced) when it could not be written; the next is tried when due.
  bool writeCheckpoint();
  // Waits until the checkpoint being written, if any, is on disk (tests; the stop).
  void awaitCheckpoint();
  // What checkpoints cost; any thread.
  struct CheckpointStats {
    std::atomic<long long> written{0};
    std::atomic<long long> longestCopyMillis{0};   // the analyzer's pause, rows copied
    std::atomic<long long> longestWriteMillis{0};  // on the writer's thread
  };
  const CheckpointStats& getCheckpointStats() const {
    return checkpointStats;
  }
  // Where startRun's checkpoint says reading resumes; empty file name without one.
  const ReadPosition& resumePosition() const {
    return resumeAt;
  }
  // True once the run has restored what an earlier run left (checkpoint, current interval):
  // until then the tables answer empty, which alerts must not take for recovery. Any thread.
  bool isRestored() const {
    return restored.load();
  }

 protected:
  void Run() override;

 private:
  // Write the instance files' buffered records.
  void flushInstanceFile() REQUIRES(treeMutex);
  void flushSubInstanceFile() REQUIRES(treeMutex);
  // Steps of processTransaction (transaction_processing.cc).
  void restampIfTooOld(CDPXTransaction& transaction);
  void selectTreesFor(long t) REQUIRES(treeMutex);
  void recordInstance(CDPXTransaction& w, bool page, const InstancePatterns& names)
      REQUIRES(treeMutex);
  template <class Layout, class Inner>
  Layout* lockedQuery(Inner inner, int* count) EXCLUDES(treeMutex);
  // A summary query: the current interval's rows of its over-time table merged into the fold
  // of that table's history (stem), which folds keeps between queries.
  template <class SummaryRow>
  typename SummaryRow::LayoutType* summaryQuery(const char* stem,
                                                HistoryCache<HistoryFold<SummaryRow>>& folds,
                                                const char* where, int sampleType, int* count,
                                                std::size_t limit) EXCLUDES(treeMutex);
  // Loads the checkpoint and puts everything back as it stood then; false when there is none
  // (or it was set aside), leaving everything untouched.
  bool recoverFromCheckpoint() REQUIRES(treeMutex);
  // Checkpoints off: removes an earlier run's checkpoint (paths.retiredCheckpointFile).
  void retireCheckpoint() const;
  // False when the interval's rows could not all be saved.
  bool saveIntervalData(long interval) REQUIRES(treeMutex);
  // Saves the intervals whose save failed, oldest first; false while any remains unsaved.
  bool saveUnsaved() REQUIRES(treeMutex);
  void saveAllData(long interval) REQUIRES(treeMutex);
  void cleanupOldFiles();

  const Paths paths;
  std::unique_ptr<history::HistoryStore> history;
  std::unique_ptr<history::StateFile> state;
  // The file manager tailing dataDirectory, created when the thread starts. Analyzer thread.
  std::unique_ptr<TransactionFeeder> feeder;

  // The tree lock: processing and rollover on the analyzer thread, queries on framework threads.
  mutable CvelMutex treeMutex;
  std::unique_ptr<IntervalCache> cache PT_GUARDED_BY(treeMutex);  // the trees, and the cache
  std::unique_ptr<history::InstanceFile> instanceFile PT_GUARDED_BY(treeMutex);
  std::unique_ptr<history::InstanceFile> subInstanceFile PT_GUARDED_BY(treeMutex);
  // Every page request counted since the start, for /metrics.
  std::unique_ptr<RequestMetrics> requestMetrics PT_GUARDED_BY(treeMutex);
  // Ended intervals whose rows could not be saved (a full disk), oldest first.
  std::vector<std::pair<long, std::unique_ptr<COverTimeTrees>>> unsaved GUARDED_BY(treeMutex);
  // Each summary's history fold, kept between queries; locks itself.
  const std::unique_ptr<SummaryFolds> summaryFolds;
  // The interval transactions are judged against. Written by the analyzer thread under the
  // tree lock, read by it without: an atomic, since nothing else reads it.
  std::atomic<long> referenceInterval{0};

  int rolloverCount = 0;        // analyzer thread
  short lastInstanceLevel = 0;  // analyzer thread: the level of the last page

  // Starts a checkpoint: copies what it holds under the tree lock and hands it to the writer.
  // False when it is put off (unwritten records) or the writer is busy.
  bool startCheckpoint();
  // Takes the writer's result for the pending checkpoint (waiting for it when wait); true
  // when it was written.
  bool collectCheckpoint(bool wait);

  // Checkpoints; all analyzer thread. Null file: checkpoints are off.
  std::unique_ptr<history::CheckpointFile> checkpointFile;
  // Writes them; declared after the file, so it is gone (its write finished) before the file.
  std::unique_ptr<history::CheckpointWriter> checkpointWriter;
  struct PendingCheckpoint {
    uint64_t sequence = 0;
    long interval = 0;
    ReadPosition position;
    long rows = 0;
    long long copyMillis = 0;
  };
  std::optional<PendingCheckpoint> pendingCheckpoint;  // handed to the writer
  CheckpointStats checkpointStats;
  ReadPosition position;              // every record before it is in the trees
  ReadPosition resumeAt;              // the recovered checkpoint's position
  bool recovered = false;             // startRun loaded a checkpoint
  std::atomic<bool> restored{false};  // startRun is done
  uint64_t checkpointSequence = 0;
  long lastCheckpointAt = 0;      // when the last one was tried, seconds since 1970
  bool checkpointDue = false;     // a rollover happened since the last one
  bool checkpointPutOff = false;  // the last one waited for unwritten records (traced once)
};
