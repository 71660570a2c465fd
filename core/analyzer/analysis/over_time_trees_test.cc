// The index in front of each over-time tree finds exactly the row the tree's own search finds,
// and a row's one-pass compare answers as greater and equals do, over random keys: names that
// differ only past a field's width, fill it exactly, or are empty.

#include "core/analyzer/analysis/over_time_trees.h"

#include <gtest/gtest.h>

#include <memory>
#include <random>
#include <string>
#include <utility>
#include <vector>

#include "core/analyzer/rows/rows.h"
#include "core/analyzer/testing/transaction_builder.h"

namespace {

// Names from a small pool, so that keys repeat: short, empty, 127 to 130 characters (two of
// them differ only in the last character, past the 128-character width).
std::string Name(std::mt19937& random) {
  static const std::vector<std::string> kNames = {"",
                                                  "a",
                                                  "b",
                                                  "shop.example",
                                                  std::string(127, 'x'),
                                                  std::string(128, 'x'),
                                                  std::string(129, 'x'),
                                                  std::string(128, 'x') + "y",
                                                  std::string(130, 'y')};
  std::string name = kNames[std::uniform_int_distribution<size_t>(0, kNames.size() - 1)(random)];
  if (random() % 2 != 0) {
    name += std::to_string(random() % 8);  // past the width for the long names
  }
  return name;
}

template <class Row>
void ExpectIndexAgreesWithTree(OverTimeTable table) {
  std::mt19937 random(11);
  COverTimeTrees trees;
  std::unique_ptr<Row> previous;
  int found = 0;
  for (int i = 0; i < 3000; ++i) {
    std::string url = "/" + Name(random);
    CDPXTransaction t = TransactionBuilder()
                            .host(Name(random))
                            .url(url)
                            .client(random() % 2 ? "10.0.0.1" : "10.0.0.2")
                            .server(random() % 2 ? "10.1.0.1" : "10.1.0.2")
                            .build();
    if (random() % 2) {
      t.setApplicationName(Name(random).c_str());
      t.setTransactionName(Name(random).c_str());
      t.setClientName(Name(random).c_str());
      t.setServerName(Name(random).c_str());
    }
    Row probe(t);
    probe.setDeleteOnRemoval(false);
    const std::size_t hash = probe.indexHash();
    // Asked of the transaction itself, without building a row: the same hash and equality.
    ASSERT_EQ(hash, Row::indexHashOf(t)) << "transaction " << i;
    ASSERT_TRUE(probe.hasKeyOf(t));
    if (previous != nullptr) {
      ASSERT_EQ(previous->equals(probe, 0), previous->hasKeyOf(t)) << "transaction " << i;
    }
    if (previous != nullptr) {
      for (auto [a, b] : {std::pair<Row*, Row*>{&probe, previous.get()},
                          {previous.get(), &probe},
                          {&probe, &probe}}) {
        const int literal = a->greater(*b, 0) ? 1 : (a->equals(*b, 0) ? 0 : -1);
        ASSERT_EQ(literal, a->compare(*b, 0)) << "transaction " << i;
      }
    }
    TreeNode* const viaTree = trees.tree(table).findNode(&probe);
    ASSERT_EQ(viaTree, trees.find(table, hash, probe)) << "transaction " << i;
    ASSERT_EQ(viaTree,
              trees.findIf(table, hash,
                           [&t](TreeNode* row) { return static_cast<Row*>(row)->hasKeyOf(t); }))
        << "transaction " << i;
    found += viaTree != nullptr;
    if (viaTree == nullptr && random() % 3 != 0) {
      auto row = std::make_unique<Row>(t);
      ASSERT_TRUE(trees.add(table, row.get(), hash));
      row.release();
    }
    previous = std::make_unique<Row>(t);
  }
  // Both outcomes happened often enough to mean something.
  EXPECT_GT(found, 300);
  EXPECT_GT(trees.tree(table).getSize(), 20);
}

TEST(OverTimeTreesTest, IndexAgreesWithTreeSearch) {
  ExpectIndexAgreesWithTree<CApplicationOverTime>(OverTimeTable::kApplication);
  ExpectIndexAgreesWithTree<CTransactionOverTime>(OverTimeTable::kTransaction);
  ExpectIndexAgreesWithTree<CClientServerOverTime>(OverTimeTable::kClientServer);
  ExpectIndexAgreesWithTree<CClientOverTime>(OverTimeTable::kClient);
}

}  // namespace
