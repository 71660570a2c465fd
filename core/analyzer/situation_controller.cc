#include "core/analyzer/situation_controller.h"

#include <errno.h>
#include <fcntl.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cassert>
#include <new>
#include <utility>

#include "core/analyzer/pattern_overlap.h"
#include "core/runtime/clog.h"
#include "core/runtime/misc.h"
#include "core/runtime/set_aside.h"
#include "framework/atomic_file.h"
#include "framework/file_io.h"
#include "framework/status.h"

// Pattern files: a format version word (uint32, host byte order) followed by fixed-size records
// in matching order. Texts take their full field width, NUL-padded; numbers are in host byte
// order. Counters are not kept: they start again at zero.
//
// tpatterns.dat record (1044 bytes):
//     0 applicationName[129]     129 applicationPattern[256]   385 transactionName[129]
//   514 transactionPattern[256]  770 aggappsuniq i16            772 aggtxsuniq i16
//   774 mrtthres i32             778 collectInstances i16       780 samplePercent i32
//   784 orderingKey i16          786 importance i16             788 situationId[256]
// cpatterns.dat record (899 bytes):
//     0 clientName[129]          129 hostNamePattern[256]      385 ipAddressPattern[256]
//   641 aggregateUniquely i16    643 situationId[256]

namespace {

constexpr uint32_t kFormatVersion = 1;
constexpr size_t kVersionSize = sizeof(uint32_t);
constexpr size_t kTransactionRecordSize = 2 * kPatternNameWidth + 2 * kPatternTextWidth +
                                          5 * sizeof(int16_t) + 2 * sizeof(int32_t) +
                                          kSituationIdWidth;
constexpr size_t kClientRecordSize =
    kPatternNameWidth + 2 * kPatternTextWidth + sizeof(int16_t) + kSituationIdWidth;
static_assert(kTransactionRecordSize == 1044 && kClientRecordSize == 899);

constexpr const char* kTransactionFileName = "tpatterns.dat";
constexpr const char* kClientFileName = "cpatterns.dat";

// Appends fields at their on-disk widths.
class RecordWriter {
 public:
  explicit RecordWriter(std::string* out) : out_(out) {}
  template <size_t N>
  void text(const char (&field)[N]) {
    const size_t n = strnlen(field, N - 1);
    out_->append(field, n);
    out_->append(N - n, '\0');
  }
  template <typename T>
  void number(T value) {
    out_->append(reinterpret_cast<const char*>(&value), sizeof(value));
  }

 private:
  std::string* out_;
};

// Reads fields back; the caller has checked that a whole record is there.
class RecordReader {
 public:
  explicit RecordReader(const char* at) : at_(at) {}
  template <size_t N>
  void text(char (&field)[N]) {
    memcpy(field, at_, N);
    field[N - 1] = '\0';
    at_ += N;
  }
  template <typename T>
  void number(T* value) {
    memcpy(value, at_, sizeof(T));
    at_ += sizeof(T);
  }

