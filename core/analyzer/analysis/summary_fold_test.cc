// Summary queries fold the history once and merge each query's current rows into it; checked
// against the fold as defined (every row, the current interval's first, into a tree of summary
// rows) on random rows, and through the analyzer across rollovers and history rewrites.

#include "core/analyzer/analysis/summary_fold.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cstdio>
#include <cstring>
#include <memory>
#include <random>
#include <string>
#include <vector>

#include "core/analyzer/analysis/analyzer_fixture.h"
#include "core/history/history_store.h"

namespace {

using Summary = CTransactionSummary;
using OverTimeRow = kq7_q7txot_data_t;
using SummaryRow = kq7_q7txsm_data_t;

constexpr size_t kNoLimit = static_cast<size_t>(-1);

// The fold as defined.
std::vector<SummaryRow> PlainFold(const OverTimeRow* rows, size_t count) {
  TSAVLTree folded(0, false);
  for (size_t i = 0; i < count; ++i) {
    Summary key(rows[i]);
    key.setDeleteOnRemoval(false);
    if (auto* row = static_cast<Summary*>(folded.findNode(&key))) {
      row->Update(rows[i]);
      continue;
    }
    auto row = std::make_unique<Summary>(rows[i]);
    if (folded.addNode(row.get())) {
      row.release();
    }
  }
  std::vector<TreeNode*> nodes;
  getTreeNodes(folded, nodes);
  std::vector<SummaryRow> out(nodes.size());
  for (size_t i = 0; i < nodes.size(); ++i) {
    static_cast<Summary*>(nodes[i])->getQ7Struct(out[i]);
  }
  return out;
}

// Row i of got and want, byte for byte, sampletime aside.
void ExpectSameRows(const std::vector<SummaryRow>& want, const SummaryRow* got, size_t count) {
  ASSERT_EQ(want.size(), count);
  for (size_t i = 0; i < count; ++i) {
    SummaryRow row = got[i];
    std::memset(row.sampletime, 0, sizeof(row.sampletime));
    ASSERT_EQ(0, std::memcmp(&want[i], &row, sizeof(row)))
        << "row " << i << " of " << count << ": " << rows::FieldText(row.transactn, 128);
  }
}

// Text for a key field, one of choices: texts sharing prefixes, and one filling the field.
// Some leave bytes after their NUL that comparisons must ignore. Few keys, so that rows of
// one key meet.
void RandomKey(std::mt19937& rng, char* field, size_t width, int choices) {
  static const char* const kTexts[] = {"ab", "a", "\xc3\xa9t\xc3\xa9", "a b"};
  const int pick = static_cast<int>(rng() % static_cast<unsigned>(choices));
  if (pick == choices - 1) {
    std::memset(field, 'z', width);
    return;
  }
  std::memset(field, 0, width);
  std::strcpy(field, kTexts[pick]);
  if (rng() % 4 == 0) {
    field[width - 1] = static_cast<char>('A' + rng() % 26);
  }
}

OverTimeRow RandomRow(std::mt19937& rng) {
  OverTimeRow row;
  std::memset(&row, 0, sizeof(row));
  RandomKey(rng, row.applicatin, sizeof(row.applicatin), 3);
  RandomKey(rng, row.server, sizeof(row.server), 2);
  RandomKey(rng, row.client, sizeof(row.client), 2);
  RandomKey(rng, row.transactn, sizeof(row.transactn), 4);
  char stamp[17];
  std::snprintf(stamp, sizeof(stamp), "1%015u", static_cast<unsigned>(rng()));
  std::memcpy(row.timestamp, stamp, sizeof(row.timestamp));
  row.rootuuid[0] = static_cast<char>('0' + rng() % 10);
  row.importance = static_cast<int16_t>(rng() % 100);
  row.aggby = static_cast<int32_t>(rng() % 8);
  row.dintval = 300;
  row.mrtthres = static_cast<int32_t>(rng() % 1000);
  row.totreq = static_cast<int32_t>(rng() % 4 == 0 ? 0 : rng() % 50);
  row.failreq = static_cast<int32_t>(rng() % 5);
  row.slowreq = static_cast<int32_t>(rng() % 5);
  row.succreq = row.totreq;
  // The minimum rule treats 0 apart; negative values must fold the same way too.
  row.minrtt = static_cast<int32_t>(rng() % 3 == 0 ? 0 : static_cast<int>(rng() % 600) - 50);
  row.maxrtt = static_cast<int32_t>(rng() % 900);
  row.oatime = static_cast<int32_t>(rng() % 700);
  row.clienttime = static_cast<int32_t>(rng() % 300);
  row.servtime = static_cast<int32_t>(rng() % 300);
  row.loadtime = static_cast<int32_t>(rng() % 300);
  row.totbytes = static_cast<int32_t>(rng() % 100000);
  row.num2xx = static_cast<int32_t>(rng() % 50);
  row.num500 = static_cast<int32_t>(rng() % 3);
  return row;
}

std::vector<OverTimeRow> RandomRows(std::mt19937& rng, size_t max) {
  std::vector<OverTimeRow> rows(rng() % (max + 1));
  for (OverTimeRow& row : rows) {
    row = RandomRow(rng);
  }
  return rows;
}

// The merge of current rows (duplicate keys among them) into a history fold gives the plain
// fold of both, and a limit gives its first rows.
TEST(SummaryFoldTest, MergeIntoHistoryIsThePlainFold) {
  std::mt19937 rng(7);
  for (int round = 0; round < 300; ++round) {
    const std::vector<OverTimeRow> history = RandomRows(rng, 60);
    const std::vector<OverTimeRow> current = RandomRows(rng, 30);
    std::vector<OverTimeRow> all = current;
    all.insert(all.end(), history.begin(), history.end());
    const std::vector<SummaryRow> want = PlainFold(all.data(), all.size());

    const HistoryFold<Summary> fold(history.data(), history.size());
    const SummaryKeys<Summary> keys(current.data(), current.size());
    const std::vector<std::uint32_t> order = keys.order();
    std::vector<SummaryRow> got(current.size() + fold.size());
    const size_t limit = round % 3 == 0 ? rng() % (want.size() + 2) : kNoLimit;
    const size_t count = fold.merge(current.data(), keys, order, limit, got.data());
    ExpectSameRows(
        std::vector<SummaryRow>(want.begin(), want.begin() + std::min(limit, want.size())),
        got.data(), count);
  }
}

// Sort keys order keyed rows as their tree does, NUL-padded fields and bytes past the NUL
// included.
TEST(SummaryFoldTest, SortKeysOrderAsTheTree) {
  std::mt19937 rng(11);
  const std::vector<OverTimeRow> rows = RandomRows(rng, 200);
  const SummaryKeys<Summary> keys(rows.data(), rows.size());
  for (size_t i = 0; i + 1 < rows.size(); ++i) {
    Summary a(rows[i]);
    Summary b(rows[i + 1]);
    const int order = keys[i].compare(keys[i + 1]);
    EXPECT_EQ(a.compare(b, 0), order < 0 ? -1 : order > 0 ? 1 : 0) << i;
  }
}

using q7test::kStart;

class SummaryQueryTest : public q7test::AnalyzerFixture {
 protected:
  // The summary query against the plain fold of the over-time query (the current rows, then
  // the history newest first: the fold's input), whole and cut at a few limits.
  void ExpectPlainFold() {
    int count = 0;
    std::unique_ptr<OverTimeRow[]> overTime(analyzer_->get_tbltxot(3, &count));
    const std::vector<SummaryRow> want = PlainFold(overTime.get(), static_cast<size_t>(count));
    for (size_t limit : {kNoLimit, size_t{0}, size_t{1}, want.size() / 2, want.size() + 1}) {
      std::unique_ptr<SummaryRow[]> got(analyzer_->get_tbltxsm(3, &count, limit));
      const size_t expected = std::min(limit, want.size());
      ExpectSameRows(std::vector<SummaryRow>(want.begin(), want.begin() + expected), got.get(),
                     static_cast<size_t>(count));
      if (count > 0) {
        EXPECT_NE('\0', got[count - 1].sampletime[0]);
      }
    }
  }
};

// Transactions over rollovers, late ones rewriting past intervals, history saved beside the
// analyzer: after each step the kept fold must answer what folding everything answers.
TEST_F(SummaryQueryTest, KeptFoldAnswersAsThePlainFold) {
  // An application per host and a transaction per URL: the tree and the summary then order
  // rows differently.
  AddPattern("all", "Shop", "*", "Tx", "*", 100, 0, 1, 1);
  std::mt19937 rng(3);
  const char* const apps[] = {"shop.example", "bank.example", "b.example"};
  const char* const clients[] = {"10.1.2.3", "10.1.2.4", "10.9.9.9"};
  for (int step = 0; step < 40; ++step) {
    const int action = static_cast<int>(rng() % 10);
    if (action == 0) {
      now_ = now_ + 300;
      analyzer_->rollover();
    } else if (action == 1) {
      // A copy of the current rows saved as an earlier interval, as another writer would.
      int count = 0;
      std::unique_ptr<OverTimeRow[]> rows(analyzer_->get_tbltxot(3, &count));
      const long interval = analyzer_->getCurrentOverTimeInterval() - 300L * (1 + rng() % 5);
      const size_t saved = std::min<size_t>(static_cast<size_t>(count), rng() % 3 * 2);
      ASSERT_TRUE(analyzer_->historyStore().saveInterval(interval, "q7txot", rows.get(),
                                                         sizeof(OverTimeRow), saved));
    }
    for (int i = 0, n = static_cast<int>(rng() % 20); i < n; ++i) {
      const std::string url = "/p" + std::to_string(rng() % 12);
      // Some belong to an interval already saved: the interval cache takes them there.
      const long late = rng() % 5 == 0 ? now_ - 300 * static_cast<long>(1 + rng() % 2) : 0;
      Process(Page(apps[rng() % 3], url.c_str(), static_cast<int>(rng() % 800),
                   rng() % 6 == 0 ? 500 : 200, clients[rng() % 3], late));
    }
    ExpectPlainFold();
    if (HasFatalFailure()) {
      FAIL() << "at step " << step;
    }
  }
}

// History at the MAX_ROWS cap: the rows past it count in neither answer.
TEST_F(SummaryQueryTest, CappedHistoryFoldsAsThePlainFold) {
  AddPattern("all", "Shop", "*", "Tx", "*", 100, 0, 0, 1);
  std::mt19937 rng(5);
  std::vector<OverTimeRow> rows(MAX_ROWS / 2 + 10);
  for (size_t i = 0; i < rows.size(); ++i) {
    rows[i] = RandomRow(rng);
    std::snprintf(rows[i].transactn, sizeof(rows[i].transactn), "/t%zu", i % 9000);
  }
  for (long back : {1L, 2L}) {
    ASSERT_TRUE(analyzer_->historyStore().saveInterval(kStart - 300 * back, "q7txot", rows.data(),
                                                       sizeof(OverTimeRow), rows.size()));
  }
  Process(Page("shop.example", "/t1"));
  ExpectPlainFold();
}

}  // namespace
