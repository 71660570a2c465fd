#include "collector/capture/tcp_reassembler.h"

#include <algorithm>
#include <cstring>

namespace capture {

// A segment that arrived ahead of the next expected byte.
struct Pending {
  std::vector<uint8_t> bytes;
  uint32_t missing_tail = 0;  // bytes after these that the snap length cut off
  Micros time = 0;
};

struct TcpReassembler::HalfStream {
  bool started = false;  // base is known
  uint32_t base = 0;     // sequence number of stream offset 0
  uint64_t next = 0;     // offset of the next byte to deliver
  bool fin_seen = false;
  uint64_t fin_offset = 0;              // offset the FIN occupies
  bool ended = false;                   // OnEnd was called
  std::map<uint64_t, Pending> pending;  // by offset
  uint64_t buffered = 0;                // bytes in pending

  void Start(uint32_t seq) {
    started = true;
    base = seq;
  }
  // The 64-bit offset of seq, taken as the one nearest to next: sequence numbers wrap, and a
  // stream never has 2 GiB in flight. Negative when it lies before the stream's start.
  int64_t OffsetOf(uint32_t seq) const {
    const auto expected = static_cast<uint32_t>(base + static_cast<uint32_t>(next));
    const auto delta = static_cast<int32_t>(seq - expected);
    return static_cast<int64_t>(next) + delta;
  }
};

struct TcpReassembler::Connection {
  Key key;
  ConnectionInfo info;
  std::unique_ptr<StreamHandler> handler;
  HalfStream half[2];
  Micros last_seen = 0;

