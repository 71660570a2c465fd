#include "collector/capture/http_head.h"

#include <algorithm>
#include <array>
#include <climits>
#include <cstring>

namespace capture {
namespace {

constexpr size_t kMaxMethodBytes = 32;
constexpr size_t kMaxChunkSizeDigits = 15;  // keeps sizes below 2^60

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
bool ParseStartLine(HttpMessageKind kind, std::string_view line, HttpHead* head) {
  const auto digit = [](char c) { return IsDigit(static_cast<uint8_t>(c)); };
  std::string_view version = line;
  if (kind == HttpMessageKind::kRequest) {
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

}  // namespace

LineCheck CheckStartLine(HttpMessageKind kind, const uint8_t* p, size_t n) {
  return kind == HttpMessageKind::kRequest ? CheckRequestLine(p, n) : CheckStatusLine(p, n);
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

// ---- Heads

// text: a whole head, start line to empty line. False for a malformed one.
bool ParseHead(HttpMessageKind kind, std::string_view text, HttpHead* head, std::string* fold) {
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

BodyFraming RequestFraming(const HttpHead& head) {
  if (head.transfer_encoding) {
    // Without chunked last, a request's body length cannot be known.
    return head.chunked ? BodyFraming::kChunked : BodyFraming::kBad;
  }
  return head.content_length >= 0 ? BodyFraming::kLength : BodyFraming::kNone;
}

BodyFraming ResponseFraming(const HttpHead& head) {
  if (head.status < 200 || head.status == 204 || head.status == 304) {
    return BodyFraming::kNone;
  }
  if (head.transfer_encoding) {
    return head.chunked ? BodyFraming::kChunked : BodyFraming::kUntilClose;
  }
  return head.content_length >= 0 ? BodyFraming::kLength : BodyFraming::kUntilClose;
}

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

}  // namespace capture
