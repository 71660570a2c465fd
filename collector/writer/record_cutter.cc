#include "collector/writer/record_cutter.h"

#include <array>

namespace collector {
namespace {

constexpr std::array<std::string_view, 4> kHeaders = {"<hpage>", "<hobj>", "<audio>", "<video>"};

enum class Match { kYes, kNo, kMaybe };

// Whether text starts with want; kMaybe when text is a proper prefix of it.
Match StartsWith(std::string_view text, std::string_view want) {
  if (text.size() >= want.size()) {
    return text.substr(0, want.size()) == want ? Match::kYes : Match::kNo;
  }
  return want.substr(0, text.size()) == text ? Match::kMaybe : Match::kNo;
}

// The header tag at the start of text ("<hpage>" gives "hpage"), or empty; *maybe is set when
// text is too short to tell.
std::string_view HeaderAt(std::string_view text, bool* maybe) {
  *maybe = false;
  for (std::string_view header : kHeaders) {
    const Match match = StartsWith(text, header);
    if (match == Match::kYes) {
      return header.substr(1, header.size() - 2);
    }
    *maybe = *maybe || match == Match::kMaybe;
  }
  return {};
}

}  // namespace

void RecordCutter::Drop(size_t count) {
  start_ += count;
  dropped_ += count;
}

RecordCutter::Scan RecordCutter::Step(const Emit& emit, bool at_end) {
  const std::string_view rest = std::string_view(buffer_).substr(start_);
  const size_t open = rest.find('<');
  if (open == std::string_view::npos) {
    Drop(rest.size());
    return Scan::kNeedMore;
  }
  if (open > 0) {
    Drop(open);
    return Scan::kDropped;
  }
  bool maybe = false;
  const std::string_view tag = HeaderAt(rest, &maybe);
  if (tag.empty()) {
    if (maybe && !at_end) {
      return Scan::kNeedMore;
    }
    Drop(1);
    return Scan::kDropped;
  }
  // Fields hold no '<', so the next one starts the trailer or shows the record was cut off.
  const size_t fields = tag.size() + 2;
  const size_t close = rest.find('<', fields);
  if (close == std::string_view::npos) {
    if (rest.size() > kMaxRecord || at_end) {
      Drop(rest.size());
      return Scan::kDropped;
    }
    return Scan::kNeedMore;
  }
  const std::string trailer = "</" + std::string(tag) + ">";
  const Match match = StartsWith(rest.substr(close), trailer);
  if (match == Match::kNo || (match == Match::kMaybe && at_end)) {
    Drop(close);  // resynchronise on that '<': it may be the next record's header
    return Scan::kDropped;
  }
  if (match == Match::kMaybe) {
    return Scan::kNeedMore;
  }
  const size_t end = close + trailer.size();
  const std::string_view after = rest.substr(end);
  size_t line_end = 0;
  if (after.starts_with("\r\n")) {
    line_end = 2;
  } else if (after.starts_with("\n")) {
    line_end = 1;
  } else if (!at_end && (after.empty() || after == "\r")) {
    return Scan::kNeedMore;  // the line end may be on its way
  }
  if (line_end > 0) {
    emit(rest.substr(0, end + line_end));
  } else {
    // Producers always end a line; keep the file line-shaped when one did not.
    emit(std::string(rest.substr(0, end)) + "\n");
  }
  start_ += end + line_end;
  ++records_;
  return Scan::kRecord;
}

void RecordCutter::Feed(std::string_view bytes, const Emit& emit) {
  buffer_.append(bytes);
  while (start_ < buffer_.size() && Step(emit, false) != Scan::kNeedMore) {
  }
  // Compact once the consumed head dominates, so appends stay amortised O(1).
  if (start_ > 0 && start_ * 2 >= buffer_.size()) {
    buffer_.erase(0, start_);
    start_ = 0;
  }
}

uint64_t RecordCutter::Finish(const Emit& emit) {
  const uint64_t before = dropped_;
  while (start_ < buffer_.size()) {
    Step(emit, true);
  }
  buffer_.clear();
  start_ = 0;
  return dropped_ - before;
}

}  // namespace collector
