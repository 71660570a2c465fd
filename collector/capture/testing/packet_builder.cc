#include "collector/capture/testing/packet_builder.h"

#include <arpa/inet.h>

#include <algorithm>
#include <cassert>
#include <cstring>
#include <string>

namespace capture::testing {

namespace {

// Big-endian appends, as every header below the link layer is written.
void Put8(std::vector<uint8_t>* out, uint8_t v) {
  out->push_back(v);
}
void Put16(std::vector<uint8_t>* out, uint16_t v) {
  out->push_back(static_cast<uint8_t>(v >> 8));
  out->push_back(static_cast<uint8_t>(v));
}
void Put32(std::vector<uint8_t>* out, uint32_t v) {
  Put16(out, static_cast<uint16_t>(v >> 16));
  Put16(out, static_cast<uint16_t>(v));
}
void PutBytes(std::vector<uint8_t>* out, const void* bytes, size_t size) {
  const auto* p = static_cast<const uint8_t*>(bytes);
  out->insert(out->end(), p, p + size);
}
void Store16(std::vector<uint8_t>* out, size_t at, uint16_t v) {
  (*out)[at] = static_cast<uint8_t>(v >> 8);
  (*out)[at + 1] = static_cast<uint8_t>(v);
}

// RFC 1071 one's-complement sum, not yet folded or inverted.
uint32_t SumWords(const uint8_t* data, size_t size, uint32_t sum) {
  for (size_t i = 0; i + 1 < size; i += 2) {
    sum += static_cast<uint32_t>(data[i]) << 8 | data[i + 1];
  }
  if (size % 2 == 1) {
    sum += static_cast<uint32_t>(data[size - 1]) << 8;
  }
  return sum;
}

uint16_t FoldChecksum(uint32_t sum) {
  while (sum >> 16 != 0) {
    sum = (sum & 0xffff) + (sum >> 16);
  }
  return static_cast<uint16_t>(~sum);
}

size_t AddressSize(const IpAddress& address) {
  return address.v6 ? 16 : 4;
}

constexpr uint16_t kEtherIpv4 = 0x0800;
constexpr uint16_t kEtherIpv6 = 0x86dd;
constexpr uint8_t kIpv6HopByHop = 0;
constexpr uint8_t kIpv6Fragment = 44;

void AppendLinkHeader(const LinkSpec& link, const Segment& segment, std::vector<uint8_t>* out) {
  const uint16_t ether_type = segment.src.v6 ? kEtherIpv6 : kEtherIpv4;
  static constexpr uint8_t kClientMac[6] = {0x02, 0x00, 0x00, 0x00, 0x00, 0x01};
  static constexpr uint8_t kServerMac[6] = {0x02, 0x00, 0x00, 0x00, 0x00, 0x02};
  const uint8_t* src_mac = segment.from_client ? kClientMac : kServerMac;
  const uint8_t* dst_mac = segment.from_client ? kServerMac : kClientMac;
  switch (link.type) {
    case kLinkEthernet: {
      PutBytes(out, dst_mac, 6);
      PutBytes(out, src_mac, 6);
      uint16_t vlan_id = 100;
      for (uint16_t tpid : link.vlan_tpids) {
        Put16(out, tpid);
        Put16(out, vlan_id++);
      }
      Put16(out, ether_type);
      return;
    }
    case kLinkLinuxSll:
      Put16(out, 0);  // packet type: addressed to this host
      Put16(out, 1);  // ARPHRD_ETHER
      Put16(out, 6);
      PutBytes(out, src_mac, 6);
      Put16(out, 0);  // address padding to 8 bytes
      Put16(out, ether_type);
      return;
    case kLinkLinuxSll2:
      Put16(out, ether_type);
      Put16(out, 0);  // reserved
      Put32(out, 2);  // interface index
      Put16(out, 1);  // ARPHRD_ETHER
      Put8(out, 0);   // packet type
      Put8(out, 6);
      PutBytes(out, src_mac, 6);
      Put16(out, 0);
      return;
    case kLinkNull: {
      // The family is in the capturing host's byte order; ours will do.
      const uint32_t family = segment.src.v6 ? link.null_af_inet6 : 2;
      PutBytes(out, &family, 4);
      return;
    }
    case kLinkRaw:
    case kLinkRawFile:
      return;
  }
  assert(false && "packet_builder: unknown link type");
}

// The TCP pseudo-header sum for either IP version.
uint32_t PseudoHeaderSum(const Segment& segment, size_t tcp_size) {
  const size_t n = AddressSize(segment.src);
  uint32_t sum = SumWords(segment.src.bytes.data(), n, 0);
  sum = SumWords(segment.dst.bytes.data(), n, sum);
  sum += 6;  // the protocol, whatever the IP header says, as a sender computes it
  sum += static_cast<uint32_t>(tcp_size >> 16) + static_cast<uint32_t>(tcp_size & 0xffff);
  return sum;
}

void AppendTcp(const Segment& segment, const FrameOptions& options, std::vector<uint8_t>* out) {
  assert(options.tcp_options.size() % 4 == 0 && options.tcp_options.size() <= 40);
  const size_t start = out->size();
  Put16(out, segment.src_port);
  Put16(out, segment.dst_port);
  Put32(out, segment.seq);
  Put32(out, segment.ack);
  Put8(out, static_cast<uint8_t>((5 + options.tcp_options.size() / 4) << 4));
  Put8(out, segment.flags);
  Put16(out, segment.window);
  Put16(out, 0);  // checksum, filled below
  Put16(out, 0);  // urgent pointer
  PutBytes(out, options.tcp_options.data(), options.tcp_options.size());
  PutBytes(out, segment.payload.data(), segment.payload.size());
  if (options.tcp_checksum) {
    const size_t size = out->size() - start;
    const uint32_t sum = SumWords(out->data() + start, size, PseudoHeaderSum(segment, size));
    Store16(out, start + 16, FoldChecksum(sum));
  }
}

void AppendIpv4(const Segment& segment, const FrameOptions& options, size_t tcp_size,
                std::vector<uint8_t>* out) {
  assert(options.ip_options.size() % 4 == 0 && options.ip_options.size() <= 40);
  const size_t header_size = 20 + options.ip_options.size();
  const size_t start = out->size();
  Put8(out, static_cast<uint8_t>(0x40 | header_size / 4));
  Put8(out, 0);
  Put16(out, static_cast<uint16_t>(header_size + tcp_size));
  Put16(out, static_cast<uint16_t>(segment.seq));  // an identification that varies
  uint16_t fragment = options.fragment_offset & 0x1fff;
  if (options.more_fragments) {
    fragment |= 0x2000;
  } else if (options.fragment_offset == 0) {
    fragment |= 0x4000;  // don't fragment, as TCP stacks send
  }
  Put16(out, fragment);
  Put8(out, 64);
  Put8(out, options.ip_protocol);
  Put16(out, 0);  // checksum, filled below
  PutBytes(out, segment.src.bytes.data(), 4);
  PutBytes(out, segment.dst.bytes.data(), 4);
  PutBytes(out, options.ip_options.data(), options.ip_options.size());
  Store16(out, start + 10, FoldChecksum(SumWords(out->data() + start, header_size, 0)));
}

void AppendIpv6(const Segment& segment, const FrameOptions& options, size_t tcp_size,
                std::vector<uint8_t>* out) {
  const bool fragment = options.fragment_offset != 0 || options.more_fragments;
  const size_t extensions = (options.ipv6_hop_by_hop ? 8 : 0) + (fragment ? 8 : 0);
  Put32(out, 0x60000000);
  Put16(out, static_cast<uint16_t>(extensions + tcp_size));
  uint8_t next = options.ipv6_hop_by_hop ? kIpv6HopByHop
                 : fragment              ? kIpv6Fragment
                                         : options.ip_protocol;
  Put8(out, next);
  Put8(out, 64);
  PutBytes(out, segment.src.bytes.data(), 16);
  PutBytes(out, segment.dst.bytes.data(), 16);
  if (options.ipv6_hop_by_hop) {
    Put8(out, fragment ? kIpv6Fragment : options.ip_protocol);
    Put8(out, 0);  // length in 8-byte units beyond the first 8
    Put8(out, 1);  // a PadN option filling the rest
    Put8(out, 4);
    Put32(out, 0);
  }
  if (fragment) {
    Put8(out, options.ip_protocol);
    Put8(out, 0);
    Put16(out,
          static_cast<uint16_t>(options.fragment_offset << 3 | (options.more_fragments ? 1 : 0)));
    Put32(out, 0x12345678);  // identification
  }
}

}  // namespace

IpAddress ParseAddress(std::string_view text) {
  const std::string s(text);
  IpAddress address;
  if (s.find(':') != std::string::npos) {
    address.v6 = true;
    const int ok = ::inet_pton(AF_INET6, s.c_str(), address.bytes.data());
    assert(ok == 1 && "packet_builder: bad IPv6 address");
    (void)ok;
  } else {
    const int ok = ::inet_pton(AF_INET, s.c_str(), address.bytes.data());
    assert(ok == 1 && "packet_builder: bad IPv4 address");
    (void)ok;
  }
  return address;
}

TcpSegment Segment::View() const {
  TcpSegment view;
  view.time = time;
  view.src = src;
  view.dst = dst;
  view.src_port = src_port;
  view.dst_port = dst_port;
  view.seq = seq;
  view.ack = ack;
  view.flags = flags;
  view.payload = reinterpret_cast<const uint8_t*>(payload.data());
  view.payload_size = static_cast<uint32_t>(payload.size());
  view.wire_payload_size = view.payload_size;
  return view;
}

std::vector<TcpSegment> Views(const std::vector<Segment>& segments) {
  std::vector<TcpSegment> views;
  views.reserve(segments.size());
  for (const Segment& segment : segments) {
    views.push_back(segment.View());
  }
  return views;
}

Segment Slice(const Segment& segment, size_t from, size_t size) {
  assert(from + size <= segment.payload.size());
  Segment slice = segment;
  slice.payload = segment.payload.substr(from, size);
  // A SYN takes the sequence number before the first payload byte.
  const bool has_syn = (segment.flags & kTcpSyn) != 0;
  slice.seq = segment.seq + static_cast<uint32_t>(from) + (has_syn && from > 0 ? 1 : 0);
  if (from > 0) {
    slice.flags &= static_cast<uint8_t>(~kTcpSyn);
  }
  if (from + size < segment.payload.size()) {
    slice.flags &= static_cast<uint8_t>(~(kTcpFin | kTcpPsh));
  }
  return slice;
}

TcpConversation::TcpConversation(std::string_view client, uint16_t client_port,
                                 std::string_view server, uint16_t server_port, uint32_t client_isn,
                                 uint32_t server_isn) {
  client_ = Side{ParseAddress(client), client_port, client_isn, true};
  server_ = Side{ParseAddress(server), server_port, server_isn, false};
  assert(client_.address.v6 == server_.address.v6);
}

void TcpConversation::Send(Side* from, const Side& to, uint8_t flags, std::string_view bytes,
                           Micros time) {
  Segment segment;
  segment.time = time;
  segment.src = from->address;
  segment.dst = to.address;
  segment.src_port = from->port;
  segment.dst_port = to.port;
  segment.seq = from->next_seq;
  segment.ack = (flags & kTcpAck) != 0 ? to.next_seq : 0;
  segment.flags = flags;
  segment.payload.assign(bytes);
  segment.from_client = from->is_client;
  from->next_seq += static_cast<uint32_t>(bytes.size());
  if ((flags & (kTcpSyn | kTcpFin)) != 0) {
    from->next_seq += 1;
  }
  segments_.push_back(std::move(segment));
}

void TcpConversation::SendData(Side* from, const Side& to, std::string_view bytes, Micros time,
                               Micros step) {
  assert(mss_ > 0);
  for (size_t at = 0; at < bytes.size(); at += mss_) {
    const std::string_view part = bytes.substr(at, mss_);
    const bool last = at + part.size() == bytes.size();
    Send(from, to, static_cast<uint8_t>(kTcpAck | (last ? kTcpPsh : 0)), part, time);
    time += step;
  }
}

void TcpConversation::Handshake(Micros syn, Micros syn_ack, Micros ack) {
  Send(&client_, server_, kTcpSyn, {}, syn);
  Send(&server_, client_, kTcpSyn | kTcpAck, {}, syn_ack);
  Send(&client_, server_, kTcpAck, {}, ack);
}

void TcpConversation::ClientSends(std::string_view bytes, Micros time, Micros step) {
  SendData(&client_, server_, bytes, time, step);
}

void TcpConversation::ServerSends(std::string_view bytes, Micros time, Micros step) {
  SendData(&server_, client_, bytes, time, step);
}

void TcpConversation::ClientAck(Micros time) {
  Send(&client_, server_, kTcpAck, {}, time);
}
void TcpConversation::ServerAck(Micros time) {
  Send(&server_, client_, kTcpAck, {}, time);
}
void TcpConversation::ClientFin(Micros time) {
  Send(&client_, server_, kTcpFin | kTcpAck, {}, time);
}
void TcpConversation::ServerFin(Micros time) {
  Send(&server_, client_, kTcpFin | kTcpAck, {}, time);
}
void TcpConversation::ClientRst(Micros time) {
  Send(&client_, server_, kTcpRst | kTcpAck, {}, time);
}
void TcpConversation::ServerRst(Micros time) {
  Send(&server_, client_, kTcpRst | kTcpAck, {}, time);
}

std::vector<Segment> TcpConversation::TakeSegments() {
  std::vector<Segment> taken;
  taken.swap(segments_);
  return taken;
}

void Frame::Truncate(uint32_t caplen) {
  if (data.size() > caplen) {
    data.resize(caplen);
  }
}

Frame BuildFrame(const Segment& segment, const LinkSpec& link, const FrameOptions& options) {
  assert(segment.src.v6 == segment.dst.v6);
  Frame frame;
  frame.time = segment.time;
  std::vector<uint8_t>& out = frame.data;
  out.reserve(96 + segment.payload.size());
  AppendLinkHeader(link, segment, &out);
  const size_t tcp_size = 20 + options.tcp_options.size() + segment.payload.size();
  if (segment.src.v6) {
    AppendIpv6(segment, options, tcp_size, &out);
  } else {
    AppendIpv4(segment, options, tcp_size, &out);
  }
  AppendTcp(segment, options, &out);
  frame.wire_len = static_cast<uint32_t>(out.size());
  return frame;
}

std::vector<Frame> BuildFrames(const std::vector<Segment>& segments, const LinkSpec& link) {
  std::vector<Frame> frames;
  frames.reserve(segments.size());
  for (const Segment& segment : segments) {
    frames.push_back(BuildFrame(segment, link));
  }
  return frames;
}

namespace {

constexpr uint32_t kPcapMagicMicros = 0xa1b2c3d4;
constexpr uint32_t kPcapMagicNanos = 0xa1b23c4d;
constexpr uint32_t kBlockSectionHeader = 0x0a0d0d0a;
constexpr uint32_t kBlockInterface = 1;
constexpr uint32_t kBlockEnhancedPacket = 6;

size_t Pad4(size_t size) {
  return (size + 3) & ~size_t{3};
}

}  // namespace

PcapWriter::PcapWriter(std::FILE* file, FileFormat format) : file_(file), format_(format) {}

PcapWriter::~PcapWriter() = default;

std::unique_ptr<PcapWriter> PcapWriter::Open(const std::string& path, FileFormat format,
                                             int link_type, std::string* error, uint32_t snaplen) {
  std::FILE* file = std::fopen(path.c_str(), "wb");
  if (file == nullptr) {
    *error = path + ": " + std::strerror(errno);
    return nullptr;
  }
  std::unique_ptr<PcapWriter> writer(new PcapWriter(file, format));
  std::setvbuf(file, nullptr, _IOFBF, 1 << 20);
  if (format == FileFormat::kPcapng) {
    const uint32_t shb_length = 28;
    const uint32_t byte_order_magic = 0x1a2b3c4d;
    const uint16_t version[2] = {1, 0};
    const int64_t section_length = -1;  // not given
    writer->Put(&kBlockSectionHeader, 4);
    writer->Put(&shb_length, 4);
    writer->Put(&byte_order_magic, 4);
    writer->Put(version, 4);
    writer->Put(&section_length, 8);
    writer->Put(&shb_length, 4);
    const uint16_t link_and_reserved[2] = {static_cast<uint16_t>(link_type), 0};
    const uint32_t idb_length = 20;
    writer->Put(&kBlockInterface, 4);
    writer->Put(&idb_length, 4);
    writer->Put(link_and_reserved, 4);
    writer->Put(&snaplen, 4);
    writer->Put(&idb_length, 4);
  } else {
    const uint32_t magic = format == FileFormat::kPcapNanos ? kPcapMagicNanos : kPcapMagicMicros;
    const uint16_t version[2] = {2, 4};
    const int32_t zone = 0;
    const uint32_t sigfigs = 0;
    const uint32_t link = static_cast<uint32_t>(link_type);
    writer->Put(&magic, 4);
    writer->Put(version, 4);
    writer->Put(&zone, 4);
    writer->Put(&sigfigs, 4);
    writer->Put(&snaplen, 4);
    writer->Put(&link, 4);
  }
  if (!writer->ok_) {
    *error = path + ": write failed";
    return nullptr;
  }
  return writer;
}

void PcapWriter::Put(const void* bytes, size_t size) {
  if (file_ != nullptr && std::fwrite(bytes, 1, size, file_.get()) != size) {
    ok_ = false;
  }
}

void PcapWriter::Write(Micros time, const uint8_t* data, uint32_t caplen, uint32_t wire_len) {
  if (format_ == FileFormat::kPcapng) {
    // Time stamps in the default resolution, microseconds, as one 64-bit count.
    const uint64_t stamp = static_cast<uint64_t>(time);
    const uint32_t length = static_cast<uint32_t>(32 + Pad4(caplen));
    const uint32_t head[7] = {
        kBlockEnhancedPacket,         length, 0,       static_cast<uint32_t>(stamp >> 32),
        static_cast<uint32_t>(stamp), caplen, wire_len};
    static constexpr uint8_t kZeros[4] = {};
    Put(head, sizeof(head));
    Put(data, caplen);
    Put(kZeros, Pad4(caplen) - caplen);
    Put(&length, 4);
    return;
  }
  const uint32_t fraction = static_cast<uint32_t>(time % 1000000);
  const uint32_t record[4] = {static_cast<uint32_t>(time / 1000000),
                              format_ == FileFormat::kPcapNanos ? fraction * 1000 : fraction,
                              caplen, wire_len};
  Put(record, sizeof(record));
  Put(data, caplen);
}

bool PcapWriter::Close() {
  if (file_ != nullptr) {
    std::FILE* file = file_.release();
    if (std::fclose(file) != 0) {
      ok_ = false;
    }
  }
  return ok_;
}

bool WriteCaptureFile(const std::string& path, FileFormat format, int link_type,
                      const std::vector<Frame>& frames, std::string* error) {
  std::unique_ptr<PcapWriter> writer = PcapWriter::Open(path, format, link_type, error);
  if (writer == nullptr) {
    return false;
  }
  for (const Frame& frame : frames) {
    writer->Write(frame);
  }
  if (!writer->Close()) {
    *error = path + ": write failed";
    return false;
  }
  return true;
}

}  // namespace capture::testing
