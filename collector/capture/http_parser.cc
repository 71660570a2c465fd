#include "collector/capture/http_parser.h"

#include <algorithm>
#include <array>
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
constexpr size_t kMaxMethodBytes = 32;
constexpr size_t kMaxChunkLineBytes = 4096;
constexpr size_t kMaxChunkSizeDigits = 15;  // keeps sizes below 2^60
// Buffers grown past this by one large head are given back rather than kept per connection.
constexpr size_t kKeepCapacity = 16 * 1024;

enum class LineCheck { kValid, kInvalid, kNeedMore };

// Where the bytes seen so far left a line, for finding an empty line across segments.
enum EolState : uint8_t { kMidLine, kLineStart, kLineStartCr };

constexpr std::array<bool, 256> MakeTcharTable() {
  std::array<bool, 256> table{};
  for (int c = '0'; c <= '9'; ++c) {
    table[c] = true;
  }
  for (int c = 'a'; c <= 'z'; ++c) {
    table[c] = true;
    table[c - 'a' + 'A'] = true;
  }
  for (char c : std::string_view("!#$%&'*+-.^_`|~")) {
    table[static_cast<uint8_t>(c)] = true;
  }
  return table;
}

constexpr std::array<bool, 256> kTchar = MakeTcharTable();

bool IsTchar(uint8_t c) {
  return kTchar[c];
}
bool IsDigit(uint8_t c) {
  return c >= '0' && c <= '9';
}
bool IsBlank(char c) {
  return c == ' ' || c == '\t';
}

int HexValue(uint8_t c) {
  if (c >= '0' && c <= '9') {
    return c - '0';
  }
  if (c >= 'a' && c <= 'f') {
    return c - 'a' + 10;
  }
  if (c >= 'A' && c <= 'F') {
    return c - 'A' + 10;
  }
  return -1;
}

// Line checks take the bytes of a line so far: p[0, n) ends at its first '\n' when the line is
// complete. A complete line is never kNeedMore.

LineCheck CheckVersion(const uint8_t* p, size_t n) {
  static constexpr char kPrefix[] = "HTTP/1.";
  if (std::memcmp(p, kPrefix, std::min<size_t>(n, 7)) != 0) {
    return LineCheck::kInvalid;
  }
  if (n < 8) {
    return LineCheck::kNeedMore;
  }
  return IsDigit(p[7]) ? LineCheck::kValid : LineCheck::kInvalid;
}

LineCheck CheckLineEnd(const uint8_t* p, size_t n) {
  if (n == 0) {
    return LineCheck::kNeedMore;
  }
  if (p[0] == '\n') {
    return LineCheck::kValid;
  }
  if (p[0] != '\r') {
    return LineCheck::kInvalid;
  }
  if (n == 1) {
    return LineCheck::kNeedMore;
  }
  return p[1] == '\n' ? LineCheck::kValid : LineCheck::kInvalid;
}

LineCheck CheckRequestLine(const uint8_t* p, size_t n) {
  size_t i = 0;
  while (i < n && IsTchar(p[i])) {
    ++i;
  }
  if (i > kMaxMethodBytes) {
    return LineCheck::kInvalid;
  }
  if (i == n) {
    return LineCheck::kNeedMore;
  }
  if (i == 0 || p[i] != ' ') {
    return LineCheck::kInvalid;
  }
  const size_t target = ++i;
  while (i < n && p[i] > ' ' && p[i] != 0x7f) {
    ++i;
  }
  if (i == n) {
    return LineCheck::kNeedMore;
  }
  if (i == target || p[i] != ' ') {
    return LineCheck::kInvalid;
  }
  ++i;
  const LineCheck version = CheckVersion(p + i, n - i);
  if (version != LineCheck::kValid) {
    return version;
  }
  return CheckLineEnd(p + i + 8, n - i - 8);
}

