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

void PutEntries(std::string* out, uint8_t kind, const LatencyBook::Entries& entries) {
  for (const auto& [key, entry] : entries) {
    Put(out, kind);
    Put(out, static_cast<uint32_t>(key.size()));
    out->append(key);
    Put(out, entry.thresholdMillis);
    Put(out, entry.satisfied);
    Put(out, entry.tolerating);
    const std::string sketch = entry.sketch.encode();
    Put(out, static_cast<uint32_t>(sketch.size()));
    out->append(sketch);
  }
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

void LatencyBook::add(std::string_view application, std::string_view transaction,
                      int32_t thresholdMillis, double millis) {
  LatencyEntry& app = EntryOf(applications_, application);
  if (app.sketch.empty()) {
    app.thresholdMillis = thresholdMillis;
  }
  app.add(millis);
  // One key buffer per thread: building the key must not allocate for every request.
  thread_local std::string key;
  key.assign(application).push_back('\0');
  key.append(transaction);
  LatencyEntry& tx = EntryOf(transactions_, key);
  if (tx.sketch.empty()) {
    tx.thresholdMillis = thresholdMillis;
  }
  tx.add(millis);
}

void LatencyBook::merge(const LatencyBook& other) {
  for (const auto& [key, entry] : other.applications_) {
    EntryOf(applications_, key).merge(entry);
  }
  for (const auto& [key, entry] : other.transactions_) {
    EntryOf(transactions_, key).merge(entry);
  }
}

void LatencyBook::clear() {
  applications_.clear();
  transactions_.clear();
}

std::string LatencyBook::encode() const {
  std::string out(kMagic, sizeof(kMagic));
  Put(&out, static_cast<uint64_t>(applications_.size() + transactions_.size()));
  PutEntries(&out, kApplicationKind, applications_);
  PutEntries(&out, kTransactionKind, transactions_);
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
    const std::string_view key = bytes.substr(0, keyLength);
    bytes.remove_prefix(keyLength);
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
    Entries& entries = kind == kApplicationKind ? read.applications_ : read.transactions_;
    if (!entries.emplace(std::string(key), std::move(entry)).second) {
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