 private:
  const char* at_;
};

void WriteRecord(const TransactionPattern& p, RecordWriter* w) {
  w->text(p.applicationName);
  w->text(p.applicationPattern);
  w->text(p.transactionName);
  w->text(p.transactionPattern);
  w->number(p.aggappsuniq);
  w->number(p.aggtxsuniq);
  w->number(p.mrtthres);
  w->number(p.collectInstances);
  w->number(p.samplePercent);
  w->number(p.orderingKey);
  w->number(p.importance);
  w->text(p.situationId);
}

void ReadRecord(RecordReader* r, TransactionPattern* p) {
  r->text(p->applicationName);
  r->text(p->applicationPattern);
  r->text(p->transactionName);
  r->text(p->transactionPattern);
  r->number(&p->aggappsuniq);
  r->number(&p->aggtxsuniq);
  r->number(&p->mrtthres);
  r->number(&p->collectInstances);
  r->number(&p->samplePercent);
  r->number(&p->orderingKey);
  r->number(&p->importance);
  r->text(p->situationId);
}

void WriteRecord(const ClientPattern& p, RecordWriter* w) {
  w->text(p.clientName);
  w->text(p.hostNamePattern);
  w->text(p.ipAddressPattern);
  w->number(p.aggregateUniquely);
  w->text(p.situationId);
}

void ReadRecord(RecordReader* r, ClientPattern* p) {
  r->text(p->clientName);
  r->text(p->hostNamePattern);
  r->text(p->ipAddressPattern);
  r->number(&p->aggregateUniquely);
  r->text(p->situationId);
}

std::string StartImage() {
  std::string image;
  RecordWriter(&image).number(kFormatVersion);
  return image;
}

bool Later(const timespec& a, const timespec& b) {
  return a.tv_sec != b.tv_sec ? a.tv_sec > b.tv_sec : a.tv_nsec > b.tv_nsec;
}

// How many whole records an image holds after its version word, or -1 (traced) when it is not a
// pattern file of this format. An empty image holds none.
long RecordCount(const std::string& image, size_t recordSize, const char* path) {
  if (image.empty()) {
    return 0;
  }
  uint32_t version = 0;
  if (image.size() >= kVersionSize) {
    RecordReader(image.data()).number(&version);
  }
  if (version != kFormatVersion) {
    CLOG::error("%s: %s: format version %u, expected %u; patterns kept",
                "CSituationController::loadPatternsIfNewer", path, version, kFormatVersion);
    return -1;
  }
  if ((image.size() - kVersionSize) % recordSize != 0) {
    CLOG::error("%s: %s: %zu bytes is not a whole number of %zu-byte records; patterns kept",
                "CSituationController::loadPatternsIfNewer", path, image.size(), recordSize);
    return -1;
  }
  return static_cast<long>((image.size() - kVersionSize) / recordSize);
}

// Reads the file when it changed since file.loaded: true with *image set when it did.
template <typename File>
bool ReadIfNewer(File& file, std::string* image) REQUIRES(file.mutex) {
  static constexpr const char* kWhere = "CSituationController::loadPatternsIfNewer";
  fw::UniqueFd fd(::open(file.path.c_str(), O_RDONLY | O_CLOEXEC));
  if (!fd.valid()) {
    if (errno != ENOENT) {
      CLOG::error("%s: cannot open %s: %s", kWhere, file.path.c_str(), strerror(errno));
    }
    return false;
  }
  struct stat st {};
  if (::fstat(fd.get(), &st) != 0) {
    CLOG::error("%s: cannot examine %s: %s", kWhere, file.path.c_str(), strerror(errno));
    return false;
  }
  if (!Later(st.st_mtim, file.loaded)) {
    return false;
  }
  // Counted as read even if it turns out unusable, so a bad file is reported once, not at
  // every rollover.
  file.loaded = st.st_mtim;
  image->resize(static_cast<size_t>(st.st_size));
  if (fw::ReadAt(fd.get(), image->data(), image->size(), 0) !=
      static_cast<ssize_t>(image->size())) {
    CLOG::error("%s: cannot read %s: %s", kWhere, file.path.c_str(), strerror(errno));
    return false;
  }
  return true;
}

// What tells the two kinds of pattern apart where they are otherwise handled alike.
template <typename Pattern>
struct Kind;

template <>
struct Kind<TransactionPattern> {
  static constexpr size_t kRecordSize = kTransactionRecordSize;
  static constexpr const char* kNoun = "transaction";
  static const char* first(const TransactionPattern& p) { return p.applicationPattern; }
  static const char* second(const TransactionPattern& p) { return p.transactionPattern; }
  // Sets the ordering key and clears the counters of a pattern about to be stored.
  static void prepare(TransactionPattern* p) {
    p->orderingKey =
        static_cast<int16_t>(strlen(p->applicationPattern) + strlen(p->transactionPattern));
    p->matchedCount = 0;
    p->sampledCount = 0;
  }
  // Where a new pattern goes: after every pattern whose key is greater or equal.
  template <typename Entries>
  static auto place(const Entries& entries, const TransactionPattern& p) {
    return std::find_if(entries.begin(), entries.end(),
                        [&](const auto& e) { return e.pattern->orderingKey < p.orderingKey; });
  }
};

template <>
struct Kind<ClientPattern> {
  static constexpr size_t kRecordSize = kClientRecordSize;
  static constexpr const char* kNoun = "client";
  static const char* first(const ClientPattern& p) { return p.hostNamePattern; }
  static const char* second(const ClientPattern& p) { return p.ipAddressPattern; }
  static void prepare(ClientPattern*) {}
  // Client patterns keep the order they came in.
  template <typename Entries>
  static auto place(const Entries& entries, const ClientPattern&) {
    return entries.end();
  }
};

// Compiles both patterns of entry->pattern; false, with no lists kept, when either matches
// nothing (or memory ran out).
template <typename E>
bool Compile(E* entry) {
  using K = Kind<typename decltype(E::pattern)::element_type>;
  entry->first.reset(CCommon::getParseInfo(K::first(*entry->pattern)));
  entry->second.reset(CCommon::getParseInfo(K::second(*entry->pattern)));
  if (entry->first == nullptr || entry->second == nullptr) {
    entry->first.reset();
    entry->second.reset();
    return false;
  }
  return true;
}

// The whole file image of entries.
template <typename E>
std::string Image(const std::vector<E>& entries) {
  using K = Kind<typename decltype(E::pattern)::element_type>;
  std::string image = StartImage();
  image.reserve(kVersionSize + entries.size() * K::kRecordSize);
  RecordWriter writer(&image);
  for (const E& e : entries) {
    WriteRecord(*e.pattern, &writer);
  }
  assert(image.size() == kVersionSize + entries.size() * K::kRecordSize &&
         "record layout out of step with its size");
  return image;
}

}  // namespace