LineCheck CheckStatusLine(const uint8_t* p, size_t n) {
  const LineCheck version = CheckVersion(p, n);
  if (version != LineCheck::kValid) {
    return version;
  }
  for (size_t i = 8; i < 12; ++i) {
    if (i == n) {
      return LineCheck::kNeedMore;
    }
    if (i == 8 ? p[i] != ' ' : !IsDigit(p[i])) {
      return LineCheck::kInvalid;
    }
  }
  if (p[9] == '0') {
    return LineCheck::kInvalid;
  }
  if (n == 12) {
    return LineCheck::kNeedMore;
  }
  if (p[12] != ' ') {
    return CheckLineEnd(p + 12, n - 12);
  }
  for (size_t i = 13; i < n; ++i) {
    const uint8_t c = p[i];
    if (c == '\r' || c == '\n') {
      return CheckLineEnd(p + i, n - i);
    }
    if ((c < ' ' && c != '\t') || c == 0x7f) {
      return LineCheck::kInvalid;
    }
  }
  return LineCheck::kNeedMore;
}

LineCheck CheckStartLine(HttpParser::Kind kind, const uint8_t* p, size_t n) {
  return kind == HttpParser::Kind::kRequest ? CheckRequestLine(p, n) : CheckStatusLine(p, n);
}

// chunk-size [BWS] [";" chunk-ext] CRLF, accepting a bare LF. Extensions are not looked into.
LineCheck CheckChunkLine(const uint8_t* p, size_t n, uint64_t* size) {
  size_t i = 0;
  uint64_t value = 0;
  for (; i < n; ++i) {
    const int digit = HexValue(p[i]);
    if (digit < 0) {
      break;
    }
    if (i == kMaxChunkSizeDigits) {
      return LineCheck::kInvalid;
    }
    value = value * 16 + static_cast<uint64_t>(digit);
  }
  if (i == n) {
    return LineCheck::kNeedMore;
  }
  if (i == 0) {
    return LineCheck::kInvalid;
  }
  while (i < n && IsBlank(static_cast<char>(p[i]))) {
    ++i;
  }
  if (i == n) {
    return LineCheck::kNeedMore;
  }
  if (p[i] == ';') {
    if (p[n - 1] != '\n') {
      return LineCheck::kNeedMore;
    }
  } else {
    const LineCheck end = CheckLineEnd(p + i, n - i);
    if (end != LineCheck::kValid) {
      return end;
    }
  }
  *size = value;
  return LineCheck::kValid;
}

constexpr size_t kNotFound = static_cast<size_t>(-1);

// Finds the end of the first empty line ("\n" or "\r\n" at a line start) in data[pos, size),
// pos < size, continuing from *state; returns one past it, or kNotFound with *state updated.
size_t FindEmptyLine(const uint8_t* data, size_t pos, size_t size, uint8_t* state) {
  size_t i = pos;
  if (*state == kLineStartCr) {
    if (data[i] == '\n') {
      return i + 1;
    }
  } else if (*state == kLineStart) {
    if (data[i] == '\n') {
      return i + 1;
    }
    if (data[i] == '\r') {
      if (i + 1 == size) {
        *state = kLineStartCr;
        return kNotFound;
      }
      if (data[i + 1] == '\n') {
        return i + 2;
      }
    }
  }
  for (;;) {
    const void* nl = std::memchr(data + i, '\n', size - i);
    if (nl == nullptr) {
      *state = kMidLine;
      return kNotFound;
    }
    i = static_cast<size_t>(static_cast<const uint8_t*>(nl) - data) + 1;
    if (i == size) {
      *state = kLineStart;
      return kNotFound;
    }
    if (data[i] == '\n') {
      return i + 1;
    }
    if (data[i] == '\r') {
      if (i + 1 == size) {
        *state = kLineStartCr;
        return kNotFound;
      }
      if (data[i + 1] == '\n') {
        return i + 2;
      }
    }
  }
}

void ReleaseBuffer(std::string* buffer) {
  if (buffer->capacity() > kKeepCapacity) {
    std::string().swap(*buffer);
  } else {
    buffer->clear();
  }
}

// ---- Heads

std::string_view StripCr(std::string_view line) {
  if (!line.empty() && line.back() == '\r') {
    line.remove_suffix(1);
  }
  return line;
}

std::string_view Trim(std::string_view s) {
  while (!s.empty() && IsBlank(s.front())) {
    s.remove_prefix(1);
  }
  while (!s.empty() && IsBlank(s.back())) {
    s.remove_suffix(1);
  }
  return s;
}

// lower is lower-case.
bool EqualsIgnoreCase(std::string_view s, std::string_view lower) {
  if (s.size() != lower.size()) {
    return false;
  }
  for (size_t i = 0; i < s.size(); ++i) {
    char c = s[i];
    if (c >= 'A' && c <= 'Z') {
      c = static_cast<char>(c - 'A' + 'a');
    }
    if (c != lower[i]) {
      return false;
    }
  }
  return true;
}

