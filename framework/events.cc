#include "framework/events.h"

#include <algorithm>
#include <cctype>
#include <map>
#include <utility>

#include "framework/mutex.h"
#include "framework/status.h"

namespace fw {
namespace {

std::string Key(std::string_view table) {
  std::string key(table);
  for (char& c : key) {
    c = static_cast<char>(std::toupper(static_cast<unsigned char>(c)));
  }
  return key;
}

struct EventHub {
  // Rows are delivered to subscriptions while mutex is held, so every subscriber sees rows in
  // sequence order.
  Mutex mutex;
  std::map<std::string, std::deque<EventRow>> rings GUARDED_BY(mutex);  // by upper-case name
  std::vector<std::weak_ptr<EventSubscription>> subscriptions GUARDED_BY(mutex);
  std::uint64_t last_sequence GUARDED_BY(mutex) = 0;
};

// A function-local static, so rows may be pushed during start-up before anything else runs.
EventHub& Hub() {
  static EventHub hub;
  return hub;
}

}  // namespace

namespace {

// The subscriptions still open, after dropping those whose owners are gone.
std::vector<std::shared_ptr<EventSubscription>> LiveSubscriptions(EventHub& hub)
    REQUIRES(hub.mutex) {
  std::vector<std::shared_ptr<EventSubscription>> live;
  std::erase_if(hub.subscriptions, [&](const std::weak_ptr<EventSubscription>& weak) {
    std::shared_ptr<EventSubscription> subscription = weak.lock();
    if (subscription == nullptr) {
      return true;
    }
    live.push_back(std::move(subscription));
    return false;
  });
  return live;
}

// Keeps a delivered row in its table's ring, the oldest beyond the capacity dropped.
void Keep(EventHub& hub, EventRow row) REQUIRES(hub.mutex) {
  std::deque<EventRow>& ring = hub.rings[Key(row.table)];
  ring.push_back(std::move(row));
  if (ring.size() > kEventRingCapacity) {
    ring.pop_front();
  }
}

}  // namespace

int PushEventRows(std::string_view table, const void* rows, std::size_t row_size, int count) {
  if (table.empty() || rows == nullptr || row_size == 0 || count < 1) {
    return kInvalidArgument;
  }
  EventHub& hub = Hub();
  MutexLock lock(hub.mutex);
  const std::vector<std::shared_ptr<EventSubscription>> live = LiveSubscriptions(hub);
  const auto* bytes = static_cast<const std::byte*>(rows);
  for (int i = 0; i < count; ++i) {
    EventRow row;
    row.table = std::string(table);
    row.sequence = ++hub.last_sequence;
    const std::byte* start = bytes + static_cast<std::size_t>(i) * row_size;
    row.bytes.assign(start, start + row_size);
    for (const auto& subscription : live) {
      subscription->Deliver(row);
    }
    Keep(hub, std::move(row));
  }
  return kOk;
}

int PushEventJson(std::string_view stream, nlohmann::ordered_json event) {
  if (stream.empty() || !event.is_object()) {
    return kInvalidArgument;
  }
  EventHub& hub = Hub();
  MutexLock lock(hub.mutex);
  EventRow row;
  row.table = std::string(stream);
  row.sequence = ++hub.last_sequence;
  row.json = std::move(event);
  for (const auto& subscription : LiveSubscriptions(hub)) {
    subscription->Deliver(row);
  }
  Keep(hub, std::move(row));
  return kOk;
}

std::vector<EventRow> ListEventRows(std::string_view table) {
  EventHub& hub = Hub();
  MutexLock lock(hub.mutex);
  const auto it = hub.rings.find(Key(table));
  if (it == hub.rings.end()) {
    return {};
  }
  return {it->second.begin(), it->second.end()};
}

std::vector<EventRow> ListAllEventRows() {
  std::vector<EventRow> all;
  {
    EventHub& hub = Hub();
    MutexLock lock(hub.mutex);
    for (const auto& [name, ring] : hub.rings) {
      all.insert(all.end(), ring.begin(), ring.end());
    }
  }
  std::sort(all.begin(), all.end(),
            [](const EventRow& a, const EventRow& b) { return a.sequence < b.sequence; });
  return all;
}

std::shared_ptr<EventSubscription> SubscribeEvents() {
  std::shared_ptr<EventSubscription> subscription(new EventSubscription());
  EventHub& hub = Hub();
  MutexLock lock(hub.mutex);
  hub.subscriptions.push_back(subscription);
  return subscription;
}

void ResetEventsForTesting() {
  EventHub& hub = Hub();
  MutexLock lock(hub.mutex);
  hub.rings.clear();
}

void EventSubscription::Deliver(const EventRow& row) {
  {
    MutexLock lock(mutex_);
    if (closed_) {
      return;
    }
    waiting_.push_back(row);
    if (waiting_.size() > kEventRingCapacity) {
      waiting_.pop_front();
    }
  }
  ready_.NotifyAll();
}

bool EventSubscription::Next(EventRow* row, std::chrono::milliseconds timeout) {
  MutexLock lock(mutex_);
  ready_.WaitFor(mutex_, timeout,
                 [this]() REQUIRES(mutex_) { return closed_ || !waiting_.empty(); });
  if (closed_ || waiting_.empty()) {
    return false;
  }
  *row = std::move(waiting_.front());
  waiting_.pop_front();
  return true;
}

void EventSubscription::Close() {
  {
    MutexLock lock(mutex_);
    closed_ = true;
    waiting_.clear();
  }
  ready_.NotifyAll();
}

bool EventSubscription::closed() const {
  MutexLock lock(mutex_);
  return closed_;
}

}  // namespace fw
