// libFuzzer target over the capture pipeline and the TCP reassembler. The input is a script of
// packets: raw frames taken as they are, and TCP segments built from a few fields on four
// connections (so sequence numbers mostly make sense and HTTP gets through), with clock jumps
// and ticks in between. Every packet goes to a CapturePipeline; each built segment also goes,
// with a payload of known bytes, to a TcpReassembler of its own.
//
// Beyond not crashing, it checks what the record format and the stream handlers rely on:
// - every record formats into one line of the right number of fields, with no '^', '<' or line
//   break inside a value and every text within its field's width, and every exchange counted
//   is one record, a page or an object;
// - each direction's bytes come out in sequence order: payload byte values follow the byte's
//   sequence number, so bytes delivered out of place or a gap of the wrong size show;
// - nothing is delivered in a direction after its end, each direction ends exactly once, and
//   before its handler is destroyed.
//
// Input: one header byte, then records until the input ends.
//   header bits 0-2: link type; bit 3: small table and buffer limits; bit 4: the reassembler's
//   factory ignores every third connection.
//   record byte r, kind r % 4 (its top six bits, v, move the clock first: v ms, or 400 s at 63):
//     0: a raw frame: length byte, then that many bytes
//     1, 2: a built segment: connection byte (bits 0-1 which, bit 2 from the server, bit 3
//        IPv6, bit 4 cut by the snap length), flags byte, sequence delta (signed 16 bits, big
//        end first, from the side's next byte), acknowledgement byte (bit 7: all of the other
//        side's bytes, else that many fewer), length byte, then the payload
//     3: a clock tick

#include <algorithm>
#include <array>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <memory>
#include <string>
#include <vector>

#include "collector/capture/capture_pipeline.h"
#include "collector/capture/tcp_reassembler.h"
#include "collector/capture/testing/packet_builder.h"
#include "collector/sm3gen/record_format.h"

namespace {

using capture::Direction;
using capture::Micros;
using capture::testing::Segment;

void Check(bool ok, const char* what) {
  if (!ok) {
    std::fprintf(stderr, "capture_fuzz: %s\n", what);
    std::abort();
  }
}

// The value a payload byte carries in the reassembler's copy: a function of its sequence number
// whose consecutive values differ by 131, so any byte out of place breaks the chain.
uint8_t PatternByte(uint32_t seq) {
  return static_cast<uint8_t>(seq * 131u);
}

// ---- Records ----

bool WithinWidth(const std::string& text, size_t width) {
  return text.size() <= width;
}

class CheckingSink : public capture::RecordSink {
 public:
  uint64_t count() const { return count_; }

  void Write(const sm3gen::Record& r) override {
    ++count_;
    const bool page_layout = sm3gen::UsesPageLayout(r.kind);
    for (const std::string* text : {&r.product_version,
                                    &r.application_id,
                                    &r.reserved1,
                                    &r.collector_id,
                                    &r.guid,
                                    &r.date,
                                    &r.time_of_day,
                                    &r.time_zone,
                                    &r.client_address,
                                    &r.server_address,
                                    &r.url,
                                    &r.referrer,
                                    &r.browser,
                                    &r.server_description,
                                    &r.protocol,
                                    &r.host,
                                    &r.url_path,
                                    &r.url_file,
                                    &r.url_query,
                                    &r.url_anchor,
                                    &r.title}) {
      Check(text->find_first_of(std::string("^<\r\n\0", 5)) == std::string::npos,
            "a record value holds a framing character");
    }
    Check(WithinWidth(r.collector_id, 31) && WithinWidth(r.guid, 64) &&
              WithinWidth(r.client_address, 64) && WithinWidth(r.server_address, 64) &&
              WithinWidth(r.url, 254) && WithinWidth(r.referrer, 254) &&
              WithinWidth(r.browser, 254) && WithinWidth(r.server_description, 254) &&
              WithinWidth(r.protocol, 32) && WithinWidth(r.host, 254) &&
              WithinWidth(r.url_path, 254) && WithinWidth(r.url_file, 254) &&
              WithinWidth(r.url_query, 254) && WithinWidth(r.url_anchor, 126) &&
              WithinWidth(r.title, 254),
          "a record value over its field's width");
    const std::string line = sm3gen::FormatRecord(r);
    const size_t separators = static_cast<size_t>(std::count(line.begin(), line.end(), '^'));
    const size_t fields = page_layout ? sm3gen::kPageLayoutFields : sm3gen::kObjectLayoutFields;
    Check(separators + 1 == fields, "a record with the wrong number of fields");
    Check(std::count(line.begin(), line.end(), '<') == 2, "a record with a stray '<'");
    Check(r.response_ms >= 0 && r.request_bytes >= 0 && r.reply_bytes >= 0,
          "a negative time or size in a record");
  }

