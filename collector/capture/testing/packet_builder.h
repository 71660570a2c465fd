#pragma once

// Hand-built TCP traffic for tests, fuzz targets and benchmarks: TCP segments with owned
// payloads, scripted conversations that keep both sides' sequence numbers, link-layer frames
// (Ethernet with VLAN tags, Linux cooked SLL and SLL2, BSD loopback, raw IP) carrying IPv4 or
// IPv6 with valid checksums, and pcap / pcapng files that libpcap and tshark read.
//
// Everything here is test support: bad arguments (an address that does not parse, an unknown
// link type) stop the process with an assert message rather than being reported.
//
// Thread safety: none; each object belongs to one thread. The free functions are pure.

#include <cstdint>
#include <cstdio>
#include <memory>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "collector/capture/tcp_segment.h"

namespace capture::testing {

// libpcap link types (DLT_* as pcap_datalink() reports them; the same numbers in files, except
// that files say 101 for raw IP and libpcap reports it as 12).
inline constexpr int kLinkNull = 0;        // BSD loopback: 4-byte address family, host order
inline constexpr int kLinkEthernet = 1;    // DLT_EN10MB
inline constexpr int kLinkRaw = 12;        // DLT_RAW on Linux
inline constexpr int kLinkRawFile = 101;   // LINKTYPE_RAW
inline constexpr int kLinkLinuxSll = 113;  // Linux cooked capture v1
inline constexpr int kLinkLinuxSll2 = 276;

// "10.0.0.1" or "2001:db8::1". Asserts that the text parses.
IpAddress ParseAddress(std::string_view text);

// One TCP segment with its own payload bytes.
struct Segment {
  Micros time = 0;
  IpAddress src;
  IpAddress dst;
  uint16_t src_port = 0;
  uint16_t dst_port = 0;
  uint32_t seq = 0;
  uint32_t ack = 0;
  uint8_t flags = 0;
  uint16_t window = 65535;
  std::string payload;
  bool from_client = true;  // set by TcpConversation; informative only

  // The segment as the decoder would hand it over. The view points into payload: it is valid
  // while this Segment lives and its payload is not changed.
  TcpSegment View() const;
};

// Views of every segment, in order; valid while *segments lives unchanged.
std::vector<TcpSegment> Views(const std::vector<Segment>& segments);

// The part [from, from + size) of segment's payload as a segment of its own, with the sequence
// number moved to match: the material for overlapping retransmissions. SYN and FIN are kept
// only on the slice that holds the segment's start or end respectively.
Segment Slice(const Segment& segment, size_t from, size_t size);

// A TCP connection scripted from both ends. Each call appends the segments it produces to
// segments(), with the sequence and acknowledgement numbers the two sides would use; a test
// then reorders, duplicates, cuts or drops them as it likes. Every data or control segment
// acknowledges everything the other side has sent so far, whether or not the test later
// drops it.
class TcpConversation {
 public:
  TcpConversation(std::string_view client, uint16_t client_port, std::string_view server,
                  uint16_t server_port, uint32_t client_isn = 1000, uint32_t server_isn = 500000);

  // Largest payload of one data segment (1448 unless set).
  void set_mss(uint32_t mss) { mss_ = mss; }

  // SYN, SYN/ACK and ACK at the three times.
  void Handshake(Micros syn, Micros syn_ack, Micros ack);
  // bytes cut into segments of at most mss bytes; segment i is sent at time + i * step. The
  // last one carries PSH.
  void ClientSends(std::string_view bytes, Micros time, Micros step = 0);
  void ServerSends(std::string_view bytes, Micros time, Micros step = 0);
  // A payload-free ACK of everything the other side has sent.
  void ClientAck(Micros time);
  void ServerAck(Micros time);
  // FIN (with ACK); it takes one sequence number.
  void ClientFin(Micros time);
  void ServerFin(Micros time);
  void ClientRst(Micros time);
  void ServerRst(Micros time);

  std::vector<Segment>& segments() { return segments_; }
  const std::vector<Segment>& segments() const { return segments_; }
  // Hands over the segments produced so far; the conversation goes on with an empty list.
  std::vector<Segment> TakeSegments();

  // Next sequence number each side will use.
  uint32_t client_next_seq() const { return client_.next_seq; }
  uint32_t server_next_seq() const { return server_.next_seq; }

