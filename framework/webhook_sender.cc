#include "framework/webhook_sender.h"

#include <arpa/inet.h>
#include <httplib.h>

#include <algorithm>
#include <cassert>
#include <cctype>
#include <exception>
#include <memory>
#include <tuple>
#include <utility>

#include "framework/trace.h"

namespace fw {
namespace {

constexpr char kUnit[] = "framework";
constexpr char kNotHttp[] = "a webhook must be an http:// or https:// URL";
constexpr char kBadPort[] = "the webhook URL's port must be a number from 1 to 65535";

bool Fail(std::string* error, std::string text) {
  if (error != nullptr) {
    *error = std::move(text);
  }
  return false;
}

bool IsHostNameChar(char c) {
  return std::isalnum(static_cast<unsigned char>(c)) != 0 || c == '-' || c == '.' || c == '_';
}

// Digits only, 1..65535.
bool ParsePort(const std::string& text, int* port) {
  if (text.empty() || text.size() > 5 ||
      text.find_first_not_of("0123456789") != std::string::npos) {
    return false;
  }
  const int value = std::stoi(text);
  if (value < 1 || value > 65535) {
    return false;
  }
  *port = value;
  return true;
}

}  // namespace

std::string WebhookUrl::Origin() const {
  const bool v6 = host.find(':') != std::string::npos;
  return scheme + "://" + (v6 ? "[" + host + "]" : host) + ":" + std::to_string(port);
}

bool ParseWebhookUrl(const std::string& url, WebhookUrl* out, std::string* error) {
  // Such characters would end up in the request line or the Host header.
  for (const char c : url) {
    if (static_cast<unsigned char>(c) <= 0x20 || c == 0x7f) {
      return Fail(error, "a webhook URL must not contain spaces or control characters");
    }
  }
  const auto scheme_end = url.find("://");
  if (scheme_end == std::string::npos) {
    return Fail(error, kNotHttp);
  }
  WebhookUrl parsed;
  parsed.scheme = url.substr(0, scheme_end);
  std::transform(parsed.scheme.begin(), parsed.scheme.end(), parsed.scheme.begin(),
                 [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
  if (parsed.scheme != "http" && parsed.scheme != "https") {
    return Fail(error, kNotHttp);
  }

  const std::string rest = url.substr(scheme_end + 3);
  const auto authority_end = rest.find_first_of("/?#");
  const std::string authority = rest.substr(0, authority_end);
  const std::string target = authority_end == std::string::npos ? "" : rest.substr(authority_end);
  if (target.find('#') != std::string::npos) {
    return Fail(error, "a webhook URL must not have a #fragment");
  }
  if (authority.find('@') != std::string::npos) {
    return Fail(error, "a webhook URL must not carry a user name or password");
  }

  std::string port_text;
  bool has_port = false;
  if (!authority.empty() && authority.front() == '[') {
    const auto close = authority.find(']');
    if (close == std::string::npos) {
      return Fail(error, "the webhook URL's IPv6 address has no closing ]");
    }
    parsed.host = authority.substr(1, close - 1);
    if (parsed.host.empty()) {
      return Fail(error, "the webhook URL has no host");
    }
    in6_addr address;
    if (inet_pton(AF_INET6, parsed.host.c_str(), &address) != 1) {
      return Fail(error, "the webhook URL's host [" + parsed.host + "] is not an IPv6 address");
    }
    const std::string after = authority.substr(close + 1);
    if (!after.empty()) {
      if (after.front() != ':') {
        return Fail(error, "the webhook URL has text after its IPv6 address");
      }
      has_port = true;
      port_text = after.substr(1);
    }
  } else {
    if (std::count(authority.begin(), authority.end(), ':') > 1) {
      return Fail(error, "the webhook URL's IPv6 address must be in brackets");
    }
    const auto colon = authority.find(':');
    parsed.host = authority.substr(0, colon);
    if (colon != std::string::npos) {
      has_port = true;
      port_text = authority.substr(colon + 1);
    }
    if (parsed.host.empty()) {
      return Fail(error, "the webhook URL has no host");
    }
    if (!std::all_of(parsed.host.begin(), parsed.host.end(), IsHostNameChar)) {
      return Fail(error,
                  "the webhook URL's host \"" + parsed.host + "\" is not a host name or address");
    }
  }
  if (!has_port) {
    parsed.port = parsed.scheme == "https" ? 443 : 80;
  } else if (!ParsePort(port_text, &parsed.port)) {
    return Fail(error, kBadPort);
  }

  parsed.target = target.empty() || target.front() == '?' ? "/" + target : target;
  *out = std::move(parsed);
  return true;
}

// Copied out of the queue so that the POST runs without the lock; the delivery itself stays at
// the front of its destination until settled, which keeps later ones to that URL behind it.
struct WebhookSender::Attempt {
  std::string key;  // the URL as enqueued: the destination's key
  WebhookUrl url;
  std::string body;
  std::uint64_t sequence = 0;
};

struct WebhookSender::Settled {
  enum Kind { kDelivered, kRetrying, kGivenUp } kind;
  int attempts;                       // attempts made, this one included
  std::chrono::milliseconds backoff;  // kRetrying: the wait before the next attempt
};

WebhookSender::WebhookSender() : WebhookSender(Options()) {}

WebhookSender::WebhookSender(const Options& options) : options_(options) {
  assert(options_.capacity > 0 && "a webhook sender needs room for one delivery");
  assert(options_.max_attempts > 0 && "a webhook delivery needs at least one attempt");
  worker_ = std::thread([this] { Run(); });
}

WebhookSender::~WebhookSender() {
  Stop();
}

bool WebhookSender::Enqueue(std::string url, std::string body) {
  WebhookUrl parsed;
  std::string error;
  const bool valid = ParseWebhookUrl(url, &parsed, &error);
  bool stopped = false;
  std::uint64_t dropped = 0;  // the refusal's counter after this one
  bool traced = true;         // whether this refusal is traced
  {
    MutexLock lock(mutex_);
    const auto now = std::chrono::steady_clock::now();
    const auto due = [&](std::optional<std::chrono::steady_clock::time_point>& last) {
      if (last && now - *last < options_.drop_trace_period) {
        return false;
      }
      last = now;
      return true;
    };
    if (stopping_) {
      stopped = true;
    } else if (!valid) {
      dropped = ++counters_.dropped_invalid;
      traced = due(invalid_traced_);
    } else if (counters_.pending >= options_.capacity) {
      dropped = ++counters_.dropped_full;
      traced = due(full_traced_);
    } else {
      auto [it, inserted] = destinations_.try_emplace(std::move(url));
      if (inserted) {
        it->second.url = std::move(parsed);
      }
      it->second.deliveries.push_back(
          Delivery{std::move(body), 0, std::chrono::steady_clock::now(), next_sequence_++});
      ++counters_.enqueued;
      ++counters_.pending;
      wake_.NotifyOne();
      return true;
    }
  }
  // Traced without the lock, so that the worker never waits for the trace file.
  if (!traced) {
    return false;
  }
  if (stopped) {
    Q7_TRACE(kUnit, kTraceError, "webhook delivery dropped: the sender is stopped");
  } else if (!valid) {
    Q7_TRACE(kUnit, kTraceError, "webhook delivery dropped (%llu so far): %s",
             static_cast<unsigned long long>(dropped), error.c_str());
  } else {
    Q7_TRACE(kUnit, kTraceError,
             "webhook delivery to %s dropped (%llu so far): %zu deliveries are pending already",
             parsed.Origin().c_str(), static_cast<unsigned long long>(dropped), options_.capacity);
  }
  return false;
}

void WebhookSender::Stop() {
  if (!worker_.joinable()) {
    return;
  }
  {
    MutexLock lock(mutex_);
    stopping_ = true;
    wake_.NotifyAll();
    // A receiver that hangs must not hold up the agent's stop for the POST's timeouts.
    if (in_flight_ != nullptr) {
      in_flight_->stop();
    }
  }
  worker_.join();
  std::uint64_t abandoned = 0;
  {
    MutexLock lock(mutex_);
    abandoned = counters_.pending;
  }
  if (abandoned > 0) {
    Q7_TRACE(kUnit, kTraceInfo, "webhook sender stopped; deliveries not sent: %llu",
             static_cast<unsigned long long>(abandoned));
  }
}

WebhookSender::Counters WebhookSender::counters() const {
  MutexLock lock(mutex_);
  return counters_;
}

void WebhookSender::Run() {
  SetThreadName("Webhook Sender");
  try {
    for (;;) {
      Attempt attempt;
      {
        MutexLock lock(mutex_);
        if (!NextDue(&attempt)) {
          return;
        }
      }
      std::string failure;
      const bool delivered = Post(attempt, &failure);
      const Settled settled = [&] {
        MutexLock lock(mutex_);
        return Settle(attempt, delivered);
      }();
      const std::string origin = attempt.url.Origin();
      switch (settled.kind) {
        case Settled::kDelivered:
          Q7_TRACE(kUnit, kTraceDetail, "webhook delivery to %s delivered at attempt %d",
                   origin.c_str(), settled.attempts);
          break;
        case Settled::kRetrying:
          Q7_TRACE(kUnit, kTraceDetail,
                   "webhook delivery to %s failed at attempt %d (%s), next in %lld ms",
                   origin.c_str(), settled.attempts, failure.c_str(),
                   static_cast<long long>(settled.backoff.count()));
          break;
        case Settled::kGivenUp:
          Q7_TRACE(kUnit, kTraceError, "webhook delivery to %s given up after %d attempts: %s",
                   origin.c_str(), settled.attempts, failure.c_str());
          break;
      }
    }
  } catch (const std::exception& e) {
    // Nothing here throws short of running out of memory; the thread must not take the process
    // down with it.
    Q7_TRACE(kUnit, kTraceError, "webhook sender stopped working: %s", e.what());
  } catch (...) {
    Q7_TRACE(kUnit, kTraceError, "webhook sender stopped working: unknown exception");
  }
}

bool WebhookSender::NextDue(Attempt* attempt) {
  for (;;) {
    if (stopping_) {
      return false;
    }
    // Few URLs (one per situation with a webhook): a scan is cheaper than keeping an index.
    const std::string* next_key = nullptr;
    const Delivery* next = nullptr;
    for (const auto& [key, destination] : destinations_) {
      const Delivery& front = destination.deliveries.front();
      if (next == nullptr ||
          std::tie(front.due, front.sequence) < std::tie(next->due, next->sequence)) {
        next_key = &key;
        next = &front;
      }
    }
    const std::uint64_t enqueued = counters_.enqueued;
    const auto woken = [this, enqueued]()
                           REQUIRES(mutex_) { return stopping_ || counters_.enqueued != enqueued; };
    const auto now = std::chrono::steady_clock::now();
    if (next == nullptr) {
      wake_.Wait(mutex_, woken);
    } else if (next->due > now) {
      wake_.WaitFor(mutex_, next->due - now, woken);
    } else {
      attempt->key = *next_key;
      attempt->url = destinations_.at(*next_key).url;
      attempt->body = next->body;
      attempt->sequence = next->sequence;
      return true;
    }
  }
}

WebhookSender::Settled WebhookSender::Settle(const Attempt& attempt, bool delivered) {
  const auto it = destinations_.find(attempt.key);
  assert(it != destinations_.end() && it->second.deliveries.front().sequence == attempt.sequence &&
         "only the worker removes deliveries, and only the one it attempted");
  Destination& destination = it->second;
  Delivery& delivery = destination.deliveries.front();
  ++delivery.attempts;
  Settled settled{Settled::kDelivered, delivery.attempts, std::chrono::milliseconds(0)};
  if (delivered) {
    ++counters_.delivered;
  } else {
    ++counters_.attempts_failed;
    if (delivery.attempts < options_.max_attempts) {
      ++counters_.retried;
      settled.kind = Settled::kRetrying;
      settled.backoff = Backoff(delivery.attempts);
      delivery.due = std::chrono::steady_clock::now() + settled.backoff;
      return settled;
    }
    ++counters_.given_up;
    settled.kind = Settled::kGivenUp;
  }
  --counters_.pending;
  destination.deliveries.pop_front();
  if (destination.deliveries.empty()) {
    destinations_.erase(it);
  }
  return settled;
}

std::chrono::milliseconds WebhookSender::Backoff(int failed_attempts) const {
  std::chrono::milliseconds backoff = options_.first_backoff;
  for (int i = 1; i < failed_attempts && backoff < options_.max_backoff; ++i) {
    backoff *= 2;
  }
  return std::min(backoff, options_.max_backoff);
}

bool WebhookSender::Post(const Attempt& attempt, std::string* failure) {
  try {
    // Built from the parsed host and port: httplib's own "scheme://host:port" parsing takes no
    // IPv6 address with letters in it and would quietly fall back to plain HTTP on port 80.
    std::unique_ptr<httplib::ClientImpl> client;
    if (attempt.url.scheme == "https") {
      // Verifies the receiver's certificate against the system's CAs (OpenSSL's default paths).
      client = std::make_unique<httplib::SSLClient>(attempt.url.host, attempt.url.port);
    } else {
      client = std::make_unique<httplib::ClientImpl>(attempt.url.host, attempt.url.port);
    }
    client->set_connection_timeout(options_.timeout);
    client->set_read_timeout(options_.timeout);
    client->set_write_timeout(options_.timeout);
    {
      MutexLock lock(mutex_);
      if (stopping_) {
        *failure = "stopping";
        return false;
      }
      in_flight_ = client.get();
    }
    // Cleared however the POST ends, exceptions included, before the client goes.
    struct InFlight {
      WebhookSender* sender;
      ~InFlight() {
        MutexLock lock(sender->mutex_);
        sender->in_flight_ = nullptr;
      }
    } in_flight{this};
    const httplib::Result result =
        client->Post(attempt.url.target, attempt.body, "application/json");
    if (!result) {
      *failure = "no answer (" + httplib::to_string(result.error()) + " error)";
      return false;
    }
    if (result->status >= 200 && result->status < 300) {
      return true;
    }
    *failure = "HTTP status " + std::to_string(result->status);
  } catch (const std::exception& e) {
    *failure = std::string("exception: ") + e.what();
  } catch (...) {
    *failure = "unknown exception";
  }
  return false;
}

}  // namespace fw
