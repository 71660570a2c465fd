#pragma once

// AlertBook: the bookkeeping of alerts. A situation that samples a table at an interval hands
// each sample's matching rows to Evaluate; the book turns them into alert changes:
//
// - a row key that matched in "for" consecutive samples of a situation raises one alert, which
//   stays open, without repeats, while the key keeps matching;
// - an open alert whose key no longer matches clears (one change);
// - a key that stops matching before it raised starts its count again.
//
// A key is the values of the table's key columns as the caller gives them (an ordered JSON
// object); the book never decides which columns they are. Two keys are the same key when their
// JSON text is the same, so the caller must name the columns in the same order every time.
//
// Every change gets a sequence number, increasing across restarts, and is kept in a ring of the
// last `capacity` changes. Open alerts, the counts of keys on their way to raising, the sequence
// counter and the ring are saved in one file (replaced whole, see atomic_file.h) whenever any of
// them changes, so that a restart neither loses an alert or a count nor raises an alert again.
// The last values seen of an open alert are not worth a write of their own: they are saved with
// the next change, so after a restart a clear may report values older than the last sample.
//
// Thread safety: every member may be called from any thread; one lock serialises them, and a
// save happens with it held (readers wait for at most one file replacement).

#include <time.h>

#include <cstddef>
#include <cstdint>
#include <deque>
#include <map>
#include <nlohmann/json.hpp>
#include <string>
#include <string_view>
#include <vector>

#include "framework/mutex.h"

namespace fw {

enum class AlertKind { kRaised, kCleared };

// "raised" or "cleared".
std::string_view AlertKindName(AlertKind kind);

// One change of one alert: the webhook's body and an item of the alerts API.
struct AlertChange {
  std::uint64_t sequence = 0;  // order of changes over all situations, from 1, across restarts
  AlertKind kind = AlertKind::kRaised;
  std::string situation;
  std::string table;              // as the situation names it
  std::string severity;           // the situation's, at the raise (a clear repeats its raise's)
  nlohmann::ordered_json key;     // {column: value, ...} of the key columns, in the caller's order
  nlohmann::ordered_json values;  // the row at the raise; at a clear, the last row seen
  time_t raised_at = 0;           // seconds since 1970 of the sample that raised the alert
  time_t at = 0;                  // seconds since 1970 of this change (raised_at for a raise)

  // {"sequence", "kind", "situation", "table", "severity", "key", "values", "raised_at",
  //  "raised_at_epoch", "at", "at_epoch"}; the *_at times as ISO-8601 UTC text
  // ("2026-11-23T10:48:18Z"), the *_epoch ones as seconds since 1970.
  nlohmann::ordered_json ToJson() const;
};

// One row of a sample: the values of its key columns and all its values.
struct MatchedRow {
  nlohmann::ordered_json key;     // {column: value, ...}
  nlohmann::ordered_json values;  // {column: value, ...}
};

inline constexpr std::size_t kDefaultAlertCapacity = 1000;

class AlertBook {
 public:
  // Keeps the state in the file at path (empty: nowhere) and the last `capacity` changes. The
  // book starts empty; Load restores the file's state.
  explicit AlertBook(std::string path, std::size_t capacity = kDefaultAlertCapacity);

  AlertBook(const AlertBook&) = delete;
  AlertBook& operator=(const AlertBook&) = delete;

  // Replaces the book's state with the file's. A missing file is a first start (kOk, empty
  // book). A file that does not parse as an alert book is traced, set aside as "<path>.bad"
  // and the book starts empty: kParseError with *error saying why. A file that exists but
  // cannot be read leaves the book empty: kIoError. error may be null.
  int Load(std::string* error);

  // Takes the rows one sample of the situation matched at now (seconds since 1970) and returns
  // the changes they cause, in sequence order: raises for keys that matched in for_count
  // consecutive samples (for_count below 1 counts as 1), clears for open alerts whose key is
  // not among the rows. Rows with the same key count once, with the first one's values.
  // table and severity are recorded at the raise.
  std::vector<AlertChange> Evaluate(const std::string& situation, const std::string& table,
                                    const std::string& severity, int for_count,
                                    const std::vector<MatchedRow>& matched, time_t now);

  // The situation was stopped: its open alerts clear at now (the changes returned) and the
  // counts of its other keys are dropped.
  std::vector<AlertChange> ForgetSituation(const std::string& situation, time_t now);

  // The situations that have open alerts or keys on their way to raising, in name order; after
  // a restart, the caller forgets those no longer started.
  std::vector<std::string> Situations() const;

  // The open alerts, oldest raise first: [{"sequence" (of the raise), "situation", "table",
  // "severity", "key", "values" (the last seen), "raised_at", "raised_at_epoch", "seen_at",
  // "seen_at_epoch" (the last sample the key matched)}].
  nlohmann::ordered_json Open() const;

  // The last `limit` changes kept, oldest first (ToJson items).
  nlohmann::ordered_json Recent(std::size_t limit) const;

  // The changes kept whose sequence is above since_sequence, oldest first: what an event stream
  // has not sent yet. A since_sequence above the last sequence given out means the book started
  // its count again (its file was set aside), and every change kept is returned.
  nlohmann::ordered_json Changes(std::uint64_t since_sequence) const;

  // The sequence of the last change; 0 before the first.
  std::uint64_t last_sequence() const;

 private:
  // One key of one situation: counting its matches, or an open alert.
  struct Track {
    nlohmann::ordered_json key;
    int matches = 0;  // consecutive samples that matched it, while not open
    bool open = false;
    // The rest describes the open alert (values and seen_at also while counting).
    std::uint64_t raised_sequence = 0;
    std::string table;
    std::string severity;
    time_t raised_at = 0;           // seconds since 1970
    time_t seen_at = 0;             // seconds since 1970 of the last sample that matched it
    nlohmann::ordered_json values;  // of the last sample that matched it
  };
  // A situation's tracks by the key's JSON text.
  using Tracks = std::map<std::string, Track>;

  // An item of Open().
  static nlohmann::ordered_json OpenAlertJson(const std::string& situation, const Track& track);
  // The clear of an open alert, with the next sequence number.
  AlertChange ClearChange(const std::string& situation, const Track& track, time_t now)
      REQUIRES(mutex_);
  // Keeps the changes in the ring and traces them.
  void Record(const std::vector<AlertChange>& changes) REQUIRES(mutex_);
  // Writes the state when it changed since the last successful write.
  void SaveIfChanged() REQUIRES(mutex_);
  nlohmann::ordered_json StateJson() const REQUIRES(mutex_);
  // Restores the state from the file's JSON; false with *why when it is not an alert book.
  bool RestoreState(const nlohmann::ordered_json& state, std::string* why) REQUIRES(mutex_);
  void ClearState() REQUIRES(mutex_);

  const std::string path_;
  const std::size_t capacity_;

  // mutex_ protects the following state.
  mutable Mutex mutex_;
  std::map<std::string, Tracks> situations_ GUARDED_BY(mutex_);  // by situation name
  std::uint64_t last_sequence_ GUARDED_BY(mutex_) = 0;
  std::deque<AlertChange> recent_ GUARDED_BY(mutex_);  // oldest first, capacity_ at most
  bool unsaved_ GUARDED_BY(mutex_) = false;  // state changed since the file was last written
};

}  // namespace fw
