#pragma once

// The framework's HTTP API server (cpp-httplib): JSON endpoints on one listening address,
// served from a pool of worker threads, and optionally the dashboard's static files at "/".
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

  // Serves the files below the directory `dir` at "/" (index.html for a directory), before
  // the routes and only for files that exist. GET and HEAD of such paths need no token even
  // off loopback, since the files hold no data; /api/, /metrics and /healthz keep their rules.
  // Call before Start; when `dir` cannot be served, Start traces it and serves the API only.
  void ServeStatic(std::string dir) { static_dir_ = std::move(dir); }

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
  std::string static_dir_;             // empty: the API only
};

}  // namespace fw
