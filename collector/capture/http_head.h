#pragma once

// The syntax of HTTP/1.x heads for HttpParser: checking start lines and chunk-size lines as
// their bytes arrive, finding the empty line that ends a head, parsing a complete head into an
// HttpHead, and how a message's body is framed. Pure functions over caller-owned bytes.
//
// Thread safety: HttpHead is a plain value; the functions keep no state.

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

namespace capture {

enum class HttpMessageKind { kRequest, kResponse };

// The head of one message, with the fields the collector records. Header names match
// case-insensitively; a repeated header keeps its first value (Content-Length excepted: see
// content_length). Values have their surrounding blanks removed and are cut at kMaxFieldBytes.
struct HttpHead {
  static constexpr size_t kMaxFieldBytes = 4096;

  std::string method;  // requests: the method token as sent ("GET")
  std::string target;  // requests: the request-target as sent ("/a/b.html?x=1")
  int version_major = 1;
  int version_minor = 1;  // from "HTTP/1.1"
  int status = 0;         // responses: the 3-digit status code
  std::string host;
  std::string referer;
  std::string user_agent;
  std::string server;
  std::string content_type;
  std::string connection;          // the Connection header's value as sent
  int64_t content_length = -1;     // -1 when absent; a valid list of equal values counts once
  bool chunked = false;            // Transfer-Encoding's last coding is "chunked"
  bool transfer_encoding = false;  // a Transfer-Encoding header is present

  void Clear();
};

// Whether the bytes of a line so far can be, are, or cannot be what is looked for. A check
// takes p[0, n), which ends at the line's first '\n' when the line is complete; a complete
// line is never kNeedMore.
enum class LineCheck { kValid, kInvalid, kNeedMore };

// A request line ("GET /a HTTP/1.1") or a status line ("HTTP/1.1 200 OK"), CRLF or bare LF.
LineCheck CheckStartLine(HttpMessageKind kind, const uint8_t* p, size_t n);
// chunk-size [BWS] [";" chunk-ext] CRLF (or a bare LF); *size is set when kValid.
LineCheck CheckChunkLine(const uint8_t* p, size_t n, uint64_t* size);

// Where the bytes seen so far left a line, for finding an empty line across segments.
enum EolState : uint8_t { kMidLine, kLineStart, kLineStartCr };
inline constexpr size_t kNotFound = static_cast<size_t>(-1);

// Finds the end of the first empty line ("\n" or "\r\n" at a line start) in data[pos, size),
// pos < size, continuing from *state; returns one past it, or kNotFound with *state updated.
size_t FindEmptyLine(const uint8_t* data, size_t pos, size_t size, uint8_t* state);

// text: a whole head, start line to empty line, already checked with CheckStartLine. Fills
// *head (cleared first); fold is scratch space kept by the caller to save allocations. False
// for a malformed head.
bool ParseHead(HttpMessageKind kind, std::string_view text, HttpHead* head, std::string* fold);

// How a message's body ends, by its head alone; a reply to HEAD is the caller's to know.
enum class BodyFraming { kNone, kLength, kChunked, kUntilClose, kBad };
BodyFraming RequestFraming(const HttpHead& head);
BodyFraming ResponseFraming(const HttpHead& head);

}  // namespace capture
