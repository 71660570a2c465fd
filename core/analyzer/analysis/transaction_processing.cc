// Processing one transaction: the patterns it matches decide whether and under which names it
// counts; it then updates the over-time trees (of its own interval, swapping a past interval
// in when needed) and, by instance level, the instance files. The order of the steps matters:
// restamp a record too old for the reference interval, skip what the collector did not sample,
// match the patterns, then for each matched pair rename the working copy after its patterns,
// pick the trees of its interval, update them and, by instance level, the instance files.

#include <cstring>
#include <memory>
#include <string_view>

#include "core/analyzer/analysis/instance_rows.h"
#include "core/analyzer/dpx_analyzer.h"
#include "core/analyzer/intake/common.h"
#include "core/analyzer/intake/dpx_transaction.h"
#include "core/analyzer/rows/rows.h"
#include "core/analyzer/situation_controller.h"
#include "core/config/cconfig.h"
#include "core/history/instance_file.h"
#include "core/runtime/clog.h"
#include "framework/clock.h"

namespace {

constexpr int kAggByApplication = 1;
constexpr int kAggByClient = 2;
constexpr int kAggByTransaction = 4;

// A name field's text, up to its NUL or its width as the rows keep it.
std::string_view FieldText(const char* field) {
  return {field, strnlen(field, kTransactionNameWidth)};
}

// Finds the row of Row with w's key in table (through the trees' index, without building a
// lookup row), or adds a new one starting at the transaction's interval; then adds w to it.
template <class Row>
void UpdateTable(COverTimeTrees& trees, OverTimeTable table, CDPXTransaction& w,
                 const char* refusal) {
  const std::size_t hash = Row::indexHashOf(w);
  Row* row = static_cast<Row*>(trees.findIf(table, hash, [&w](TreeNode* candidate) {
    return static_cast<Row*>(candidate)->hasKeyOf(w);
  }));
  if (row == nullptr) {
    auto fresh = std::make_unique<Row>(w);
    fresh->reset(w.getTimeRecorded());
    if (!trees.add(table, fresh.get(), hash)) {
      CLOG::min("%s", refusal);
      return;
    }
    row = fresh.release();  // the tree owns it now
  }
  row->Update(w);
}

// The seven page tables, in this order.
void UpdatePageTables(COverTimeTrees& trees, CDPXTransaction& w) {
  UpdateTable<CApplicationOverTime>(trees, OverTimeTable::kApplication, w,
                                    "Error adding to AOT tree!");
  UpdateTable<CServerAppOverTime>(trees, OverTimeTable::kServerApp, w,
                                  "Error adding to CSAOT tree!");
  UpdateTable<CServerOverTime>(trees, OverTimeTable::kServer, w, "Error adding to CSOT tree!");
  UpdateTable<CClientServerOverTime>(trees, OverTimeTable::kClientServer, w,
                                     "Error adding to CCSOT tree!");
  UpdateTable<CClientOverTime>(trees, OverTimeTable::kClient, w, "Error adding to CCOT tree!");
  UpdateTable<CTransactionOverTime>(trees, OverTimeTable::kTransaction, w,
                                    "Error adding to CTOT tree!");
  UpdateTable<CClientAppOverTime>(trees, OverTimeTable::kClientApp, w,
                                  "Error adding to CAOT tree!");
}

// The page's latency in its interval's book, and in the metrics since the start (through the
// book entry's cached series).
void UpdateLatency(COverTimeTrees& trees, RequestMetrics& metrics, CDPXTransaction& w) {
  const std::string_view application = FieldText(w.getApplicationName());
  const std::string_view transaction = FieldText(w.getTransactionName());
  const int32_t response = w.getTotalResponseTime();
  const LatencyEntry& entry =
      trees.latency().add(application, transaction, w.getMinThreshold(), response);
  metrics.add(application, transaction,
              {w.getMinThreshold(), response, w.getServerTime(), w.getNetworkTime(),
               response - w.getServerTime(), w.isBadStatusCode(), w.getRequestStatus()},
              &entry.metricsSeries);
}

// Sets the client field of w whose text is value to its first three address parts, cut to the
// field's width.
void CutToSubnet(CDPXTransaction& w, const char* value, void (CTransaction::*set)(const char*)) {
  char text[kTransactionNameWidth];
  snprintf(text, sizeof(text), "%s", value);
  char out[kTransactionNameWidth + 2];
  CCommon::stripToSubnet(text, out, 3);
  const size_t length = strnlen(out, sizeof(text) - 1);
  memcpy(text, out, length);
  text[length] = '\0';
  (w.*set)(text);
}

// The made-up matches of an object and of a client no pattern names: built once, since a
// match record is over a kilobyte to clear.
const ClientMatch& OwnClientIdentity() {
  static const ClientMatch kOwnIdentity = [] {
    ClientMatch m;
    m.pattern.aggregateUniquely = 1;
    return m;
  }();
  return kOwnIdentity;
}
const TransactionMatch& ObjectMatch() {
  static const TransactionMatch kObjectMatch = [] {
    TransactionMatch m;
    m.pattern.aggappsuniq = 1;
    m.pattern.aggtxsuniq = 1;
    m.pattern.samplePercent = 100;
    return m;
  }();
  return kObjectMatch;
}

// The instance level and importance of one matched pair: the pattern's, except for a
// sub-transaction record, whose control flags carry its own.
struct InstanceChoice {
  int level;
  int importance;
};
InstanceChoice ChooseInstanceLevel(const CDPXTransaction& t, const TransactionPattern& tp) {
  if (t.getTrueTransType() == static_cast<int>(TRANSACTION_KIND_SUBTX)) {
    return {t.getControlFlags() & 3, (t.getControlFlags() >> 8) & 255};
  }
  return {tp.collectInstances, tp.importance};
}

// Renames w after the transaction pattern unless the pattern keeps its names apart; returns the
// aggby bits of the names kept.
int ApplyTransactionPattern(CDPXTransaction& w, const TransactionPattern& tp, int importance) {
  int aggBy = 0;
  if (tp.aggappsuniq != 0) {
    aggBy |= kAggByApplication;
  } else {
    w.setApplicationName(tp.applicationName);
  }
  if (tp.aggtxsuniq != 0) {
    aggBy |= kAggByTransaction;
  } else {
    w.setTransactionName(tp.transactionName);
  }
  w.setImportance(importance);
  w.setMinThreshold(tp.mrtthres);
  return aggBy;
}

// Renames w's client after the client pattern: kept apart (aggby bit), folded into the
// pattern's name, or cut to its subnet. Returns the aggby bit it adds.
int ApplyClientPattern(CDPXTransaction& w, const ClientPattern& cp) {
  if (cp.aggregateUniquely == 1) {
    return kAggByClient;
  }
  if (cp.aggregateUniquely == 0) {
    w.setClientName(cp.clientName);
    w.setClientHostname(cp.clientName);
    w.setClientIPAddress(cp.clientName);
    return 0;
  }
  CutToSubnet(w, w.getClientName(), &CTransaction::setClientName);
  CutToSubnet(w, w.getClientHostname(), &CTransaction::setClientHostname);
  CutToSubnet(w, w.getClientIPAddress(), &CTransaction::setClientIPAddress);
  CutToSubnet(w, w.getClientIPv6Address(), &CTransaction::setClientIPv6Address);
  return 0;
}

}  // namespace