enum Field {
  kHost,
  kReferer,
  kUserAgent,
  kServer,
  kContentType,
  kConnection,
  kContentLength,
  kTransferEncoding,
  kOther,
};

Field Classify(std::string_view name) {
  switch (name.size()) {
    case 4:
      return EqualsIgnoreCase(name, "host") ? kHost : kOther;
    case 6:
      return EqualsIgnoreCase(name, "server") ? kServer : kOther;
    case 7:
      return EqualsIgnoreCase(name, "referer") ? kReferer : kOther;
    case 10:
      if (EqualsIgnoreCase(name, "user-agent")) {
        return kUserAgent;
      }
      return EqualsIgnoreCase(name, "connection") ? kConnection : kOther;
    case 12:
      return EqualsIgnoreCase(name, "content-type") ? kContentType : kOther;
    case 14:
      return EqualsIgnoreCase(name, "content-length") ? kContentLength : kOther;
    case 17:
      return EqualsIgnoreCase(name, "transfer-encoding") ? kTransferEncoding : kOther;
    default:
      return kOther;
  }
}

std::string* FieldString(HttpHead* head, Field field) {
  switch (field) {
    case kHost:
      return &head->host;
    case kReferer:
      return &head->referer;
    case kUserAgent:
      return &head->user_agent;
    case kServer:
      return &head->server;
    case kContentType:
      return &head->content_type;
    case kConnection:
      return &head->connection;
    default:
      return nullptr;
  }
}

// Content-Length is digits, or a list of equal values; every occurrence must agree, since
// framing that two readers could read differently is not framing.
bool AddContentLength(std::string_view value, int64_t* length) {
  bool any = false;
  while (true) {
    const size_t comma = value.find(',');
    const std::string_view item = Trim(value.substr(0, comma));
    if (!item.empty()) {
      int64_t n = 0;
      for (char c : item) {
        if (!IsDigit(static_cast<uint8_t>(c)) || n > (INT64_MAX - 9) / 10) {
          return false;
        }
        n = n * 10 + (c - '0');
      }
      if (*length >= 0 && *length != n) {
        return false;
      }
      *length = n;
      any = true;
    }
    if (comma == std::string_view::npos) {
      break;
    }
    value.remove_prefix(comma + 1);
  }
  return any;
}

// Repeated Transfer-Encoding headers make one list: the last coding named decides.
void AddTransferEncoding(std::string_view value, HttpHead* head) {
  head->transfer_encoding = true;
  while (!value.empty()) {
    const size_t comma = value.rfind(',');
    std::string_view item = comma == std::string_view::npos ? value : value.substr(comma + 1);
    item = Trim(item.substr(0, item.find(';')));
    if (!item.empty()) {
      head->chunked = EqualsIgnoreCase(item, "chunked");
      return;
    }
    value = comma == std::string_view::npos ? std::string_view() : value.substr(0, comma);
  }
}

bool AddField(Field field, std::string_view value, HttpHead* head, unsigned* seen) {
  switch (field) {
    case kOther:
      return true;
    case kContentLength:
      return AddContentLength(value, &head->content_length);
    case kTransferEncoding:
      AddTransferEncoding(value, head);
      return true;
    default:
      if ((*seen & (1u << field)) == 0) {
        *seen |= 1u << field;
        FieldString(head, field)->assign(value.substr(0, HttpHead::kMaxFieldBytes));
      }
      return true;
  }
}

// line is a start line without its line end, checked before; the digits are looked at again
// only so that nothing here depends on how the line got here.
bool ParseStartLine(HttpParser::Kind kind, std::string_view line, HttpHead* head) {
  const auto digit = [](char c) { return IsDigit(static_cast<uint8_t>(c)); };
  std::string_view version = line;
  if (kind == HttpParser::Kind::kRequest) {
    const size_t sp1 = line.find(' ');
    const size_t sp2 = sp1 == std::string_view::npos ? sp1 : line.find(' ', sp1 + 1);
    if (sp2 == std::string_view::npos) {
      return false;
    }
    head->method.assign(line.substr(0, sp1));
    head->target.assign(line.substr(sp1 + 1, sp2 - sp1 - 1));
    version = line.substr(sp2 + 1);
  } else {
    if (line.size() < 12 || !digit(line[9]) || !digit(line[10]) || !digit(line[11])) {
      return false;
    }
    head->status = (line[9] - '0') * 100 + (line[10] - '0') * 10 + (line[11] - '0');
  }
  if (version.size() < 8 || !digit(version[7])) {
    return false;
  }
  head->version_major = 1;
  head->version_minor = version[7] - '0';
  return true;
}

