// The latency book: apdex counts at each key's threshold, merges that keep the latest
// threshold, and files and checkpoint sections that read back exactly or not at all.

#include "core/analyzer/analysis/latency_book.h"

#include <gtest/gtest.h>

#include <fstream>
#include <string>

#include "core/history/checkpoint_file.h"
#include "core/history/history_store.h"
#include "tests/support/scratch_dir.h"

namespace {

LatencyBook Sample() {
  LatencyBook book;
  for (int i = 0; i < 100; ++i) {
    book.add("Shop", "/cart", 500, i * 25.0);  // 0 .. 2475 ms
    book.add("Shop", "/", 500, 10);
  }
  book.add("News", std::string("a\0b", 3), 100, 7);  // a NUL in a name keeps to its key
  return book;
}

TEST(LatencyBookTest, ApdexCountsAtTheKeysThreshold) {
  const LatencyBook book = Sample();
  const LatencyEntry& cart = book.transactions().at(LatencyBook::transactionKey("Shop", "/cart"));
  EXPECT_EQ(21u, cart.satisfied);   // 0 .. 500
  EXPECT_EQ(60u, cart.tolerating);  // 525 .. 2000
  EXPECT_DOUBLE_EQ((21 + 30) / 100.0, cart.apdex());
  const LatencyBook::Entries applications = book.applications();
  const LatencyEntry& shop = applications.at("Shop");
  EXPECT_EQ(200u, shop.sketch.count());
  EXPECT_EQ(121u, shop.satisfied);
  EXPECT_EQ(500, shop.thresholdMillis);
  EXPECT_DOUBLE_EQ(1.0, LatencyEntry{}.apdex());
}

TEST(LatencyBookTest, MergingKeepsTheLatestThreshold) {
  LatencyBook older = Sample();
  LatencyBook newer;
  newer.add("Shop", "/cart", 2000, 1500);
  older.merge(newer);
  const LatencyEntry& cart = older.transactions().at(LatencyBook::transactionKey("Shop", "/cart"));
  EXPECT_EQ(101u, cart.sketch.count());
  EXPECT_EQ(2000, cart.thresholdMillis);
  EXPECT_EQ(22u, cart.satisfied);  // counted at the threshold of its own interval
  // An empty entry changes nothing, its threshold included.
  older.merge(LatencyBook{});
  EXPECT_EQ(2000, older.applications().at("Shop").thresholdMillis);
  // An application's threshold is its first transaction's; its apdex counts each transaction
  // at its own.
  LatencyBook mixed;
  mixed.add("Shop", "/fast", 100, 150);   // tolerating at 100
  mixed.add("Shop", "/slow", 1000, 150);  // satisfied at 1000
  const LatencyEntry shop = mixed.applications().at("Shop");
  EXPECT_EQ(100, shop.thresholdMillis);
  EXPECT_EQ(1u, shop.satisfied);
  EXPECT_EQ(1u, shop.tolerating);
}

TEST(LatencyBookTest, EncodingReadsBackAndRefusesDamage) {
  const LatencyBook book = Sample();
  const std::string bytes = book.encode();
  LatencyBook back;
  ASSERT_TRUE(LatencyBook::decode(bytes, &back));
  EXPECT_EQ(book, back);
  const std::string key = LatencyBook::transactionKey("News", "x");
  const auto [app, tx] = LatencyBook::splitKey(key);
  EXPECT_EQ("News", app);
  EXPECT_EQ("x", tx);

  LatencyBook untouched = Sample();
  for (size_t cut = 0; cut < bytes.size(); cut += 7) {
    EXPECT_FALSE(LatencyBook::decode(bytes.substr(0, cut), &untouched)) << cut;
  }
  EXPECT_FALSE(LatencyBook::decode(bytes + "x", &untouched));
  std::string flipped = bytes;
  flipped[6] ^= 0x7f;  // the entry count
  EXPECT_FALSE(LatencyBook::decode(flipped, &untouched));
  EXPECT_EQ(Sample(), untouched);
}

TEST(LatencyBookTest, SavedLoadedAndCheckpointedWhole) {
  q7test::ScratchDir dir;
  history::HistoryStore store(dir.path());
  const LatencyBook book = Sample();
  ASSERT_TRUE(book.save(store, 600));
  LatencyBook loaded;
  loaded.load(store, 600);
  loaded.load(store, 900);  // no file: nothing
  EXPECT_EQ(book, loaded);

  // A damaged file adds nothing and does not stop the load.
  std::ofstream(store.pathOf(1200, LatencyBook::kStem)) << "q7lb\x01garbage";
  LatencyBook none;
  none.load(store, 1200);
  EXPECT_TRUE(none.empty());

  // An empty book leaves no file.
  ASSERT_TRUE(LatencyBook{}.save(store, 600));
  LatencyBook empty;
  empty.load(store, 600);
  EXPECT_TRUE(empty.empty());

  // The section is a copy: later additions are not in it.
  LatencyBook changing = Sample();
  const history::RecordSection section = changing.section();
  changing.add("Late", "/", 100, 1);
  history::LoadedSection loadedSection{section.stem, section.record_size, {}};
  loadedSection.records.resize(section.count);
  section.fill(0, section.count, loadedSection.records.data());
  LatencyBook restored;
  ASSERT_TRUE(restored.loadSection(loadedSection));
  EXPECT_EQ(Sample(), restored);
  loadedSection.records.pop_back();
  EXPECT_FALSE(restored.loadSection(loadedSection));
}

}  // namespace
