#include "core/runtime/ts_avl_tree.h"

TSAVLTree::TSAVLTree() : AVLTree() {}

TSAVLTree::TSAVLTree(int mode) : AVLTree(mode) {}

TSAVLTree::TSAVLTree(int mode, bool allowDuplicates) : AVLTree(mode, allowDuplicates) {}

TSAVLTree::~TSAVLTree() {
  CvelMutexLock hold(mutex);
  removeAll();
}

bool TSAVLTree::addNode(TreeNode* n) {
  CvelMutexLock hold(mutex);
  return AVLTree::addNode(n);
}

bool TSAVLTree::removeNode(TreeNode* key, bool lock) {
  if (!lock) {
    return AVLTree::removeNode(key);
  }
  CvelMutexLock hold(mutex);
  return AVLTree::removeNode(key);
}

bool TSAVLTree::removeNode(TreeNode* key) {
  return removeNode(key, true);
}

// The key operations: the base operation with the mutex held for its whole run.
#define Q7_LOCKED_KEY_OPERATION(Result, name) \
  Result TSAVLTree::name(TreeNode* key) {     \
    CvelMutexLock hold(mutex);                \
    return AVLTree::name(key);                \
  }
Q7_LOCKED_KEY_OPERATION(TreeNode*, findNode)
Q7_LOCKED_KEY_OPERATION(TreeNode*, getLarger)
Q7_LOCKED_KEY_OPERATION(TreeNode*, markForDeletion)
Q7_LOCKED_KEY_OPERATION(TreeNode*, AddRef)
Q7_LOCKED_KEY_OPERATION(TreeNode*, Release)
Q7_LOCKED_KEY_OPERATION(int32_t, getRefCount)
#undef Q7_LOCKED_KEY_OPERATION

// The dumps call the base dumpATree directly: the overridden one would take the mutex again.
void TSAVLTree::dumpTree() {
  CvelMutexLock hold(mutex);
  int count = 0;
  int depth = 0;
  AVLTree::dumpATree(false, &count, &depth);
}

void TSAVLTree::dumpSortedTree() {
  CvelMutexLock hold(mutex);
  int count = 0;
  int depth = 0;
  AVLTree::dumpATree(true, &count, &depth);
}

void TSAVLTree::dumpATree(bool sorted, int* count, int* depth) {
  CvelMutexLock hold(mutex);
  AVLTree::dumpATree(sorted, count, depth);
}
