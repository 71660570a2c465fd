#pragma once

// PageAssembler: turns exchanges into page views and writes them in the order the agent needs,
// a page directly followed by its objects.
//
// A text/html (or application/xhtml+xml) reply is a page and opens its client's view, closing
// the one before. Another reply whose Referer names the open view's page, or one of its objects
// (images a style sheet loads name the style sheet), of the same client address, and whose
// request started at most 30 s after the page's, is an object of that view: <audio> or <video>
// for audio/* or video/* content, <hobj> otherwise. A view is written when the client's next
// page arrives, 5 s after the last of its replies ended, or 30 s after its page's request
// started.
//
// A reply with a Referer that names no open page waits up to 30 s from its own start for its
// page, whose HTML may still be arriving; if none claims it, it is written as a page of its own
// and counted as an orphan. A reply without a Referer (API calls, downloads, direct links) is a
// page of its own at once. Referers and page URLs compare without scheme, default port and
// fragment, with the host in lower case.
//
// Thread safety: none; the capture thread owns it.

#include <cstdint>
#include <deque>
#include <string>
#include <unordered_map>
#include <vector>

#include "collector/capture/capture_stats.h"
#include "collector/capture/http_exchange.h"
#include "collector/capture/record_builder.h"
#include "collector/capture/record_sink.h"

namespace capture {

class PageAssembler : public ExchangeSink {
 public:
  static constexpr Micros kViewSpan = 30 * 1000000LL;   // page start to its last object start
  static constexpr Micros kQuietClose = 5 * 1000000LL;  // idle time that ends a view

  // builder, sink and stats must outlive the assembler.
  PageAssembler(RecordBuilder* builder, RecordSink* sink, CaptureStats* stats);
  ~PageAssembler() override;
  PageAssembler(const PageAssembler&) = delete;
  PageAssembler& operator=(const PageAssembler&) = delete;

  void OnExchange(const HttpExchange& exchange) override;
  // The capture clock reached now: writes the views and orphans that are due.
  void Advance(Micros now);
  // Writes everything still open (end of input).
  void Flush();
  // The smallest HttpExchange::sequence among the exchanges not written yet; UINT64_MAX when
  // none is held. Every exchange with a smaller sequence has reached the sink. Looks through
  // every client: call it now and then, not per exchange.
  uint64_t OldestHeld() const;

 private:
  struct Item {
    HttpExchange exchange;
    sm3gen::RecordKind kind = sm3gen::RecordKind::kObject;
    std::string key;          // its own URL, normalised
    std::string referer_key;  // its Referer, normalised; empty without one
    bool hostless = false;    // its request named no host, or an assumed one (an access log
                              // without one): its URL is matched by path and query alone
  };
  struct View {
    Item page;
    std::vector<Item> objects;
    Micros last_end = 0;  // the latest reply end among page and objects
  };
  struct Client {
    bool has_view = false;
    View view;
    std::deque<Item> waiting;  // replies whose page has not been seen (yet)
  };
  struct AddressHash {
    size_t operator()(const IpAddress& address) const;
  };

  Item MakeItem(const HttpExchange& exchange) const;
  bool Due(const View& view, Micros now) const;
  bool Claims(const View& view, const Item& item) const;
  void Attach(View* view, Item&& item);
  void ClaimWaiting(Client* client);
  void WriteView(Client* client);
  void WriteAlone(const Item& item, bool orphan);
  void Write(const HttpExchange& exchange, sm3gen::RecordKind kind, const PageFigures& figures);

  RecordBuilder* const builder_;
  RecordSink* const sink_;
  CaptureStats* const stats_;
  std::unordered_map<IpAddress, Client, AddressHash> clients_;
  Micros now_ = 0;           // the latest capture time seen
  Micros last_advance_ = 0;  // when due views were last looked for
};

// The normalised form of a URL ("http://Shop.example:80/a?b#c" -> "shop.example/a?b") and of
// a request (Host header, or the server address, and its target).
std::string NormaliseUrl(std::string_view url);
std::string RequestKey(const HttpExchange& exchange);

}  // namespace capture