CSituationController::CSituationController(std::string directory)
    : directory_(std::move(directory)),
      transactionFile_(directory_ + "/" + kTransactionFileName),
      clientFile_(directory_ + "/" + kClientFileName) {}

CSituationController::~CSituationController() = default;

template <typename Pattern>
bool CSituationController::add(std::unique_ptr<Pattern>&& pattern, PatternFile& file,
                               std::vector<Entry<Pattern>>* entries) {
  using K = Kind<Pattern>;
  static constexpr const char* kWhere = "CSituationController::add";
  if (pattern == nullptr) {
    return false;
  }
  Entry<Pattern> entry;
  entry.pattern = std::move(pattern);
  if (!Compile(&entry)) {
    CLOG::error("%s: situation %s: %s pattern [%s] [%s] matches nothing; not added", kWhere,
                entry.pattern->situationId, K::kNoun, K::first(*entry.pattern),
                K::second(*entry.pattern));
    pattern = std::move(entry.pattern);  // a refused pattern stays with the caller
    return false;
  }
  K::prepare(entry.pattern.get());
  // Stays alive after mutex_ is let go: only holders of file.mutex take patterns away.
  const Pattern& added = *entry.pattern;

  CvelMutexLock fileLock(file.mutex);
  std::string image;
  size_t at = 0;
  size_t count = 0;
  {
    CvelMutexLock lock(mutex_);
    const auto before = K::place(*entries, added);
    at = static_cast<size_t>(before - entries->begin());
    entries->insert(before, std::move(entry));
    count = entries->size();
    image = Image(*entries);
    reindex(*entries);
  }
  CLOG::med("%s: situation %s: %s pattern [%s] [%s] placed %zu of %zu", kWhere, added.situationId,
            K::kNoun, K::first(added), K::second(added), at + 1, count);
  write(file, image);
  return true;
}