// A transaction too old for the reference interval is counted into it. The interval is taken in
// minutes as if they were seconds: that is how old records have always been judged.
void CDPXAnalyzer::restampIfTooOld(CDPXTransaction& transaction) {
  const long recorded = transaction.getTimeRecorded();
  const long m = CConfig::getOverTimeInterval();
  const long s = recorded - (recorded % m) - m;
  if (s < referenceInterval) {
    transaction.setTimeRecorded(referenceInterval);
    ++oldTransactions;
  }
}

// Makes the trees of interval-start t the ones processing updates: the current interval's, or
// a past interval's swapped in as the cache.
void CDPXAnalyzer::selectTreesFor(long t) {
  if (!cache->active() && t >= getCurrentOverTimeInterval()) {
    return;
  }
  if (cache->active() && t >= referenceInterval) {
    cache->deactivate(getCurrentOverTimeInterval());
    return;
  }
  const long m = CConfig::getOverTimeInterval();
  const long interval = t - (t % (m * 60));
  if (cache->active() && cache->interval() != interval) {
    cache->deactivate(getCurrentOverTimeInterval());
  }
  if (!cache->active()) {
    cache->activate(interval, getCurrentOverTimeInterval());
  }
  CLOG::med("%s Processing transaction from a previous time period",
            "CDPXAnalyzer::processTransaction");
}

// Appends w's instance row to the page or sub-transaction instance file.
void CDPXAnalyzer::recordInstance(CDPXTransaction& w, bool page, const InstancePatterns& names) {
  if (page) {
    kq7_q7txins_data_t row;
    buildInstanceRow(w, names, row);
    instanceFile->append(getCurrentOverTimeInterval(), &row);
  } else {
    kq7_q7subtxins_data_t row;
    buildInstanceRow(w, names, row);
    subInstanceFile->append(getCurrentOverTimeInterval(), &row);
  }
}

