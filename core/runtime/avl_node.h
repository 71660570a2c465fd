#pragma once

// AVLNode: one node of AVLTree's balanced structure. Only AVLTree creates and links nodes.
//
// Ownership: a node owns its wrapper while ownsValue is true (its destructor destroys it, and
// with it the stored object when that reports getDeleteOnRemoval() true). It never owns its
// children; the tree frees them.

#include <cstdint>

#include "core/runtime/tree_node.h"

struct AVLNode {
  explicit AVLNode(MTreeNode* wrapper) : value(wrapper) {}
  ~AVLNode() {
    if (ownsValue) {
      delete value;
    }
  }

  AVLNode(const AVLNode&) = delete;
  AVLNode& operator=(const AVLNode&) = delete;

  // The node dump behind AVLTree::dumpATree. It prints nothing: dumps have no visible effect.
  void dump(bool /*sorted*/, int* /*count*/, int* /*depth*/) const {}

  AVLNode* left = nullptr;
  AVLNode* right = nullptr;
  MTreeNode* value;       // the wrapper held here
  bool ownsValue = true;  // cleared while the value moves to another node during removal
  int32_t skew = 0;       // 0: subtrees equally deep; 1: right one deeper; 2: left one deeper
};