bool CSituationController::addTransactionPattern(std::unique_ptr<TransactionPattern>&& pattern) {
  return add(std::move(pattern), transactionFile_, &transactions_);
}

bool CSituationController::addClientPattern(std::unique_ptr<ClientPattern>&& pattern) {
  return add(std::move(pattern), clientFile_, &clients_);
}

template <typename Pattern>
std::optional<Pattern> CSituationController::findOverlap(
    const Pattern& candidate,
    const std::vector<Entry<Pattern>> CSituationController::*entries) const {
  using K = Kind<Pattern>;
  // Deciding an overlap can take milliseconds for long patterns; the search runs on copies so
  // that matching never waits for it.
  std::vector<Pattern> stored;
  {
    CvelMutexLock lock(mutex_);
    stored.reserve((this->*entries).size());
    for (const Entry<Pattern>& e : this->*entries) {
      stored.push_back(*e.pattern);
    }
  }
  const ListPtr first(CCommon::getParseInfo(K::first(candidate)));
  const ListPtr second(CCommon::getParseInfo(K::second(candidate)));
  for (const Pattern& p : stored) {
    if (patternsOverlap(K::first(candidate), first.get(), K::first(p), nullptr) &&
        patternsOverlap(K::second(candidate), second.get(), K::second(p), nullptr)) {
      return p;
    }
  }
  return std::nullopt;
}

std::optional<TransactionPattern> CSituationController::findOverlappingTransactionPattern(
    const TransactionPattern& candidate) const {
  return findOverlap(candidate, &CSituationController::transactions_);
}

std::optional<ClientPattern> CSituationController::findOverlappingClientPattern(
    const ClientPattern& candidate) const {
  return findOverlap(candidate, &CSituationController::clients_);
}

template <typename Pattern>
int CSituationController::remove(const char* situationId, PatternFile& file,
                                 std::vector<Entry<Pattern>>* entries) {
  if (situationId == nullptr) {
    return 0;
  }
  CvelMutexLock fileLock(file.mutex);
  std::string image;
  size_t removed = 0;
  {
    CvelMutexLock lock(mutex_);
    removed = std::erase_if(*entries, [&](const Entry<Pattern>& e) {
      return strcmp(e.pattern->situationId, situationId) == 0;
    });
    if (removed > 0) {
      image = Image(*entries);
      reindex(*entries);
    }
  }
  if (removed > 0) {
    CLOG::med("%s: situation %s: %zu %s patterns removed", "CSituationController::remove",
              situationId, removed, Kind<Pattern>::kNoun);
    write(file, image);
  }
  return static_cast<int>(removed);
}

int CSituationController::removeTransactionPatterns(const char* situationId) {
  return remove(situationId, transactionFile_, &transactions_);
}

int CSituationController::removeClientPatterns(const char* situationId) {
  return remove(situationId, clientFile_, &clients_);
}

namespace {

// Appends a copy of pattern to a match list through *tail. Out of memory drops the match with
// a trace: the transaction is then treated as matching fewer patterns, never crashes.
template <class Node, class Pattern>
void AppendMatch(Node*** tail, const Pattern& pattern, const char* where, const char* text) {
  Node* node = new (std::nothrow) Node;
  if (node == nullptr) {
    CLOG::error("%s: out of memory; match of [%s] dropped", where, text);
    return;
  }
  node->pattern = pattern;
  **tail = node;
  *tail = &node->next;
}

}  // namespace

