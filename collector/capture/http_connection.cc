#include "collector/capture/http_connection.h"

#include <strings.h>

namespace capture {

// The client's direction: each request opens an exchange.
class HttpConnection::RequestSide : public HttpParser::Listener {
 public:
  RequestSide(HttpConnection* owner, size_t max_head_bytes)
      : parser(HttpParser::Kind::kRequest, this, max_head_bytes), owner_(owner) {}

  void OnMessageBegin(uint64_t, Micros time) override {
    Pending& pending = owner_->pending_.emplace_back();
    pending.id = ++owner_->requests_;
    pending.exchange.connection = owner_->info_;
    // A new connection's handshake is part of its first request's time.
    pending.exchange.start =
        owner_->first_request_ && owner_->info_.syn_seen ? owner_->info_.syn_time : time;
    owner_->first_request_ = false;
  }

  bool OnHead(const HttpHead& head) override {
    if (Pending* pending = Current(); pending != nullptr) {
      pending->exchange.request = head;
      pending->head_seen = true;
    }
    return false;
  }

  void OnMessage(const HttpHead&, const HttpMessageSpan& span) override {
    Pending* current = Current();
    if (current == nullptr) {
      return;  // answered (and written) before it was complete, or dropped
    }
    Pending& pending = *current;
    HttpExchange& exchange = pending.exchange;
    pending.request_done = true;
    exchange.request_last = span.last_time;
    exchange.request_bytes = span.end_offset - span.begin_offset;
    exchange.request_packets = span.packets;
    exchange.gap |= span.gap;
  }

  void OnDesync(HttpParser::Desync reason) override {
    owner_->Desync(Direction::kToServer, reason);
  }

  HttpParser parser;

 private:
  // The exchange of the request being received: a server may answer before a request ends.
  Pending* Current() {
    auto& pending = owner_->pending_;
    return !pending.empty() && pending.back().id == owner_->requests_ ? &pending.back() : nullptr;
  }

  HttpConnection* const owner_;
};

// The server's direction: replies are matched to the oldest unanswered request.
class HttpConnection::ResponseSide : public HttpParser::Listener {
 public:
  ResponseSide(HttpConnection* owner, size_t max_head_bytes)
      : parser(HttpParser::Kind::kResponse, this, max_head_bytes), owner_(owner) {}

  void OnMessageBegin(uint64_t, Micros time) override {
    Pending* pending = owner_->Answering();
    if (pending == nullptr) {
      return;  // counted when the reply ends
    }
    pending->response_begun = true;
    // Overwritten by each reply: the final one's first byte is what counts.
    pending->exchange.response_first = time;
  }

  bool OnHead(const HttpHead&) override {
    Pending* pending = owner_->Answering();
    return pending != nullptr && pending->head_seen &&
           strcasecmp(pending->exchange.request.method.c_str(), "HEAD") == 0;
  }

  void OnMessage(const HttpHead& head, const HttpMessageSpan& span) override {
    Pending* pending = owner_->Answering();
    if (pending == nullptr) {
      ++owner_->stats_->unmatched_responses;
      return;
    }
    HttpExchange& exchange = pending->exchange;
    exchange.response_bytes += span.end_offset - span.begin_offset;
    exchange.response_packets += span.packets;
    exchange.gap |= span.gap;
    if (head.status >= 100 && head.status < 200 && head.status != 101) {
      return;  // interim: the request still waits for its final reply
    }
    exchange.response = head;
    exchange.response_last = span.last_time;
    if (!pending->head_seen) {
      // The request's head was lost; a reply alone is no exchange.
      ++owner_->stats_->unmatched_responses;
    } else {
      owner_->sink_->OnExchange(exchange);
    }
    owner_->pending_.pop_front();
    if (parser.switched()) {
      owner_->ignored_ = true;  // another protocol follows the 101
    }
  }

  void OnDesync(HttpParser::Desync reason) override {
    owner_->Desync(Direction::kToClient, reason);
  }

