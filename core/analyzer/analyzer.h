#pragma once

// CAnalyzer: what every analyzer shares: the transaction queue the intake threads feed, the
// current over-time interval, the counters, the situation controller holding the patterns, and
// the pattern registration entry points the pattern tables call.
//
// Threads: add() from intake threads; the pattern entry points from framework threads (the
// controller has its own lock); everything else from the analyzer thread, except the counters
// and the interval, which are atomics any thread may read.

#include <atomic>
#include <cstdint>
#include <memory>

#include "core/analyzer/intake/intake_counters.h"
#include "core/analyzer/intake/transaction_sink.h"
#include "core/runtime/tvel_queue.h"
#include "core/runtime/typed_transaction.h"

class CSituationController;

class CAnalyzer : public TransactionSink {
 public:
  // patternDirectory: where the pattern files live (the historical data directory).
  explicit CAnalyzer(const char* patternDirectory);
  ~CAnalyzer() override;
  CAnalyzer(const CAnalyzer&) = delete;
  CAnalyzer& operator=(const CAnalyzer&) = delete;

  // Queues item; the analyzer owns its transaction from then on. False when the queue refused
  // it (the transaction is then deleted) or did not exist (the transaction stays the caller's).
  bool add(_TYPED_TRANSACTION item) override;
  // The same for a batch, put in with one lock per stretch of room.
  bool addBatch(const _TYPED_TRANSACTION* items, size_t n) override;

  // Queues a CPositionMark behind the records queued so far.
  void markPosition(const ReadPosition& position) override;

  // Asks the analyzer thread to finish. Besides setting the flag its loop polls, it queues an
  // empty item so that a thread waiting on an idle queue notices at once.
  void Shutdown();
  bool isShutdownRequested() const override { return shutdownRequested.load(); }

  int getCurrentOverTimeInterval() const { return currentOverTimeInterval.load(); }
  void setCurrentOverTimeInterval(int interval) { currentOverTimeInterval.store(interval); }
  // Current interval = now - now mod (over-time interval x 60).
  void updateCurrentOverTimeInterval();
  bool isNewOverTimeInterval() const;
  bool isNewOverTimeInterval(long interval) const;

  // Registration of patterns (the pattern tables' situations). Traced; overlaps send their
  // agent message; a successful change saves the pattern files.
  bool newTransactionPattern(const char* situationID, const char* applicationName,
                             const char* applicationPattern, const char* transactionName,
                             const char* transactionPattern, int16_t aggappsuniq,
                             int16_t aggtxsuniq, int16_t collectInstances, int32_t samplePercent,
                             int32_t mrtthres, int16_t importance);
  bool newClientPattern(const char* situationID, const char* clientName,
                        const char* clientHostNamePattern, const char* clientIPPattern,
                        int16_t aggregateUniquely);
  bool removeTransactionPattern(const char* situationID);
  bool removeClientPattern(const char* situationID);

  // True when at least one transaction and one client pattern are registered.
  bool haveSituations() const;
  // Sleeps sleepTime ms at a time until there are situations, at most maxSleeps times.
  void waitForSituations(unsigned long sleepTime, int maxSleeps);

  CSituationController& situations() { return *situationController; }

  // What the data file monitors read; they write it, anyone reads it.
  IntakeCounters& intakeCounters() override { return intake; }
  const IntakeCounters& intakeCounters() const { return intake; }

  int32_t getTransactionsProcessed() const { return transactionsProcessed.load(); }
  int32_t getTransactionsIgnored() const { return transactionsIgnored.load(); }
  // Transactions taken from the queue and done with, whatever became of them; with the queue
  // empty and this equal to what the intake queued, the tables are final.
  int64_t getTransactionsTaken() const { return transactionsTaken.load(); }
  int32_t getQueueDepthHint() const;
  // Transactions waiting now: in the queue, or taken out with the analyzer's current batch and
  // not yet processed.
  long getQueueDepth() const { return (newQueue ? newQueue->Size() : 0) + heldItems.load(); }

 protected:
  std::unique_ptr<CSituationController> situationController;
  std::atomic<bool> shutdownRequested{false};
  std::atomic<int32_t> transactionsProcessed{0};
  std::atomic<int32_t> transactionsIgnored{0};
  std::atomic<int64_t> transactionsTaken{0};  // analyzer thread writes, anyone reads
  std::atomic<long> heldItems{0};  // of the analyzer's current batch; it writes, anyone reads
  std::atomic<int64_t> totalProcessingTime{0};  // ms
  int32_t oldTransactions = 0;       // restamped into this interval; analyzer thread only
  int32_t transactionsReceived = 0;  // handed to processing in this interval; analyzer thread
  std::atomic<int32_t> currentOverTimeInterval{0};  // seconds since 1970
  // Created at construction, recreated by add() should it ever be missing; the analyzer
  // thread alone takes items out.
  std::unique_ptr<TvelQueue<_TYPED_TRANSACTION>> newQueue;
  IntakeCounters intake;
};
