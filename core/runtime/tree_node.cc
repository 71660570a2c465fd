#include "core/runtime/tree_node.h"

namespace {

TreeNode* Wrapped(TreeNode& other) {
  return static_cast<MTreeNode&>(other).getTreeNode();
}

}  // namespace

MTreeNode::~MTreeNode() {
  if (treeNode != nullptr && treeNode->getDeleteOnRemoval()) {
    delete treeNode;
  }
  treeNode = nullptr;
  prev = nullptr;
  next = nullptr;
}

bool MTreeNode::equals(TreeNode& other, int mode) {
  TreeNode* theirs = Wrapped(other);
  return treeNode != nullptr && theirs != nullptr && treeNode->equals(*theirs, mode);
}

bool MTreeNode::greater(TreeNode& other, int mode) {
  TreeNode* theirs = Wrapped(other);
  return treeNode != nullptr && theirs != nullptr && treeNode->greater(*theirs, mode);
}

int MTreeNode::compare(TreeNode& other, int mode) {
  TreeNode* theirs = Wrapped(other);
  return treeNode != nullptr && theirs != nullptr ? treeNode->compare(*theirs, mode) : -1;
}

const char* MTreeNode::toString(int mode) {
  return treeNode != nullptr ? treeNode->toString(mode) : nullptr;
}

bool MTreeNode::getDeleteOnRemoval() {
  return treeNode != nullptr && treeNode->getDeleteOnRemoval();
}

void MTreeNode::setDeleteOnRemoval(bool deleteOnRemoval) {
  if (treeNode != nullptr) {
    treeNode->setDeleteOnRemoval(deleteOnRemoval);
  }
}
