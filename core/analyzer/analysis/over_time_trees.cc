#include "core/analyzer/analysis/over_time_trees.h"

#include <cstring>
#include <memory>

#include "core/analyzer/rows/rows.h"
#include "core/history/checkpoint_file.h"
#include "core/history/history_store.h"
#include "core/runtime/clog.h"

namespace {

template <class Row>
bool SaveTree(TSAVLTree& tree, history::HistoryStore& store, long interval, const char* stem) {
  using Layout = typename Row::LayoutType;
  std::vector<TreeNode*> nodes;
  getTreeNodes(tree, nodes);
  // A stretch of rows at a time: a copy of the whole tree would double the peak memory.
  return store.saveIntervalInPieces(interval, stem, sizeof(Layout), nodes.size(),
                                    [&nodes](size_t first, size_t n, void* out) {
                                      Layout* const rows = static_cast<Layout*>(out);
                                      for (size_t i = 0; i < n; ++i) {
                                        static_cast<Row*>(nodes[first + i])->getQ7Struct(rows[i]);
                                      }
                                    });
}

template <class Row>
history::RecordSection TreeSection(TSAVLTree& tree, const char* stem) {
  using Layout = typename Row::LayoutType;
  auto nodes = std::make_shared<std::vector<TreeNode*>>();
  getTreeNodes(tree, *nodes);
  const size_t count = nodes->size();
  return {stem, sizeof(Layout), count, [nodes](size_t first, size_t n, void* out) {
            Layout* const rows = static_cast<Layout*>(out);
            for (size_t i = 0; i < n; ++i) {
              static_cast<Row*>((*nodes)[first + i])->getQ7Struct(rows[i]);
            }
          }};
}

// Adds count records of Row's layout to table; where and interval name them in the trace.
template <class Row>
void AddRecords(COverTimeTrees& trees, OverTimeTable table, const std::byte* records, size_t count,
                const char* stem, long interval) {
  using Layout = typename Row::LayoutType;
  for (size_t i = 0; i < count; ++i) {
    Layout layout;
    memcpy(&layout, records + i * sizeof(Layout), sizeof(Layout));
    auto row = std::make_unique<Row>(layout);
    if (trees.add(table, row.get(), row->indexHash())) {
      row.release();  // the tree owns it now
    } else {
      CLOG::min("%s duplicate row in the history of %s for interval[%ld] ignored",
                "COverTimeTrees::load", stem, interval);
    }
  }
}

template <class Row>
void LoadTree(COverTimeTrees& trees, OverTimeTable table, history::HistoryStore& store,
              long interval, const char* stem) {
  using Layout = typename Row::LayoutType;
  const std::vector<std::byte> bytes = store.loadInterval(interval, stem, sizeof(Layout));
  AddRecords<Row>(trees, table, bytes.data(), bytes.size() / sizeof(Layout), stem, interval);
}

template <class Row>
void LoadSection(COverTimeTrees& trees, OverTimeTable table, const std::byte* records, size_t count,
                 const char* stem) {
  AddRecords<Row>(trees, table, records, count, stem, -1);
}

template <class Row>
void SeedTree(COverTimeTrees& trees, OverTimeTable table, TSAVLTree& ended, long interval) {
  using Layout = typename Row::LayoutType;
  std::vector<TreeNode*> nodes;
  getTreeNodes(ended, nodes);
  for (TreeNode* node : nodes) {
    Layout layout;
    static_cast<Row*>(node)->getQ7Struct(layout);
    auto row = std::make_unique<Row>(layout);
    row->reset(interval);
    if (trees.add(table, row.get(), row->indexHash())) {
      row.release();
    }
  }
}

struct TableOps {
  const char* stem;
  size_t recordSize;
  bool (*save)(TSAVLTree&, history::HistoryStore&, long, const char*);
  void (*load)(COverTimeTrees&, OverTimeTable, history::HistoryStore&, long, const char*);
  void (*seed)(COverTimeTrees&, OverTimeTable, TSAVLTree&, long);
  history::RecordSection (*section)(TSAVLTree&, const char*);
  void (*loadSection)(COverTimeTrees&, OverTimeTable, const std::byte*, size_t, const char*);
};

template <class Row>
constexpr TableOps Ops(const char* stem) {
  return {stem,
          sizeof(typename Row::LayoutType),
          &SaveTree<Row>,
          &LoadTree<Row>,
          &SeedTree<Row>,
          &TreeSection<Row>,
          &LoadSection<Row>};
}

// In OverTimeTable order: the list's.
#define Q7_TREE_OPS(name, Row, keys, Tree, EXPORT) Ops<Row>("q7" #name),
constexpr TableOps kTables[kOverTimeTables] = {
    Q7_ANALYZER_TABLES(Q7_TREE_OPS, Q7_NO_SUMMARY, Q7_NO_CURRENT, Q7_NO_INSTANCE)};
#undef Q7_TREE_OPS

}  // namespace

