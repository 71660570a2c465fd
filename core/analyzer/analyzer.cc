#include "core/analyzer/analyzer.h"

#include <cstring>
#include <memory>
#include <utility>

#include "core/analyzer/intake/transaction.h"
#include "core/analyzer/situation_controller.h"
#include "core/config/cconfig.h"
#include "core/messages/agent_message.h"
#include "core/runtime/clog.h"
#include "core/runtime/misc.h"
#include "framework/clock.h"

namespace {

// How long a reader pauses when it finds the queue full: at a few microseconds per
// transaction the analyzer takes several hundred items meanwhile and never runs dry.
constexpr unsigned long kFullQueuePauseMillis = 1;

}  // namespace

CAnalyzer::CAnalyzer(const char* patternDirectory)
    : situationController(std::make_unique<CSituationController>(patternDirectory)),
      newQueue(std::make_unique<TvelQueue<_TYPED_TRANSACTION>>()) {}

CAnalyzer::~CAnalyzer() = default;

bool CAnalyzer::add(_TYPED_TRANSACTION item) {
  static const char* const kWhere = "CAnalyzer::add(TYPED_TRANSACTION)";
  if (!newQueue) {
    CLOG::min(
        "%s ERROR, newQueue does not exist and it should always exist!  Will attempt to create "
        "one now.",
        kWhere);
    newQueue = std::make_unique<TvelQueue<_TYPED_TRANSACTION>>();
    return false;
  }
  // A full queue means the analyzer is behind: let it drain a stretch before queueing again.
  // Blocking in Put instead would wake this thread for every item the analyzer takes, and the
  // two threads would hand the processor to each other once per transaction.
  while (newQueue->IsFull() && !shutdownRequested.load()) {
    CMisc::sleep(kFullQueuePauseMillis);
  }
  // Put still waits while the queue is full, holding the reader back rather than dropping
  // records.
  const long status = newQueue->Put(item);
  if (status != 0) {
    CLOG::min("%s ERROR, Failed[%d] to add to newQueue", kWhere, static_cast<int>(status));
    delete item.transaction;
    return false;
  }
  return true;
}

bool CAnalyzer::addBatch(const _TYPED_TRANSACTION* items, size_t n) {
  static const char* const kWhere = "CAnalyzer::add(TYPED_TRANSACTION)";
  if (!newQueue) {
    bool all = true;
    for (size_t i = 0; i < n; ++i) {
      all = add(items[i]) && all;
    }
    return all;
  }
  // As add: let a full queue drain a stretch before queueing again.
  while (newQueue->IsFull() && !shutdownRequested.load()) {
    CMisc::sleep(kFullQueuePauseMillis);
  }
  unsigned long stored = 0;
  const long status = newQueue->PutBatch(items, n, &stored);
  if (status != 0) {
    CLOG::min("%s ERROR, Failed[%d] to add to newQueue", kWhere, static_cast<int>(status));
    for (size_t i = stored; i < n; ++i) {
      delete items[i].transaction;
    }
    return false;
  }
  return true;
}

void CAnalyzer::markPosition(const ReadPosition& position) {
  add(_TYPED_TRANSACTION{TRANSACTION_KIND_POSITION, new CPositionMark(position)});
}

void CAnalyzer::Shutdown() {
  shutdownRequested.store(true);
  if (newQueue && !newQueue->IsFull()) {
    newQueue->Put(_TYPED_TRANSACTION{});
  }
}

int32_t CAnalyzer::getQueueDepthHint() const {
  return (newQueue && !newQueue->IsEmpty()) || heldItems.load() > 0 ? 1 : 0;
}

void CAnalyzer::updateCurrentOverTimeInterval() {
  const long now = fw::Now();
  currentOverTimeInterval.store(
      static_cast<int32_t>(now - (now % CConfig::getOverTimeIntervalSeconds())));
}

bool CAnalyzer::isNewOverTimeInterval() const {
  return isNewOverTimeInterval(getCurrentOverTimeInterval());
}

bool CAnalyzer::isNewOverTimeInterval(long interval) const {
  const long now = fw::Now();
  return now - (now % CConfig::getOverTimeIntervalSeconds()) != interval;
}

bool CAnalyzer::haveSituations() const {
  return situationController && situationController->getTransactionPatternCount() > 0 &&
         situationController->getClientPatternCount() > 0;
}

void CAnalyzer::waitForSituations(unsigned long sleepTime, int maxSleeps) {
  static const char* const kWhere = "waitForSituatuions";
  int sleeps = 0;
  for (;;) {
    if (haveSituations()) {
      CLOG::min("%s We have situations!  No (more) sleeps.", kWhere);
      return;
    }
    CLOG::min("%s Don't have situations yet.  Going to sleep", kWhere);
    CMisc::sleep(sleepTime);
    if (++sleeps >= maxSleeps) {
      CLOG::min("%s Did [%d] sleeps and no situations yet.  Continuing on.", kWhere, maxSleeps);
      return;
    }
  }
}

// ---- Patterns ----

namespace {

// The winner of an overlap is the pattern matching takes: the greater ordering key, the
// existing one on a tie (client patterns: always the existing one, the earlier added).
const char* Winner(const char* added, int addedKey, const char* existing, int existingKey) {
  return addedKey > existingKey ? added : existing;
}

}  // namespace

