#pragma once

// HttpParser: an incremental HTTP/1.x message parser for one direction of a TCP connection
// (requests from the client, or responses from the server), fed the reassembled byte stream
// segment by segment with each segment's capture time. It frames messages (heads, Content-Length,
// chunked and close-delimited bodies, replies that never have a body), keeps the header fields
// the collector records, and measures each message on the wire: its stream offsets, the capture
// times of its first and last byte and the segments that carried it.
//
// It never fails on bad input: bytes that are not HTTP (a stream seen from its middle, TLS,
// HTTP/2, a gap inside a head, a head over the size limit, a malformed line) are reported once
// through OnDesync, and the parser then looks for the next start line of its kind at the
// beginning of a line, resynchronising the stream there.
//
// Thread safety: none; one thread owns an instance. The listener must outlive the parser.

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

#include "collector/capture/http_head.h"
#include "collector/capture/tcp_segment.h"

namespace capture {

// One message as seen on the wire.
struct HttpMessageSpan {
  uint64_t begin_offset = 0;  // stream offset of its first byte (offsets count from 0 at the
                              // first byte the parser was given; gaps count as bytes)
  uint64_t end_offset = 0;    // one past its last byte
  Micros first_time = 0;      // capture time of the segment holding its first byte
  Micros last_time = 0;       // ... of its last byte, or of the last byte seen when truncated
  uint32_t packets = 0;       // Feed calls that carried at least one of its bytes
  bool gap = false;           // some of its bytes were missing from the capture
  bool truncated = false;     // it ended before its framing said (stream end, lost framing)
};

class HttpParser {
 public:
  using Kind = HttpMessageKind;

  enum class Desync {
    kNotHttp,       // the stream, seen from its start, does not begin with a start line
    kMidstream,     // the stream was not seen from its start and does not begin with one
    kGapInHead,     // bytes of a head were missing: the message is dropped
    kGapInFraming,  // a gap hid where a chunked body or the next message begins
    kHeadTooLarge,  // a head over the size limit: the message is dropped
    kBadHead,       // a malformed start line, header line or chunk size: the message is dropped
  };

  // Calls come from inside Feed, Gap and End and must not call back into the parser. A head
  // given to OnHead or OnMessage belongs to the parser and is valid only during the call. After
  // OnHead a message ends in OnMessage, or is dropped by OnDesync(kBadHead) for broken chunked
  // framing or OnDesync(kHeadTooLarge) for a trailer over the head size limit.
  class Listener {
   public:
    virtual ~Listener() = default;
    // A message began at offset, its first byte captured at time. Called once its start line
    // is complete and valid, so bytes that are not HTTP never begin a message.
    virtual void OnMessageBegin(uint64_t offset, Micros time) = 0;
    // The head is complete. Return true when the message has no body whatever its headers
    // say (the reply to a HEAD request). The parser itself knows that requests without
    // Content-Length or chunked coding, and 1xx, 204 and 304 replies, have none, and that a
    // 101 reply ends HTTP on the stream: everything after its head is ignored.
    virtual bool OnHead(const HttpHead& head) = 0;
    // The message is over: complete, or ended early (span.truncated). head is the one given
    // to OnHead. A message dropped in its head is not reported here (OnDesync is).
    virtual void OnMessage(const HttpHead& head, const HttpMessageSpan& span) = 0;
    // Bytes that are not a message of this stream; the parser now seeks a start line.
    virtual void OnDesync(Desync reason) = 0;
  };

  // max_head_bytes: the largest head (start line to the empty line) accepted.
  HttpParser(Kind kind, Listener* listener, size_t max_head_bytes = 64 * 1024);
  HttpParser(const HttpParser&) = delete;
  HttpParser& operator=(const HttpParser&) = delete;

  // Call before the first Feed when the stream was not seen from its start (no SYN): bytes
  // before the first start line are then reported as kMidstream instead of kNotHttp.
  void SetMidstream();

