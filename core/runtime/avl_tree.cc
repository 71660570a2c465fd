#include "core/runtime/avl_tree.h"

#include <new>
#include <string_view>

#include "framework/trace.h"

namespace {

constexpr std::string_view kUnit = "runtime";

}  // namespace

AVLTree::AVLTree() : AVLTree(0, true) {}

AVLTree::AVLTree(int mode) : AVLTree(mode, true) {}

AVLTree::AVLTree(int mode, bool allowDuplicates) {
  initialize(mode, allowDuplicates, 0, 0);
}

AVLTree::~AVLTree() {
  removeAll();
}

void AVLTree::initialize(int mode, bool duplicates, long newMaxSize, long newRemoveCount) {
  compareMode = mode;
  allowDuplicates = duplicates;
  maxSize = newMaxSize;
  removeCount = newRemoveCount;
  root = nullptr;
  size = 0;
  lruHead = nullptr;
  mruTail = nullptr;
}

void AVLTree::removeAll() {
  while (root != nullptr) {
    bool heightChanged = false;
    bool removed = false;
    root = removeNodeWorker(root, root->value, nullptr, heightChanged, removed);
    if (!removed) {
      break;
    }
  }
  // Only equal duplicates make a root removal fail; free what is left rather than leak it.
  freeSubtree(root);
  root = nullptr;
  size = 0;
  lruHead = nullptr;
  mruTail = nullptr;
}

AVLNode* AVLTree::findAVLNode(TreeNode* key) {
  if (key == nullptr) {
    return nullptr;
  }
  MTreeNode probe(key);
  AVLNode* node = root;
  while (node != nullptr) {
    const int order = probe.compare(*node->value, compareMode);
    if (order == 0) {
      break;
    }
    node = order > 0 ? node->right : node->left;
  }
  if (node != nullptr) {
    moveToMostRecent(node->value);
    // Readers pass the stored object itself as the key (AddRef/Release of a row they hold);
    // the probe must not destroy it on the way out.
    if (node->value->treeNode == key) {
      probe.treeNode = nullptr;
    }
  }
  return node;
}

MTreeNode* AVLTree::findNodePrivate(TreeNode* key) {
  AVLNode* node = findAVLNode(key);
  return node != nullptr ? node->value : nullptr;
}

void AVLTree::moveToMostRecent(MTreeNode* wrapper) {
  if (wrapper == mruTail) {
    return;
  }
  if (wrapper == lruHead) {
    lruHead = wrapper->next;
  }
  if (wrapper->prev != nullptr) {
    wrapper->prev->next = wrapper->next;
  }
  if (wrapper->next != nullptr) {
    wrapper->next->prev = wrapper->prev;
  }
  wrapper->next = nullptr;
  appendMostRecent(wrapper);
}

void AVLTree::appendMostRecent(MTreeNode* wrapper) {
  wrapper->prev = mruTail;
  if (mruTail != nullptr) {
    mruTail->next = wrapper;
  }
  mruTail = wrapper;
  if (lruHead == nullptr) {
    lruHead = wrapper;
  }
}

void AVLTree::unlink(MTreeNode* wrapper) {
  if (wrapper == lruHead) {
    lruHead = wrapper->next;
  }
  if (wrapper == mruTail) {
    mruTail = wrapper->prev;
  }
  if (wrapper->prev != nullptr) {
    wrapper->prev->next = wrapper->next;
  }
  if (wrapper->next != nullptr) {
    wrapper->next->prev = wrapper->prev;
  }
  wrapper->prev = nullptr;
  wrapper->next = nullptr;
}

bool AVLTree::addNode(TreeNode* n) {
  if (maxSize < 0) {
    // A tree that accepts nothing still reports success, so callers need no special case.
    return true;
  }
  if (n == nullptr) {
    return false;
  }
  MTreeNode* wrapper = new (std::nothrow) MTreeNode(n);
  if (wrapper == nullptr) {
    Q7_TRACE(kUnit, fw::kTraceError, "no memory for a tree entry");
    return false;
  }
  n->addingToTree();
  bool heightChanged = false;
  bool added = false;
  root = insertNode(root, wrapper, heightChanged, added);
  if (added) {
    ++size;
    appendMostRecent(wrapper);
    if (maxSize != 0 && size >= maxSize) {
      Q7_TRACE(kUnit, fw::kTraceDetail, "size %ld reached the limit, trimming %ld", size,
               removeCount);
      trimTreeByCount(removeCount, false);
    }
    return true;
  }
  n->removingFromTree();
  // The caller still owns a refused object: keep the wrapper from destroying it.
  bool deleteOnRemoval = n->getDeleteOnRemoval();
  n->setDeleteOnRemoval(false);
  delete wrapper;
  n->setDeleteOnRemoval(deleteOnRemoval);
  return false;
}

bool AVLTree::removeNode(TreeNode* key, bool /*lock*/) {
  return removeNode(key);
}

