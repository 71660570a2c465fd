#pragma once

// TSAVLTree: an AVLTree whose operations that change or walk the tree hold one mutex.
//
// Locked for their whole run: addNode (with any trim it starts), removeNode (when lock is true),
// findNode, getLarger, the dumps, markForDeletion, AddRef, Release and getRefCount.
// Not locked: isTreeEmpty, getRoot, getSmaller, collectInOrder, getSize, getMaxSize, getLRUNode,
// setMaxSize, setRemoveCount, trimTreeByCount; callers that use these while other threads use the
// tree hold their own lock around both. getSmaller stays unlocked while getLarger is locked, on
// purpose.
//
// Object pointers returned are used after the lock is gone: a reader that keeps one pins it
// with AddRef and lets go with Release. Ownership is as for AVLTree. The mutex is not recursive;
// the trim inside addNode removes through removeNode(object, false) so it is not taken twice.

#include <cstdint>

#include "core/runtime/avl_tree.h"
#include "core/runtime/cvel_mutex.h"
#include "framework/thread_annotations.h"

class TSAVLTree : public AVLTree {
 public:
  TSAVLTree();
  explicit TSAVLTree(int mode);
  TSAVLTree(int mode, bool allowDuplicates);
  // Empties the tree under the lock. No other thread may start an operation once it runs.
  ~TSAVLTree() override;

  bool addNode(TreeNode* n) EXCLUDES(mutex) override;
  // Takes the mutex only when lock is true; false is for callers that already hold it.
  bool removeNode(TreeNode* key, bool lock) override;
  bool removeNode(TreeNode* key) EXCLUDES(mutex) override;
  TreeNode* findNode(TreeNode* key) EXCLUDES(mutex) override;
  TreeNode* getLarger(TreeNode* key) EXCLUDES(mutex) override;
  void dumpTree() EXCLUDES(mutex) override;
  void dumpSortedTree() EXCLUDES(mutex) override;
  void dumpATree(bool sorted, int* count, int* depth) EXCLUDES(mutex) override;

  TreeNode* markForDeletion(TreeNode* key) EXCLUDES(mutex);
  TreeNode* AddRef(TreeNode* key) EXCLUDES(mutex);
  TreeNode* Release(TreeNode* key) EXCLUDES(mutex);
  int32_t getRefCount(TreeNode* key) EXCLUDES(mutex);

 private:
  // Guards the structure, the recency list, the counts and size: AVLTree's fields, which no
  // GUARDED_BY here can name.
  CvelMutex mutex;
};
