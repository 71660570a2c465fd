#include "core/runtime/avl_tree.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <iterator>
#include <list>
#include <map>
#include <memory>
#include <random>
#include <set>
#include <vector>

// Reaches the tree's internals for the invariant checks.
class AVLTreeTestPeer {
 public:
  static AVLNode* Root(AVLTree& tree) { return tree.root; }
  static MTreeNode* Head(AVLTree& tree) { return tree.lruHead; }
  static MTreeNode* Tail(AVLTree& tree) { return tree.mruTail; }
  static MTreeNode* Next(MTreeNode* wrapper) { return wrapper->next; }
  static MTreeNode* Prev(MTreeNode* wrapper) { return wrapper->prev; }
};

namespace {

// What happened to rows, counted across their lifetime.
struct Hooks {
  int adding = 0;
  int removing = 0;
  int destroyed = 0;
};

class Row : public TreeNode {
 public:
  explicit Row(int key, bool deleteOnRemoval = false, Hooks* hooks = nullptr)
      : key_(key), deleteOnRemoval_(deleteOnRemoval), hooks_(hooks) {}
  ~Row() override {
    if (hooks_ != nullptr) {
      ++hooks_->destroyed;
    }
  }
  bool equals(TreeNode& other, int) override { return key_ == Key(other); }
  bool greater(TreeNode& other, int) override { return key_ > Key(other); }
  const char* toString(int) override { return nullptr; }
  bool getDeleteOnRemoval() override { return deleteOnRemoval_; }
  void setDeleteOnRemoval(bool on) override { deleteOnRemoval_ = on; }
  void removingFromTree() override {
    if (hooks_ != nullptr) {
      ++hooks_->removing;
    }
  }
  void addingToTree() override {
    if (hooks_ != nullptr) {
      ++hooks_->adding;
    }
  }

  int key() const { return key_; }
  static int Key(TreeNode& node) { return static_cast<Row&>(node).key_; }

