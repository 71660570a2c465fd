#pragma once

// CSituationController: the transaction and client patterns that running situations registered.
// The analyzer matches every transaction against them to name its application, transaction and
// client; situations add and remove them; the pattern tables show them. The patterns survive a
// restart in two files of the historical data directory, tpatterns.dat and cpatterns.dat, and
// are read back from there when another writer changed them.
//
// Transaction patterns are kept in matching order: ordering key descending (longer patterns
// first), a new pattern after those with an equal key. Client patterns keep the order they were
// added in. The first pattern in that order that matches is the one a transaction gets.
//
// Thread safety: every public method may be called from any thread at any time. Matching holds
// the pattern lock only; adding and removing also write the file, holding that file's lock so
// that files are written in the order their contents were made. The object must outlive every
// call into it.

#include <time.h>

#include <cstddef>
#include <cstdint>
#include <cstring>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "core/analyzer/intake/common.h"
#include "core/analyzer/intake/pattern_index.h"
#include "core/runtime/cvel_mutex.h"

// Text field widths in bytes, the terminating NUL included. Texts are UTF-8.
inline constexpr int kPatternNameWidth = 129;  // reported names: at most 128 bytes
inline constexpr int kPatternTextWidth = 256;  // wildcard patterns: at most 255 bytes
inline constexpr int kSituationIdWidth = 256;  // situation names: at most 255 bytes

// TransactionPattern::collectInstances.
inline constexpr int16_t kCollectNoInstances = 0;
inline constexpr int16_t kCollectAllInstances = 1;
inline constexpr int16_t kCollectBadStatusInstances = 2;

// ClientPattern::aggregateUniquely; any other value aggregates by subnet.
inline constexpr int16_t kClientAggregateUnderName = 0;
inline constexpr int16_t kClientKeepOwnIdentity = 1;

// Copies text into a fixed text field, always terminated. Text too long for the field is cut
// before the first UTF-8 character that does not fit whole. A null text gives an empty field.
template <size_t N>
void setPatternText(char (&field)[N], const char* text) {
  size_t n = text != nullptr ? strnlen(text, N - 1) : 0;
  if (n == N - 1) {
    while (n > 0 && (static_cast<unsigned char>(text[n]) & 0xC0) == 0x80) {
      --n;  // text[n] continues a character that began before the cut
    }
  }
  if (n > 0) {
    memcpy(field, text, n);
  }
  field[n] = '\0';
}

// One transaction pattern of a situation. Plain data: copies are independent. The controller
// keeps the compiled form of each stored pattern beside it, never in it.
struct TransactionPattern {
  char applicationName[kPatternNameWidth] = {};  // reported for matching transactions
  char applicationPattern[kPatternTextWidth] = {};
  char transactionName[kPatternNameWidth] = {};  // reported for matching transactions
  char transactionPattern[kPatternTextWidth] = {};
  int16_t aggappsuniq = 0;       // non-zero: each transaction keeps its own application name
  int16_t aggtxsuniq = 0;        // non-zero: each transaction keeps its own transaction name
  int32_t mrtthres = 0;          // response-time threshold, ms
  int16_t collectInstances = 0;  // kCollect*
  int32_t samplePercent = 100;   // share of matches taken when sampling, 1..100
  uint32_t sampledCount = 0;     // matches taken by sampling so far
  uint32_t matchedCount = 0;     // matches so far
  int16_t orderingKey = 0;       // strlen(applicationPattern) + strlen(transactionPattern)
  int16_t importance = 0;
  char situationId[kSituationIdWidth] = {};  // the situation that registered the pattern
};

// One client pattern of a situation. Plain data: copies are independent.
struct ClientPattern {
  char clientName[kPatternNameWidth] = {};  // reported for matching clients
  char hostNamePattern[kPatternTextWidth] = {};
  char ipAddressPattern[kPatternTextWidth] = {};
  int16_t aggregateUniquely = 0;  // kClient*, any other value: by subnet
  char situationId[kSituationIdWidth] = {};
};

