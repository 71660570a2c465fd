#pragma once

// PcapSource: packets from libpcap, either a live interface or a capture file (pcap or pcapng,
// whatever the installed libpcap reads). Live capture is non-blocking behind poll(2), so the
// caller's loop stays in charge of stop requests, timers and its output.
//
// Thread safety: none; one thread owns a source.

#include <pcap/pcap.h>

#include <cstdint>
#include <string>

#include "collector/capture/tcp_segment.h"

namespace capture {

struct SourceOptions {
  std::string interface;  // live capture on this interface, or
  std::string read_file;  // read this capture file
  std::string filter;     // BPF filter expression; empty: every packet
  int snaplen = 262144;   // live: bytes kept of each packet
  bool promiscuous = false;
  int buffer_mb = 32;  // live: kernel buffer
};

class PcapSource {
 public:
  // Receives each packet: link type, bytes, captured and wire length, time.
  using PacketFn = void (*)(void* context, int link_type, const uint8_t* data, uint32_t caplen,
                            uint32_t wire_len, Micros time);

  PcapSource() = default;
  ~PcapSource();
  PcapSource(const PcapSource&) = delete;
  PcapSource& operator=(const PcapSource&) = delete;

  // False with *error naming the problem (no such file or interface, not a capture file, no
  // permission to capture, a filter that does not compile).
  bool Open(const SourceOptions& options, std::string* error);

  enum class Status { kPackets, kEnd, kError };
  // Hands every packet available now to fn (live: waiting up to timeout_ms for the first).
  // kEnd at the end of a file. A file cut short mid-packet ends with kError and *error saying
  // so; the packets before it have been delivered.
  Status Dispatch(PacketFn fn, void* context, int timeout_ms, std::string* error);

  // Packets the kernel or the interface dropped (live capture), 0 for a file.
  uint64_t Drops() const;
  bool live() const { return live_; }
  int link_type() const { return link_type_; }

 private:
  pcap_t* handle_ = nullptr;
  bool live_ = false;
  int link_type_ = 0;
  int fd_ = -1;  // live: what poll waits on
};

}  // namespace capture
