#include "collector/capture/http_parser.h"

#include <algorithm>
#include <cstring>

namespace capture {

namespace {

using Desync = HttpParser::Desync;

// A start line waited for across segments while resynchronising: longer lines are dropped, so
// a non-HTTP stream costs at most this much memory.
constexpr size_t kMaxCarryBytes = 8 * 1024;
// A partial line is checked as a prefix only while it is this short; longer ones are checked
// once complete, so a line arriving byte by byte costs linear time.
constexpr size_t kPrefixCheckBytes = 256;
constexpr size_t kMaxChunkLineBytes = 4096;
// Buffers grown past this by one large head are given back rather than kept per connection.
constexpr size_t kKeepCapacity = 16 * 1024;

void ReleaseBuffer(std::string* buffer) {
  if (buffer->capacity() > kKeepCapacity) {
    std::string().swap(*buffer);
  } else {
    buffer->clear();
  }
}

}  // namespace

HttpParser::HttpParser(Kind kind, Listener* listener, size_t max_head_bytes)
    : kind_(kind), listener_(listener), max_head_bytes_(max_head_bytes) {}

void HttpParser::SetMidstream() {
  midstream_ = true;
}

bool HttpParser::in_message() const {
  switch (state_) {
    case State::kHeaders:
    case State::kLengthBody:
    case State::kChunkSize:
    case State::kChunkData:
    case State::kChunkDataEnd:
    case State::kTrailer:
    case State::kCloseBody:
      return true;
    default:
      return false;
  }
}

bool HttpParser::switched() const {
  return state_ == State::kSwitched;
}

void HttpParser::Feed(const uint8_t* data, size_t size, Micros time) {
  if (size == 0) {
    return;
  }
  if (state_ == State::kSwitched || state_ == State::kEnded) {
    offset_ += size;
    return;
  }
  ++feed_count_;
  time_ = time;
  head_pos_ = 0;
  if (state_ == State::kResync) {
    // Senders begin a message with a write of its own, so a segment's first byte is worth a
    // look: a body seen from its middle rarely ends with a line end before the next message.
    at_line_start_ = true;
  }
  size_t pos = 0;
  while (pos < size) {
    switch (state_) {
      case State::kIdle:
        pos = OnIdle(data, pos, size);
        break;
      case State::kResync:
        pos = OnResync(data, pos, size);
        break;
      case State::kStartLine:
        pos = ContinueStartLine(data, pos, size);
        break;
      case State::kHeaders:
        pos = OnHeaders(data, pos, size);
        break;
      case State::kLengthBody:
      case State::kChunkData: {
        const uint64_t n = std::min<uint64_t>(remaining_, size - pos);
        pos += n;
        remaining_ -= n;
        Extend(pos);
        if (remaining_ == 0) {
          if (state_ == State::kLengthBody) {
            FinishMessage();
          } else {
            state_ = State::kChunkDataEnd;
            chunk_cr_ = false;
          }
        }
        break;
      }
      case State::kChunkSize:
        pos = OnChunkSize(data, pos, size);
        break;
      case State::kChunkDataEnd:
        pos = OnChunkDataEnd(data, pos);
        break;
      case State::kTrailer:
        pos = OnTrailer(data, pos, size);
        break;
      case State::kCloseBody:
        pos = size;
        Extend(pos);
        break;
      case State::kSwitched:
      case State::kEnded:
        pos = size;
        break;
    }
  }
  offset_ += size;
}

void HttpParser::Gap(uint64_t size, Micros /*time*/) {
  if (size == 0) {
    return;
  }
  switch (state_) {
    case State::kIdle:
      // The missing bytes may hold the next start line.
      LoseSync(Desync::kGapInFraming, true);
      break;
    case State::kResync:
      at_line_start_ = true;
      break;
    case State::kStartLine:
    case State::kHeaders:
      LoseSync(Desync::kGapInHead, true);
      break;
    case State::kLengthBody: {
      span_.gap = true;
      const uint64_t n = std::min(size, remaining_);
      remaining_ -= n;
      span_.end_offset = offset_ + n;
      if (remaining_ == 0) {
        FinishMessage();
        if (size > n) {
          LoseSync(Desync::kGapInFraming, true);
        }
      }
      break;
    }
    case State::kChunkData:
      span_.gap = true;
      if (size <= remaining_) {
        remaining_ -= size;
        span_.end_offset = offset_ + size;
        if (remaining_ == 0) {
          state_ = State::kChunkDataEnd;
          chunk_cr_ = false;
        }
      } else {
        span_.end_offset = offset_ + remaining_;
        LoseFraming(true);
      }
      break;
    case State::kChunkSize:
    case State::kChunkDataEnd:
    case State::kTrailer:
      LoseFraming(true);
      break;
    case State::kCloseBody:
      span_.gap = true;
      span_.end_offset = offset_ + size;
      break;
    case State::kSwitched:
    case State::kEnded:
      break;
  }
  offset_ += size;
}

void HttpParser::End(Micros /*time*/) {
  switch (state_) {
    case State::kLengthBody:
    case State::kChunkSize:
    case State::kChunkData:
    case State::kChunkDataEnd:
    case State::kTrailer:
      span_.truncated = true;
      listener_->OnMessage(head_, span_);
      break;
    case State::kCloseBody:
      listener_->OnMessage(head_, span_);
      break;
    case State::kSwitched:
      return;
    default:
      break;  // a message still in its head is dropped
  }
  state_ = State::kEnded;
  ReleaseBuffer(&head_buf_);
  ReleaseBuffer(&chunk_line_);
}

size_t HttpParser::OnIdle(const uint8_t* data, size_t pos, size_t size) {
  // Blank lines between messages are tolerated (clients send a CRLF after a POST body).
  while (pos < size && (data[pos] == '\r' || data[pos] == '\n')) {
    ++pos;
  }
  return pos == size ? size : TryStartLine(data, pos, size);
}

size_t HttpParser::OnResync(const uint8_t* data, size_t pos, size_t size) {
  if (at_line_start_) {
    return TryStartLine(data, pos, size);
  }
  const void* nl = std::memchr(data + pos, '\n', size - pos);
  if (nl == nullptr) {
    return size;
  }
  at_line_start_ = true;
  return static_cast<size_t>(static_cast<const uint8_t*>(nl) - data) + 1;
}

size_t HttpParser::TryStartLine(const uint8_t* data, size_t pos, size_t size) {
  const uint8_t* line = data + pos;
  const void* nl = std::memchr(line, '\n', size - pos);
  const size_t n =
      nl != nullptr ? static_cast<size_t>(static_cast<const uint8_t*>(nl) - line) + 1 : size - pos;
  const LineCheck check = CheckStartLine(kind_, line, n);
  if (nl != nullptr && check == LineCheck::kValid) {
    BeginMessage(pos);
    Extend(pos + n);
    head_pos_ = pos;
    if (pos + n == size) {
      // The rest of the head comes in later segments.
      head_buf_.assign(reinterpret_cast<const char*>(line), n);
    }
    return StartLineRecognised(pos + n);
  }
  if (nl == nullptr && check == LineCheck::kNeedMore && n <= StartLineLimit()) {
    BeginMessage(pos);
    Extend(size);
    head_buf_.assign(reinterpret_cast<const char*>(line), n);
    state_ = State::kStartLine;
    return size;
  }
  LoseSync(check == LineCheck::kNeedMore ? Desync::kHeadTooLarge : StartLineFailure(line, n),
           nl != nullptr);
  return pos + n;
}

size_t HttpParser::ContinueStartLine(const uint8_t* data, size_t pos, size_t size) {
  const uint8_t* part = data + pos;
  const void* nl = std::memchr(part, '\n', size - pos);
  const size_t n =
      nl != nullptr ? static_cast<size_t>(static_cast<const uint8_t*>(nl) - part) + 1 : size - pos;
  const size_t had = head_buf_.size();
  if (had + n > StartLineLimit()) {
    LoseSync(Desync::kHeadTooLarge, nl != nullptr);
    return pos + n;
  }
  head_buf_.append(reinterpret_cast<const char*>(part), n);
  Extend(pos + n);
  const auto* line = reinterpret_cast<const uint8_t*>(head_buf_.data());
  if (nl == nullptr) {
    if (had < kPrefixCheckBytes &&
        CheckStartLine(kind_, line, head_buf_.size()) == LineCheck::kInvalid) {
      LoseSync(StartLineFailure(line, head_buf_.size()), false);
    }
    return size;
  }
  if (CheckStartLine(kind_, line, head_buf_.size()) != LineCheck::kValid) {
    LoseSync(StartLineFailure(line, head_buf_.size()), true);
    return pos + n;
  }
  head_pos_ = pos + n;
  return StartLineRecognised(pos + n);
}

size_t HttpParser::StartLineRecognised(size_t next) {
  resyncing_ = false;
  seen_start_line_ = true;
  state_ = State::kHeaders;
  eol_state_ = kLineStart;
  listener_->OnMessageBegin(span_.begin_offset, span_.first_time);
  return next;
}

size_t HttpParser::OnHeaders(const uint8_t* data, size_t pos, size_t size) {
  const size_t end = FindEmptyLine(data, pos, size, &eol_state_);
  const size_t stop = end == kNotFound ? size : end;
  if (head_buf_.size() + (stop - head_pos_) > max_head_bytes_) {
    LoseSync(Desync::kHeadTooLarge, data[stop - 1] == '\n');
    return stop;
  }
  Extend(stop);
  const char* bytes = reinterpret_cast<const char*>(data + head_pos_);
  if (end == kNotFound) {
    head_buf_.append(bytes, size - head_pos_);
    return size;
  }
  std::string_view head(bytes, end - head_pos_);
  if (!head_buf_.empty()) {
    head_buf_.append(head);
    head = head_buf_;
  }
  return OnHeadComplete(head, end);
}

size_t HttpParser::OnHeadComplete(std::string_view head, size_t next) {
  BodyFraming body = BodyFraming::kBad;
  if (ParseHead(kind_, head, &head_, &fold_)) {
    body = kind_ == Kind::kRequest ? RequestFraming(head_) : ResponseFraming(head_);
  }
  ReleaseBuffer(&head_buf_);
  ReleaseBuffer(&fold_);
  if (body == BodyFraming::kBad) {
    LoseSync(Desync::kBadHead, true);
    return next;
  }
  const bool no_body = listener_->OnHead(head_);
  if (kind_ == Kind::kResponse && head_.status == 101) {
    state_ = State::kSwitched;  // before OnMessage, which may ask switched()
    listener_->OnMessage(head_, span_);
    return next;
  }
  if (no_body) {
    body = BodyFraming::kNone;
  }
  switch (body) {
    case BodyFraming::kLength:
      if (head_.content_length > 0) {
        remaining_ = static_cast<uint64_t>(head_.content_length);
        state_ = State::kLengthBody;
        break;
      }
      FinishMessage();
      break;
    case BodyFraming::kChunked:
      state_ = State::kChunkSize;
      chunk_line_.clear();
      break;
    case BodyFraming::kUntilClose:
      state_ = State::kCloseBody;
      break;
    default:
      FinishMessage();
      break;
  }
  return next;
}

size_t HttpParser::OnChunkSize(const uint8_t* data, size_t pos, size_t size) {
  const uint8_t* part = data + pos;
  const void* nl = std::memchr(part, '\n', size - pos);
  const size_t n =
      nl != nullptr ? static_cast<size_t>(static_cast<const uint8_t*>(nl) - part) + 1 : size - pos;
  const size_t had = chunk_line_.size();
  // The message is dropped. A bad line is rescanned from its start when it began here: framing
  // gone wrong often means the next message stands where a chunk size was expected.
  if (had + n > kMaxChunkLineBytes) {
    LoseSync(Desync::kBadHead, had == 0);
    return pos;
  }
  const uint8_t* line = part;
  size_t length = n;
  if (had > 0 || nl == nullptr) {
    chunk_line_.append(reinterpret_cast<const char*>(part), n);
    line = reinterpret_cast<const uint8_t*>(chunk_line_.data());
    length = chunk_line_.size();
  }
  uint64_t chunk_size = 0;
  const LineCheck check = nl != nullptr || had < kPrefixCheckBytes
                              ? CheckChunkLine(line, length, &chunk_size)
                              : LineCheck::kNeedMore;
  if (check == LineCheck::kInvalid || (nl != nullptr && check != LineCheck::kValid)) {
    LoseSync(Desync::kBadHead, had == 0);
    return pos;
  }
  Extend(pos + n);
  if (nl == nullptr) {
    return size;
  }
  chunk_line_.clear();
  if (chunk_size == 0) {
    state_ = State::kTrailer;
    eol_state_ = kLineStart;
    trailer_bytes_ = 0;
  } else {
    remaining_ = chunk_size;
    state_ = State::kChunkData;
  }
  return pos + n;
}

size_t HttpParser::OnChunkDataEnd(const uint8_t* data, size_t pos) {
  if (data[pos] == '\r' && !chunk_cr_) {
    chunk_cr_ = true;
  } else if (data[pos] == '\n') {
    state_ = State::kChunkSize;
  } else {
    LoseSync(Desync::kBadHead, false);
    return pos;
  }
  Extend(pos + 1);
  return pos + 1;
}

size_t HttpParser::OnTrailer(const uint8_t* data, size_t pos, size_t size) {
  const size_t end = FindEmptyLine(data, pos, size, &eol_state_);
  const size_t stop = end == kNotFound ? size : end;
  trailer_bytes_ += stop - pos;
  if (trailer_bytes_ > max_head_bytes_) {
    LoseSync(Desync::kHeadTooLarge, false);
    return pos;
  }
  Extend(stop);
  if (end != kNotFound) {
    FinishMessage();
  }
  return stop;
}

void HttpParser::BeginMessage(size_t pos) {
  head_buf_.clear();
  span_ = HttpMessageSpan();
  span_.begin_offset = offset_ + pos;
  span_.end_offset = span_.begin_offset;
  span_.first_time = time_;
  span_.last_time = time_;
  message_feed_ = 0;
}

void HttpParser::Extend(size_t end) {
  if (message_feed_ != feed_count_) {
    message_feed_ = feed_count_;
    ++span_.packets;
  }
  span_.last_time = time_;
  span_.end_offset = offset_ + end;
}

void HttpParser::FinishMessage() {
  state_ = State::kIdle;
  listener_->OnMessage(head_, span_);
}

void HttpParser::LoseFraming(bool at_line_start) {
  span_.gap = true;
  span_.truncated = true;
  listener_->OnMessage(head_, span_);
  LoseSync(Desync::kGapInFraming, at_line_start);
}

void HttpParser::LoseSync(Desync reason, bool at_line_start) {
  state_ = State::kResync;
  at_line_start_ = at_line_start;
  ReleaseBuffer(&head_buf_);
  chunk_line_.clear();
  if (!resyncing_) {
    resyncing_ = true;
    listener_->OnDesync(reason);
  }
}

HttpParser::Desync HttpParser::StartLineFailure(const uint8_t* line, size_t size) const {
  // A TLS handshake or HTTP/2 is another protocol wherever it starts (from the start, or
  // after CONNECT or an h2c upgrade), not a broken HTTP/1 message.
  static constexpr char kHttp2Preface[] = "PRI * HTTP/2";
  if ((size > 0 && line[0] == 0x16) ||
      (size >= sizeof(kHttp2Preface) - 1 &&
       std::memcmp(line, kHttp2Preface, sizeof(kHttp2Preface) - 1) == 0)) {
    return Desync::kNotHttp;
  }
  if (seen_start_line_) {
    return Desync::kBadHead;
  }
  return midstream_ ? Desync::kMidstream : Desync::kNotHttp;
}

size_t HttpParser::StartLineLimit() const {
  return resyncing_ ? std::min(kMaxCarryBytes, max_head_bytes_) : max_head_bytes_;
}

}  // namespace capture
