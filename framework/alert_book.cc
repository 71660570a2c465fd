#include "framework/alert_book.h"

#include <fcntl.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <set>
#include <type_traits>
#include <utility>

#include "framework/atomic_file.h"
#include "framework/file_io.h"
#include "framework/status.h"
#include "framework/trace.h"

namespace fw {
namespace {

using Json = nlohmann::ordered_json;

constexpr char kUnit[] = "alerts";
constexpr char kFormat[] = "q7agent alert book";
constexpr int kFormatVersion = 1;

// Row values need not be valid UTF-8, and a strict dump would throw. Replacing is idempotent,
// so a key read back from the file has the same text as the key the sampler hands over.
std::string JsonText(const Json& json) {
  return json.dump(-1, ' ', false, Json::error_handler_t::replace);
}

std::string IsoUtc(time_t t) {
  struct tm tm {};
  char text[32];
  if (gmtime_r(&t, &tm) == nullptr ||
      std::strftime(text, sizeof text, "%Y-%m-%dT%H:%M:%SZ", &tm) == 0) {
    return "";
  }
  return text;
}

// Field readers for the file: false when the field is missing or of another type.
bool ReadString(const Json& object, const char* name, std::string* out) {
  const auto it = object.find(name);
  if (it == object.end() || !it->is_string()) {
    return false;
  }
  *out = it->get<std::string>();
  return true;
}

bool ReadObject(const Json& object, const char* name, Json* out) {
  const auto it = object.find(name);
  if (it == object.end() || !it->is_object()) {
    return false;
  }
  *out = *it;
  return true;
}

template <typename Integer>
bool ReadInteger(const Json& object, const char* name, Integer* out) {
  const auto it = object.find(name);
  if (it == object.end() || !it->is_number_integer() ||
      (std::is_unsigned_v<Integer> && !it->is_number_unsigned())) {
    return false;
  }
  *out = it->get<Integer>();
  return true;
}

bool ReadChange(const Json& item, AlertChange* change) {
  std::string kind;
  if (!item.is_object() || !ReadInteger(item, "sequence", &change->sequence) ||
      !ReadString(item, "kind", &kind) || !ReadString(item, "situation", &change->situation) ||
      !ReadString(item, "table", &change->table) ||
      !ReadString(item, "severity", &change->severity) || !ReadObject(item, "key", &change->key) ||
      !ReadObject(item, "values", &change->values) ||
      !ReadInteger(item, "raised_at_epoch", &change->raised_at) ||
      !ReadInteger(item, "at_epoch", &change->at)) {
    return false;
  }
  if (kind == AlertKindName(AlertKind::kRaised)) {
    change->kind = AlertKind::kRaised;
  } else if (kind == AlertKindName(AlertKind::kCleared)) {
    change->kind = AlertKind::kCleared;
  } else {
    return false;
  }
  return true;
}

// The whole file at path. False with errno set when it cannot be opened or read.
bool ReadWholeFile(const std::string& path, std::string* text) {
  const UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
  if (!fd.valid()) {
    return false;
  }
  const off_t size = FileSize(fd.get());
  if (size < 0) {
    return false;
  }
  text->resize(static_cast<std::size_t>(size));
  const ssize_t got = ReadAt(fd.get(), text->data(), text->size(), 0);
  if (got < 0) {
    return false;
  }
  text->resize(static_cast<std::size_t>(got));
  return true;
}

}  // namespace

std::string_view AlertKindName(AlertKind kind) {
  return kind == AlertKind::kRaised ? "raised" : "cleared";
}

Json AlertChange::ToJson() const {
  return {{"sequence", sequence},
          {"kind", std::string(AlertKindName(kind))},
          {"situation", situation},
          {"table", table},
          {"severity", severity},
          {"key", key},
          {"values", values},
          {"raised_at", IsoUtc(raised_at)},
          {"raised_at_epoch", static_cast<std::int64_t>(raised_at)},
          {"at", IsoUtc(at)},
          {"at_epoch", static_cast<std::int64_t>(at)}};
}

AlertBook::AlertBook(std::string path, std::size_t capacity)
    : path_(std::move(path)), capacity_(capacity) {}

std::vector<AlertChange> AlertBook::Evaluate(const std::string& situation, const std::string& table,
                                             const std::string& severity, int for_count,
                                             const std::vector<MatchedRow>& matched, time_t now) {
  for_count = std::max(for_count, 1);
  MutexLock lock(mutex_);
  Tracks& tracks = situations_[situation];
  std::vector<AlertChange> changes;
  std::set<std::string> seen;
  for (const MatchedRow& row : matched) {
    std::string text = JsonText(row.key);
    if (!seen.insert(text).second) {
      continue;
    }
    Track& track = tracks[std::move(text)];
    track.key = row.key;
    track.values = row.values;
    track.seen_at = now;
    if (track.open) {
      continue;
    }
    ++track.matches;
    unsaved_ = true;
    if (track.matches < for_count) {
      continue;
    }
    track.open = true;
    track.table = table;
    track.severity = severity;
    track.raised_at = now;
    AlertChange& raise = changes.emplace_back();
    raise.sequence = ++last_sequence_;
    track.raised_sequence = raise.sequence;
    raise.kind = AlertKind::kRaised;
    raise.situation = situation;
    raise.table = table;
    raise.severity = severity;
    raise.key = row.key;
    raise.values = row.values;
    raise.raised_at = now;
    raise.at = now;
  }
  for (auto it = tracks.begin(); it != tracks.end();) {
    if (seen.count(it->first) != 0) {
      ++it;
      continue;
    }
    if (it->second.open) {
      changes.push_back(ClearChange(situation, it->second, now));
    }
    it = tracks.erase(it);
    unsaved_ = true;
  }
  if (tracks.empty()) {
    situations_.erase(situation);
  }
  Record(changes);
  SaveIfChanged();
  return changes;
}

std::vector<AlertChange> AlertBook::ForgetSituation(const std::string& situation, time_t now) {
  MutexLock lock(mutex_);
  std::vector<AlertChange> changes;
  const auto found = situations_.find(situation);
  if (found == situations_.end()) {
    return changes;
  }
  for (const auto& [text, track] : found->second) {
    if (track.open) {
      changes.push_back(ClearChange(situation, track, now));
    }
  }
  situations_.erase(found);
  unsaved_ = true;
  Record(changes);
  SaveIfChanged();
  return changes;
}

std::vector<std::string> AlertBook::Situations() const {
  MutexLock lock(mutex_);
  std::vector<std::string> names;
  for (const auto& [name, tracks] : situations_) {
    names.push_back(name);
  }
  return names;
}

Json AlertBook::Open() const {
  MutexLock lock(mutex_);
  std::vector<std::pair<const std::string*, const Track*>> open;
  for (const auto& [name, tracks] : situations_) {
    for (const auto& [text, track] : tracks) {
      if (track.open) {
        open.emplace_back(&name, &track);
      }
    }
  }
  std::sort(open.begin(), open.end(), [](const auto& a, const auto& b) {
    return std::pair(a.second->raised_at, a.second->raised_sequence) <
           std::pair(b.second->raised_at, b.second->raised_sequence);
  });
  Json items = Json::array();
  for (const auto& [name, track] : open) {
    items.push_back(OpenAlertJson(*name, *track));
  }
  return items;
}

Json AlertBook::Recent(std::size_t limit) const {
  MutexLock lock(mutex_);
  Json items = Json::array();
  const std::size_t skip = recent_.size() - std::min(limit, recent_.size());
  for (auto it = recent_.begin() + static_cast<std::ptrdiff_t>(skip); it != recent_.end(); ++it) {
    items.push_back(it->ToJson());
  }
  return items;
}

Json AlertBook::Changes(std::uint64_t since_sequence) const {
  MutexLock lock(mutex_);
  if (since_sequence > last_sequence_) {
    since_sequence = 0;
  }
  const auto first = std::upper_bound(
      recent_.begin(), recent_.end(), since_sequence,
      [](std::uint64_t since, const AlertChange& c) { return since < c.sequence; });
  Json items = Json::array();
  for (auto it = first; it != recent_.end(); ++it) {
    items.push_back(it->ToJson());
  }
  return items;
}

std::uint64_t AlertBook::last_sequence() const {
  MutexLock lock(mutex_);
  return last_sequence_;
}

Json AlertBook::OpenAlertJson(const std::string& situation, const Track& track) {
  return {{"sequence", track.raised_sequence},
          {"situation", situation},
          {"table", track.table},
          {"severity", track.severity},
          {"key", track.key},
          {"values", track.values},
          {"raised_at", IsoUtc(track.raised_at)},
          {"raised_at_epoch", static_cast<std::int64_t>(track.raised_at)},
          {"seen_at", IsoUtc(track.seen_at)},
          {"seen_at_epoch", static_cast<std::int64_t>(track.seen_at)}};
}

AlertChange AlertBook::ClearChange(const std::string& situation, const Track& track, time_t now) {
  AlertChange clear;
  clear.sequence = ++last_sequence_;
  clear.kind = AlertKind::kCleared;
  clear.situation = situation;
  clear.table = track.table;
  clear.severity = track.severity;
  clear.key = track.key;
  clear.values = track.values;
  clear.raised_at = track.raised_at;
  clear.at = now;
  return clear;
}

void AlertBook::Record(const std::vector<AlertChange>& changes) {
  for (const AlertChange& change : changes) {
    Q7_TRACE(kUnit, kTraceSummary, "%s %s on %s key %s (sequence %llu)",
             std::string(AlertKindName(change.kind)).c_str(), change.situation.c_str(),
             change.table.c_str(), JsonText(change.key).c_str(),
             static_cast<unsigned long long>(change.sequence));
    recent_.push_back(change);
  }
  while (recent_.size() > capacity_) {
    recent_.pop_front();
  }
}

// Open alerts and the ring are kept as the API shows them, so the file reads like the API.
Json AlertBook::StateJson() const {
  Json open = Json::array();
  Json counting = Json::array();
  for (const auto& [name, tracks] : situations_) {
    for (const auto& [text, track] : tracks) {
      if (track.open) {
        open.push_back(OpenAlertJson(name, track));
      } else {
        counting.push_back({{"situation", name},
                            {"key", track.key},
                            {"matches", track.matches},
                            {"values", track.values},
                            {"seen_at_epoch", static_cast<std::int64_t>(track.seen_at)}});
      }
    }
  }
  Json recent = Json::array();
  for (const AlertChange& change : recent_) {
    recent.push_back(change.ToJson());
  }
  return {{"format", kFormat},
          {"version", kFormatVersion},
          {"last_sequence", last_sequence_},
          {"open", std::move(open)},
          {"counting", std::move(counting)},
          {"recent", std::move(recent)}};
}

void AlertBook::SaveIfChanged() {
  if (!unsaved_ || path_.empty()) {
    return;
  }
  std::string error;
  if (ReplaceFile(path_, JsonText(StateJson()) + "\n", {0600, ""}, nullptr, &error) != kOk) {
    // unsaved_ stays set: the next evaluation tries again.
    Q7_TRACE(kUnit, kTraceError, "%s", error.c_str());
    return;
  }
  unsaved_ = false;
}

void AlertBook::ClearState() {
  situations_.clear();
  recent_.clear();
  last_sequence_ = 0;
  unsaved_ = false;
}

int AlertBook::Load(std::string* error) {
  MutexLock lock(mutex_);
  ClearState();
  if (path_.empty()) {
    return kOk;
  }
  std::string text;
  if (!ReadWholeFile(path_, &text)) {
    if (errno == ENOENT) {
      Q7_TRACE(kUnit, kTraceDetail, "no alerts to restore (%s)", path_.c_str());
      return kOk;
    }
    const std::string why = "cannot read " + path_ + ": " + std::strerror(errno);
    TracePrintfAlways(kUnit, kTraceError, __func__, "%s; starting with no alerts", why.c_str());
    if (error != nullptr) {
      *error = why;
    }
    return kIoError;
  }
  const Json state = Json::parse(text, nullptr, false);
  std::string why;
  if (state.is_discarded()) {
    why = "is not JSON";
  } else if (RestoreState(state, &why)) {
    Q7_TRACE(kUnit, kTraceSummary, "restored %zu situations with alerts, sequence %llu",
             situations_.size(), static_cast<unsigned long long>(last_sequence_));
    return kOk;
  }
  ClearState();
  const std::string aside = SetFileAside(path_);
  TracePrintfAlways(kUnit, kTraceError, __func__, "%s %s; set aside as %s, starting with no alerts",
                    path_.c_str(), why.c_str(),
                    aside.empty() ? "(could not be moved)" : aside.c_str());
  if (error != nullptr) {
    *error = path_ + " " + why;
  }
  return kParseError;
}

bool AlertBook::RestoreState(const Json& state, std::string* why) {
  std::string format;
  int version = 0;
  if (!state.is_object() || !ReadString(state, "format", &format) || format != kFormat ||
      !ReadInteger(state, "version", &version)) {
    *why = "is not an alert book";
    return false;
  }
  if (version != kFormatVersion) {
    *why = "has format version " + std::to_string(version) + ", this agent reads " +
           std::to_string(kFormatVersion);
    return false;
  }
  if (!ReadInteger(state, "last_sequence", &last_sequence_) || !state.contains("open") ||
      !state["open"].is_array() || !state.contains("counting") || !state["counting"].is_array() ||
      !state.contains("recent") || !state["recent"].is_array()) {
    *why = "lacks last_sequence, open, counting or recent";
    return false;
  }
  // The sequence never goes back, even if the counter was written behind an item.
  auto add_track = [&](const std::string& situation, Track&& track) REQUIRES(mutex_) {
    last_sequence_ = std::max(last_sequence_, track.raised_sequence);
    return situations_[situation].try_emplace(JsonText(track.key), std::move(track)).second;
  };
  for (const Json& item : state["open"]) {
    std::string situation;
    Track track;
    track.open = true;
    if (!item.is_object() || !ReadString(item, "situation", &situation) ||
        !ReadInteger(item, "sequence", &track.raised_sequence) ||
        !ReadString(item, "table", &track.table) ||
        !ReadString(item, "severity", &track.severity) || !ReadObject(item, "key", &track.key) ||
        !ReadObject(item, "values", &track.values) ||
        !ReadInteger(item, "raised_at_epoch", &track.raised_at) ||
        !ReadInteger(item, "seen_at_epoch", &track.seen_at)) {
      *why = "has a malformed open alert";
      return false;
    }
    if (!add_track(situation, std::move(track))) {
      *why = "holds a key of situation " + situation + " twice";
      return false;
    }
  }
  for (const Json& item : state["counting"]) {
    std::string situation;
    Track track;
    if (!item.is_object() || !ReadString(item, "situation", &situation) ||
        !ReadObject(item, "key", &track.key) || !ReadInteger(item, "matches", &track.matches) ||
        track.matches < 1 || !ReadObject(item, "values", &track.values) ||
        !ReadInteger(item, "seen_at_epoch", &track.seen_at)) {
      *why = "has a malformed count of matches";
      return false;
    }
    if (!add_track(situation, std::move(track))) {
      *why = "holds a key of situation " + situation + " twice";
      return false;
    }
  }
  for (const Json& item : state["recent"]) {
    AlertChange change;
    if (!ReadChange(item, &change) ||
        (!recent_.empty() && change.sequence <= recent_.back().sequence)) {
      *why = "has a malformed or out-of-order recent change";
      return false;
    }
    last_sequence_ = std::max(last_sequence_, change.sequence);
    recent_.push_back(std::move(change));
  }
  while (recent_.size() > capacity_) {
    recent_.pop_front();
  }
  return true;
}

}  // namespace fw
