// Processing one transaction: the patterns it matches decide whether and under which names it
// counts; it then updates the over-time trees (of its own interval, swapping a past interval
// in when needed) and, by instance level, the instance files. The order of the steps matters.

#include <cstring>
#include <memory>
#include <optional>

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

// Builds the row of Row for w, finds its equal in tree, or adds a new one starting at the
// transaction's interval; then adds w to it.
template <class Row>
void UpdateTable(TSAVLTree& tree, CDPXTransaction& w, const char* refusal) {
  Row key(w);
  key.setDeleteOnRemoval(false);  // a lookup key: the tree must not destroy it
  Row* row = static_cast<Row*>(tree.findNode(&key));
  if (row == nullptr) {
    auto fresh = std::make_unique<Row>(w);
    fresh->reset(w.getTimeRecorded());
    if (!tree.addNode(fresh.get())) {
      CLOG::min("%s", refusal);
      return;
    }
    row = fresh.release();  // the tree owns it now
  }
  row->Update(w);
}

// The seven page tables, in this order.
void UpdatePageTables(COverTimeTrees& trees, CDPXTransaction& w) {
  UpdateTable<CApplicationOverTime>(trees.tree(OverTimeTable::kApplication), w,
                                    "Error adding to AOT tree!");
  UpdateTable<CServerAppOverTime>(trees.tree(OverTimeTable::kServerApp), w,
                                  "Error adding to CSAOT tree!");
  UpdateTable<CServerOverTime>(trees.tree(OverTimeTable::kServer), w, "Error adding to CSOT tree!");
  UpdateTable<CClientServerOverTime>(trees.tree(OverTimeTable::kClientServer), w,
                                     "Error adding to CCSOT tree!");
  UpdateTable<CClientOverTime>(trees.tree(OverTimeTable::kClient), w, "Error adding to CCOT tree!");
  UpdateTable<CTransactionOverTime>(trees.tree(OverTimeTable::kTransaction), w,
                                    "Error adding to CTOT tree!");
  UpdateTable<CClientAppOverTime>(trees.tree(OverTimeTable::kClientApp), w,
                                  "Error adding to CAOT tree!");
}

void ToSubnet(char* text, size_t size) {
  char out[kTransactionNameWidth + 2];
  CCommon::stripToSubnet(text, out, 3);
  const size_t length = strnlen(out, size - 1);
  memcpy(text, out, length);
  text[length] = '\0';
}

}  // namespace

