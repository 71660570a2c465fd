#pragma once

// TcpReassembler: the table of TCP connections seen by the capture and, per connection, both
// directions' byte streams put back in order. Each connection gets a StreamHandler from a
// factory when its first segment arrives; the handler receives the in-order bytes of each
// direction segment by segment, the bytes the capture missed as gaps, payload-free ACKs, and
// the end of each direction.
//
// Reassembly: sequence numbers are tracked relative to where each direction began (its SYN, or
// its first segment for a stream seen from its middle) as 64-bit offsets, so wrap-around is
// harmless. A retransmitted or overlapping segment delivers only the bytes not delivered yet.
// Segments ahead of the next expected byte wait in a per-direction buffer; the hole before them
// becomes a gap when the other side acknowledges past it (the receiver has the bytes, the
// capture never will), when the buffer exceeds its cap, or when the direction ends.
//
// Limits: at most max_connections connections (a new one beyond it is ignored and counted);
// at most max_buffered_bytes waiting out of order per direction and max_total_buffered_bytes
// in all; a connection idle for idle_timeout is ended; a closed connection (FIN both ways or
// RST) is ended at once.
//
// Thread safety: none; one thread owns the reassembler, its handlers and the stats.

#include <cstdint>
#include <map>
#include <memory>
#include <unordered_map>
#include <unordered_set>
#include <vector>

#include "collector/capture/capture_stats.h"
#include "collector/capture/tcp_segment.h"

namespace capture {

// Which way bytes flow. The client is the side that sent the SYN; for a connection seen from
// its middle, the side whose port is higher (servers listen on low, well-known ports; on a
// tie, the first sender is the client).
enum class Direction : uint8_t { kToServer = 0, kToClient = 1 };

inline Direction Reverse(Direction d) {
  return d == Direction::kToServer ? Direction::kToClient : Direction::kToServer;
}

// Identity of a connection as the handler sees it.
struct ConnectionInfo {
  IpAddress client;
  IpAddress server;
  uint16_t client_port = 0;
  uint16_t server_port = 0;
  bool syn_seen = false;  // the connection was seen from the client's SYN
  Micros syn_time = 0;    // time of the client's SYN when syn_seen
  Micros first_time = 0;  // time of its first segment
  // Each direction's stream is known from its first byte (its SYN was seen, or for the
  // client the server's SYN/ACK named it); otherwise its first bytes may be mid-message.
  bool from_start[2] = {false, false};  // indexed by Direction
};

class StreamHandler {
 public:
  virtual ~StreamHandler() = default;
  // The next in-order bytes of one direction, carried by one segment captured at time.
  virtual void OnData(Direction dir, const uint8_t* data, uint32_t size, Micros time) = 0;
  // size bytes of one direction the capture missed, noticed at time.
  virtual void OnGap(Direction dir, uint64_t size, Micros time) = 0;
  // A segment without payload that only acknowledges (no SYN, FIN or RST), sent in dir.
  virtual void OnPureAck(Direction dir, Micros time) = 0;
  // No more bytes will come in dir (FIN reached in order, RST, timeout or the connection's
  // end). Called once per direction, before the handler is destroyed.
  virtual void OnEnd(Direction dir, Micros time) = 0;
};

class StreamHandlerFactory {
 public:
  virtual ~StreamHandlerFactory() = default;
  // A handler for a new connection; nullptr ignores the connection. The reassembler owns it.
  virtual std::unique_ptr<StreamHandler> NewConnection(const ConnectionInfo& info) = 0;
};

struct ReassemblerOptions {
  uint32_t max_connections = 65536;
  uint32_t max_buffered_bytes = 1 << 20;           // out of order, per direction
  uint64_t max_total_buffered_bytes = 256u << 20;  // out of order, all connections
  Micros idle_timeout = 300 * 1000000LL;
};

class TcpReassembler {
 public:
  // factory and stats must outlive the reassembler.
  TcpReassembler(const ReassemblerOptions& options, StreamHandlerFactory* factory,
                 CaptureStats* stats);
  ~TcpReassembler();
  TcpReassembler(const TcpReassembler&) = delete;
  TcpReassembler& operator=(const TcpReassembler&) = delete;

  // One decoded segment. Segments must come in capture order.
  void Add(const TcpSegment& segment);
  // Ends connections idle since before now - idle_timeout. Cheap; call once a second or so.
  void Expire(Micros now);
  // Ends every connection (end of input).
  void EndAll(Micros now);

  size_t connection_count() const { return connections_.size(); }

 private:
  struct Key {
    IpAddress a;
    IpAddress b;
    uint16_t a_port = 0;
    uint16_t b_port = 0;
    bool operator==(const Key&) const = default;
  };
  struct KeyHash {
    size_t operator()(const Key& key) const;
  };
  struct HalfStream;
  struct Connection;

  static Key MakeKey(const TcpSegment& segment);
  Connection* Open(const Key& key, const TcpSegment& segment);
  void AddToStream(Connection* connection, Direction dir, const TcpSegment& segment);
  void Deliver(Connection* connection, Direction dir, uint64_t offset, const uint8_t* data,
               uint32_t size, Micros time);
  void DeliverBuffered(Connection* connection, Direction dir);
  void FillHoleTo(Connection* connection, Direction dir, uint64_t offset, Micros time);
  void EndDirection(Connection* connection, Direction dir, Micros time);
  void Close(const Key& key, Micros time);

  const ReassemblerOptions options_;
  StreamHandlerFactory* const factory_;
  CaptureStats* const stats_;
  std::unordered_map<Key, std::unique_ptr<Connection>, KeyHash> connections_;
  // Connections ignored because the table was full, so that each is counted once (bounded).
  std::unordered_set<Key, KeyHash> capped_;
  uint64_t total_buffered_ = 0;  // bytes waiting out of order in all connections
  Micros last_expire_ = 0;
};

}  // namespace capture