void getTreeNodes(AVLTree& tree, std::vector<TreeNode*>& nodes) {
  const size_t before = nodes.size();
  nodes.reserve(before + static_cast<size_t>(tree.getSize()));
  tree.collectInOrder(nodes);
  const size_t copied = nodes.size() - before;
  if (copied != static_cast<size_t>(tree.getSize())) {
    CLOG::min("ERROR: Copy'd %d nodes from tree of size[%d]", static_cast<int>(copied),
              static_cast<int>(tree.getSize()));
  }
}

COverTimeTrees::COverTimeTrees() {
  for (auto& tree : trees_) {
    tree = std::make_unique<TSAVLTree>(0, false);
  }
}

long COverTimeTrees::totalRows() const {
  long rows = 0;
  for (const auto& tree : trees_) {
    rows += tree->getSize();
  }
  return rows;
}

bool COverTimeTrees::save(history::HistoryStore& store, long interval) const {
  bool saved = true;
  for (int i = 0; i < kOverTimeTables; ++i) {
    saved = kTables[i].save(*trees_[i], store, interval, kTables[i].stem) && saved;
  }
  return latency_.save(store, interval) && saved;
}

void COverTimeTrees::load(history::HistoryStore& store, long interval) {
  for (int i = 0; i < kOverTimeTables; ++i) {
    kTables[i].load(*this, static_cast<OverTimeTable>(i), store, interval, kTables[i].stem);
  }
  latency_.load(store, interval);
}

std::vector<history::RecordSection> COverTimeTrees::sections() const {
  std::vector<history::RecordSection> out;
  for (int i = 0; i < kOverTimeTables; ++i) {
    out.push_back(kTables[i].section(*trees_[i], kTables[i].stem));
  }
  out.push_back(latency_.section());
  return out;
}

bool COverTimeTrees::loadSection(const history::LoadedSection& section) {
  if (section.stem == LatencyBook::kStem) {
    return latency_.loadSection(section);
  }
  for (int i = 0; i < kOverTimeTables; ++i) {
    if (section.stem == kTables[i].stem) {
      if (section.record_size != kTables[i].recordSize) {
        return false;
      }
      kTables[i].loadSection(*this, static_cast<OverTimeTable>(i), section.records.data(),
                             section.count(), kTables[i].stem);
      return true;
    }
  }
  return false;
}

void COverTimeTrees::seedZeroRows(const COverTimeTrees& ended, long interval) {
  for (int i = 0; i < kOverTimeTables; ++i) {
    kTables[i].seed(*this, static_cast<OverTimeTable>(i), *ended.trees_[i], interval);
  }
}

TreeNode* COverTimeTrees::find(OverTimeTable table, std::size_t hash, TreeNode& probe) const {
  return index_[static_cast<int>(table)].find(
      hash, [&probe](TreeNode* row) { return row->equals(probe, 0); });
}

bool COverTimeTrees::add(OverTimeTable table, TreeNode* row, std::size_t hash) {
  const int i = static_cast<int>(table);
  if (!trees_[i]->addNode(row)) {
    return false;
  }
  if (!index_[i].add(hash, row)) {
    // Without its index entry the row could never be found again: take it back out.
    // The caller keeps a refused row, so the tree must not destroy it on the way out.
    CLOG::error("%s: out of memory indexing a row; row refused", "COverTimeTrees::add");
    const bool deleteOnRemoval = row->getDeleteOnRemoval();
    row->setDeleteOnRemoval(false);
    trees_[i]->removeNode(row, true);
    row->setDeleteOnRemoval(deleteOnRemoval);
    return false;
  }
  return true;
}
