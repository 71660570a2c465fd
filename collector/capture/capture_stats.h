#pragma once

// CaptureStats: what sm3capture counts, printed by --stats and in its final summary line.
// Every packet or byte the collector cannot use is counted under the reason it was left.
//
// Thread safety: none; the capture thread owns it.

#include <cstdint>
#include <string>

namespace capture {

struct CaptureStats {
  // Packets.
  uint64_t packets = 0;            // packets read from libpcap
  uint64_t bytes = 0;              // their captured bytes (link layer included)
  uint64_t tcp_segments = 0;       // packets decoded as TCP
  uint64_t not_tcp = 0;            // other protocols (a filter normally keeps them out)
  uint64_t truncated_packets = 0;  // cut short before the TCP header ended
  uint64_t ip_fragments = 0;       // IP fragments (not reassembled)
  uint64_t unsupported_link = 0;   // link-layer or network protocols we do not read
  uint64_t pcap_drops = 0;         // packets libpcap reports dropped (live capture)

  // TCP.
  uint64_t connections = 0;          // connections opened in the table
  uint64_t connections_capped = 0;   // new connections ignored: the table was full
  uint64_t connections_expired = 0;  // ended by the idle timeout
  uint64_t retransmissions = 0;      // segments whose payload had been delivered already
  uint64_t out_of_order = 0;         // segments that had to wait for an earlier one
  uint64_t gaps = 0;                 // holes in a stream the capture missed
  uint64_t gap_bytes = 0;
  uint64_t buffer_overflows = 0;  // holes given up because a reorder buffer was full

  // HTTP.
  uint64_t exchanges = 0;            // request/response pairs written as records
  uint64_t pages = 0;                // written as <hpage>
  uint64_t objects = 0;              // written as <hobj>, <audio> or <video>
  uint64_t orphan_objects = 0;       // pages of their own because their page was not seen
  uint64_t unmatched_requests = 0;   // requests that never got a reply
  uint64_t unmatched_responses = 0;  // replies without a request (stream seen midway)
  uint64_t non_http_streams = 0;     // streams that did not start as HTTP/1.x (TLS, HTTP/2, ...)
  uint64_t midstream = 0;            // streams seen from their middle that needed resync
  uint64_t dropped_heads = 0;        // messages dropped: gap, malformed or oversized head
  uint64_t lost_framing = 0;         // gaps that hid where a message ends

  // Output.
  uint64_t records = 0;       // records handed to the output
  uint64_t records_lost = 0;  // records the output could not take (no writer, full FIFO)

  // "packets=N bytes=N ..." in a fixed order: one line, easy to grep and to parse.
  std::string Format() const;
};

}  // namespace capture
