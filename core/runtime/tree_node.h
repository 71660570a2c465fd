#pragma once

// TreeNode: the interface of every object stored in an AVLTree (the aggregate rows).
// MTreeNode: the tree's private wrapper around one stored object; it adds the reference count,
// the marked-for-deletion flag and the links of the tree's recency (LRU) list.
//
// The virtual operations are declared in a fixed order that row classes rely on; keep it.
//
// Ownership: a wrapper does not own its object, except that its destructor destroys the object
// when the object reports getDeleteOnRemoval() true. So an object that reports true is
// destroyed by whatever destroys its wrapper: removal from the tree, trimming, the tree's
// destructor, or the temporary wrapper of a lookup key (lookup keys must report false).
//
// Thread safety: none of its own; the owning tree (or its lock) serialises every use.

#include <cstdint>

class AVLTree;

class TreeNode {
 public:
  virtual ~TreeNode() = default;
  // Compare with `other` under the tree's compare mode, which is passed through unchanged.
  virtual bool equals(TreeNode& other, int mode) = 0;
  // True when this object sorts after `other`.
  virtual bool greater(TreeNode& other, int mode) = 0;
  // A text of the object's key; the row classes decide its form. May return null.
  virtual const char* toString(int mode) = 0;
  // True when the tree may destroy the object once it leaves the tree.
  virtual bool getDeleteOnRemoval() = 0;
  virtual void setDeleteOnRemoval(bool deleteOnRemoval) = 0;
  // Notifications around insertion and removal; by default nothing happens.
  virtual void removingFromTree() {}
  virtual void addingToTree() {}
  // greater and equals in one: 1 when this sorts after other, 0 when equal, else -1. A search
  // asks this once per level; objects whose key can answer in one pass override it.
  virtual int compare(TreeNode& other, int mode) {
    return greater(other, mode) ? 1 : (equals(other, mode) ? 0 : -1);
  }
};

class MTreeNode : public TreeNode {
 public:
  // Wraps `node` (may be null). See the class comment for when the wrapper destroys it.
  explicit MTreeNode(TreeNode* node) : treeNode(node) {}
  ~MTreeNode() override;

  MTreeNode(const MTreeNode&) = delete;
  MTreeNode& operator=(const MTreeNode&) = delete;

  // These forward to the wrapped object with the other wrapper's wrapped object; `other` must
  // be an MTreeNode. Without a wrapped object (on either side) they answer false, toString
  // answers null and setDeleteOnRemoval does nothing.
  bool equals(TreeNode& other, int mode) override;
  bool greater(TreeNode& other, int mode) override;
  int compare(TreeNode& other, int mode) override;
  const char* toString(int mode) override;
  bool getDeleteOnRemoval() override;
  void setDeleteOnRemoval(bool deleteOnRemoval) override;

  virtual void markForDeletion() { markedForDeletion = true; }
  virtual void AddRef() { ++refCount; }
  virtual void Release() { --refCount; }
  virtual bool IsMarkedForDeletion() { return markedForDeletion; }
  virtual int32_t getRefCount() { return refCount; }

  TreeNode* getTreeNode() { return treeNode; }

 private:
  friend class AVLTree;          // keeps the recency links and the count
  friend class AVLTreeTestPeer;  // invariant checks in tests

  TreeNode* treeNode;              // the stored object; see the class comment for ownership
  MTreeNode* prev = nullptr;       // next wrapper toward the least recently used end
  MTreeNode* next = nullptr;       // next wrapper toward the most recently used end
  bool markedForDeletion = false;  // removal was asked while the entry was referenced
  int32_t refCount = 0;            // readers holding the object (AddRef minus Release)
};