template <typename Pattern, typename Visit>
void CSituationController::forEachMatch(std::vector<Entry<Pattern>>& entries, PatternIndex& index,
                                        const char* first, const char* second, Visit visit) {
  using K = Kind<Pattern>;
  if (index.size() != entries.size() || !index.candidates(first, second, &candidates_)) {
    for (Entry<Pattern>& e : entries) {  // a text that is not ASCII: every pattern in order
      if (CCommon::patternMatches(K::first(*e.pattern), first, e.first.get()) &&
          CCommon::patternMatches(K::second(*e.pattern), second, e.second.get()) &&
          !visit(*e.pattern)) {
        return;
      }
    }
    return;
  }
  const std::string& a = index.foldedFirst();
  const std::string& b = index.foldedSecond();
  for (const uint32_t i : candidates_) {
    Entry<Pattern>& e = entries[i];
    if (CCommon::patternMatchesFolded(K::first(*e.pattern), first, a.data(), a.size(),
                                      e.first.get()) &&
        CCommon::patternMatchesFolded(K::second(*e.pattern), second, b.data(), b.size(),
                                      e.second.get()) &&
        !visit(*e.pattern)) {
      return;
    }
  }
}

TransactionMatch* CSituationController::matchTransactionPatterns(const char* applicationName,
                                                                 const char* transactionName,
                                                                 bool all, bool sample) {
  if (applicationName == nullptr || transactionName == nullptr) {
    return nullptr;
  }
  TransactionMatch* head = nullptr;
  TransactionMatch** tail = &head;
  CvelMutexLock lock(mutex_);
  forEachMatch(transactions_, transactionIndex_, applicationName, transactionName,
               [&](TransactionPattern& p) {
                 ++p.matchedCount;
                 bool taken = !sample;
                 if (sample && p.samplePercent > 0) {
                   // Single precision on purpose: which matches are taken must not drift from
                   // the counts operators already know (50 % takes the 2nd, 4th, ...).
                   const float step = 100.0f / static_cast<float>(p.samplePercent);
                   if (step <= static_cast<float>(p.matchedCount) -
                                   static_cast<float>(p.sampledCount) * step) {
                     ++p.sampledCount;
                     taken = true;
                   }
                 }
                 if (taken) {
                   AppendMatch(&tail, p, "CSituationController::matchTransactionPatterns",
                               p.transactionPattern);
                 }
                 return all;
               });
  return head;
}

ClientMatch* CSituationController::matchClientPatterns(const char* clientName,
                                                       const char* clientIPAddress, bool all) {
  if (clientName == nullptr || clientIPAddress == nullptr) {
    return nullptr;
  }
  ClientMatch* head = nullptr;
  ClientMatch** tail = &head;
  CvelMutexLock lock(mutex_);
  forEachMatch(clients_, clientIndex_, clientName, clientIPAddress, [&](const ClientPattern& p) {
    AppendMatch(&tail, p, "CSituationController::matchClientPatterns", p.hostNamePattern);
    return all;
  });
  return head;
}

void CSituationController::freeTransactionMatches(TransactionMatch* list) {
  while (list != nullptr) {
    TransactionMatch* next = list->next;
    delete list;
    list = next;
  }
}

void CSituationController::freeClientMatches(ClientMatch* list) {
  while (list != nullptr) {
    ClientMatch* next = list->next;
    delete list;
    list = next;
  }
}

int CSituationController::getTransactionPatternCount() const {
  CvelMutexLock lock(mutex_);
  return static_cast<int>(transactions_.size());
}

int CSituationController::getClientPatternCount() const {
  CvelMutexLock lock(mutex_);
  return static_cast<int>(clients_.size());
}

std::vector<TransactionPattern> CSituationController::getTransactionPatterns() const {
  CvelMutexLock lock(mutex_);
  std::vector<TransactionPattern> out;
  out.reserve(transactions_.size());
  for (const Entry<TransactionPattern>& e : transactions_) {
    out.push_back(*e.pattern);
  }
  return out;
}

std::vector<PatternCounter> CSituationController::getPatternCounters() const {
  CvelMutexLock lock(mutex_);
  std::vector<PatternCounter> out;
  out.reserve(transactions_.size());
  for (const Entry<TransactionPattern>& e : transactions_) {
    const TransactionPattern& p = *e.pattern;
    out.push_back({p.situationId, p.applicationPattern, p.transactionPattern, p.matchedCount,
                   p.sampledCount});
  }
  return out;
}