bool CAnalyzer::newTransactionPattern(const char* situationID, const char* applicationName,
                                      const char* applicationPattern, const char* transactionName,
                                      const char* transactionPattern, int16_t aggappsuniq,
                                      int16_t aggtxsuniq, int16_t collectInstances,
                                      int32_t samplePercent, int32_t mrtthres, int16_t importance) {
  static const char* const kWhere = "newTransactionPattern";
  if (situationID == nullptr) {
    CLOG::min("Error: %s, Situation ID was null!!", kWhere);
    return false;
  }
  CLOG::max(
      "%s, applicationName[%s] applicationPattern[%s] transactionName[%s] "
      "transactionPattern[%s] aggappsuniq[%d] aggtxsuniq[%d] collectInstances[%d] mrtthres[%d], "
      "samplePercent[%d]",
      kWhere, applicationName, applicationPattern, transactionName, transactionPattern, aggappsuniq,
      aggtxsuniq, collectInstances, mrtthres, samplePercent);
  auto pattern = std::make_unique<TransactionPattern>();
  setPatternText(pattern->applicationName, applicationName);
  setPatternText(pattern->applicationPattern, applicationPattern);
  setPatternText(pattern->transactionName, transactionName);
  setPatternText(pattern->transactionPattern, transactionPattern);
  setPatternText(pattern->situationId, situationID);
  pattern->aggappsuniq = aggappsuniq;
  pattern->aggtxsuniq = aggtxsuniq;
  pattern->collectInstances = collectInstances;
  pattern->samplePercent = samplePercent;
  pattern->mrtthres = mrtthres;
  pattern->importance = importance;
  pattern->orderingKey = static_cast<int16_t>(strlen(pattern->applicationPattern) +
                                              strlen(pattern->transactionPattern));
  CLOG::max("%s initial count of Transaction patterns[%d]", kWhere,
            situationController->getTransactionPatternCount());
  if (const auto existing = situationController->findOverlappingTransactionPattern(*pattern)) {
    AgentMessage::sendMessage(
        "TRANSPATTERN_OVERLAP_WARNING", 2,
        {situationID, existing->situationId,
         Winner(situationID, pattern->orderingKey, existing->situationId, existing->orderingKey)});
  }
  if (!situationController->addTransactionPattern(std::move(pattern))) {
    CLOG::min("%s, Failed to add situation %s", kWhere, situationID);
    return false;
  }
  CLOG::max("%s updated count of Transaction patterns[%d]", kWhere,
            situationController->getTransactionPatternCount());
  return true;
}

bool CAnalyzer::newClientPattern(const char* situationID, const char* clientName,
                                 const char* clientHostNamePattern, const char* clientIPPattern,
                                 int16_t aggregateUniquely) {
  static const char* const kWhere = "newClientPattern";
  if (situationID == nullptr) {
    CLOG::min("Error: %s, Situation ID was null!!", kWhere);
    return false;
  }
  CLOG::max(
      "%s, clientName[%s] clientHostNamePattern[%s] clientIPPattern[%s] "
      "aggregateUniquely[%d]",
      kWhere, clientName, clientHostNamePattern, clientIPPattern, aggregateUniquely);
  auto pattern = std::make_unique<ClientPattern>();
  setPatternText(pattern->clientName, clientName);
  setPatternText(pattern->hostNamePattern, clientHostNamePattern);
  setPatternText(pattern->ipAddressPattern, clientIPPattern);
  setPatternText(pattern->situationId, situationID);
  pattern->aggregateUniquely = aggregateUniquely;
  CLOG::max("%s initial count of Client patterns[%d]", kWhere,
            situationController->getClientPatternCount());
  if (const auto existing = situationController->findOverlappingClientPattern(*pattern)) {
    AgentMessage::sendMessage("CLIENTPATTERN_OVERLAP_WARNING", 2,
                              {situationID, existing->situationId, existing->situationId});
  }
  if (!situationController->addClientPattern(std::move(pattern))) {
    CLOG::min("%s, Failed to add situation %s", kWhere, situationID);
    return false;
  }
  CLOG::max("%s updated count of Client patterns[%d]", kWhere,
            situationController->getClientPatternCount());
  return true;
}

bool CAnalyzer::removeTransactionPattern(const char* situationID) {
  static const char* const kWhere = "removeTransactionPattern";
  CLOG::max("%s, attempt to remove TransactionPattern for situationID[%s], initial count[%d]",
            kWhere, situationID != nullptr ? situationID : "",
            situationController->getTransactionPatternCount());
  if (situationController->removeTransactionPatterns(situationID) > 0) {
    CLOG::max("%s, removed transaction pattern, new count[%d]", kWhere,
              situationController->getTransactionPatternCount());
    return true;
  }
  CLOG::min("%s, Failed to remove situation [%s]", kWhere,
            situationID != nullptr ? situationID : "");
  return false;
}

bool CAnalyzer::removeClientPattern(const char* situationID) {
  static const char* const kWhere = "removeClientPattern";
  CLOG::max("%s, attempt to remove ClientPattern for situationID[%s], initial count[%d]", kWhere,
            situationID != nullptr ? situationID : "",
            situationController->getClientPatternCount());
  if (situationController->removeClientPatterns(situationID) > 0) {
    CLOG::max("%s, removed client pattern, new count[%d]", kWhere,
              situationController->getClientPatternCount());
    return true;
  }
  CLOG::min("%s, Failed to remove situation [%s]", kWhere,
            situationID != nullptr ? situationID : "");
  return false;
}
