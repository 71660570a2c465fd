#pragma once

// HttpExchange: one HTTP request and its final reply as seen on the wire, measured at the
// capture point. It is what a connection hands to page-view assembly, and what becomes one
// collector record.

#include <cstdint>
#include <string>

#include "collector/capture/http_parser.h"
#include "collector/capture/tcp_reassembler.h"
#include "collector/capture/tcp_segment.h"

namespace capture {

struct HttpExchange {
  ConnectionInfo connection;
  // A client known by name rather than address (an access log written with host-name
  // lookups): the record names it so; connection.client is then all zero.
  std::string client_name;
  HttpHead request;
  HttpHead response;  // the final reply (an interim 1xx is counted, not kept)

  // Times, in capture microseconds.
  Micros start = 0;           // the client's SYN for a connection's first request, else
                              // the request's first byte
  Micros request_last = 0;    // last request byte
  Micros response_first = 0;  // first byte of the final reply
  Micros response_last = 0;   // last reply byte (last seen when the reply has a gap)

  // On the wire: TCP payload bytes by sequence numbers, segments with payload, and the other
  // side's payload-free ACKs while each message was under way.
  uint64_t request_bytes = 0;
  uint64_t response_bytes = 0;  // interim replies included
  uint32_t request_packets = 0;
  uint32_t response_packets = 0;
  uint32_t request_acks = 0;   // the server's, from the request's first byte until the reply
  uint32_t response_acks = 0;  // the client's, while the reply was received
  bool gap = false;            // bytes of it were missing from the capture

  // request.host was not seen but assumed (an access log without virtual hosts names its site
  // by --host): Referers then match this request's URL by path and query alone, as a site
  // reached under several names is referred to by any of them.
  bool host_assumed = false;

  // The producer's own order number (sm3logs: the log line's), for PageAssembler::OldestHeld.
  uint64_t sequence = 0;
};

// Receives finished exchanges, in the order their replies ended.
class ExchangeSink {
 public:
  virtual ~ExchangeSink() = default;
  virtual void OnExchange(const HttpExchange& exchange) = 0;
};

}  // namespace capture
