// The balanced structure of AVLTree: insertion, removal and their rotations.

#include <algorithm>
#include <new>

#include "core/runtime/avl_tree.h"

namespace {

int Depth(const AVLNode* node) {
  return node == nullptr ? 0 : 1 + std::max(Depth(node->left), Depth(node->right));
}

// Skew from measured depths; after a double rotation on removal the skews are recomputed
// this way rather than derived.
void DetermineNodeSkew(AVLNode* node) {
  if (node == nullptr) {
    return;
  }
  int left = Depth(node->left);
  int right = Depth(node->right);
  node->skew = left > right ? 2 : (right > left ? 1 : 0);
}

}  // namespace

AVLNode* AVLTree::rotateLeft(AVLNode* x) {
  AVLNode* r = x->right;
  if (r == nullptr) {
    return nullptr;
  }
  x->right = r->left;
  r->left = x;
  return r;
}

AVLNode* AVLTree::rotateRight(AVLNode* x) {
  AVLNode* l = x->left;
  if (l == nullptr) {
    return nullptr;
  }
  x->left = l->right;
  l->right = x;
  return l;
}

void AVLTree::repairSkews(AVLNode* subtreeRoot) {
  DetermineNodeSkew(subtreeRoot->left);
  DetermineNodeSkew(subtreeRoot->right);
  DetermineNodeSkew(subtreeRoot);
}

void AVLTree::freeSubtree(AVLNode* node) {
  if (node == nullptr) {
    return;
  }
  freeSubtree(node->left);
  freeSubtree(node->right);
  delete node;
}

AVLNode* AVLTree::insertNode(AVLNode* node, MTreeNode* wrapper, bool& heightChanged, bool& added) {
  if (node == nullptr) {
    AVLNode* created = new (std::nothrow) AVLNode(wrapper);
    heightChanged = added = created != nullptr;
    return created;
  }
  const int order = wrapper->compare(*node->value, compareMode);
  if (order > 0) {
    node->right = insertNode(node->right, wrapper, heightChanged, added);
    if (heightChanged && added) {
      switch (node->skew) {
        case 0:
          node->skew = 1;
          break;
        case 2:
          node->skew = 0;
          heightChanged = false;
          break;
        default:
          node = balanceRight(node, heightChanged);
          break;
      }
    }
    return node;
  }
  if (!allowDuplicates && order == 0) {
    added = false;
    return node;
  }
  node->left = insertNode(node->left, wrapper, heightChanged, added);
  if (heightChanged && added) {
    switch (node->skew) {
      case 0:
        node->skew = 2;
        break;
      case 1:
        node->skew = 0;
        heightChanged = false;
        break;
      default:
        node = balanceLeft(node, heightChanged);
        break;
    }
  }
  return node;
}

AVLNode* AVLTree::balanceRight(AVLNode* x, bool& heightChanged) {
  AVLNode* r = x->right;
  if (r->skew == 1) {
    x->skew = 0;
    r->skew = 0;
    heightChanged = false;
    return rotateLeft(x);
  }
  if (r->skew == 2) {
    AVLNode* rl = r->left;
    switch (rl->skew) {
      case 1:
        x->skew = 2;
        r->skew = 0;
        break;
      case 2:
        x->skew = 0;
        r->skew = 1;
        break;
      default:
        x->skew = 0;
        r->skew = 0;
        break;
    }
    rl->skew = 0;
    x->right = rotateRight(r);
    heightChanged = false;
    return rotateLeft(x);
  }
  return x;
}

AVLNode* AVLTree::balanceLeft(AVLNode* x, bool& heightChanged) {
  AVLNode* l = x->left;
  if (l->skew == 2) {
    x->skew = 0;
    l->skew = 0;
    heightChanged = false;
    return rotateRight(x);
  }
  if (l->skew == 1) {
    AVLNode* lr = l->right;
    switch (lr->skew) {
      case 1:
        x->skew = 0;
        l->skew = 2;
        break;
      case 2:
        x->skew = 1;
        l->skew = 0;
        break;
      default:
        x->skew = 0;
        l->skew = 0;
        break;
    }
    lr->skew = 0;
    x->left = rotateLeft(l);
    heightChanged = false;
    return rotateRight(x);
  }
  heightChanged = false;
  return x;
}

AVLNode* AVLTree::removeNodeWorker(AVLNode* node, MTreeNode* key, const AVLNode* predecessor,
                                   bool& heightChanged, bool& removed) {
  if (node == nullptr) {
    heightChanged = removed = false;
    return nullptr;
  }
  if (key->equals(*node->value, compareMode)) {
    if (predecessor != nullptr && node != predecessor) {
      // Moving the predecessor up met an equal duplicate first; removing that one instead
      // would free an entry still on the recency list, so nothing is removed.
      heightChanged = removed = false;
      return node;
    }
    if (node->left != nullptr && node->right != nullptr) {
      AVLNode* pred = node->left;
      while (pred->right != nullptr) {
        pred = pred->right;
      }
      // The predecessor's wrapper survives its node and replaces this node's value.
      pred->ownsValue = false;
      MTreeNode* moved = pred->value;
      AVLNode* subtree = removeNodeWorker(node, moved, pred, heightChanged, removed);
      if (!removed) {
        pred->ownsValue = true;
        return subtree;
      }
      delete node->value;
      node->value = moved;
      return subtree;
    }
    AVLNode* child = node->left != nullptr ? node->left : node->right;
    delete node;
    heightChanged = removed = true;
    return child;
  }
  if (key->greater(*node->value, compareMode)) {
    node->right = removeNodeWorker(node->right, key, predecessor, heightChanged, removed);
    if (!heightChanged || !removed) {
      return node;
    }
    return shrunkRight(node, heightChanged);
  }
  node->left = removeNodeWorker(node->left, key, predecessor, heightChanged, removed);
  if (!heightChanged || !removed) {
    return node;
  }
  return shrunkLeft(node, heightChanged);
}

AVLNode* AVLTree::shrunkRight(AVLNode* x, bool& heightChanged) {
  switch (x->skew) {
    case 1:
      x->skew = 0;
      return x;
    case 0:
      x->skew = 2;
      heightChanged = false;
      return x;
    default:
      break;
  }
  AVLNode* l = x->left;
  if (l->skew == 2) {
    x->skew = 0;
    AVLNode* top = rotateRight(x);
    l->skew = 0;
    return top;
  }
  if (l->skew == 0) {
    x->skew = 2;
    AVLNode* top = rotateRight(x);
    top->skew = 1;
    heightChanged = false;
    return top;
  }
  x->left = rotateLeft(l);
  AVLNode* top = rotateRight(x);
  repairSkews(top);
  return top;
}

AVLNode* AVLTree::shrunkLeft(AVLNode* x, bool& heightChanged) {
  switch (x->skew) {
    case 2:
      x->skew = 0;
      return x;
    case 0:
      x->skew = 1;
      heightChanged = false;
      return x;
    default:
      break;
  }
  AVLNode* r = x->right;
  if (r->skew == 1) {
    x->skew = 0;
    AVLNode* top = rotateLeft(x);
    r->skew = 0;
    return top;
  }
  if (r->skew == 0) {
    x->skew = 1;
    AVLNode* top = rotateLeft(x);
    top->skew = 2;
    heightChanged = false;
    return top;
  }
  x->right = rotateRight(r);
  AVLNode* top = rotateLeft(x);
  repairSkews(top);
  return top;
}