void CDPXAnalyzer::processTransaction(CDPXTransaction& transaction, short* instanceLevel) {
  // 1. A transaction too old for the reference interval is counted into it. The interval is
  // taken in minutes as if they were seconds: that is how old records have always been judged.
  const long recorded = transaction.getTimeRecorded();
  const long m = CConfig::getOverTimeInterval();
  const long s = recorded - (recorded % m) - m;
  if (s < referenceInterval) {
    transaction.setTimeRecorded(referenceInterval);
    ++oldTransactions;
  }
  ++transactionsReceived;

  // 2.
  const int64_t started = QbrmBestGetCurrentTime();

  // 3.
  if ((transaction.getControlFlags() & 4) != 0) {
    CLOG::max("Transaction did not match a Pattern or was not sampled. Ignoring...");
    ++transactionsIgnored;
    return;
  }

  // 4-5. Page or sub-transaction, and the matches that decide its names.
  const bool page = transaction.getParentUUID()[0] == '\0';
  CSituationController& controller = situations();
  TransactionMatch* txMatches = nullptr;
  ClientMatch* clientMatches = nullptr;
  // The made-up matches of an object and of a client no pattern names: built once, since a
  // match record is over a kilobyte to clear.
  static const ClientMatch kOwnIdentity = [] {
    ClientMatch m;
    m.pattern.aggregateUniquely = 1;
    return m;
  }();
  static const TransactionMatch kObjectMatch = [] {
    TransactionMatch m;
    m.pattern.aggappsuniq = 1;
    m.pattern.aggtxsuniq = 1;
    m.pattern.samplePercent = 100;
    return m;
  }();
  std::optional<TransactionMatch> madeUpTx;
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
    // An object of a page counts under its own names, at the level of the page before it.
    madeUp = true;
    madeUpTx.emplace(kObjectMatch);
    madeUpTx->pattern.collectInstances = *instanceLevel;
    txMatches = &*madeUpTx;
    clientMatches = const_cast<ClientMatch*>(&kOwnIdentity);
  }

  // 6.
  CLOG::med("Processing transaction tTemp[%p] appName[%s] tranName[%s]",
            static_cast<void*>(&transaction), transaction.getApplicationName(),
            transaction.getTransactionName());

  // 9.
  if (txMatches == nullptr) {
    CLOG::max("Transaction did not match a Pattern or was not sampled. Ignoring...");
    ++transactionsIgnored;
    controller.freeClientMatches(clientMatches);
    return;
  }

  // 7.
  if (clientMatches == nullptr) {
    CLOG::med("Transaction did not match a client pattern.");
  }
  const bool onePair =
      txMatches->next == nullptr && (clientMatches == nullptr || clientMatches->next == nullptr);
  for (const TransactionMatch* tm = txMatches; tm != nullptr; tm = tm->next) {
    const TransactionPattern& tp = tm->pattern;
    for (const ClientMatch* cm = clientMatches != nullptr ? clientMatches : &kOwnIdentity;
         cm != nullptr; cm = cm->next) {
      const ClientPattern& cp = cm->pattern;
      // a.
      int level = tp.collectInstances;
      int importance = tp.importance;
      if (transaction.getTrueTransType() == static_cast<int>(TRANSACTION_KIND_SUBTX)) {
        level = transaction.getControlFlags() & 3;
        importance = (transaction.getControlFlags() >> 8) & 255;
      }
      // b. The analyzer asks for the first match only, so there is one pair and the record
      // itself can be the working copy; a copy (4.6 KB) is made only when more pairs follow.
      std::unique_ptr<CDPXTransaction> copy;
      if (!onePair) {
        copy = std::make_unique<CDPXTransaction>(transaction);
      }
      CDPXTransaction& w = copy ? *copy : transaction;
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
      // c.
      if (cp.aggregateUniquely == 1) {
        aggBy |= kAggByClient;
      } else if (cp.aggregateUniquely == 0) {
        w.setClientName(cp.clientName);
        w.setClientHostname(cp.clientName);
        w.setClientIPAddress(cp.clientName);
      } else {
        char text[kTransactionNameWidth];
        snprintf(text, sizeof(text), "%s", w.getClientName());
        ToSubnet(text, sizeof(text));
        w.setClientName(text);
        snprintf(text, sizeof(text), "%s", w.getClientHostname());
        ToSubnet(text, sizeof(text));
        w.setClientHostname(text);
        snprintf(text, sizeof(text), "%s", w.getClientIPAddress());
        ToSubnet(text, sizeof(text));
        w.setClientIPAddress(text);
        snprintf(text, sizeof(text), "%s", w.getClientIPv6Address());
        ToSubnet(text, sizeof(text));
        w.setClientIPv6Address(text);
      }
      // d.
      w.setAggBy(aggBy);
      CLOG::med("Transaction matched a defined pattern. Processing....");

      // e.
      Lock();
      const long now = fw::Now();
      if (w.getTimeRecorded() > now - static_cast<long>(CConfig::getSummaryInterval()) * 3600) {
        // f. The trees of the transaction's interval.
        const long t = w.getTimeRecorded();
        if (!cacheActive && t >= getCurrentOverTimeInterval()) {
          // the current trees
        } else if (cacheActive && t >= referenceInterval) {
          deactivateCache();
        } else {
          const long interval = t - (t % (m * 60));
          if (cacheActive && cacheInterval != interval) {
            deactivateCache();
          }
          if (!cacheActive) {
            activateCache(t);
          }
          CLOG::med("%s Processing transaction from a previous time period",
                    "CDPXAnalyzer::processTransaction");
        }
        if (page) {
          UpdatePageTables(*trees, w);
        }
        if (level == 1 || (level == 2 && w.isBadStatusCode())) {
          CLOG::med("Transaction Instance Trace [%d], sending to instance tables ...", level);
          w.setTimeRecorded(recorded);
          InstancePatterns names;
          if (!madeUp) {
            names = {tp.applicationPattern, tp.transactionPattern,
                     cm == &kOwnIdentity ? "" : cp.clientName,
                     cm == &kOwnIdentity ? "" : cp.hostNamePattern,
                     cm == &kOwnIdentity ? "" : cp.ipAddressPattern};
          }
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
        if (!page) {
          UpdateTable<CSubTransactionOverTime>(trees->tree(OverTimeTable::kSubTransaction), w,
                                               "Error adding to CSTOT tree!");
        }
      }
      // g.
      const int64_t elapsed = QbrmBestGetCurrentTime() - started;
      Unlock();
      ++transactionsProcessed;
      totalProcessingTime += elapsed / 1000000;
    }
  }
  // 8.
  if (!madeUp) {
    controller.freeTransactionMatches(txMatches);
    controller.freeClientMatches(clientMatches);
  }
}
