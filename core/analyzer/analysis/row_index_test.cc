// The row index against a multimap over random hashes that collide often (few distinct values,
// equal tags in different slots, runs across the table's end), through several growths.

#include "core/analyzer/analysis/row_index.h"

#include <gtest/gtest.h>

#include <iterator>
#include <map>
#include <memory>
#include <random>
#include <vector>

namespace {

TEST(RowIndexTest, FindsWhatAMultimapHolds) {
  std::mt19937_64 random(7);
  // Addresses stand in for rows; the index never dereferences them itself.
  std::vector<char> rows(5000);
  RowIndex index;
  std::multimap<std::size_t, TreeNode*> reference;
  std::vector<std::size_t> filedHashes;
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
    filedHashes.push_back(hash);
    if (i % 31 != 0) {
      continue;
    }
    for (int probe = 0; probe < 20; ++probe) {
      const std::size_t h =
          probe % 2 == 0 ? randomHash() : filedHashes[random() % filedHashes.size()];
      // Rows filed under h are found when asked for (the first, the last and one between: a
      // shared hash holds hundreds), and a row never filed is not.
      const auto [first, last] = reference.equal_range(h);
      const std::size_t filed = static_cast<std::size_t>(std::distance(first, last));
      for (const std::size_t at : {std::size_t{0}, filed / 2, filed - 1}) {
        if (at >= filed) {
          continue;
        }
        TreeNode* const want = std::next(first, static_cast<std::ptrdiff_t>(at))->second;
        ASSERT_EQ(want, index.find(h, [&](TreeNode* r) { return r == want; }));
      }
      TreeNode* const absent = reinterpret_cast<TreeNode*>(rows.data() + rows.size());
      ASSERT_EQ(nullptr, index.find(h, [&](TreeNode* r) { return r == absent; }));
    }
  }
  EXPECT_EQ(rows.size(), index.size());
}

}  // namespace
