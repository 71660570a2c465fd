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

TreeNode* TSAVLTree::findNode(TreeNode* key) {
  CvelMutexLock hold(mutex);
  return AVLTree::findNode(key);
}

TreeNode* TSAVLTree::getLarger(TreeNode* key) {
  CvelMutexLock hold(mutex);
  return AVLTree::getLarger(key);
}

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

TreeNode* TSAVLTree::markForDeletion(TreeNode* key) {
  CvelMutexLock hold(mutex);
  return AVLTree::markForDeletion(key);
}

TreeNode* TSAVLTree::AddRef(TreeNode* key) {
  CvelMutexLock hold(mutex);
  return AVLTree::AddRef(key);
}

TreeNode* TSAVLTree::Release(TreeNode* key) {
  CvelMutexLock hold(mutex);
  return AVLTree::Release(key);
}

int32_t TSAVLTree::getRefCount(TreeNode* key) {
  CvelMutexLock hold(mutex);
  return AVLTree::getRefCount(key);
}