  HalfStream& stream(Direction dir) { return half[static_cast<int>(dir)]; }
  Direction DirectionOf(const TcpSegment& segment) const {
    return segment.src == info.client && segment.src_port == info.client_port
               ? Direction::kToServer
               : Direction::kToClient;
  }
};

namespace {

// How many capped connections are remembered before the memory starts over.
constexpr size_t kMaxRememberedCapped = 65536;

}  // namespace

size_t TcpReassembler::KeyHash::operator()(const Key& key) const {
  // FNV-1a over the addresses and ports: cheap and well spread for these few bytes.
  uint64_t h = 1469598103934665603ull;
  auto mix = [&h](const uint8_t* p, size_t n) {
    for (size_t i = 0; i < n; ++i) {
      h = (h ^ p[i]) * 1099511628211ull;
    }
  };
  const size_t address_bytes = key.a.v6 ? 16 : 4;
  mix(key.a.bytes.data(), address_bytes);
  mix(key.b.bytes.data(), address_bytes);
  const uint32_t ports = static_cast<uint32_t>(key.a_port) << 16 | key.b_port;
  mix(reinterpret_cast<const uint8_t*>(&ports), sizeof(ports));
  return static_cast<size_t>(h);
}

TcpReassembler::TcpReassembler(const ReassemblerOptions& options, StreamHandlerFactory* factory,
                               CaptureStats* stats)
    : options_(options), factory_(factory), stats_(stats) {}

TcpReassembler::~TcpReassembler() = default;

TcpReassembler::Key TcpReassembler::MakeKey(const TcpSegment& segment) {
  // Both directions of a connection share one key: the smaller endpoint first.
  const bool src_first = std::memcmp(segment.src.bytes.data(), segment.dst.bytes.data(), 16) < 0 ||
                         (segment.src == segment.dst && segment.src_port < segment.dst_port);
  Key key;
  if (src_first) {
    key = {segment.src, segment.dst, segment.src_port, segment.dst_port};
  } else {
    key = {segment.dst, segment.src, segment.dst_port, segment.src_port};
  }
  return key;
}

TcpReassembler::Connection* TcpReassembler::Open(const Key& key, const TcpSegment& segment) {
  const bool syn = (segment.flags & kTcpSyn) != 0;
  const bool ack = (segment.flags & kTcpAck) != 0;
  // Only an opening or a segment with data starts a connection: the tail of one that ended
  // before the capture (FINs, ACKs, RSTs) is not worth a table entry.
  if ((segment.flags & kTcpRst) != 0 || (!syn && segment.payload_size == 0)) {
    return nullptr;
  }
  if (connections_.size() >= options_.max_connections) {
    if (capped_.size() >= kMaxRememberedCapped) {
      capped_.clear();
    }
    if (capped_.insert(key).second) {
      ++stats_->connections_capped;
    }
    return nullptr;
  }
  auto connection = std::make_unique<Connection>();
  connection->key = key;
  ConnectionInfo& info = connection->info;
  // Who is the client: the SYN's sender; the receiver of a SYN/ACK; else the higher port.
  bool sender_is_client;
  if (syn) {
    sender_is_client = !ack;
  } else {
    sender_is_client =
        segment.src_port != segment.dst_port ? segment.src_port > segment.dst_port : true;
  }
  if (sender_is_client) {
    info.client = segment.src;
    info.server = segment.dst;
    info.client_port = segment.src_port;
    info.server_port = segment.dst_port;
  } else {
    info.client = segment.dst;
    info.server = segment.src;
    info.client_port = segment.dst_port;
    info.server_port = segment.src_port;
  }
  info.first_time = segment.time;
  if (syn && !ack) {
    info.syn_seen = true;
    info.syn_time = segment.time;
    // The server's first bytes follow its SYN/ACK, seen or not.
    info.from_start[static_cast<int>(Direction::kToServer)] = true;
    info.from_start[static_cast<int>(Direction::kToClient)] = true;
  } else if (syn && ack) {
    // The client's SYN was missed, but the server names where the client's bytes begin.
    info.from_start[static_cast<int>(Direction::kToServer)] = true;
    info.from_start[static_cast<int>(Direction::kToClient)] = true;
    connection->stream(Direction::kToServer).Start(segment.ack);
  }
  connection->handler = factory_->NewConnection(info);
  if (connection->handler == nullptr) {
    return nullptr;
  }
  ++stats_->connections;
  Connection* raw = connection.get();
  connections_.emplace(key, std::move(connection));
  return raw;
}

void TcpReassembler::Add(const TcpSegment& segment) {
  const Key key = MakeKey(segment);
  auto found = connections_.find(key);
  Connection* connection = found != connections_.end() ? found->second.get() : nullptr;
  if (connection != nullptr && (segment.flags & (kTcpSyn | kTcpAck)) == kTcpSyn) {
    // A new SYN on the same addresses and ports: the old connection is over (its end was not
    // seen) unless this is its own SYN again.
    const HalfStream& client = connection->stream(Direction::kToServer);
    if (!(segment.src == connection->info.client &&
          segment.src_port == connection->info.client_port && client.started &&
          client.base == segment.seq + 1)) {
      Close(key, segment.time);
      connection = nullptr;
    }
  }
  if (connection == nullptr) {
    connection = Open(key, segment);
    if (connection == nullptr) {
      return;
    }
  }
  connection->last_seen = segment.time;
  const Direction dir = connection->DirectionOf(segment);
  HalfStream& stream = connection->stream(dir);
  HalfStream& reverse = connection->stream(Reverse(dir));

  if ((segment.flags & kTcpRst) != 0) {
    Close(key, segment.time);
    return;
  }
  if ((segment.flags & kTcpSyn) != 0) {
    if (!stream.started) {
      stream.Start(segment.seq + 1);  // the SYN takes one sequence number
      connection->info.from_start[static_cast<int>(dir)] = true;
    }
    if ((segment.flags & kTcpAck) != 0 && !reverse.started) {
      reverse.Start(segment.ack);
    }
    if (segment.payload_size == 0 && (segment.flags & kTcpFin) == 0) {
      return;
    }
  }
  if (!stream.started) {
    stream.Start(segment.seq);
  }

  // An acknowledgement past the other direction's next byte: the receiver has bytes the
  // capture missed, and they will never be seen. Up to a FIN, which takes a number of its own.
  if ((segment.flags & kTcpAck) != 0 && reverse.started && !reverse.ended) {
    int64_t acked = reverse.OffsetOf(segment.ack);
    if (reverse.fin_seen) {
      acked = std::min<int64_t>(acked, static_cast<int64_t>(reverse.fin_offset));
    }
    while (acked > static_cast<int64_t>(reverse.next)) {
      uint64_t to = static_cast<uint64_t>(acked);
      if (!reverse.pending.empty()) {
        to = std::min(to, reverse.pending.begin()->first);
      }
      FillHoleTo(connection, Reverse(dir), to, segment.time);
      DeliverBuffered(connection, Reverse(dir));
    }
    if (reverse.fin_seen && reverse.next >= reverse.fin_offset) {
      EndDirection(connection, Reverse(dir), segment.time);
    }
  }

  if (segment.wire_payload_size > 0 || (segment.flags & kTcpFin) != 0) {
    AddToStream(connection, dir, segment);
  } else if ((segment.flags & (kTcpSyn | kTcpFin)) == 0 && !stream.ended) {
    connection->handler->OnPureAck(dir, segment.time);
  }

  // Both sides have said FIN: whatever hole is left will not be filled by this connection.
  if (connection->half[0].fin_seen && connection->half[1].fin_seen) {
    EndDirection(connection, Direction::kToServer, segment.time);
    EndDirection(connection, Direction::kToClient, segment.time);
  }
  if (connection->half[0].ended && connection->half[1].ended) {
    connections_.erase(key);
  }
}

void TcpReassembler::AddToStream(Connection* connection, Direction dir, const TcpSegment& segment) {
  HalfStream& stream = connection->stream(dir);
  if (stream.ended) {
    return;
  }
  // A SYN takes a sequence number of its own: data it carries (TCP Fast Open) follows it.
  const uint32_t data_seq = segment.seq + ((segment.flags & kTcpSyn) != 0 ? 1 : 0);
  const int64_t signed_offset = stream.OffsetOf(data_seq);
  const uint64_t wire = segment.wire_payload_size;
  if ((segment.flags & kTcpFin) != 0 && signed_offset + static_cast<int64_t>(wire) >= 0) {
    stream.fin_seen = true;
    stream.fin_offset = static_cast<uint64_t>(signed_offset) + wire;
  }
  if (wire > 0) {
    if (signed_offset + static_cast<int64_t>(wire) <= static_cast<int64_t>(stream.next)) {
      ++stats_->retransmissions;
    } else {
      // Trim what was delivered already (a retransmission that overlaps new bytes).
      uint64_t offset = static_cast<uint64_t>(std::max<int64_t>(signed_offset, 0));
      uint32_t skip = static_cast<uint32_t>(offset - signed_offset);
      if (offset < stream.next) {
        skip += static_cast<uint32_t>(stream.next - offset);
        offset = stream.next;
      }
      const uint32_t captured = segment.payload_size > skip ? segment.payload_size - skip : 0;
      const uint64_t end = static_cast<uint64_t>(signed_offset) + wire;
      const uint32_t missing = static_cast<uint32_t>(end - offset - captured);
      if (offset == stream.next) {
        Deliver(connection, dir, offset, segment.payload + skip, captured, segment.time);
        if (missing > 0) {
          FillHoleTo(connection, dir, end, segment.time);
        }
      } else {
        ++stats_->out_of_order;
        // Make room: give up on the oldest hole while this would overflow a buffer.
        while (stream.buffered + captured > options_.max_buffered_bytes ||
               total_buffered_ + captured > options_.max_total_buffered_bytes) {
          ++stats_->buffer_overflows;
          const uint64_t to = stream.pending.empty() ? offset : stream.pending.begin()->first;
          FillHoleTo(connection, dir, to, segment.time);
          DeliverBuffered(connection, dir);
          if (stream.pending.empty() || stream.next >= offset) {
            break;
          }
        }
        if (offset <= stream.next) {
          // The hole closed while making room: deliver what is still new.
          const uint64_t cut = stream.next - offset;
          if (cut < captured) {
            Deliver(connection, dir, stream.next, segment.payload + skip + cut,
                    captured - static_cast<uint32_t>(cut), segment.time);
          }
          if (missing > 0 && end > stream.next) {
            FillHoleTo(connection, dir, end, segment.time);
          }
        } else {
          Pending& slot = stream.pending[offset];
          if (captured + missing > slot.bytes.size() + slot.missing_tail) {
            stream.buffered -= slot.bytes.size();
            total_buffered_ -= slot.bytes.size();
            slot.bytes.assign(segment.payload + skip, segment.payload + skip + captured);
            slot.missing_tail = missing;
            slot.time = segment.time;
            stream.buffered += captured;
            total_buffered_ += captured;
          }
        }
      }
      DeliverBuffered(connection, dir);
    }
  }
  if (stream.fin_seen && stream.next >= stream.fin_offset) {
    EndDirection(connection, dir, segment.time);
  }
}

void TcpReassembler::Deliver(Connection* connection, Direction dir, uint64_t offset,
                             const uint8_t* data, uint32_t size, Micros time) {
  HalfStream& stream = connection->stream(dir);
  if (offset != stream.next || size == 0) {
    return;
  }
  stream.next += size;
  connection->handler->OnData(dir, data, size, time);
}

void TcpReassembler::DeliverBuffered(Connection* connection, Direction dir) {
  HalfStream& stream = connection->stream(dir);
  while (!stream.pending.empty() && stream.pending.begin()->first <= stream.next) {
    auto node = stream.pending.extract(stream.pending.begin());
    const uint64_t offset = node.key();
    Pending& pending = node.mapped();
    stream.buffered -= pending.bytes.size();
    total_buffered_ -= pending.bytes.size();
    const uint64_t end = offset + pending.bytes.size() + pending.missing_tail;
    if (end <= stream.next) {
      continue;  // wholly covered by what was delivered since it arrived
    }
    const uint64_t cut = stream.next - offset;
    if (cut < pending.bytes.size()) {
      Deliver(connection, dir, stream.next, pending.bytes.data() + cut,
              static_cast<uint32_t>(pending.bytes.size() - cut), pending.time);
    }
    if (pending.missing_tail > 0 && end > stream.next) {
      FillHoleTo(connection, dir, end, pending.time);
    }
  }
}

void TcpReassembler::FillHoleTo(Connection* connection, Direction dir, uint64_t offset,
                                Micros time) {
  HalfStream& stream = connection->stream(dir);
  if (offset <= stream.next) {
    return;
  }
  const uint64_t size = offset - stream.next;
  ++stats_->gaps;
  stats_->gap_bytes += size;
  stream.next = offset;
  connection->handler->OnGap(dir, size, time);
}

void TcpReassembler::EndDirection(Connection* connection, Direction dir, Micros time) {
  HalfStream& stream = connection->stream(dir);
  if (stream.ended) {
    return;
  }
  // What still waits behind a hole is delivered after it; the hole is a gap.
  while (!stream.pending.empty()) {
    FillHoleTo(connection, dir, stream.pending.begin()->first, time);
    DeliverBuffered(connection, dir);
  }
  if (stream.fin_seen && stream.fin_offset > stream.next) {
    FillHoleTo(connection, dir, stream.fin_offset, time);
  }
  stream.ended = true;
  connection->handler->OnEnd(dir, time);
}

void TcpReassembler::Close(const Key& key, Micros time) {
  auto found = connections_.find(key);
  if (found == connections_.end()) {
    return;
  }
  Connection* connection = found->second.get();
  // The client's direction first, so requests are known before their replies end.
  EndDirection(connection, Direction::kToServer, time);
  EndDirection(connection, Direction::kToClient, time);
  connections_.erase(found);
}

void TcpReassembler::Expire(Micros now) {
  if (now - last_expire_ < 1000000 && now >= last_expire_) {
    return;
  }
  last_expire_ = now;
  std::vector<Key> idle;
  for (const auto& [key, connection] : connections_) {
    if (now - connection->last_seen > options_.idle_timeout) {
      idle.push_back(key);
    }
  }
  for (const Key& key : idle) {
    ++stats_->connections_expired;
    Close(key, now);
  }
}

void TcpReassembler::EndAll(Micros now) {
  std::vector<Key> keys;
  keys.reserve(connections_.size());
  for (const auto& entry : connections_) {
    keys.push_back(entry.first);
  }
  for (const Key& key : keys) {
    Close(key, now);
  }
}

}  // namespace capture