 private:
  int key_;
  bool deleteOnRemoval_;
  Hooks* hooks_;
};

int KeyOf(TreeNode* node) {
  return node == nullptr ? -1 : Row::Key(*node);
}

// Adds a tree-owned row.
bool AddOwned(AVLTree& tree, int key, Hooks* hooks = nullptr) {
  auto* row = new Row(key, true, hooks);
  if (tree.addNode(row)) {
    return true;
  }
  delete row;
  return false;
}

// ---- Invariants ----

struct Walk {
  std::vector<int> keys;  // in order
  int badSkews = 0;
  int unbalanced = 0;
};

int CheckNode(AVLNode* node, Walk* walk) {
  if (node == nullptr) {
    return 0;
  }
  int left = CheckNode(node->left, walk);
  walk->keys.push_back(KeyOf(node->value->getTreeNode()));
  int right = CheckNode(node->right, walk);
  int expected = left > right ? 2 : (right > left ? 1 : 0);
  walk->badSkews += node->skew != expected;
  walk->unbalanced += std::abs(left - right) > 1;
  return 1 + std::max(left, right);
}

// Checks order, balance, size and the recency list against the model's keys and order.
void ExpectConsistent(AVLTree& tree, const std::multiset<int>& model,
                      const std::list<int>* recency) {
  Walk walk;
  CheckNode(AVLTreeTestPeer::Root(tree), &walk);
  ASSERT_EQ(0, walk.badSkews);
  ASSERT_EQ(0, walk.unbalanced);
  ASSERT_TRUE(std::equal(walk.keys.begin(), walk.keys.end(), model.begin(), model.end()));
  ASSERT_EQ(static_cast<long>(model.size()), tree.getSize());
  // collectInOrder walks the same structure; the recency checks below show it left no trace.
  std::vector<TreeNode*> collected;
  tree.collectInOrder(collected);
  std::vector<int> collectedKeys;
  std::transform(collected.begin(), collected.end(), std::back_inserter(collectedKeys), KeyOf);
  ASSERT_EQ(walk.keys, collectedKeys);

  std::vector<int> forward;
  MTreeNode* last = nullptr;
  for (MTreeNode* w = AVLTreeTestPeer::Head(tree); w != nullptr; w = AVLTreeTestPeer::Next(w)) {
    ASSERT_EQ(last, AVLTreeTestPeer::Prev(w));
    ASSERT_LE(forward.size(), model.size());
    forward.push_back(KeyOf(w->getTreeNode()));
    last = w;
  }
  ASSERT_EQ(last, AVLTreeTestPeer::Tail(tree));
  if (recency != nullptr) {
    ASSERT_TRUE(std::equal(forward.begin(), forward.end(), recency->begin(), recency->end()));
  } else {
    std::sort(forward.begin(), forward.end());
    ASSERT_TRUE(std::equal(forward.begin(), forward.end(), model.begin(), model.end()));
  }
}

// ---- Edge cases ----

// A refused duplicate sees both hooks and survives although it asks to be deleted on removal.
TEST(AvlTreeTest, RefusedDuplicateStaysAliveAfterBothHooks) {
  Hooks stored;  // outlives the tree, whose destructor deletes the stored row
  Hooks refused;
  AVLTree tree(0, false);
  ASSERT_TRUE(tree.addNode(new Row(1, true, &stored)));
  Row duplicate(1, true, &refused);
  EXPECT_FALSE(tree.addNode(&duplicate));
  EXPECT_EQ(1, refused.adding);
  EXPECT_EQ(1, refused.removing);
  EXPECT_EQ(0, refused.destroyed);
  EXPECT_TRUE(duplicate.getDeleteOnRemoval());
  EXPECT_EQ(1, tree.getSize());
  duplicate.setDeleteOnRemoval(false);  // it lives on the stack
}

// Equal keys go to the left; a find answers the first equal node met from the root.
TEST(AvlTreeTest, DuplicatesGoLeftAndFindTakesTheFirstMet) {
  Row first(5);
  Row second(5);
  AVLTree tree;  // after the rows: it outlives neither
  ASSERT_TRUE(tree.addNode(&first));
  ASSERT_TRUE(tree.addNode(&second));
  Row key(5);
  EXPECT_EQ(&first, tree.findNode(&key));
  EXPECT_EQ(&second, tree.getSmaller(&key));
  EXPECT_EQ(nullptr, tree.getLarger(&key));
}

// maxSize -1 reports success and stores nothing, not even calling the hook.
TEST(AvlTreeTest, NegativeMaxSizeAcceptsNothing) {
  AVLTree tree;
  tree.initialize(0, false, -1, 0);
  Hooks hooks;
  Row row(1, false, &hooks);
  EXPECT_TRUE(tree.addNode(&row));
  EXPECT_TRUE(tree.isTreeEmpty());
  EXPECT_EQ(0, tree.getSize());
  EXPECT_EQ(0, hooks.adding);
}

// A removal of a referenced entry only flags it; the last Release removes it. The hook runs
// on the caller's key, not on the stored row.
TEST(AvlTreeTest, ReferencedRemovalWaitsForTheLastRelease) {
  AVLTree tree(0, false);
  Hooks stored;
  Hooks probe;
  AddOwned(tree, 7, &stored);
  Row key(7, false, &probe);
  ASSERT_NE(nullptr, tree.AddRef(&key));
  ASSERT_NE(nullptr, tree.AddRef(&key));
  EXPECT_FALSE(tree.removeNode(&key));
  EXPECT_EQ(2, tree.getRefCount(&key));
  EXPECT_EQ(7, KeyOf(tree.Release(&key)));  // one reader still holds it
  EXPECT_EQ(nullptr, tree.Release(&key));
  EXPECT_EQ(1, stored.destroyed);
  EXPECT_EQ(0, stored.removing);
  EXPECT_EQ(1, probe.removing);
  EXPECT_EQ(0, probe.destroyed);
  EXPECT_TRUE(tree.isTreeEmpty());
  EXPECT_EQ(-1, tree.getRefCount(&key));
  EXPECT_EQ(nullptr, tree.AddRef(&key));
  EXPECT_EQ(nullptr, tree.findNode(nullptr));
  EXPECT_EQ(nullptr, tree.markForDeletion(nullptr));
}

// Readers pin the row they were given by passing it as the key; a lookup must not destroy it.
TEST(AvlTreeTest, StoredObjectMayBeItsOwnKey) {
  AVLTree tree(0, false);
  Hooks hooks;
  AddOwned(tree, 3, &hooks);
  TreeNode* row = tree.getRoot();
  EXPECT_EQ(row, tree.AddRef(row));
  EXPECT_EQ(row, tree.Release(row));
  EXPECT_EQ(0, hooks.destroyed);
  EXPECT_TRUE(tree.removeNode(row));
  EXPECT_EQ(1, hooks.destroyed);
}

// getSmaller/getLarger answer the node's children, not its in-order neighbours.
TEST(AvlTreeTest, SmallerAndLargerAreChildren) {
  AVLTree tree(0, false);
  for (int key : {2, 1, 3}) {
    AddOwned(tree, key);
  }
  Row one(1);
  Row two(2);
  Row three(3);
  EXPECT_EQ(1, KeyOf(tree.getSmaller(&two)));
  EXPECT_EQ(3, KeyOf(tree.getLarger(&two)));
  EXPECT_EQ(nullptr, tree.getSmaller(&three));
  EXPECT_EQ(nullptr, tree.getLarger(&one));
  Row absent(9);
  EXPECT_EQ(nullptr, tree.getSmaller(&absent));
}

// A trim of 4 that can remove only 2 (the others referenced) forces a trim of 2 more.
TEST(AvlTreeTest, TrimFallsBackToForcedTrim) {
  AVLTree tree(0, false);
  Hooks hooks;
  for (int key = 1; key <= 4; ++key) {
    AddOwned(tree, key, &hooks);
  }
  Row one(1);
  Row two(2);
  tree.AddRef(&one);
  tree.AddRef(&two);  // recency now 3 4 1 2
  EXPECT_TRUE(tree.trimTreeByCount(4));
  EXPECT_TRUE(tree.isTreeEmpty());
  EXPECT_EQ(4, hooks.destroyed);
  EXPECT_EQ(0, tree.getSize());
}

// Reaching maxSize trims from the least recently used end; a find counts as a use.
TEST(AvlTreeTest, SizeLimitTrimsLeastRecentlyUsed) {
  AVLTree tree(0, false);
  tree.initialize(0, false, 3, 1);
  AddOwned(tree, 1);
  AddOwned(tree, 2);
  Row one(1);
  ASSERT_NE(nullptr, tree.findNode(&one));
  AddOwned(tree, 3);  // size 3 reached: 2 is the oldest
  Row two(2);
  EXPECT_EQ(nullptr, tree.findNode(&two));
  EXPECT_EQ(2, tree.getSize());
  EXPECT_EQ(1, KeyOf(tree.getLRUNode()));
}

// markForDeletion moves the entry to the oldest end and flags it, so a Release back to zero
// removes it; a single entry is neither moved nor flagged.
TEST(AvlTreeTest, MarkForDeletion) {
  AVLTree tree(0, false);
  AddOwned(tree, 1);
  Row one(1);
  EXPECT_EQ(1, KeyOf(tree.markForDeletion(&one)));
  tree.AddRef(&one);
  EXPECT_EQ(1, KeyOf(tree.Release(&one)));  // not flagged

  AddOwned(tree, 2);
  AddOwned(tree, 3);
  EXPECT_EQ(1, KeyOf(tree.markForDeletion(&one)));  // found, so newest, then moved oldest
  EXPECT_EQ(1, KeyOf(tree.getLRUNode()));
  tree.AddRef(&one);
  EXPECT_EQ(nullptr, tree.Release(&one));
  EXPECT_EQ(2, tree.getSize());
  EXPECT_EQ(std::multiset<int>({2, 3}).size(), static_cast<size_t>(tree.getSize()));
  ExpectConsistent(tree, {2, 3}, nullptr);
}

// The destructor destroys only the rows that ask for it, without removal hooks.
TEST(AvlTreeTest, DestructorDestroysOwnedRowsOnly) {
  Hooks owned;
  Hooks borrowed;
  Row kept(100, false, &borrowed);
  {
    AVLTree tree;
    for (int key = 0; key < 50; ++key) {
      AddOwned(tree, key % 10, &owned);  // duplicates too
    }
    tree.addNode(&kept);
  }
  EXPECT_EQ(50, owned.destroyed);
  EXPECT_EQ(0, owned.removing);
  EXPECT_EQ(0, borrowed.destroyed);
}

// ---- Randomized against a model ----

// Inserts, finds, references, releases, marks and removals on a tree that refuses duplicates,
// checked after every step against a multiset of keys and the expected recency order.
TEST(AvlTreeRandomTest, MatchesModelWithoutDuplicates) {
  std::mt19937 random(20240607);
  AVLTree tree(0, false);
  std::multiset<int> model;
  std::list<int> recency;  // oldest first
  std::map<int, int> refs;
  std::set<int> flagged;
  auto touch = [&](int key) {
    recency.remove(key);
    recency.push_back(key);
  };
  auto forget = [&](int key) {
    model.erase(key);
    recency.remove(key);
    refs.erase(key);
    flagged.erase(key);
  };
  std::uniform_int_distribution<int> keys(0, 600);
  std::uniform_int_distribution<int> ops(0, 99);
  for (int step = 0; step < 8000; ++step) {
    int key = keys(random);
    int op = ops(random);
    Row probe(key);
    bool present = model.count(key) != 0;
    if (op < 45) {
      EXPECT_EQ(!present, AddOwned(tree, key));
      if (!present) {
        model.insert(key);
        recency.push_back(key);
      }
    } else if (op < 65) {
      EXPECT_EQ(present ? key : -1, KeyOf(tree.findNode(&probe)));
      if (present) {
        touch(key);
      }
    } else if (op < 72) {
      EXPECT_EQ(present ? key : -1, KeyOf(tree.AddRef(&probe)));
      if (present) {
        touch(key);
        ++refs[key];
      }
    } else if (op < 80) {
      if (present && refs[key] > 0) {
        TreeNode* left = tree.Release(&probe);
        if (--refs[key] < 1 && flagged.count(key) != 0) {
          EXPECT_EQ(nullptr, left);
          forget(key);
        } else {
          EXPECT_EQ(key, KeyOf(left));
          touch(key);
        }
      }
    } else if (op < 83) {
      EXPECT_EQ(present ? key : -1, KeyOf(tree.markForDeletion(&probe)));
      if (present && model.size() > 1) {
        recency.remove(key);
        recency.push_front(key);
        flagged.insert(key);
      }
    } else {
      bool removable = present && refs[key] == 0;
      EXPECT_EQ(removable, tree.removeNode(&probe));
      if (removable) {
        forget(key);
      } else if (present) {
        touch(key);
        flagged.insert(key);
      }
    }
    ASSERT_NO_FATAL_FAILURE(ExpectConsistent(tree, model, &recency)) << "step " << step;
  }
}

// With duplicates allowed, equal keys accumulate and the tree stays ordered and balanced.
TEST(AvlTreeRandomTest, MatchesModelWithDuplicates) {
  std::mt19937 random(77);
  AVLTree tree;
  std::multiset<int> model;
  std::uniform_int_distribution<int> keys(0, 200);
  for (int step = 0; step < 3000; ++step) {
    int key = keys(random);
    if (step % 3 == 2) {
      Row probe(key);
      EXPECT_EQ(model.count(key) != 0 ? key : -1, KeyOf(tree.findNode(&probe)));
    } else {
      ASSERT_TRUE(AddOwned(tree, key));
      model.insert(key);
    }
    ASSERT_NO_FATAL_FAILURE(ExpectConsistent(tree, model, nullptr)) << "step " << step;
  }
}

}  // namespace
