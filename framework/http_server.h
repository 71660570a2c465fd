#pragma once

// The framework's HTTP API server (cpp-httplib): JSON endpoints on one listening address,
// served from a pool of worker threads.
//
// Lifetime: Start once, Stop once (the destructor stops too). Start and Stop run on the main
// loop's thread; handlers run on the pool's threads and read only thread-safe framework state.

#include <memory>
#include <string>
#include <thread>
#include <utility>

namespace httplib {
class Server;
}

namespace fw {

class AlertBook;

class HttpServer {
 public:
  HttpServer();
  ~HttpServer();
  HttpServer(const HttpServer&) = delete;
  HttpServer& operator=(const HttpServer&) = delete;

  // Listens on "host:port" ("[v6]:port" for IPv6; port 0 picks a free port) and starts
  // serving on a thread of its own. Returns kOk, kInvalidArgument for an address that does
  // not parse, or kIoError when the address cannot be bound; *error says why.
  int Start(const std::string& address, std::string* error);

  // The bearer token changes need (and, on a non-loopback address, every request). Empty: no
  // request that needs it is allowed. Call before Start.
  void SetApiToken(std::string token) { api_token_ = std::move(token); }

  // Serves HTTPS with the PEM certificate (chain) and private key files at these paths. Call
  // before Start; Start fails when they do not load.
  void UseTls(std::string certificate, std::string key) {
    tls_certificate_ = std::move(certificate);
    tls_key_ = std::move(key);
  }
  bool tls() const { return !tls_certificate_.empty(); }

  // Serves GET /api/v1/alerts from the book, which must outlive the server. Call before Start.
  void ServeAlerts(const AlertBook* book) { alerts_ = book; }

  // Stops serving and waits for requests in flight. Safe to call when not started.
  void Stop();

  // "host:port" as bound ("https://host:port" with TLS), empty before Start succeeded.
  const std::string& bound_address() const { return bound_address_; }

  // Splits "host:port"; returns false when it does not parse.
  static bool ParseAddress(const std::string& address, std::string* host, int* port);

 private:
  void InstallRoutes(bool loopback);

  std::unique_ptr<httplib::Server> server_;  // made by Start: plain or TLS
  std::thread thread_;
  std::string bound_address_;
  std::string api_token_;  // set before Start, then read by the pool threads
  std::string tls_certificate_;
  std::string tls_key_;
  const AlertBook* alerts_ = nullptr;  // null: no alerts endpoint
};

}  // namespace fw