int CSituationController::restorePatternCounters(const std::vector<PatternCounter>& counters) {
  CvelMutexLock lock(mutex_);
  int set = 0;
  for (const PatternCounter& c : counters) {
    for (Entry<TransactionPattern>& e : transactions_) {
      TransactionPattern& p = *e.pattern;
      if (c.situationId == p.situationId && c.applicationPattern == p.applicationPattern &&
          c.transactionPattern == p.transactionPattern) {
        p.matchedCount = c.matched;
        p.sampledCount = c.sampled;
        ++set;
        break;
      }
    }
  }
  return set;
}

std::vector<ClientPattern> CSituationController::getClientPatterns() const {
  CvelMutexLock lock(mutex_);
  std::vector<ClientPattern> out;
  out.reserve(clients_.size());
  for (const Entry<ClientPattern>& e : clients_) {
    out.push_back(*e.pattern);
  }
  return out;
}

// ---- Persistence. ----

void CSituationController::write(PatternFile& file, const std::string& image) {
  static constexpr const char* kWhere = "CSituationController::write";
  // Readers see either the old patterns or all of the new ones; the modification time of what
  // we wrote is kept, so a write by someone else after ours is never mistaken for our own.
  fw::ReplaceResult result;
  std::string error;
  if (fw::ReplaceFile(file.path, image, {0644, ""}, &result, &error) != fw::kOk) {
    CLOG::error("%s: %s", kWhere, error.c_str());
    return;
  }
  file.loaded = result.modified;
}

template <typename Pattern>
void CSituationController::reindex(const std::vector<Entry<Pattern>>& entries) {
  using K = Kind<Pattern>;
  std::vector<std::pair<PatternIndex::Field, PatternIndex::Field>> pairs;
  pairs.reserve(entries.size());
  for (const Entry<Pattern>& e : entries) {
    pairs.push_back(
        {{K::first(*e.pattern), e.first.get()}, {K::second(*e.pattern), e.second.get()}});
  }
  indexOf(entries).build(pairs);
}

template <typename Pattern>
bool CSituationController::reload(PatternFile& file, std::vector<Entry<Pattern>>* entries) {
  using K = Kind<Pattern>;
  static constexpr const char* kWhere = "CSituationController::loadPatternsIfNewer";
  CvelMutexLock fileLock(file.mutex);
  std::string image;
  if (!ReadIfNewer(file, &image)) {
    return false;
  }
  const long count = RecordCount(image, K::kRecordSize, file.path.c_str());
  if (count < 0) {
    // The situations list registers its patterns again, which writes a new file.
    SetAsideTraced("Pattern file", file.path, "format version or size");
    return false;
  }
  std::vector<Entry<Pattern>> loaded;
  for (long i = 0; i < count; ++i) {
    RecordReader reader(image.data() + kVersionSize + i * K::kRecordSize);
    Entry<Pattern> entry;
    entry.pattern = std::make_unique<Pattern>();
    ReadRecord(&reader, entry.pattern.get());
    if (!Compile(&entry)) {
      CLOG::error("%s: %s: record %ld (situation %s) matches nothing; skipped", kWhere,
                  file.path.c_str(), i, entry.pattern->situationId);
      continue;
    }
    loaded.push_back(std::move(entry));
  }
  CLOG::min("%s: %s: %zu %s patterns", kWhere, file.path.c_str(), loaded.size(), K::kNoun);
  CvelMutexLock lock(mutex_);
  entries->swap(loaded);  // the old patterns go when loaded does, after the lock
  reindex(*entries);
  return true;
}

int CSituationController::loadPatternsIfNewer() {
  return static_cast<int>(reload(transactionFile_, &transactions_)) +
         static_cast<int>(reload(clientFile_, &clients_));
}
