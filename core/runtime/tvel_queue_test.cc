#include "core/runtime/tvel_queue.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdlib>
#include <functional>
#include <thread>
#include <vector>

#include "core/runtime/cvel_status.h"
#include "core/runtime/typed_transaction.h"
#include "tests/support/test_util.h"

namespace {

using Clock = std::chrono::steady_clock;
using Queue = TvelQueue<_TYPED_TRANSACTION>;

// How long a thread that should stay blocked is watched before we accept that it is blocked.
constexpr auto kBlockedWindow = std::chrono::milliseconds(100);

_TYPED_TRANSACTION Item(uint32_t sequence) {
  return _TYPED_TRANSACTION{sequence, nullptr};
}

// Takes every item left (the queue does not free queued items) and returns their codes.
std::vector<uint32_t> Drain(Queue& queue) {
  std::vector<uint32_t> codes;
  _TYPED_TRANSACTION item;
  while (!queue.IsEmpty() && queue.Get(item, 1000) == cvel::kOk) {
    codes.push_back(item.type);
  }
  return codes;
}

// Items leave in the order they came, across the wrap from slot 2047 to slot 0.
TEST(TvelQueueTest, FifoAcrossRingWrap) {
  Queue queue;
  _TYPED_TRANSACTION item;
  for (uint32_t i = 0; i < 2000; ++i) {
    ASSERT_EQ(cvel::kOk, queue.Put(Item(i)));
  }
  for (uint32_t i = 0; i < 2000; ++i) {
    ASSERT_EQ(cvel::kOk, queue.Get(item, 1000));
    ASSERT_EQ(i, item.type);
  }
  EXPECT_TRUE(queue.IsEmpty());
  for (uint32_t i = 0; i < 100; ++i) {  // slots 2000..2047, then 0..51
    ASSERT_EQ(cvel::kOk, queue.Put(Item(5000 + i)));
  }
  std::vector<uint32_t> expected;
  for (uint32_t i = 0; i < 100; ++i) {
    expected.push_back(5000 + i);
  }
  EXPECT_EQ(expected, Drain(queue));
}

// Batches take what single Gets would, in the same order: random puts and batch sizes over a
// small ring (wrapping often), a full queue emptied by one batch letting a blocked producer
// in, and the timeout code when nothing comes.
TEST(TvelQueueTest, GetBatchTakesWhatGetWould) {
  Queue queue(7);
  std::srand(3);
  uint32_t next = 0;
  uint32_t expected = 0;
  _TYPED_TRANSACTION out[10];
  for (int round = 0; round < 2000; ++round) {
    for (int n = std::rand() % 8; n > 0 && !queue.IsFull(); --n) {
      ASSERT_EQ(cvel::kOk, queue.Put(Item(next++)));
    }
    if (queue.IsEmpty()) {
      continue;
    }
    const long queued = queue.Size();
    const unsigned long max = 1 + static_cast<unsigned long>(std::rand()) % 10;
    const long taken = queue.GetBatch(out, max, 1000);
    ASSERT_EQ(std::min<long>(queued, static_cast<long>(max)), taken);
    for (long i = 0; i < taken; ++i) {
      ASSERT_EQ(expected++, out[i].type);
    }
    ASSERT_EQ(queued - taken, queue.Size());
  }
  std::vector<uint32_t> rest = Drain(queue);
  for (uint32_t code : rest) {
    ASSERT_EQ(expected++, code);
  }
  EXPECT_EQ(next, expected);

  for (uint32_t i = 0; i < 7; ++i) {
    ASSERT_EQ(cvel::kOk, queue.Put(Item(i)));
  }
  std::atomic<bool> putDone{false};
  std::thread producer([&] {
    queue.Put(Item(7));
    putDone = true;
  });
  EXPECT_EQ(7, queue.GetBatch(out, 10, 1000));
  ASSERT_TRUE(q7test::PollUntil([&] { return putDone.load(); }, std::chrono::seconds(10)));
  producer.join();
  EXPECT_EQ(1, queue.GetBatch(out, 10, 1000));
  EXPECT_EQ(7u, out[0].type);
  EXPECT_EQ(-132, queue.GetBatch(out, 10, 10));
  EXPECT_EQ(0, queue.GetBatch(out, 0, 10));
}

// Batches put in what single Puts would, in order, waiting for room as often as they must:
// a consumer taking random batches sees every item once, in order.
TEST(TvelQueueTest, PutBatchStoresWhatPutWould) {
  Queue queue(7);
  constexpr uint32_t kItems = 5000;
  std::thread consumer([&queue] {
    std::srand(5);
    _TYPED_TRANSACTION out[9];
    uint32_t expected = 0;
    while (expected < kItems) {
      // A loaded machine may starve this thread for seconds; a timeout here would leave the
      // producer blocked on the full queue for good.
      const long taken = queue.GetBatch(out, 1 + std::rand() % 9, 60000);
      ASSERT_GT(taken, 0);
      for (long i = 0; i < taken; ++i) {
        ASSERT_EQ(expected++, out[i].type);
      }
    }
  });
  std::vector<_TYPED_TRANSACTION> items;
  for (uint32_t next = 0; next < kItems;) {
    items.clear();
    for (int n = 1 + std::rand() % 20; n > 0 && next < kItems; --n) {
      items.push_back(Item(next++));
    }
    unsigned long stored = 0;
    ASSERT_EQ(cvel::kOk, queue.PutBatch(items.data(), items.size(), &stored));
    ASSERT_EQ(items.size(), stored);
  }
  consumer.join();
  EXPECT_TRUE(queue.IsEmpty());
}

// Get on an empty queue gives the timeout code and leaves the item alone.
TEST(TvelQueueTest, GetOnEmptyQueueTimesOut) {
  Queue queue;
  _TYPED_TRANSACTION item = Item(77);
  const auto start = Clock::now();
  EXPECT_EQ(cvel::kEventTimeout, queue.Get(item, 1500));
  EXPECT_LT(Clock::now() - start, std::chrono::seconds(5));
  EXPECT_EQ(77u, item.type);
}

// The 2049th Put waits for room and stores its item after the others once a Get makes some.
TEST(TvelQueueTest, PutBeyondCapacityBlocksUntilGet) {
  Queue queue;
  for (uint32_t i = 0; i < Queue::kMaxItems; ++i) {
    ASSERT_EQ(cvel::kOk, queue.Put(Item(i)));
  }
  EXPECT_TRUE(queue.IsFull());
  std::atomic<bool> stored{false};
  std::thread producer([&] { stored = queue.Put(Item(Queue::kMaxItems)) == cvel::kOk; });
  std::this_thread::sleep_for(kBlockedWindow);
  EXPECT_FALSE(stored.load());

  _TYPED_TRANSACTION item;
  ASSERT_EQ(cvel::kOk, queue.Get(item, 1000));
  EXPECT_EQ(0u, item.type);
  EXPECT_TRUE(q7test::PollUntil([&] { return stored.load(); }, std::chrono::seconds(10)));
  producer.join();
  const std::vector<uint32_t> rest = Drain(queue);
  ASSERT_EQ(Queue::kMaxItems, rest.size());
  EXPECT_EQ(1u, rest.front());
  EXPECT_EQ(Queue::kMaxItems, rest.back());
}

// One Get on a full queue wakes all blocked producers; exactly one of them takes the free slot
// and the others go back to waiting.
TEST(TvelQueueTest, EachFreeSlotTakesExactlyOneBlockedProducer) {
  constexpr unsigned long kCapacity = 8;
  constexpr int kProducers = 4;
  Queue queue(kCapacity);
  for (uint32_t i = 0; i < kCapacity; ++i) {
    ASSERT_EQ(cvel::kOk, queue.Put(Item(i)));
  }
  std::atomic<int> started{0};
  std::atomic<int> stored{0};
  std::vector<std::thread> producers;
  for (int p = 0; p < kProducers; ++p) {
    producers.emplace_back([&, p] {
      ++started;
      if (queue.Put(Item(100 + p)) == cvel::kOk) {
        ++stored;
      }
    });
  }
  ASSERT_TRUE(
      q7test::PollUntil([&] { return started.load() == kProducers; }, std::chrono::seconds(10)));
  std::this_thread::sleep_for(kBlockedWindow);
  ASSERT_EQ(0, stored.load());

  _TYPED_TRANSACTION item;
  for (int freed = 1; freed <= kProducers; ++freed) {
    ASSERT_EQ(cvel::kOk, queue.Get(item, 1000));
    ASSERT_TRUE(
        q7test::PollUntil([&] { return stored.load() >= freed; }, std::chrono::seconds(10)));
    std::this_thread::sleep_for(kBlockedWindow);  // the woken rest must not squeeze in
    EXPECT_EQ(freed, stored.load());
    EXPECT_TRUE(queue.IsFull());
  }
  for (std::thread& producer : producers) {
    producer.join();
  }
  EXPECT_EQ(kCapacity, Drain(queue).size());
}

// Several producers through a small queue: nothing lost or duplicated, each producer's items
// in its own order.
TEST(TvelQueueTest, SeveralProducersKeepTheirOwnOrder) {
  constexpr int kProducers = 4;
  constexpr uint32_t kPerProducer = 20000;
  Queue queue(16);
  std::vector<std::thread> producers;
  for (uint32_t p = 0; p < kProducers; ++p) {
    producers.emplace_back([&queue, p] {
      for (uint32_t i = 0; i < kPerProducer; ++i) {
        ASSERT_EQ(cvel::kOk, queue.Put(Item(p << 24 | i)));
      }
    });
  }
  std::vector<uint32_t> next(kProducers, 0);
  _TYPED_TRANSACTION item;
  for (uint32_t taken = 0; taken < kProducers * kPerProducer; ++taken) {
    ASSERT_EQ(cvel::kOk, queue.Get(item, 5000));
    const uint32_t producer = item.type >> 24;
    ASSERT_LT(producer, kProducers);
    ASSERT_EQ(next[producer], item.type & 0xFFFFFF);
    ++next[producer];
  }
  for (std::thread& producer : producers) {
    producer.join();
  }
  EXPECT_TRUE(queue.IsEmpty());
}

}  // namespace
