#pragma once

// CDPXDataFileMonitor: the thread that tails one collector .sm3 file. Each turn it reads what
// was appended (CDataFileMonitor), cuts the chunk into records, turns each into a
// CDPXTransaction, drops outliers, gives the rest their page identity and queues them to the
// analyzer, which then owns them.
//
// Two kinds:
// - live (the file manager's monitor of the newest file): runs until Shutdown. When the file
//   disappears, shrinks below what was read, or its name holds another file (device and
//   inode), the collector has renamed it; the monitor finds the renamed file (by identity,
//   else by name), finishes it and any file renamed after it with static monitors, and starts
//   the live name again at 0.
// - static (setStatic): finishes one file and stops by itself once the file has nothing more.
//
// Ownership: the owner creates, starts, stops (Shutdown + Join) and deletes the monitor. The
// sink must outlive it. Transactions queued belong to the sink.
//
// Thread safety: as CDataFileMonitor; setStatic, setSink before Start; waitForCompletion
// and isCompleted from any thread.

#include <atomic>
#include <cstdint>
#include <memory>

#include "core/analyzer/intake/data_file_monitor.h"
#include "core/analyzer/intake/transaction_sink.h"

class CDPXTransaction;

class CDPXDataFileMonitor : public CDataFileMonitor {
 public:
  // A monitor of file (copied) starting at offset.
  CDPXDataFileMonitor(const char* file, long long offset);
  ~CDPXDataFileMonitor() override;

  // May be called while the thread runs (a rollover turns the live monitor into a static one).
  void setStatic() { isStatic.store(true); }
  bool getStatic() const { return isStatic.load(); }
  bool isCompleted() const { return completed.load(); }
  // True when the run stopped taking records because the sink is shutting down: the file
  // has records after getLastProcessedOffset() that were not read.
  bool wasInterrupted() const { return interrupted.load(); }
  // Waits until Run has returned or seconds have passed, testing every 100 ms.
  void waitForCompletion(int seconds) const;
  // The same, but after seconds goes on waiting (traced every seconds) until Run has returned
  // or the sink is shutting down.
  void waitUntilFinished(int seconds) const;

  // Where records go (not owned). Unset, Run reads nothing and traces why.
  void setSink(TransactionSink* sink) { this->sink = sink; }

  // True when transaction passes the outlier test: a negative limit passes everything,
  // otherwise the total response time must be below the limit (so 0 rejects everything).
  static bool isValidTrans(const CDPXTransaction& transaction, int excludeOutlierMillis);

  // The renamed-file lookup: among the data directory's "*.sm3" files, the greatest name (byte
  // order) that starts with file's path up to its first '.' and holds a '-'. The directory is
  // the configured collector data directory. True with the name copied to newName (size bytes).
  static bool getNewLegacyFilename(const char* file, char* newName, int size);

  // Reads file from offset to its current end with a static monitor and waits for it (in
  // 30 s steps, traced, until it is done or the sink shuts down), as the file manager and the
  // rename handling do. The monitor gets excludeOutlierMillis and sink. Returns the monitor's
  // final state (stopped and joined) so the caller can see where it got to.
  static std::unique_ptr<CDPXDataFileMonitor> processStatically(const char* file, long long offset,
                                                                int excludeOutlierMillis,
                                                                TransactionSink* sink);

 protected:
  void Run() override;

 private:
  class RecordHandler;
  friend class RecordHandler;

  // The rename handling of a live monitor; true when the file was found renamed (both offsets
  // are then 0).
  bool handleLegacyDPXRename();
  // Reads the files the collector renamed after renamed (same prefix, newer by name) up to the
  // file with the live identity given: the live name moved on more than once before the
  // monitor noticed, and it read none of them.
  void processLaterRenames(const char* renamed, uint64_t liveDevice, uint64_t liveInode);

  std::atomic<bool> isStatic{false};     // set by the owner, read by the thread
  std::atomic<bool> completed{false};    // set when Run returns
  std::atomic<bool> interrupted{false};  // set by the thread when a record was refused
  TransactionSink* sink = nullptr;       // set before Start
};
