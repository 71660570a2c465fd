// Tree costs at the sizes the analyzer's row trees reach: inserting rows in random key order and
// finding them again, through the locked tree the analyzer uses.

#include <benchmark/benchmark.h>

#include <algorithm>
#include <memory>
#include <numeric>
#include <random>
#include <vector>

#include "core/runtime/ts_avl_tree.h"

namespace {

class Row : public TreeNode {
 public:
  explicit Row(long key, bool owned) : key_(key), owned_(owned) {}
  bool equals(TreeNode& other, int) override { return key_ == Key(other); }
  bool greater(TreeNode& other, int) override { return key_ > Key(other); }
  const char* toString(int) override { return nullptr; }
  bool getDeleteOnRemoval() override { return owned_; }
  void setDeleteOnRemoval(bool on) override { owned_ = on; }

 private:
  static long Key(TreeNode& node) { return static_cast<Row&>(node).key_; }
  long key_;
  bool owned_;
};

std::vector<long> ShuffledKeys(long count) {
  std::vector<long> keys(count);
  std::iota(keys.begin(), keys.end(), 0);
  std::shuffle(keys.begin(), keys.end(), std::mt19937(42));
  return keys;
}

void BM_TreeInsert(benchmark::State& state) {
  const std::vector<long> keys = ShuffledKeys(state.range(0));
  for (auto _ : state) {
    auto tree = std::make_unique<TSAVLTree>(0, false);
    for (long key : keys) {
      tree->addNode(new Row(key, true));
    }
    benchmark::DoNotOptimize(tree->getRoot());
    state.PauseTiming();  // tearing the tree down is not an insert
    tree.reset();
    state.ResumeTiming();
  }
  state.SetItemsProcessed(state.iterations() * state.range(0));
}
BENCHMARK(BM_TreeInsert)->Arg(1000)->Arg(100000)->Arg(1000000)->Unit(benchmark::kMillisecond);

void BM_TreeFind(benchmark::State& state) {
  const std::vector<long> keys = ShuffledKeys(state.range(0));
  TSAVLTree tree(0, false);
  for (long key : keys) {
    tree.addNode(new Row(key, true));
  }
  std::vector<Row> probes;
  probes.reserve(keys.size());
  for (long key : ShuffledKeys(state.range(0))) {
    probes.emplace_back(key, false);
  }
  size_t next = 0;
  for (auto _ : state) {
    benchmark::DoNotOptimize(tree.findNode(&probes[next]));
    if (++next == probes.size()) {
      next = 0;
    }
  }
  state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_TreeFind)->Arg(1000)->Arg(100000)->Arg(1000000);

}  // namespace
