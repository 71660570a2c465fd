#pragma once

// The eight over-time trees of one interval, one per over-time row class, and what is done to
// them as a set: saving them as the interval's history files, loading an interval's files back
// into them, and seeding a new interval with zero rows for the keys of the one that ended.
//
// Beside the trees, the interval's latency book (the sketches of its application and transaction
// rows), saved, loaded and checkpointed with them.
//
// The trees own their rows. Threads: the analyzer's tree lock guards a set and its rows.

#include <cstddef>
#include <memory>
#include <vector>

#include "core/analyzer/analysis/latency_book.h"
#include "core/analyzer/analysis/row_index.h"
#include "core/analyzer/rows/analyzer_tables.h"
#include "core/runtime/ts_avl_tree.h"

namespace history {
class HistoryStore;
struct LoadedSection;
struct RecordSection;
}  // namespace history

// The over-time tables in their list's order (rows/analyzer_tables.h): the order transaction
// processing updates a page's tables, then the sub-transaction table. Also the index into
// COverTimeTrees.
#define Q7_TREE_ENUMERATOR(name, Row, keys, Tree, EXPORT) Tree,
enum class OverTimeTable : int {
  Q7_ANALYZER_TABLES(Q7_TREE_ENUMERATOR, Q7_NO_SUMMARY, Q7_NO_CURRENT, Q7_NO_INSTANCE)
};
#undef Q7_TREE_ENUMERATOR
#define Q7_COUNT_TREE(name, Row, keys, Tree, EXPORT) +1
inline constexpr int kOverTimeTables =
    0 Q7_ANALYZER_TABLES(Q7_COUNT_TREE, Q7_NO_SUMMARY, Q7_NO_CURRENT, Q7_NO_INSTANCE);
#undef Q7_COUNT_TREE

class COverTimeTrees {
 public:
  COverTimeTrees();
  COverTimeTrees(const COverTimeTrees&) = delete;
  COverTimeTrees& operator=(const COverTimeTrees&) = delete;

  TSAVLTree& tree(OverTimeTable table) { return *trees_[static_cast<int>(table)]; }
  // The row of table equal to probe, whose key hashes to hash (TKeyedRow::indexHash), or null:
  // a hash lookup in front of the tree, which stays the ordered store and the rows' owner.
  TreeNode* find(OverTimeTable table, std::size_t hash, TreeNode& probe) const;
  // The same with the key given by a predicate over candidate rows (same(row) true when row has
  // the key), for lookups that build no probe row.
  template <class Same>
  TreeNode* findIf(OverTimeTable table, std::size_t hash, Same same) const {
    return index_[static_cast<int>(table)].find(hash, same);
  }
  // Adds row (whose key hashes to hash) to table's tree and index; false when the tree refused
  // it (the caller keeps it).
  bool add(OverTimeTable table, TreeNode* row, std::size_t hash);
  const TSAVLTree& tree(OverTimeTable table) const { return *trees_[static_cast<int>(table)]; }
  long totalRows() const;
  LatencyBook& latency() { return latency_; }
  const LatencyBook& latency() const { return latency_; }

  // Writes every tree, and the book, as interval's history files (an empty tree leaves an empty
  // file). False
  // when a file could not be written (traced by the store).
  bool save(history::HistoryStore& store, long interval) const;
  // Adds interval's history rows to the trees, and its book to the book.
  void load(history::HistoryStore& store, long interval);
  // Every tree's rows as history records, one section per table (stem "q7<table>"), and the
  // book's section, for a checkpoint. The sections point into the trees: use them before the trees
  // change.
  std::vector<history::RecordSection> sections() const;
  // Adds records saved by sections() to the tree of stem (or the book); false for a stem no
  // table has, a record size that is not the table's or a book that does not decode.
  bool loadSection(const history::LoadedSection& section);
  // Adds, for every key of ended, a row with no requests starting at interval.
  void seedZeroRows(const COverTimeTrees& ended, long interval);

 private:
  std::unique_ptr<TSAVLTree> trees_[kOverTimeTables];
  RowIndex index_[kOverTimeTables];  // over trees_'s rows
  LatencyBook latency_;
};

// Every object of tree in its order (left to right), for copying rows out.
void getTreeNodes(AVLTree& tree, std::vector<TreeNode*>& nodes);