// text: a whole head, start line to empty line. False for a malformed one.
bool ParseHead(HttpParser::Kind kind, std::string_view text, HttpHead* head, std::string* fold) {
  head->Clear();
  size_t nl = text.find('\n');
  if (nl == std::string_view::npos || !ParseStartLine(kind, StripCr(text.substr(0, nl)), head)) {
    return false;
  }
  unsigned seen = 0;
  Field field = kOther;  // the header whose value obs-fold lines continue
  std::string_view value;
  bool folded = false;  // value is in *fold
  size_t pos = nl + 1;
  while (pos < text.size()) {
    nl = std::min(text.find('\n', pos), text.size());
    const std::string_view line = StripCr(text.substr(pos, nl - pos));
    pos = nl + 1;
    if (line.empty()) {
      break;
    }
    if (IsBlank(line.front())) {
      // obs-fold; a fold before any header or on an ignored one is ignored with it.
      if (field != kOther) {
        if (!folded) {
          fold->assign(value);
          folded = true;
        }
        const std::string_view more = Trim(line);
        if (!more.empty()) {
          if (!fold->empty()) {
            fold->push_back(' ');
          }
          fold->append(more);
        }
      }
      continue;
    }
    if (!AddField(field, folded ? std::string_view(*fold) : value, head, &seen)) {
      return false;
    }
    field = kOther;
    folded = false;
    size_t colon = 0;
    while (colon < line.size() && IsTchar(static_cast<uint8_t>(line[colon]))) {
      ++colon;
    }
    if (colon == line.size() || line[colon] != ':') {
      // A name with blanks or other stray bytes is skipped rather than failing the message,
      // as servers configured to ignore invalid headers do; a line without a colon is not a
      // header at all.
      if (line.find(':', colon) == std::string_view::npos) {
        return false;
      }
      continue;
    }
    if (colon == 0) {
      return false;
    }
    field = Classify(line.substr(0, colon));
    value = Trim(line.substr(colon + 1));
  }
  return AddField(field, folded ? std::string_view(*fold) : value, head, &seen);
}

enum class Body { kNone, kLength, kChunked, kUntilClose, kBad };

Body RequestBody(const HttpHead& head) {
  if (head.transfer_encoding) {
    // Without chunked last, a request's body length cannot be known.
    return head.chunked ? Body::kChunked : Body::kBad;
  }
  return head.content_length >= 0 ? Body::kLength : Body::kNone;
}

Body ResponseBody(const HttpHead& head) {
  if (head.status < 200 || head.status == 204 || head.status == 304) {
    return Body::kNone;
  }
  if (head.transfer_encoding) {
    return head.chunked ? Body::kChunked : Body::kUntilClose;
  }
  return head.content_length >= 0 ? Body::kLength : Body::kUntilClose;
}

}  // namespace

void HttpHead::Clear() {
  method.clear();
  target.clear();
  version_major = 1;
  version_minor = 1;
  status = 0;
  host.clear();
  referer.clear();
  user_agent.clear();
  server.clear();
  content_type.clear();
  connection.clear();
  content_length = -1;
  chunked = false;
  transfer_encoding = false;
}

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
  Body body = Body::kBad;
  if (ParseHead(kind_, head, &head_, &fold_)) {
    body = kind_ == Kind::kRequest ? RequestBody(head_) : ResponseBody(head_);
  }
  ReleaseBuffer(&head_buf_);
  ReleaseBuffer(&fold_);
  if (body == Body::kBad) {
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
    body = Body::kNone;
  }
  switch (body) {
    case Body::kLength:
      if (head_.content_length > 0) {
        remaining_ = static_cast<uint64_t>(head_.content_length);
        state_ = State::kLengthBody;
        break;
      }
      FinishMessage();
      break;
    case Body::kChunked:
      state_ = State::kChunkSize;
      chunk_line_.clear();
      break;
    case Body::kUntilClose:
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