  HttpParser parser;

 private:
  HttpConnection* const owner_;
};

HttpConnection::HttpConnection(const ConnectionInfo& info, ExchangeSink* sink, CaptureStats* stats,
                               size_t max_head_bytes)
    : info_(info),
      sink_(sink),
      stats_(stats),
      request_side_(std::make_unique<RequestSide>(this, max_head_bytes)),
      response_side_(std::make_unique<ResponseSide>(this, max_head_bytes)) {
  if (!info.from_start[static_cast<int>(Direction::kToServer)]) {
    request_side_->parser.SetMidstream();
  }
  if (!info.from_start[static_cast<int>(Direction::kToClient)]) {
    response_side_->parser.SetMidstream();
  }
}

HttpConnection::~HttpConnection() = default;

HttpConnection::Pending* HttpConnection::Answering() {
  // Answered exchanges leave the queue at once, so the oldest one is being answered.
  return pending_.empty() ? nullptr : &pending_.front();
}

void HttpConnection::Desync(Direction dir, HttpParser::Desync reason) {
  switch (reason) {
    case HttpParser::Desync::kNotHttp:
      ++stats_->non_http_streams;
      // TLS, HTTP/2 or another protocol on the port: nothing here is for us.
      ignored_ = true;
      break;
    case HttpParser::Desync::kMidstream:
      ++stats_->midstream;
      break;
    case HttpParser::Desync::kGapInHead:
    case HttpParser::Desync::kHeadTooLarge:
    case HttpParser::Desync::kBadHead:
      ++stats_->dropped_heads;
      if (dir == Direction::kToServer) {
        // The request being received is gone; its reply will have no request to pair with.
        if (!pending_.empty() && pending_.back().id == requests_ && !pending_.back().head_seen) {
          pending_.pop_back();
        }
      } else if (Pending* answering = Answering(); answering != nullptr) {
        // This request's reply is gone: pairing the next reply with it would shift every
        // later pair on the connection.
        ++stats_->unmatched_requests;
        pending_.pop_front();
      }
      break;
    case HttpParser::Desync::kGapInFraming:
      ++stats_->lost_framing;
      break;
  }
}

void HttpConnection::OnData(Direction dir, const uint8_t* data, uint32_t size, Micros time) {
  if (ignored_) {
    return;
  }
  if (dir == Direction::kToServer) {
    request_side_->parser.Feed(data, size, time);
  } else {
    response_side_->parser.Feed(data, size, time);
  }
}

void HttpConnection::OnGap(Direction dir, uint64_t size, Micros time) {
  if (ignored_) {
    return;
  }
  if (dir == Direction::kToServer) {
    request_side_->parser.Gap(size, time);
  } else {
    response_side_->parser.Gap(size, time);
  }
}

void HttpConnection::OnPureAck(Direction dir, Micros) {
  if (ignored_ || pending_.empty()) {
    return;
  }
  if (dir == Direction::kToClient) {
    // The server acknowledging a request: the newest one it has not begun to answer.
    for (auto it = pending_.rbegin(); it != pending_.rend(); ++it) {
      if (!it->response_begun) {
        ++it->exchange.request_acks;
        return;
      }
    }
  } else if (pending_.front().response_begun) {
    ++pending_.front().exchange.response_acks;
  }
}

void HttpConnection::OnEnd(Direction dir, Micros time) {
  const int index = static_cast<int>(dir);
  if (ended_[index]) {
    return;
  }
  ended_[index] = true;
  if (!ignored_) {
    if (dir == Direction::kToServer) {
      request_side_->parser.End(time);
    } else {
      response_side_->parser.End(time);
    }
  }
  if (ended_[0] && ended_[1]) {
    for (const Pending& pending : pending_) {
      if (pending.head_seen) {
        ++stats_->unmatched_requests;
      }
    }
    pending_.clear();
  }
}

}  // namespace capture
