// The row index against a multimap over random hashes that collide often (few distinct values,
// equal tags in different slots, runs across the table's end), through several growths.

#include "core/analyzer/analysis/row_index.h"

#include <gtest/gtest.h>

#include <map>
#include <memory>
#include <random>
#include <vector>

namespace {

TEST(RowIndexTest, FindsWhatAMultimapHolds) {
  std::mt19937_64 random(7);
  // Addresses stand in for rows; the index never dereferences them itself.
  std::vector<char> rows(20000);
  RowIndex index;
  std::multimap<std::size_t, TreeNode*> reference;
  const auto randomHash = [&random] {
    // High halves from a small set (shared tags), low halves arbitrary.
    return (static_cast<std::size_t>(random() % 64) << 32) |
           (random() % 3 == 0 ? ~std::size_t{0} >> 32 : random() & 0xffffffff);
  };
  for (std::size_t i = 0; i < rows.size(); ++i) {
    TreeNode* const row = reinterpret_cast<TreeNode*>(&rows[i]);
    const std::size_t hash = randomHash();
    ASSERT_TRUE(index.add(hash, row));
    reference.emplace(hash, row);
    if (i % 97 != 0) {
      continue;
    }
    for (int probe = 0; probe < 50; ++probe) {
      const std::size_t h =
          probe % 2 == 0 ? randomHash()
                         : std::next(reference.begin(), random() % reference.size())->first;
      // Each row filed under h is found when asked for, and a row never filed is not.
      const auto [first, last] = reference.equal_range(h);
      for (auto it = first; it != last; ++it) {
        ASSERT_EQ(it->second, index.find(h, [&](TreeNode* r) { return r == it->second; }));
      }
      TreeNode* const absent = reinterpret_cast<TreeNode*>(rows.data() + rows.size());
      ASSERT_EQ(nullptr, index.find(h, [&](TreeNode* r) { return r == absent; }));
    }
  }
  EXPECT_EQ(rows.size(), index.size());
}

}  // namespace
