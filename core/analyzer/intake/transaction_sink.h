#pragma once

// The two ends of the intake's hand-off to the analyzer, so that the intake knows nothing of
// the analyzer above it. TransactionSink is where parsed transactions go (the analyzer's
// queue); TransactionFeeder is the thread that reads files into it (the file manager), which
// the analyzer starts with its own thread and stops first at shutdown.
//
// Threads: a sink is called from intake threads and must be safe for that; a feeder's start
// and shutdownAndJoin come from the thread that owns it.

#include <cstddef>
#include <cstdint>

#include "core/analyzer/intake/intake_counters.h"
#include "core/analyzer/intake/read_position.h"
#include "core/runtime/typed_transaction.h"

// Kinds of queued transaction records.
inline constexpr uint32_t TRANSACTION_KIND_DPX = 5;
inline constexpr uint32_t TRANSACTION_KIND_SUBTX = 6;
// A read position (CPositionMark) queued after the records it follows, not a transaction; an
// agent-private code, far from the record kinds.
inline constexpr uint32_t TRANSACTION_KIND_POSITION = 1000;

class TransactionSink {
 public:
  virtual ~TransactionSink() = default;
  // Queues item; the sink owns its transaction from then on. False when the sink refused it
  // (the transaction is then deleted) or had no queue (the transaction stays the caller's).
  virtual bool add(_TYPED_TRANSACTION item) = 0;
  // Queues items[0..n) in order, as that many adds would; false when any was refused. Sinks
  // with a queue override it to take the batch in one hand-off.
  virtual bool addBatch(const _TYPED_TRANSACTION* items, size_t n) {
    bool all = true;
    for (size_t i = 0; i < n; ++i) {
      all = add(items[i]) && all;
    }
    return all;
  }
  // Where reading has got to: every record before position was handed over. Sinks that
  // checkpoint queue it behind those records; the others ignore it.
  virtual void markPosition(const ReadPosition& position) { (void)position; }
  // True once the sink is shutting down: readers stop taking records.
  virtual bool isShutdownRequested() const = 0;
  // What the readers count as they go (records read, unparsed, dropped; file and offset).
  virtual IntakeCounters& intakeCounters() = 0;
};

class TransactionFeeder {
 public:
  virtual ~TransactionFeeder() = default;
  virtual void start() = 0;
  // Asks the feeder to stop and waits for its thread.
  virtual void shutdownAndJoin() = 0;
};
