#pragma once

// RowIndex: a hash index from a row key's hash to the rows of one over-time tree, so that a
// lookup costs one probe sequence instead of a descent of the tree. Open addressing with linear
// probing over two parallel arrays: 32-bit tags (the hash's high half, which also picks the
// slot, so growing needs no row's hash again) and the row pointers: 12 bytes a slot, about 20 a
// row at the loads it keeps (between 3/8 and 3/4).
//
// Rows are only ever added while an index lives (a tree's rows go with the whole tree), so there
// are no tombstones. Equal hashes may belong to different rows: find asks the caller's predicate.
// Ownership: the index borrows its rows; the tree owns them. Thread safety: none; the analyzer's
// tree lock guards it with its tree.

#include <cstddef>
#include <cstdint>
#include <memory>

class TreeNode;

class RowIndex {
 public:
  // The first row under hash for which same(row) is true, or null.
  template <class Same>
  TreeNode* find(std::size_t hash, Same same) const {
    if (capacity_ == 0) {
      return nullptr;
    }
    const uint32_t tag = Tag(hash);
    for (std::size_t at = tag & (capacity_ - 1);; at = (at + 1) & (capacity_ - 1)) {
      TreeNode* const row = rows_[at];
      if (row == nullptr) {
        return nullptr;
      }
      if (tags_[at] == tag && same(row)) {
        return row;
      }
    }
  }
  // Adds row under hash; false (and nothing added) when memory runs out.
  bool add(std::size_t hash, TreeNode* row);
  std::size_t size() const { return size_; }

 private:
  static uint32_t Tag(std::size_t hash) { return static_cast<uint32_t>(uint64_t{hash} >> 32); }
  void place(uint32_t tag, TreeNode* row);
  bool grow();

  std::size_t capacity_ = 0;  // a power of two, or 0
  std::size_t size_ = 0;
  std::unique_ptr<uint32_t[]> tags_;
  std::unique_ptr<TreeNode*[]> rows_;  // null marks a free slot
};
