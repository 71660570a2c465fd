#pragma once

// AVLTree: a balanced search tree of TreeNode objects (the aggregate rows) with reference counts,
// deferred removal of referenced entries and a recency (LRU) list that a size limit trims.
//
// Ordering comes from the objects' equals/greater under the tree's compare mode. Equal entries
// are refused or, when duplicates are allowed, stored to the left of the ones already there.
// Every lookup (find, getSmaller/getLarger, remove, mark, AddRef, Release, getRefCount) moves the
// entry to the most recently used end of the recency list.
//
// Ownership: the tree owns its nodes and their wrappers. A stored object is owned by the tree
// only if it reports getDeleteOnRemoval() true: then removal, trimming and the destructor destroy
// it. Returned object pointers stay valid until the entry leaves the tree; readers that keep one
// pin it with AddRef and let go with Release. Lookup keys (findNode, removeNode, ...) are only
// borrowed, and must report getDeleteOnRemoval() false unless they are the stored object itself:
// a lookup destroys a foreign key that reports true.
//
// Removing an entry with duplicates allowed can fail (the removal meets an equal entry before
// the one it moves); the entry then stays in the structure though it was counted out.
//
// Thread safety: none; see TSAVLTree. The virtual operations are declared in a fixed order;
// keep it.

#include <cstdint>
#include <vector>

#include "core/runtime/avl_node.h"
#include "core/runtime/tree_node.h"

class AVLTree {
 public:
  // Compare mode 0 and duplicates allowed unless given; no size limit.
  AVLTree();
  explicit AVLTree(int mode);
  AVLTree(int mode, bool allowDuplicates);

  AVLTree(const AVLTree&) = delete;
  AVLTree& operator=(const AVLTree&) = delete;

  // Destroys every entry without removingFromTree() calls or reference checks.
  virtual ~AVLTree();

  // Stores n (borrowed or owned, see the class comment) and returns true. With a negative
  // maxSize it stores nothing and still returns true. A refused duplicate returns false after
  // n.addingToTree() and n.removingFromTree(), and n stays alive whatever it reports. When the
  // size reaches a positive maxSize, trims removeCount entries from the least recently used end.
  virtual bool addNode(TreeNode* n);
  // The flag is ignored here (TSAVLTree uses it to skip its lock).
  virtual bool removeNode(TreeNode* key, bool lock);
  // Removes the entry equal to key and calls key.removingFromTree(). A referenced entry is only
  // flagged (the last Release removes it) and false is returned.
  virtual bool removeNode(TreeNode* key);
  // The stored object equal to key, or null (also for a null key).
  virtual TreeNode* findNode(TreeNode* key);
  virtual bool isTreeEmpty();
  // The object at the root, or null.
  virtual TreeNode* getRoot();
  // The object in the left / right child of the node equal to key: the child, not the in-order
  // neighbour, so that callers can walk the structure from getRoot(). Null when absent.
  virtual TreeNode* getSmaller(TreeNode* key);
  virtual TreeNode* getLarger(TreeNode* key);
  // Appends every stored object to nodes in order, left to right, straight down the structure:
  // a walk through getSmaller/getLarger looks every entry up twice (and refreshes its recency).
  void collectInOrder(std::vector<TreeNode*>& nodes) const;
  // No visible effect.
  virtual void dumpTree();
  virtual void dumpSortedTree();
  virtual void dumpATree(bool sorted, int* count, int* depth);
  // Sets the four settings and forgets the content: call it on an empty tree only.
  // maxSize: 0 no limit, negative the tree accepts nothing. A positive maxSize needs a positive
  // removeCount.
  virtual void initialize(int mode, bool allowDuplicates, long maxSize, long removeCount);

  void setMaxSize(long newMaxSize) { maxSize = newMaxSize; }
  void setRemoveCount(long count) { removeCount = count; }
  long getSize() const { return size; }
  long getMaxSize() const { return maxSize; }
  // The least recently used object, or null.
  TreeNode* getLRUNode();

  // Removes up to count entries from the least recently used end; referenced ones are flagged
  // and skipped. When no more than count / 2 went, removes count / 2 more (at least 1) by force,
  // ignoring their reference counts. Returns false when an attempted removal failed.
  // count must be at least 1.
  bool trimTreeByCount(long count);
  bool trimTreeByCount(long count, bool force);
  // Not supported: does nothing and returns false.
  bool trimTreeByAge(long age);

  // Moves the entry to the least recently used end and flags it (a single entry is neither
  // moved nor flagged). Returns the stored object or null.
  TreeNode* markForDeletion(TreeNode* key);
  // Count one reader more / less. Release returns null when it removed a flagged entry whose
  // count fell below 1. Both return the stored object, or null when absent.
  TreeNode* AddRef(TreeNode* key);
  TreeNode* Release(TreeNode* key);
  // The entry's reference count, or -1 when absent.
  int32_t getRefCount(TreeNode* key);

 protected:
  // The destructor's work: empties the tree the same way. Derived destructors call it under
  // their own lock.
  void removeAll();

 private:
  friend class AVLTreeTestPeer;  // invariant checks in tests

  // The wrapper equal to key after refreshing its recency, or null.
  MTreeNode* findNodePrivate(TreeNode* key);
  // The same lookup, answering the node.
  AVLNode* findAVLNode(TreeNode* key);
  void moveToMostRecent(MTreeNode* wrapper);
  void appendMostRecent(MTreeNode* wrapper);
  void unlink(MTreeNode* wrapper);

  // Structure (avl_tree_balance.cc). Each returns the new root of the subtree it was given.
  AVLNode* insertNode(AVLNode* node, MTreeNode* wrapper, bool& heightChanged, bool& added);
  AVLNode* removeNodeWorker(AVLNode* node, MTreeNode* key, const AVLNode* predecessor,
                            bool& heightChanged, bool& removed);
  static AVLNode* balanceRight(AVLNode* x, bool& heightChanged);
  static AVLNode* balanceLeft(AVLNode* x, bool& heightChanged);
  static AVLNode* shrunkRight(AVLNode* x, bool& heightChanged);
  static AVLNode* shrunkLeft(AVLNode* x, bool& heightChanged);
  static AVLNode* rotateLeft(AVLNode* x);
  static AVLNode* rotateRight(AVLNode* x);
  static void repairSkews(AVLNode* subtreeRoot);
  static void freeSubtree(AVLNode* node);

  AVLNode* root;         // null when empty
  int compareMode;       // passed to every equals/greater
  bool allowDuplicates;  // false: an equal entry is refused
  long maxSize;          // 0: no limit; negative: nothing is stored
  long removeCount;      // entries one trim removes
  long size;             // stored entries
  MTreeNode* lruHead;    // least recently used: trimmed first
  MTreeNode* mruTail;    // most recently used
};
