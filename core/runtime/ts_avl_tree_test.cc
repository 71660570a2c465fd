#include "core/runtime/ts_avl_tree.h"

#include <gtest/gtest.h>

#include <atomic>
#include <thread>
#include <vector>

namespace {

class SharedRow : public TreeNode {
 public:
  explicit SharedRow(int key, bool deleteOnRemoval)
      : key_(key), deleteOnRemoval_(deleteOnRemoval) {}
  bool equals(TreeNode& other, int) override { return key_ == Key(other); }
  bool greater(TreeNode& other, int) override { return key_ > Key(other); }
  const char* toString(int) override { return nullptr; }
  bool getDeleteOnRemoval() override { return deleteOnRemoval_; }
  void setDeleteOnRemoval(bool on) override { deleteOnRemoval_ = on; }
  int key() const { return key_; }
  static int Key(TreeNode& node) { return static_cast<SharedRow&>(node).key_; }

 private:
  const int key_;
  bool deleteOnRemoval_;
};

// Threads add, find, pin, read, release and remove overlapping keys. A pinned row must stay
// readable until released; at the end every row is accounted for.
TEST(TsAvlTreeTest, ConcurrentReadersAndWritersKeepPinnedRowsAlive) {
  constexpr int kThreads = 6;
  constexpr int kKeys = 64;
  constexpr int kRounds = 3000;
  TSAVLTree tree(0, false);
  std::atomic<int> readMismatches{0};
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&, t] {
      for (int i = 0; i < kRounds; ++i) {
        int key = (i * 7 + t * 13) % kKeys;
        SharedRow probe(key, false);
        switch ((i + t) % 4) {
          case 0: {
            auto* row = new SharedRow(key, true);
            if (!tree.addNode(row)) {
              delete row;
            }
            break;
          }
          case 1: {
            TreeNode* pinned = tree.AddRef(&probe);
            if (pinned != nullptr) {
              readMismatches += SharedRow::Key(*pinned) != key;
              tree.Release(&probe);
            }
            break;
          }
          case 2:
            tree.removeNode(&probe);
            break;
          default:
            tree.findNode(&probe);
            tree.getRefCount(&probe);
            tree.getLarger(&probe);
            break;
        }
      }
    });
  }
  for (auto& thread : threads) {
    thread.join();
  }
  EXPECT_EQ(0, readMismatches.load());
  long counted = 0;
  for (int key = 0; key < kKeys; ++key) {
    SharedRow probe(key, false);
    counted += tree.findNode(&probe) != nullptr;
  }
  EXPECT_EQ(counted, tree.getSize());
}

// The trim inside addNode removes without taking the (non-recursive) mutex again.
TEST(TsAvlTreeTest, TrimInsideAddDoesNotRelock) {
  TSAVLTree tree(0, false);
  tree.initialize(0, false, 4, 2);
  for (int key = 0; key < 20; ++key) {
    ASSERT_TRUE(tree.addNode(new SharedRow(key, true)));
  }
  EXPECT_LT(tree.getSize(), 4);
  tree.dumpTree();
  tree.dumpSortedTree();
  SharedRow probe(19, false);
  EXPECT_EQ(19, SharedRow::Key(*tree.findNode(&probe)));
}

}  // namespace