// A transaction pattern's counters, named by its situation and its two patterns, as a
// checkpoint keeps them: sampling takes every n-th match, so a resumed run must go on counting
// where the checkpoint's run was.
struct PatternCounter {
  std::string situationId;
  std::string applicationPattern;
  std::string transactionPattern;
  uint32_t matched = 0;
  uint32_t sampled = 0;
};

// A match result: a singly linked list of copies of the matching patterns, in matching order,
// taken under the controller's lock (counters as they stood right after this match). The list
// belongs to the caller until it hands it to CSituationController::freeTransactionMatches or
// freeClientMatches; nodes are never shared with the controller.
struct TransactionMatch {
  TransactionMatch* next = nullptr;
  TransactionPattern pattern;
};
struct ClientMatch {
  ClientMatch* next = nullptr;
  ClientPattern pattern;
};

class CSituationController {
 public:
  // directory: where the pattern files live (the agent's historical data directory); created
  // at the first write if missing. Nothing is read until loadPatternsIfNewer.
  explicit CSituationController(std::string directory);
  ~CSituationController();

  CSituationController(const CSituationController&) = delete;
  CSituationController& operator=(const CSituationController&) = delete;

  // Takes *pattern when both of its patterns compile to something that can match, sets its
  // ordering key, zeroes its counters, places it after every pattern with a greater or equal
  // key and rewrites tpatterns.dat. Returns false, leaving *pattern with the caller, for a null
  // pattern or one whose application or transaction pattern matches nothing ("", "**"): stored,
  // it would only ever be shown, never matched. A failed write is traced; the pattern stays.
  bool addTransactionPattern(std::unique_ptr<TransactionPattern>&& pattern);
  // The same for a client pattern, which goes after every existing one (cpatterns.dat).
  bool addClientPattern(std::unique_ptr<ClientPattern>&& pattern);

  // A copy of the first stored pattern, in matching order, that some transaction could match
  // together with candidate (some application name matches both application patterns and some
  // transaction name both transaction patterns), or nothing.
  std::optional<TransactionPattern> findOverlappingTransactionPattern(
      const TransactionPattern& candidate) const;
  // The same for client patterns: some host name matches both host-name patterns and some
  // address both address patterns.
  std::optional<ClientPattern> findOverlappingClientPattern(const ClientPattern& candidate) const;

  // Removes every pattern of the situation and rewrites the file when any went. Returns how many
  // were removed. A null situationId removes nothing.
  int removeTransactionPatterns(const char* situationId);
  int removeClientPatterns(const char* situationId);

  // Matches a transaction against the transaction patterns in order and counts the match. With
  // sample set, a matching pattern is taken only at the share of its matches its sample percent
  // asks for (the 2nd, 4th, ... at 50 %; none at 0 or below). Taken patterns are copied into the
  // result. Unless all is set, the walk ends at the first pattern that matched, taken or not.
  // Returns null when nothing is taken; free a list with freeTransactionMatches. Null names
  // match nothing.
  TransactionMatch* matchTransactionPatterns(const char* applicationName,
                                             const char* transactionName, bool all, bool sample);
  // Matches a client against the client patterns in order; the first match only unless all.
  // Returns null when nothing matches; free a list with freeClientMatches.
  ClientMatch* matchClientPatterns(const char* clientName, const char* clientIPAddress, bool all);

  // Free a whole match list; null is fine.
  static void freeTransactionMatches(TransactionMatch* list);
  static void freeClientMatches(ClientMatch* list);

  int getTransactionPatternCount() const;
  int getClientPatternCount() const;
  // Copies of every stored pattern in matching order, for the pattern tables.
  std::vector<TransactionPattern> getTransactionPatterns() const;
  std::vector<ClientPattern> getClientPatterns() const;

  // The counters of every stored transaction pattern, in matching order.
  std::vector<PatternCounter> getPatternCounters() const;
  // Sets the counters of each stored transaction pattern that counters names (same situation
  // and patterns); the others keep theirs. Returns how many were set.
  int restorePatternCounters(const std::vector<PatternCounter>& counters);