bool AVLTree::removeNode(TreeNode* key) {
  MTreeNode* wrapper = findNodePrivate(key);
  if (wrapper == nullptr) {
    return false;
  }
  if (wrapper->getRefCount() != 0) {
    wrapper->markForDeletion();
    Q7_TRACE(kUnit, fw::kTraceDetail, "entry held by %d readers, flagged for removal",
             wrapper->getRefCount());
    return false;
  }
  unlink(wrapper);
  key->removingFromTree();
  --size;
  bool heightChanged = false;
  bool removed = false;
  root = removeNodeWorker(root, wrapper, nullptr, heightChanged, removed);
  if (!removed) {
    Q7_TRACE(kUnit, fw::kTraceError, "entry met an equal duplicate and stays in the tree");
  }
  return removed;
}

TreeNode* AVLTree::findNode(TreeNode* key) {
  MTreeNode* wrapper = findNodePrivate(key);
  return wrapper != nullptr ? wrapper->treeNode : nullptr;
}

bool AVLTree::isTreeEmpty() {
  return root == nullptr;
}

void AVLTree::collectInOrder(std::vector<TreeNode*>& nodes) const {
  std::vector<const AVLNode*> pending;  // nodes whose left side is being walked
  const AVLNode* node = root;
  while (node != nullptr || !pending.empty()) {
    while (node != nullptr) {
      pending.push_back(node);
      node = node->left;
    }
    node = pending.back();
    pending.pop_back();
    nodes.push_back(node->value->getTreeNode());
    node = node->right;
  }
}

TreeNode* AVLTree::getRoot() {
  return root != nullptr ? root->value->getTreeNode() : nullptr;
}

TreeNode* AVLTree::getSmaller(TreeNode* key) {
  AVLNode* node = findAVLNode(key);
  return node != nullptr && node->left != nullptr ? node->left->value->getTreeNode() : nullptr;
}

TreeNode* AVLTree::getLarger(TreeNode* key) {
  AVLNode* node = findAVLNode(key);
  return node != nullptr && node->right != nullptr ? node->right->value->getTreeNode() : nullptr;
}

void AVLTree::dumpTree() {
  int count = 0;
  int depth = 0;
  dumpATree(false, &count, &depth);
}

void AVLTree::dumpSortedTree() {
  int count = 0;
  int depth = 0;
  dumpATree(true, &count, &depth);
}

void AVLTree::dumpATree(bool sorted, int* count, int* depth) {
  if (root != nullptr) {
    root->dump(sorted, count, depth);
  }
}

TreeNode* AVLTree::getLRUNode() {
  return lruHead != nullptr ? lruHead->treeNode : nullptr;
}

bool AVLTree::trimTreeByCount(long count) {
  return trimTreeByCount(count, false);
}

bool AVLTree::trimTreeByCount(long count, bool force) {
  long removed = 0;
  bool ok = true;
  for (long i = 0; i < count && lruHead != nullptr; ++i) {
    MTreeNode* oldest = lruHead;
    if (force) {
      oldest->refCount = 0;
    }
    // A referenced entry fails, is flagged and goes to the most recent end, so the next
    // round takes the next oldest.
    if (removeNode(oldest->treeNode, false)) {
      ++removed;
    } else {
      ok = false;
    }
  }
  if (removed > count / 2) {
    return ok;
  }
  // The forced fallback could never succeed here and would recurse without end.
  if (count < 1 || lruHead == nullptr) {
    Q7_TRACE(kUnit, fw::kTraceError, "trim of %ld removed %ld and cannot make up the rest", count,
             removed);
    return false;
  }
  long c = count == 1 ? 2 : count;
  Q7_TRACE(kUnit, fw::kTraceDetail, "trim of %ld removed %ld, forcing %ld more", count, removed,
           c / 2);
  return trimTreeByCount(c / 2, true);
}

bool AVLTree::trimTreeByAge(long /*age*/) {
  return false;
}

TreeNode* AVLTree::markForDeletion(TreeNode* key) {
  MTreeNode* wrapper = findNodePrivate(key);
  if (wrapper == nullptr) {
    return nullptr;
  }
  if (wrapper != lruHead) {
    unlink(wrapper);
    wrapper->next = lruHead;
    // Linked both ways: a stale null here would later let the list lose entries and keep a
    // pointer to a removed wrapper.
    lruHead->prev = wrapper;
    lruHead = wrapper;
    wrapper->markForDeletion();
  }
  return wrapper->treeNode;
}

TreeNode* AVLTree::AddRef(TreeNode* key) {
  MTreeNode* wrapper = findNodePrivate(key);
  if (wrapper == nullptr) {
    return nullptr;
  }
  wrapper->AddRef();
  return wrapper->treeNode;
}

TreeNode* AVLTree::Release(TreeNode* key) {
  MTreeNode* wrapper = findNodePrivate(key);
  if (wrapper == nullptr) {
    return nullptr;
  }
  wrapper->Release();
  if (wrapper->IsMarkedForDeletion() && wrapper->getRefCount() < 1) {
    AVLTree::removeNode(key);
    return nullptr;
  }
  return wrapper->treeNode;
}

int32_t AVLTree::getRefCount(TreeNode* key) {
  MTreeNode* wrapper = findNodePrivate(key);
  return wrapper != nullptr ? wrapper->getRefCount() : -1;
}