 private:
  struct Side {
    IpAddress address;
    uint16_t port = 0;
    uint32_t next_seq = 0;
    bool is_client = false;
  };

  void Send(Side* from, const Side& to, uint8_t flags, std::string_view bytes, Micros time);
  void SendData(Side* from, const Side& to, std::string_view bytes, Micros time, Micros step);

  Side client_;
  Side server_;
  uint32_t mss_ = 1448;
  std::vector<Segment> segments_;
};

// How a segment is framed.
struct LinkSpec {
  // Implicit, so that a bare link type reads as a LinkSpec: BuildFrame(segment, kLinkRaw).
  LinkSpec(int type = kLinkEthernet, std::vector<uint16_t> vlan_tpids = {},  // NOLINT
           uint32_t null_af_inet6 = 30)
      : type(type), vlan_tpids(std::move(vlan_tpids)), null_af_inet6(null_af_inet6) {}

  int type;
  // Ethernet only: the tag protocol ids of the VLAN tags, outermost first (0x88a8, 0x8100).
  std::vector<uint16_t> vlan_tpids;
  // kLinkNull only: the address family written for IPv6 (24, 28 or 30 on the BSDs and macOS,
  // 10 on Linux). IPv4 is always 2.
  uint32_t null_af_inet6;
};

// Uncommon IP and TCP shapes, for decoder tests.
struct FrameOptions {
  uint8_t ip_protocol = 6;  // another value makes a packet that is "not TCP"
  // IPv4: fragment offset in 8-byte units and the more-fragments flag. IPv6: the same in a
  // Fragment extension header, added when either is set.
  uint16_t fragment_offset = 0;
  bool more_fragments = false;
  bool ipv6_hop_by_hop = false;  // an 8-byte Hop-by-Hop Options header before TCP
  std::string ip_options;        // IPv4 options, a multiple of 4 bytes (at most 40)
  std::string tcp_options;       // a multiple of 4 bytes (at most 40)
  bool tcp_checksum = true;      // false leaves it zero
};

// A captured packet.
struct Frame {
  Micros time = 0;
  std::vector<uint8_t> data;  // the captured bytes
  uint32_t wire_len = 0;      // the packet's length on the wire (>= data.size())

  // Cuts the captured bytes to at most caplen, as a snap length would.
  void Truncate(uint32_t caplen);
};

// The segment in an IP packet (IPv6 when its addresses are) inside the link layer.
Frame BuildFrame(const Segment& segment, const LinkSpec& link = {},
                 const FrameOptions& options = {});
std::vector<Frame> BuildFrames(const std::vector<Segment>& segments, const LinkSpec& link = {});

enum class FileFormat {
  kPcap,       // classic pcap, microsecond time stamps
  kPcapNanos,  // classic pcap, nanosecond time stamps
  kPcapng,     // one section, one interface, enhanced packet blocks
};

// Writes a capture file frame by frame, in the host's byte order.
class PcapWriter {
 public:
  // Creates or replaces path. Returns nullptr with *error set when it cannot be created.
  static std::unique_ptr<PcapWriter> Open(const std::string& path, FileFormat format, int link_type,
                                          std::string* error, uint32_t snaplen = 262144);
  ~PcapWriter();  // closes the file; call Close to learn whether that worked
  PcapWriter(const PcapWriter&) = delete;
  PcapWriter& operator=(const PcapWriter&) = delete;

  // caplen bytes at data of a wire_len-byte packet captured at time.
  void Write(Micros time, const uint8_t* data, uint32_t caplen, uint32_t wire_len);
  void Write(const Frame& frame) {
    Write(frame.time, frame.data.data(), static_cast<uint32_t>(frame.data.size()), frame.wire_len);
  }
  // Flushes and closes. False when any write failed.
  bool Close();

 private:
  struct FileCloser {
    void operator()(std::FILE* file) const { std::fclose(file); }
  };

  PcapWriter(std::FILE* file, FileFormat format);
  void Put(const void* bytes, size_t size);

  std::unique_ptr<std::FILE, FileCloser> file_;  // null once closed
  const FileFormat format_;
  bool ok_ = true;  // no write has failed
};

// Writes frames to path in one go. False with *error set when the file cannot be written.
bool WriteCaptureFile(const std::string& path, FileFormat format, int link_type,
                      const std::vector<Frame>& frames, std::string* error);

}  // namespace capture::testing
