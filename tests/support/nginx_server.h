#pragma once

// Test helpers: real web servers on loopback for capture tests. NginxServer runs Debian's nginx
// in the foreground with a configuration of its own in a scratch directory; PythonUpstream runs
// a small http.server script as a backend that nginx can proxy to, for what nginx cannot do by
// itself (wait before answering, answer in chunks).
//
// Both are stopped and reaped when destroyed. Not thread-safe.

#include <memory>
#include <string>

#include "tests/support/child_process.h"

namespace q7test {

// A free TCP port on 127.0.0.1 at the time of the call (0 when none could be found).
int FreeLoopbackPort();

// True once something accepts TCP connections on 127.0.0.1:port.
bool AcceptsConnections(int port);

class NginxServer {
 public:
  // dir: a directory of the test's own (no '.' needed anywhere); nginx keeps its configuration,
  // pid file, logs and temporary files below dir/nginx/ and serves dir/nginx/html/.
  explicit NginxServer(std::string dir);
  ~NginxServer();
  NginxServer(const NginxServer&) = delete;
  NginxServer& operator=(const NginxServer&) = delete;

  // The document root, without a trailing '/'; files written there before or after Start are
  // served.
  std::string root() const { return dir_ + "/nginx/html"; }

  // Starts nginx on a free port of 127.0.0.1 with `locations` (nginx directives) inside its one
  // server block, and waits until it accepts connections. False with the reason in *error
  // (including the end of nginx's error log) when it does not come up.
  bool Start(const std::string& locations, std::string* error);

  int port() const { return port_; }
  // "http://127.0.0.1:<port>".
  std::string base_url() const;
  // nginx's error log (and access log, one line per request with its timings).
  std::string ErrorLog() const;
  std::string AccessLog() const;
  // The same requests in the README's nginx-timed format (combined, then $request_time and
  // $upstream_response_time), the log sm3logs reads.
  std::string timed_log_path() const;

 private:
  bool StartOnce(const std::string& locations, std::string* error);
  void Stop();

  std::string dir_;
  int port_ = 0;
  std::unique_ptr<ChildProcess> process_;
};

class PythonUpstream {
 public:
  // Runs `script` (Python 3, Debian's /usr/bin/python3) from dir/upstream.py. The script gets
  // the path of a port file as its first argument: it binds 127.0.0.1 port 0 and writes the port
  // it got there (renamed into place, so a reader never sees half of it).
  PythonUpstream(std::string dir, const std::string& script);
  ~PythonUpstream() = default;
  PythonUpstream(const PythonUpstream&) = delete;
  PythonUpstream& operator=(const PythonUpstream&) = delete;

  // Waits until the port file is there and the port accepts connections; false with the
  // script's output in *error otherwise.
  bool WaitUntilServing(std::string* error);
  int port() const { return port_; }

 private:
  std::string dir_;
  int port_ = 0;
  std::unique_ptr<ChildProcess> process_;
};

}  // namespace q7test
