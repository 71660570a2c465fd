#include "core/analyzer/analysis/latency_book.h"

#include <memory>

#include "core/analyzer/analysis/byte_codec.h"
#include "core/history/checkpoint_file.h"
#include "core/history/history_store.h"
#include "core/runtime/clog.h"

namespace {

using bytecodec::Put;
using bytecodec::Take;

constexpr char kMagic[] = {'q', '7', 'l', 'b', 1};
constexpr uint8_t kApplicationKind = 0;
constexpr uint8_t kTransactionKind = 1;

LatencyEntry& EntryOf(LatencyBook::Entries& entries, std::string_view key) {
  const auto found = entries.find(key);
  if (found != entries.end()) {
    return found->second;
  }
  return entries.emplace(std::string(key), LatencyEntry{}).first->second;
}

void PutKey(std::string* out, uint8_t kind, std::string_view key) {
  Put(out, kind);
  Put(out, static_cast<uint32_t>(key.size()));
  out->append(key);
}

}  // namespace

void LatencyEntry::add(double millis) {
  sketch.add(millis);
  if (millis <= thresholdMillis) {
    ++satisfied;
  } else if (millis <= 4.0 * thresholdMillis) {
    ++tolerating;
  }
}

void LatencyEntry::merge(const LatencyEntry& other) {
  if (other.sketch.empty()) {
    return;
  }
  sketch.merge(other.sketch);
  satisfied += other.satisfied;
  tolerating += other.tolerating;
  thresholdMillis = other.thresholdMillis;
}

double LatencyEntry::apdex() const {
  if (sketch.empty()) {
    return 1;
  }
  return (static_cast<double>(satisfied) + static_cast<double>(tolerating) / 2) /
         static_cast<double>(sketch.count());
}

std::string LatencyBook::transactionKey(std::string_view application,
                                        std::string_view transaction) {
  std::string key;
  key.reserve(application.size() + 1 + transaction.size());
  key.append(application).push_back('\0');
  key.append(transaction);
  return key;
}

std::pair<std::string_view, std::string_view> LatencyBook::splitKey(std::string_view key) {
  const size_t nul = key.find('\0');
  if (nul == std::string_view::npos) {
    return {key, {}};
  }
  return {key.substr(0, nul), key.substr(nul + 1)};
}

const LatencyEntry& LatencyBook::add(std::string_view application, std::string_view transaction,
                                     int32_t thresholdMillis, double millis) {
  // One key buffer per thread: building the key must not allocate for every request.
  thread_local std::string key;
  key.assign(application).push_back('\0');
  key.append(transaction);
  LatencyEntry& tx = EntryOf(transactions_, key);
  if (tx.sketch.empty()) {
    tx.thresholdMillis = thresholdMillis;
    if (thresholds_.find(application) == thresholds_.end()) {
      thresholds_.emplace(std::string(application), thresholdMillis);
    }
  }
  tx.add(millis);
  return tx;
}

LatencyBook::Entries LatencyBook::applications() const {
  Entries out;
  for (const auto& [key, entry] : transactions_) {
    const std::string_view application = splitKey(key).first;
    LatencyEntry& app = EntryOf(out, application);
    app.sketch.merge(entry.sketch);
    app.satisfied += entry.satisfied;
    app.tolerating += entry.tolerating;
  }
  for (auto& [application, entry] : out) {
    const auto threshold = thresholds_.find(application);
    entry.thresholdMillis = threshold != thresholds_.end() ? threshold->second : 0;
  }
  return out;
}

void LatencyBook::merge(const LatencyBook& other) {
  for (const auto& [key, entry] : other.transactions_) {
    EntryOf(transactions_, key).merge(entry);
  }
  for (const auto& [application, threshold] : other.thresholds_) {
    thresholds_[application] = threshold;
  }
}

void LatencyBook::clear() {
  thresholds_.clear();
  transactions_.clear();
}