  // Reads each pattern file whose modification time is later than when this controller last
  // read or wrote it, replacing the patterns held with the file's (in the file's order, counters
  // at zero). An empty file, or one with no records, leaves no patterns; an unreadable file,
  // one with a wrong format version or a size that is not a whole number of records is traced
  // and leaves the patterns as they were (and is not read again until it changes). Returns how
  // many files replaced patterns (0, 1 or 2). Called at start and at each rollover.
  int loadPatternsIfNewer();

 private:
  struct ListDeleter {
    void operator()(_PARSE_INFO* list) const { CCommon::freeParseInfo(list); }
  };
  using ListPtr = std::unique_ptr<_PARSE_INFO, ListDeleter>;

  // A stored pattern with its two compiled patterns, both non-null: the application and the
  // transaction pattern, or the host-name and the address pattern.
  template <typename Pattern>
  struct Entry {
    std::unique_ptr<Pattern> pattern;
    ListPtr first;
    ListPtr second;
  };

  // One pattern file. Its mutex is taken before mutex_ whenever both are held.
  struct PatternFile {
    explicit PatternFile(std::string path) : path(std::move(path)) {}
    const std::string path;
    CvelMutex mutex;  // serialises reading and writing the file
    // Modification time of the file as last read or written here; zero before the first.
    timespec loaded GUARDED_BY(mutex){};
  };

  // The halves the two kinds of pattern share. entries is transactions_ or clients_ and file the
  // file that holds it; each takes mutex_ while it touches entries, after file.mutex if it
  // takes that too.
  template <typename Pattern>
  bool add(std::unique_ptr<Pattern>&& pattern, PatternFile& file,
           std::vector<Entry<Pattern>>* entries);
  template <typename Pattern>
  int remove(const char* situationId, PatternFile& file, std::vector<Entry<Pattern>>* entries);
  // Holds mutex_ only while it copies the entries (transactions_ or clients_).
  template <typename Pattern>
  std::optional<Pattern> findOverlap(
      const Pattern& candidate,
      const std::vector<Entry<Pattern>> CSituationController::*entries) const EXCLUDES(mutex_);
  // Replaces entries with the file's patterns when it changed; true when it did.
  template <typename Pattern>
  bool reload(PatternFile& file, std::vector<Entry<Pattern>>* entries);
  // Rebuilds the index of entries (transactions_ or clients_) after it changed.
  template <typename Pattern>
  void reindex(const std::vector<Entry<Pattern>>& entries) REQUIRES(mutex_);
  PatternIndex& indexOf(const std::vector<Entry<TransactionPattern>>&) REQUIRES(mutex_) {
    return transactionIndex_;
  }
  PatternIndex& indexOf(const std::vector<Entry<ClientPattern>>&) REQUIRES(mutex_) {
    return clientIndex_;
  }
  // Calls visit(pattern) for each entry whose two patterns match first and second, in order,
  // until visit returns false. Candidates come from index; texts it cannot index are matched
  // against every entry.
  template <typename Pattern, typename Visit>
  void forEachMatch(std::vector<Entry<Pattern>>& entries, PatternIndex& index, const char* first,
                    const char* second, Visit visit) REQUIRES(mutex_);
  // Replaces file's contents with image and remembers its modification time.
  void write(PatternFile& file, const std::string& image) REQUIRES(file.mutex);

  const std::string directory_;
  PatternFile transactionFile_;
  PatternFile clientFile_;

  // mutex_ guards the pattern arrays, their order and their counters.
  mutable CvelMutex mutex_;
  std::vector<Entry<TransactionPattern>> transactions_ GUARDED_BY(mutex_);  // matching order
  std::vector<Entry<ClientPattern>> clients_ GUARDED_BY(mutex_);            // insertion order
  PatternIndex transactionIndex_ GUARDED_BY(mutex_);                        // over transactions_
  PatternIndex clientIndex_ GUARDED_BY(mutex_);                             // over clients_
  std::vector<uint32_t> candidates_ GUARDED_BY(mutex_);                     // matching's scratch
};
