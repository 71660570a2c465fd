// libFuzzer target over the HTTP/1.x parser. The input is one byte stream given to a request
// parser and to a response parser, cut into segments (and holes the capture "missed") by its
// first bytes. Beyond not crashing, each run checks what every caller relies on: messages come
// in stream order without overlapping, inside the bytes offered, after their head; nothing is
// in progress after End and nothing begins after a 101; and the messages found do not depend on
// how the stream was cut into segments (the same stream fed in one piece between holes must
// give the same). Desyncs are not compared: when and why sync is lost may rest on how much was
// seen (a head that passes the limit before its line ends, an HTTP/2 preface seen whole).
//
// Input: flags, three segment lengths, then the stream.
//   flags bit 0: both streams were not seen from their start (SetMidstream)
//   flags bit 1: a small head limit (40 to 295 bytes, from the first length byte)
//   flags bit 2: every second reply is the reply to a HEAD (OnHead returns true)
//   flags bit 3: lengths with their top bit set put a hole of 1-16 bytes before the segment
//   flags bit 4: the stream ends with End; otherwise it just stops

#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <vector>

#include "collector/capture/http_parser.h"

namespace {

using capture::HttpHead;
using capture::HttpMessageSpan;
using capture::HttpParser;
using capture::Micros;

// One step of feeding: bytes of the input, or a hole.
struct Op {
  size_t from = 0;  // Feed: offset in the stream bytes
  size_t size = 0;
  bool gap = false;
};

// What one message looked like, minus the segment-dependent packet count and times.
struct Seen {
  uint64_t begin = 0;
  uint64_t end = 0;
  bool truncated = false;
  bool gap = false;
  std::string method;
  std::string target;
  int status = 0;
  int64_t content_length = -1;
  bool chunked = false;

  bool operator==(const Seen&) const = default;
};

class CheckingListener : public HttpParser::Listener {
 public:
  explicit CheckingListener(bool head_replies) : head_replies_(head_replies) {}

  // The parser this listener hears from; set before the first Feed.
  void set_parser(const HttpParser* parser) { parser_ = parser; }
  void set_offered(uint64_t offered) { offered_ = offered; }

  void OnMessageBegin(uint64_t offset, Micros) override {
    Check(!parser_->switched(), "a message began after a 101");
    Check(!in_message_, "a message began inside another");
    Check(offset >= last_end_ && offset < offered_, "a message began outside the new bytes");
    in_message_ = true;
    head_seen_ = false;
  }

  bool OnHead(const HttpHead& head) override {
    Check(in_message_ && !head_seen_, "a head outside a message");
    Check(head.method.size() <= HttpHead::kMaxFieldBytes &&
              head.target.size() <= HttpHead::kMaxFieldBytes &&
              head.host.size() <= HttpHead::kMaxFieldBytes &&
              head.user_agent.size() <= HttpHead::kMaxFieldBytes,
          "a header value over the field limit");
    head_seen_ = true;
    ++heads_;
    return head_replies_ && heads_ % 2 == 0;
  }

  void OnMessage(const HttpHead& head, const HttpMessageSpan& span) override {
    Check(in_message_ && head_seen_, "a message ended without its head");
    Check(span.begin_offset >= last_end_, "messages overlap or go backwards");
    Check(span.begin_offset <= span.end_offset, "a message ends before it begins");
    Check(span.end_offset <= offered_, "a message ends past the bytes offered");
    Check(span.first_time <= span.last_time, "a message ends before it begins in time");
    Check(span.packets >= 1, "a message carried by no segment");
    last_end_ = span.end_offset;
    in_message_ = false;
    seen_.push_back(Seen{span.begin_offset, span.end_offset, span.truncated, span.gap, head.method,
                         head.target, head.status, head.content_length, head.chunked});
  }

  void OnDesync(HttpParser::Desync reason) override {
    // The message in progress, if any, is dropped: in its head, or after it on a bad chunk size.
    in_message_ = false;
    desynced_ = true;
    (void)reason;
  }

  const std::vector<Seen>& seen() const { return seen_; }
  bool desynced() const { return desynced_; }

  static void Check(bool ok, const char* what) {
    if (!ok) {
      std::fprintf(stderr, "http_parser_fuzz: %s\n", what);
      std::abort();
    }
  }

 private:
  const HttpParser* parser_ = nullptr;
  const bool head_replies_;
  uint64_t offered_ = 0;  // stream bytes fed or missed so far
  uint64_t last_end_ = 0;
  bool in_message_ = false;
  bool head_seen_ = false;
  int heads_ = 0;
  bool desynced_ = false;
  std::vector<Seen> seen_;
};

struct Result {
  std::vector<Seen> seen;
  bool desynced = false;
};

// Runs one parser over the ops; merged feeds consecutive bytes in one piece.
Result Parse(HttpParser::Kind kind, const std::vector<Op>& ops, const uint8_t* stream,
             uint8_t flags, size_t max_head, bool merged) {
  CheckingListener checking((flags & 4) != 0);
  HttpParser http(kind, &checking, max_head);
  checking.set_parser(&http);
  if ((flags & 1) != 0) {
    http.SetMidstream();
  }
  uint64_t offered = 0;
  Micros time = 1000;
  for (size_t i = 0; i < ops.size(); ++i) {
    const Op& op = ops[i];
    if (op.gap) {
      offered += op.size;
      checking.set_offered(offered);
      http.Gap(op.size, time);
      continue;
    }
    size_t size = op.size;
    if (merged) {
      while (i + 1 < ops.size() && !ops[i + 1].gap) {
        size += ops[++i].size;
      }
    }
    offered += size;
    checking.set_offered(offered);
    http.Feed(stream + op.from, size, time);
    time += 7;
  }
  if ((flags & 16) != 0) {
    http.End(time);
    CheckingListener::Check(!http.in_message(), "a message in progress after End");
  }
  return Result{checking.seen(), checking.desynced()};
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size < 4) {
    return 0;
  }
  const uint8_t flags = data[0];
  const uint8_t lengths[3] = {data[1], data[2], data[3]};
  const size_t max_head = (flags & 2) != 0 ? 40 + data[1] : 64 * 1024;
  const uint8_t* stream = data + 4;
  const size_t stream_size = size - 4;

  std::vector<Op> ops;
  for (size_t at = 0, i = 0; at < stream_size; ++i) {
    const uint8_t length = lengths[i % 3];
    if ((flags & 8) != 0 && (length & 0x80) != 0) {
      ops.push_back(Op{0, static_cast<size_t>(length & 0x0f) + 1, true});
    }
    const size_t n = std::min<size_t>((length & 0x7f) + 1, stream_size - at);
    ops.push_back(Op{at, n, false});
    at += n;
  }

  for (HttpParser::Kind kind : {HttpParser::Kind::kRequest, HttpParser::Kind::kResponse}) {
    const Result split = Parse(kind, ops, stream, flags, max_head, false);
    const Result whole = Parse(kind, ops, stream, flags, max_head, true);
    // In step with the stream, the cuts change nothing. Once sync is lost they may: where a
    // search for the next start line begins depends on where a head over the limit was given
    // up, and every segment's first byte is tried as a start line.
    if (!split.desynced && !whole.desynced) {
      CheckingListener::Check(split.seen == whole.seen,
                              "the messages depend on how the stream was cut into segments");
    }
  }
  return 0;
}