 private:
  uint64_t count_ = 0;
};

// ---- Reassembly ----

class CheckingHandler : public capture::StreamHandler {
 public:
  ~CheckingHandler() override {
    Check(sides_[0].ended && sides_[1].ended, "a handler destroyed before both directions ended");
  }

  void OnData(Direction dir, const uint8_t* data, uint32_t size, Micros) override {
    Side& side = sides_[static_cast<int>(dir)];
    Check(!side.ended, "bytes delivered after the direction ended");
    Check(size > 0, "an empty delivery");
    for (uint32_t i = 0; i < size; ++i) {
      Check(!side.started || data[i] == side.next, "bytes delivered out of sequence order");
      side.started = true;
      side.next = static_cast<uint8_t>(data[i] + 131);
    }
  }

  void OnGap(Direction dir, uint64_t size, Micros) override {
    Side& side = sides_[static_cast<int>(dir)];
    Check(!side.ended, "a gap after the direction ended");
    Check(size > 0, "an empty gap");
    side.next = static_cast<uint8_t>(side.next + 131 * (size % 256));
  }

  void OnPureAck(Direction, Micros) override {}

  void OnEnd(Direction dir, Micros) override {
    Side& side = sides_[static_cast<int>(dir)];
    Check(!side.ended, "a direction ended twice");
    side.ended = true;
  }

 private:
  struct Side {
    bool ended = false;
    bool started = false;  // next is known
    uint8_t next = 0;      // the value the next byte must have
  };
  std::array<Side, 2> sides_;
};

class CheckingFactory : public capture::StreamHandlerFactory {
 public:
  explicit CheckingFactory(bool ignore_some) : ignore_some_(ignore_some) {}

  std::unique_ptr<capture::StreamHandler> NewConnection(const capture::ConnectionInfo&) override {
    if (ignore_some_ && ++count_ % 3 == 0) {
      return nullptr;
    }
    return std::make_unique<CheckingHandler>();
  }

 private:
  const bool ignore_some_;
  int count_ = 0;
};

// ---- The script ----

constexpr int kLinks[8] = {capture::testing::kLinkEthernet, capture::testing::kLinkEthernet,
                           capture::testing::kLinkLinuxSll, capture::testing::kLinkLinuxSll2,
                           capture::testing::kLinkNull,     capture::testing::kLinkRaw,
                           capture::testing::kLinkRawFile,  105 /* 802.11: not read */};

// Four connections, each side with its sequence numbers; the ISNs sit near the wrap.
struct Script {
  struct Side {
    uint32_t isn = 0;
    uint32_t next = 0;  // bytes sent so far, counted from isn + 1
  };
  std::array<std::array<Side, 2>, 4> sides;

  Script() {
    for (uint32_t c = 0; c < 4; ++c) {
      sides[c][0].isn = 0xffffff00u + c * 0x40000000u;
      sides[c][1].isn = 0x7ffff000u + c * 0x10000u;
    }
  }
};

class Reader {
 public:
  Reader(const uint8_t* data, size_t size) : data_(data), size_(size) {}
  bool empty() const { return at_ >= size_; }
  uint8_t Byte() { return at_ < size_ ? data_[at_++] : 0; }
  const uint8_t* Take(size_t* n) {
    *n = std::min(*n, size_ - at_);
    const uint8_t* p = data_ + at_;
    at_ += *n;
    return p;
  }

 private:
  const uint8_t* data_;
  size_t size_;
  size_t at_ = 0;
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size < 1) {
    return 0;
  }
  Reader in(data, size);
  const uint8_t header = in.Byte();
  const int link_type = kLinks[header & 7];
  // Frames for a link type we do not read are still built, as Ethernet.
  capture::testing::LinkSpec link(link_type == 105 ? capture::testing::kLinkEthernet : link_type);
  if ((header & 7) == 1) {
    link.vlan_tpids = {0x88a8, 0x8100};
  }