std::string LatencyBook::encode() const {
  std::string out(kMagic, sizeof(kMagic));
  Put(&out, static_cast<uint64_t>(thresholds_.size() + transactions_.size()));
  for (const auto& [application, threshold] : thresholds_) {
    PutKey(&out, kApplicationKind, application);
    Put(&out, threshold);
  }
  for (const auto& [key, entry] : transactions_) {
    PutKey(&out, kTransactionKind, key);
    Put(&out, entry.thresholdMillis);
    Put(&out, entry.satisfied);
    Put(&out, entry.tolerating);
    const std::string sketch = entry.sketch.encode();
    Put(&out, static_cast<uint32_t>(sketch.size()));
    out.append(sketch);
  }
  return out;
}

bool LatencyBook::decode(std::string_view bytes, LatencyBook* book) {
  if (bytes.substr(0, sizeof(kMagic)) != std::string_view(kMagic, sizeof(kMagic))) {
    return false;
  }
  bytes.remove_prefix(sizeof(kMagic));
  uint64_t n = 0;
  if (!Take(&bytes, &n)) {
    return false;
  }
  LatencyBook read;
  for (uint64_t i = 0; i < n; ++i) {
    uint8_t kind = 0;
    uint32_t keyLength = 0;
    if (!Take(&bytes, &kind) || kind > kTransactionKind || !Take(&bytes, &keyLength) ||
        bytes.size() < keyLength) {
      return false;
    }
    const std::string key(bytes.substr(0, keyLength));
    bytes.remove_prefix(keyLength);
    if (kind == kApplicationKind) {
      int32_t threshold = 0;
      if (!Take(&bytes, &threshold) || !read.thresholds_.emplace(key, threshold).second) {
        return false;
      }
      continue;
    }
    LatencyEntry entry;
    uint32_t sketchLength = 0;
    if (!Take(&bytes, &entry.thresholdMillis) || !Take(&bytes, &entry.satisfied) ||
        !Take(&bytes, &entry.tolerating) || !Take(&bytes, &sketchLength) ||
        bytes.size() < sketchLength ||
        !LatencySketch::decode(bytes.substr(0, sketchLength), &entry.sketch) ||
        entry.satisfied > entry.sketch.count() ||
        entry.tolerating > entry.sketch.count() - entry.satisfied) {
      return false;
    }
    bytes.remove_prefix(sketchLength);
    if (!read.transactions_.emplace(key, std::move(entry)).second) {
      return false;  // a key twice: not a book this wrote
    }
  }
  if (!bytes.empty()) {
    return false;
  }
  *book = std::move(read);
  return true;
}

bool LatencyBook::save(history::HistoryStore& store, long interval) const {
  if (empty()) {
    return store.saveInterval(interval, kStem, nullptr, 1, 0);
  }
  const std::string bytes = encode();
  return store.saveInterval(interval, kStem, bytes.data(), 1, bytes.size());
}

void LatencyBook::load(const history::HistoryStore& store, long interval) {
  const std::vector<std::byte> bytes = store.loadInterval(interval, kStem, 1);
  if (bytes.empty()) {
    return;
  }
  LatencyBook saved;
  if (!decode(std::string_view(reinterpret_cast<const char*>(bytes.data()), bytes.size()),
              &saved)) {
    CLOG::error(
        "%s the latency file of interval[%ld] (%s) does not decode; its percentiles are "
        "left out",
        "LatencyBook::load", interval, store.pathOf(interval, kStem).c_str());
    return;
  }
  merge(saved);
}

history::RecordSection LatencyBook::section() const {
  auto bytes = std::make_shared<const std::string>(encode());
  return {kStem, 1, bytes->size(), [bytes](size_t first, size_t n, void* out) {
            std::memcpy(out, bytes->data() + first, n);
          }};
}

bool LatencyBook::loadSection(const history::LoadedSection& section) {
  LatencyBook saved;
  if (section.record_size != 1 ||
      !decode(std::string_view(reinterpret_cast<const char*>(section.records.data()),
                               section.records.size()),
              &saved)) {
    return false;
  }
  merge(saved);
  return true;
}