void CDPXAnalyzer::processTransaction(CDPXTransaction& transaction, short* instanceLevel) {
  const long recorded = transaction.getTimeRecorded();
  restampIfTooOld(transaction);
  ++transactionsReceived;
  const int64_t started = QbrmBestGetCurrentTime();

  // The collector marks records it did not sample.
  if ((transaction.getControlFlags() & 4) != 0) {
    CLOG::max("Transaction did not match a Pattern or was not sampled. Ignoring...");
    ++transactionsIgnored;
    return;
  }

  // Matching: a page by the patterns; an object of a page counts under its own names, at the
  // instance level of the page before it.
  const bool page = transaction.getParentUUID()[0] == '\0';
  CSituationController& controller = situations();
  TransactionMatch* txMatches = nullptr;
  ClientMatch* clientMatches = nullptr;
  bool madeUp = false;
  if (page) {
    txMatches = controller.matchTransactionPatterns(
        transaction.getApplicationName(), transaction.getTransactionName(), false,
        transaction.getTrueTransType() != static_cast<int>(TRANSACTION_KIND_SUBTX));
    clientMatches = controller.matchClientPatterns(transaction.getClientName(),
                                                   transaction.getClientIPAddress(), false);
    if (txMatches != nullptr) {
      *instanceLevel = txMatches->pattern.collectInstances;
    }
  } else {
    madeUp = true;
    // One made-up match per thread, reused: clearing and copying a match (over a kilobyte) for
    // every object cost more than the object's own processing.
    thread_local TransactionMatch objectMatch = ObjectMatch();
    objectMatch.pattern.collectInstances = *instanceLevel;
    txMatches = &objectMatch;
    clientMatches = const_cast<ClientMatch*>(&OwnClientIdentity());
  }
  CLOG::med("Processing transaction tTemp[%p] appName[%s] tranName[%s]",
            static_cast<void*>(&transaction), transaction.getApplicationName(),
            transaction.getTransactionName());
  if (txMatches == nullptr) {
    CLOG::max("Transaction did not match a Pattern or was not sampled. Ignoring...");
    ++transactionsIgnored;
    controller.freeClientMatches(clientMatches);
    return;
  }
  if (clientMatches == nullptr) {
    CLOG::med("Transaction did not match a client pattern.");
  }

  // Every pair of matched patterns counts once.
  const bool onePair =
      txMatches->next == nullptr && (clientMatches == nullptr || clientMatches->next == nullptr);
  const ClientMatch* const firstClient =
      clientMatches != nullptr ? clientMatches : &OwnClientIdentity();
  for (const TransactionMatch* tm = txMatches; tm != nullptr; tm = tm->next) {
    const TransactionPattern& tp = tm->pattern;
    for (const ClientMatch* cm = firstClient; cm != nullptr; cm = cm->next) {
      const ClientPattern& cp = cm->pattern;
      const InstanceChoice instance = ChooseInstanceLevel(transaction, tp);
      // The analyzer asks for the first match only, so there is one pair and the record itself
      // can be the working copy; a copy (4.6 KB) is made only when more pairs follow.
      std::unique_ptr<CDPXTransaction> copy;
      if (!onePair) {
        copy = std::make_unique<CDPXTransaction>(transaction);
      }
      CDPXTransaction& w = copy ? *copy : transaction;
      int aggBy = ApplyTransactionPattern(w, tp, instance.importance);
      aggBy |= ApplyClientPattern(w, cp);
      w.setAggBy(aggBy);
      CLOG::med("Transaction matched a defined pattern. Processing....");

      int64_t elapsed = 0;
      {
        CvelMutexLock lock(treeMutex);
        const long now = fw::Now();
        // Transactions older than the summary period count nowhere.
        if (w.getTimeRecorded() > now - static_cast<long>(CConfig::getSummaryInterval()) * 3600) {
          selectTreesFor(w.getTimeRecorded());
          if (page) {
            UpdatePageTables(cache->trees(), w);
            UpdateLatency(cache->trees(), *requestMetrics, w);
          }
          const int level = instance.level;
          if (level == 1 || (level == 2 && w.isBadStatusCode())) {
            CLOG::med("Transaction Instance Trace [%d], sending to instance tables ...", level);
            w.setTimeRecorded(recorded);
            InstancePatterns names;
            if (!madeUp) {
              const bool ownIdentity = cm == &OwnClientIdentity();
              names = {tp.applicationPattern, tp.transactionPattern,
                       ownIdentity ? "" : cp.clientName, ownIdentity ? "" : cp.hostNamePattern,
                       ownIdentity ? "" : cp.ipAddressPattern};
            }
            recordInstance(w, page, names);
          }
          if (!page) {
            UpdateTable<CSubTransactionOverTime>(cache->trees(), OverTimeTable::kSubTransaction, w,
                                                 "Error adding to CSTOT tree!");
          }
        }
        elapsed = QbrmBestGetCurrentTime() - started;
      }
      ++transactionsProcessed;
      totalProcessingTime += elapsed / 1000000;
    }
  }
  if (!madeUp) {
    controller.freeTransactionMatches(txMatches);
    controller.freeClientMatches(clientMatches);
  }
}
