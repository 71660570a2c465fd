#pragma once

// HttpConnection: HTTP/1.x over one TCP connection. It parses each direction with its own
// HttpParser, pairs replies with requests first-in-first-out (keep-alive and pipelining), keeps
// an interim 1xx reply with the request it precedes, and hands every request that got its
// final reply to the ExchangeSink as an HttpExchange. A connection whose client does not speak
// HTTP/1.x from its first byte (TLS, HTTP/2) is ignored from then on, as is everything after a
// 101 reply.
//
// HttpConnectionFactory makes one per connection for the TcpReassembler.
//
// Thread safety: none; the capture thread owns both, the sink and the stats.

#include <cstdint>
#include <deque>
#include <memory>

#include "collector/capture/capture_stats.h"
#include "collector/capture/http_exchange.h"
#include "collector/capture/http_parser.h"
#include "collector/capture/tcp_reassembler.h"

namespace capture {

class HttpConnection : public StreamHandler {
 public:
  // sink and stats must outlive the connection.
  HttpConnection(const ConnectionInfo& info, ExchangeSink* sink, CaptureStats* stats,
                 size_t max_head_bytes);
  ~HttpConnection() override;
  HttpConnection(const HttpConnection&) = delete;
  HttpConnection& operator=(const HttpConnection&) = delete;

  void OnData(Direction dir, const uint8_t* data, uint32_t size, Micros time) override;
  void OnGap(Direction dir, uint64_t size, Micros time) override;
  void OnPureAck(Direction dir, Micros time) override;
  void OnEnd(Direction dir, Micros time) override;

 private:
  // An exchange whose request has begun and whose final reply has not ended.
  struct Pending {
    HttpExchange exchange;
    uint64_t id = 0;              // the connection's request number, from 1
    bool head_seen = false;       // the request's head is complete
    bool request_done = false;    // the request has ended
    bool response_begun = false;  // a byte of a reply (interim or final) has arrived
  };
  class RequestSide;
  class ResponseSide;

  // The exchange the server is answering now, or nullptr.
  Pending* Answering();
  void Desync(Direction dir, HttpParser::Desync reason);

  const ConnectionInfo info_;
  ExchangeSink* const sink_;
  CaptureStats* const stats_;
  std::unique_ptr<RequestSide> request_side_;
  std::unique_ptr<ResponseSide> response_side_;
  std::deque<Pending> pending_;
  uint64_t requests_ = 0;      // requests begun
  bool first_request_ = true;  // the next request is the connection's first
  bool ignored_ = false;       // not HTTP/1.x (any more): bytes are no longer parsed
  bool ended_[2] = {false, false};
};

class HttpConnectionFactory : public StreamHandlerFactory {
 public:
  // sink and stats must outlive the factory and every connection it makes.
  HttpConnectionFactory(ExchangeSink* sink, CaptureStats* stats, size_t max_head_bytes)
      : sink_(sink), stats_(stats), max_head_bytes_(max_head_bytes) {}

  std::unique_ptr<StreamHandler> NewConnection(const ConnectionInfo& info) override {
    return std::make_unique<HttpConnection>(info, sink_, stats_, max_head_bytes_);
  }

 private:
  ExchangeSink* const sink_;
  CaptureStats* const stats_;
  const size_t max_head_bytes_;
};

}  // namespace capture