  capture::PipelineOptions options;
  options.collector_id = "fuzz";
  options.product_version = "1.0.0";
  if ((header & 8) != 0) {
    options.tcp.max_connections = 3;
    options.tcp.max_buffered_bytes = 2048;
    options.tcp.max_total_buffered_bytes = 4096;
    options.max_head_bytes = 512;
  }
  CheckingSink sink;
  capture::CaptureStats stats;
  capture::CapturePipeline pipeline(options, &sink, &stats);
  CheckingFactory factory((header & 16) != 0);
  capture::CaptureStats tcp_stats;
  auto reassembler = std::make_unique<capture::TcpReassembler>(options.tcp, &factory, &tcp_stats);

  const char* clients[2] = {"10.0.0.1", "2001:db8::1"};
  const char* servers[2] = {"10.0.0.2", "2001:db8::2"};
  Script script;
  Micros now = 1700000000LL * 1000000;
  while (!in.empty()) {
    const uint8_t r = in.Byte();
    const int step = r >> 2;
    now += step == 63 ? 400 * 1000000LL : step * 1000LL;
    switch (r % 4) {
      case 0: {
        size_t n = in.Byte();
        const uint8_t* frame = in.Take(&n);
        // A copy of exactly n bytes, so reading past the frame is the sanitizer's to see.
        const std::vector<uint8_t> copy(frame, frame + n);
        pipeline.AddPacket(link_type, copy.data(), static_cast<uint32_t>(n),
                           static_cast<uint32_t>(n), now);
        break;
      }
      case 1:
      case 2: {
        const uint8_t which = in.Byte();
        const uint8_t flags = in.Byte() & 0x1f;
        const uint8_t delta_high = in.Byte();
        const int16_t delta = static_cast<int16_t>(delta_high << 8 | in.Byte());
        const uint8_t ack = in.Byte();
        size_t n = in.Byte();
        const uint8_t* payload = in.Take(&n);
        const int c = which & 3;
        const int from = (which >> 2) & 1;
        const bool v6 = (which & 8) != 0;
        Script::Side& side = script.sides[c][from];
        const Script::Side& other = script.sides[c][1 - from];

        Segment segment;
        segment.time = now;
        segment.src = capture::testing::ParseAddress(from == 0 ? clients[v6] : servers[v6]);
        segment.dst = capture::testing::ParseAddress(from == 0 ? servers[v6] : clients[v6]);
        segment.src_port = from == 0 ? static_cast<uint16_t>(40000 + c) : 80;
        segment.dst_port = from == 0 ? 80 : static_cast<uint16_t>(40000 + c);
        segment.from_client = from == 0;
        segment.flags = flags;
        const uint32_t offset = side.next + static_cast<uint32_t>(static_cast<int32_t>(delta));
        segment.seq = (flags & capture::kTcpSyn) != 0 ? side.isn : side.isn + 1 + offset;
        segment.ack = (ack & 0x80) != 0 ? other.isn + 1 + other.next
                                        : other.isn + 1 + other.next - (ack & 0x7f);
        segment.payload.assign(reinterpret_cast<const char*>(payload), n);
        if ((flags & capture::kTcpSyn) == 0) {
          side.next = std::max(side.next, offset + static_cast<uint32_t>(n));
        }

        capture::testing::Frame frame = capture::testing::BuildFrame(segment, link);
        if ((which & 16) != 0) {
          frame.Truncate(static_cast<uint32_t>(frame.data.size() - n / 2));
        }
        pipeline.AddPacket(link_type, frame.data.data(), static_cast<uint32_t>(frame.data.size()),
                           frame.wire_len, now);

        // The reassembler's copy: the same segment with pattern bytes, cut the same way.
        const uint32_t first_byte_seq = segment.seq + ((flags & capture::kTcpSyn) != 0 ? 1 : 0);
        for (size_t i = 0; i < n; ++i) {
          segment.payload[i] = static_cast<char>(PatternByte(first_byte_seq + i));
        }
        capture::TcpSegment view = segment.View();
        if ((which & 16) != 0) {
          view.payload_size -= static_cast<uint32_t>(n / 2);
        }
        reassembler->Add(view);
        break;
      }
      case 3:
        pipeline.Tick(now);
        reassembler->Expire(now);
        break;
    }
  }
  pipeline.Finish(now);
  reassembler->EndAll(now);
  Check(reassembler->connection_count() == 0, "connections left after EndAll");
  reassembler.reset();
  Check(sink.count() == stats.exchanges && stats.pages + stats.objects == stats.exchanges,
        "the records written and the exchanges counted disagree");
  return 0;
}
