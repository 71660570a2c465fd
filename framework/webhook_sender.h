#pragma once

// Delivery of alert changes to operators' webhooks: each change is POSTed as a JSON body to a
// URL, from a worker thread of the sender's own, so that whoever raises or clears an alert (the
// sampler) never waits for a receiver.
//
// A failed attempt (no connection, no answer within the timeout, an answer other than 2xx) is
// retried after a backoff that doubles from the first backoff up to the largest, until
// max_attempts attempts have been made; then the delivery is given up. Deliveries to one URL go
// out in the order they were enqueued, so a receiver sees a raise before its clear; deliveries
// to other URLs go out while one URL waits for its backoff.
//
// One worker makes one attempt at a time: a receiver that hangs delays the others by at most
// one timeout per attempt made to it.
//
// Thread safety: Enqueue and counters may be called from any thread. Stop and the destructor
// are called by the owner, not concurrently with each other.

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <map>
#include <optional>
#include <string>
#include <thread>

#include "framework/mutex.h"
#include "framework/thread_annotations.h"

namespace httplib {
class ClientImpl;
}

namespace fw {

// A webhook URL taken apart for the HTTP client.
struct WebhookUrl {
  std::string scheme;  // "http" or "https"
  std::string host;    // a name or an address; an IPv6 address without its brackets
  int port = 0;        // as written, else 80 or 443 by scheme
  std::string target;  // path and query as sent in the request line; "/" when the URL has none

  // "scheme://host:port" (IPv6 in brackets): names the receiver in traces without the path and
  // query, where receivers often keep their secret.
  std::string Origin() const;
};

// Accepts http://host[:port][/path][?query] and the same with https (the scheme in any case).
// The host is a name, an IPv4 address or an IPv6 address in brackets; the port 1..65535. Returns
// false with *error naming what is wrong, in words fit for an API's 400 answer.
bool ParseWebhookUrl(const std::string& url, WebhookUrl* out, std::string* error);

class WebhookSender {
 public:
  struct Options {
    // Deliveries accepted and not yet delivered or given up (including the one in flight); an
    // Enqueue beyond this is dropped.
    std::size_t capacity = 1000;
    // Bound on connecting, on sending and on waiting for the answer, each.
    std::chrono::milliseconds timeout{5000};
    // Wait before the second attempt; it doubles before each further one, up to max_backoff.
    std::chrono::milliseconds first_backoff{1000};
    std::chrono::milliseconds max_backoff{60000};
    // Attempts per delivery, the first one included (at least 1).
    int max_attempts = 6;
    // Refusals of one kind (queue full, URL unusable) are traced at the first and then at most
    // once a period, each trace with the running count: a dead receiver must not flood the trace.
    std::chrono::milliseconds drop_trace_period{60000};
  };

  // Totals since construction.
  struct Counters {
    std::uint64_t enqueued = 0;         // deliveries Enqueue accepted
    std::uint64_t delivered = 0;        // deliveries a receiver answered with 2xx
    std::uint64_t attempts_failed = 0;  // attempts without a 2xx answer
    std::uint64_t retried = 0;          // failed attempts that another attempt followed
    std::uint64_t given_up = 0;         // deliveries abandoned after max_attempts failed attempts
    std::uint64_t dropped_full = 0;     // deliveries refused because capacity was reached
    std::uint64_t dropped_invalid = 0;  // deliveries refused because their URL does not parse
    std::uint64_t pending = 0;  // accepted, neither delivered nor given up (in flight included)
  };

  // Starts the worker thread.
  WebhookSender();
  explicit WebhookSender(const Options& options);
  // Stops as Stop does.
  ~WebhookSender();

  WebhookSender(const WebhookSender&) = delete;
  WebhookSender& operator=(const WebhookSender&) = delete;

  // Queues body (JSON text) for a POST to url and returns at once. Returns false (traced) when
  // the delivery is refused: the sender holds capacity deliveries already (dropped_full), the
  // URL does not parse (dropped_invalid), or the sender is stopped.
  bool Enqueue(std::string url, std::string body) EXCLUDES(mutex_);

  // Stops the worker and waits for it: at once when it is waiting, else when the attempt in
  // flight ends (within about the timeout). Deliveries still pending are dropped (traced).
  // Later calls do nothing.
  void Stop() EXCLUDES(mutex_);

  Counters counters() const EXCLUDES(mutex_);

 private:
  struct Delivery {
    std::string body;
    int attempts = 0;                           // attempts made so far
    std::chrono::steady_clock::time_point due;  // earliest start of the next attempt
    std::uint64_t sequence = 0;  // enqueue order: among receivers, the oldest due goes first
  };
  struct Destination {
    WebhookUrl url;
    std::deque<Delivery> deliveries;  // oldest first; only the front one is ever attempted
  };
  struct Attempt;  // what the worker needs, copied out, to make one attempt without the lock
  struct Settled;  // what became of an attempt, for the trace

  void Run() EXCLUDES(mutex_);
  // Waits until some delivery is due and copies it into *attempt; false once stopping.
  bool NextDue(Attempt* attempt) REQUIRES(mutex_);
  // Books the outcome of an attempt on the delivery at the front of its destination.
  Settled Settle(const Attempt& attempt, bool delivered) REQUIRES(mutex_);
  // The wait after the given number of failed attempts.
  std::chrono::milliseconds Backoff(int failed_attempts) const;
  // One POST; a 2xx answer is true, anything else false with *failure saying what happened.
  bool Post(const Attempt& attempt, std::string* failure) EXCLUDES(mutex_);

  const Options options_;

  // mutex_ protects the following state; the worker never holds it across a POST.
  mutable Mutex mutex_;
  CondVar wake_;  // signalled on Enqueue and Stop
  // By URL text; a destination is removed when its last delivery is settled.
  std::map<std::string, Destination> destinations_ GUARDED_BY(mutex_);
  std::uint64_t next_sequence_ GUARDED_BY(mutex_) = 0;
  bool stopping_ GUARDED_BY(mutex_) = false;
  Counters counters_ GUARDED_BY(mutex_);
  // When a refusal of each kind was last traced; empty before the first.
  std::optional<std::chrono::steady_clock::time_point> full_traced_ GUARDED_BY(mutex_);
  std::optional<std::chrono::steady_clock::time_point> invalid_traced_ GUARDED_BY(mutex_);

  // The client of the POST in flight, so that Stop can cut it short rather than wait for its
  // timeouts; set and cleared by the worker.
  httplib::ClientImpl* in_flight_ GUARDED_BY(mutex_) = nullptr;
  std::thread worker_;
};

}  // namespace fw
