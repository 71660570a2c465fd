#include "core/analyzer/analysis/row_index.h"

#include <new>

void RowIndex::place(uint32_t tag, TreeNode* row) {
  std::size_t at = tag & (capacity_ - 1);
  while (rows_[at] != nullptr) {
    at = (at + 1) & (capacity_ - 1);
  }
  tags_[at] = tag;
  rows_[at] = row;
}

bool RowIndex::grow() {
  const std::size_t capacity = capacity_ == 0 ? 16 : capacity_ * 2;
  std::unique_ptr<uint32_t[]> tags(new (std::nothrow) uint32_t[capacity]);
  std::unique_ptr<TreeNode*[]> rows(new (std::nothrow) TreeNode*[capacity]());
  if (tags == nullptr || rows == nullptr) {
    return false;
  }
  const std::size_t old = capacity_;
  std::unique_ptr<uint32_t[]> oldTags = std::move(tags_);
  std::unique_ptr<TreeNode*[]> oldRows = std::move(rows_);
  tags_ = std::move(tags);
  rows_ = std::move(rows);
  capacity_ = capacity;
  for (std::size_t i = 0; i < old; ++i) {
    if (oldRows[i] != nullptr) {
      place(oldTags[i], oldRows[i]);
    }
  }
  return true;
}

bool RowIndex::add(std::size_t hash, TreeNode* row) {
  if ((size_ + 1) * 4 > capacity_ * 3 && !grow()) {
    return false;
  }
  place(Tag(hash), row);
  ++size_;
  return true;
}