  // The next size bytes of the stream, carried by one segment captured at time.
  void Feed(const uint8_t* data, size_t size, Micros time);
  // size bytes of the stream that the capture missed; time is when the gap was noticed.
  void Gap(uint64_t size, Micros time);
  // The stream ended (FIN, RST, idle timeout or the connection was dropped) at time: a
  // close-delimited body completes, a message in progress ends truncated.
  void End(Micros time);

  // True while a message has begun and is not over.
  bool in_message() const;
  // True after a 101 reply: nothing more is parsed.
  bool switched() const;

 private:
  enum class State : uint8_t {
    kIdle,          // in step with the stream, between messages
    kResync,        // dropping bytes until a start line begins a line
    kStartLine,     // a start line begun in an earlier segment, held in head_buf_
    kHeaders,       // start line recognised; looking for the empty line that ends the head
    kLengthBody,    // remaining_ bytes of a Content-Length body to come
    kChunkSize,     // a chunk size line, its earlier part held in chunk_line_
    kChunkData,     // remaining_ bytes of chunk data to come
    kChunkDataEnd,  // the CRLF after chunk data
    kTrailer,       // trailer lines up to the empty line
    kCloseBody,     // a body that ends with the stream
    kSwitched,      // after a 101 reply: nothing is parsed
    kEnded,         // after End
  };

  // Each step takes the segment data[0, size), starts at pos < size and returns where the next
  // step starts; it consumes at least one byte or changes the state.
  size_t OnIdle(const uint8_t* data, size_t pos, size_t size);
  size_t OnResync(const uint8_t* data, size_t pos, size_t size);
  size_t TryStartLine(const uint8_t* data, size_t pos, size_t size);
  size_t ContinueStartLine(const uint8_t* data, size_t pos, size_t size);
  size_t StartLineRecognised(size_t next);
  size_t OnHeaders(const uint8_t* data, size_t pos, size_t size);
  size_t OnHeadComplete(std::string_view head, size_t next);
  size_t OnChunkSize(const uint8_t* data, size_t pos, size_t size);
  size_t OnChunkDataEnd(const uint8_t* data, size_t pos);
  size_t OnTrailer(const uint8_t* data, size_t pos, size_t size);

  // Starts a message at data[pos] of the current segment.
  void BeginMessage(size_t pos);
  // The current message now takes the current segment's bytes up to end.
  void Extend(size_t end);
  void FinishMessage();
  // A gap hid the current message's framing: it ends truncated and the stream is lost.
  void LoseFraming(bool at_line_start);
  // Drops any message in its head and looks for a start line; reports reason unless already
  // looking. at_line_start: the next byte begins a line.
  void LoseSync(Desync reason, bool at_line_start);
  Desync StartLineFailure(const uint8_t* line, size_t size) const;
  size_t StartLineLimit() const;

  const Kind kind_;
  Listener* const listener_;
  const size_t max_head_bytes_;

  State state_ = State::kIdle;
  bool midstream_ = false;
  bool resyncing_ = false;        // a desync was reported and no start line seen since
  bool at_line_start_ = true;     // kResync: the next byte begins a line
  bool seen_start_line_ = false;  // later failures are kBadHead, not kNotHttp/kMidstream
  bool chunk_cr_ = false;         // kChunkDataEnd: the CR was seen
  uint8_t eol_state_ = 0;         // kHeaders, kTrailer: where the last byte left the line
  uint64_t offset_ = 0;           // stream offset of the current segment's first byte
  uint64_t feed_count_ = 0;       // Feed calls that carried bytes, numbering segments
  uint64_t message_feed_ = 0;     // the last segment counted in span_.packets
  Micros time_ = 0;               // capture time of the current segment
  size_t head_pos_ = 0;           // kHeaders: where the head's unbuffered bytes begin
  uint64_t remaining_ = 0;        // bytes of body or chunk data to come
  uint64_t trailer_bytes_ = 0;

  HttpHead head_;
  HttpMessageSpan span_;
  std::string head_buf_;    // the head so far when it spans segments
  std::string chunk_line_;  // a chunk size line that spans segments
  std::string fold_;        // a header value joined from obs-fold lines
};

}  // namespace capture
