#include "tests/support/nginx_server.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <signal.h>
#include <sys/socket.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <fstream>

#include "tests/support/test_util.h"

namespace q7test {

namespace {

using namespace std::chrono_literals;
namespace fs = std::filesystem;

// The last lines of a log, for failure messages.
std::string Tail(const std::string& text, size_t lines = 8) {
  size_t at = text.size();
  while (lines-- > 0 && at > 0) {
    at = text.rfind('\n', at - 1);
    if (at == std::string::npos) {
      return text;
    }
  }
  return text.substr(at);
}

sockaddr_in Loopback(int port) {
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_port = htons(static_cast<uint16_t>(port));
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  return address;
}

}  // namespace

int FreeLoopbackPort() {
  const int fd = ::socket(AF_INET, SOCK_STREAM, 0);
  if (fd < 0) {
    return 0;
  }
  sockaddr_in address = Loopback(0);
  socklen_t length = sizeof(address);
  int port = 0;
  if (::bind(fd, reinterpret_cast<sockaddr*>(&address), sizeof(address)) == 0 &&
      ::getsockname(fd, reinterpret_cast<sockaddr*>(&address), &length) == 0) {
    port = ntohs(address.sin_port);
  }
  ::close(fd);
  return port;
}

bool AcceptsConnections(int port) {
  const int fd = ::socket(AF_INET, SOCK_STREAM, 0);
  if (fd < 0) {
    return false;
  }
  const sockaddr_in address = Loopback(port);
  const bool ok = ::connect(fd, reinterpret_cast<const sockaddr*>(&address), sizeof(address)) == 0;
  ::close(fd);
  return ok;
}

NginxServer::NginxServer(std::string dir) : dir_(std::move(dir)) {
  for (const char* sub : {"html", "logs", "temp"}) {
    fs::create_directories(dir_ + "/nginx/" + sub);
  }
}

NginxServer::~NginxServer() {
  Stop();
}

std::string NginxServer::base_url() const {
  return "http://127.0.0.1:" + std::to_string(port_);
}

std::string NginxServer::ErrorLog() const {
  return FileText(dir_ + "/nginx/logs/error.log");
}

std::string NginxServer::AccessLog() const {
  return FileText(dir_ + "/nginx/logs/access.log");
}

std::string NginxServer::timed_log_path() const {
  return dir_ + "/nginx/logs/timed.log";
}

bool NginxServer::Start(const std::string& locations, std::string* error) {
  // The port is free when picked but may be taken before nginx binds it: try a few.
  for (int attempt = 0; attempt < 5; ++attempt) {
    if (StartOnce(locations, error)) {
      return true;
    }
    if (error->find("Address already in use") == std::string::npos) {
      return false;
    }
  }
  return false;
}

bool NginxServer::StartOnce(const std::string& locations, std::string* error) {
  port_ = FreeLoopbackPort();
  const std::string home = dir_ + "/nginx/";
  std::string temp_paths;
  for (const char* kind : {"client_body", "proxy", "fastcgi", "uwsgi", "scgi"}) {
    temp_paths += std::string("  ") + kind + "_temp_path " + home + "temp/" + kind + ";\n";
  }
  // One process (no master), so that stopping it never leaves a worker behind. As root it must
  // still be told to stay root: the scratch directory is not readable by "nobody".
  std::ofstream(home + "nginx.conf")
      << (::geteuid() == 0 ? "user root;\n" : "") << "daemon off;\nmaster_process off;\n"
      << "pid " << home << "nginx.pid;\nerror_log " << home << "logs/error.log info;\n"
      << "events { worker_connections 256; }\nhttp {\n"
      << "  types { text/html html; text/css css; application/javascript js; image/png png; }\n"
      << "  default_type application/octet-stream;\n"
      << "  log_format timed '$remote_port \"$request\" $status $bytes_sent "
         "rt=$request_time urt=$upstream_response_time';\n"
      << "  access_log " << home
      << "logs/access.log timed;\n"
      // The format the README asks operators to add, for sm3logs.
      << "  log_format combined_timed '$remote_addr - $remote_user [$time_local] '\n"
         "    '\"$request\" $status $body_bytes_sent \"$http_referer\" \"$http_user_agent\" '\n"
         "    '$request_time $upstream_response_time';\n"
      << "  access_log " << timed_log_path() << " combined_timed;\n"
      << temp_paths << "  server {\n    listen 127.0.0.1:" << port_ << ";\n    root " << root()
      << ";\n"
      << locations << "\n  }\n}\n";
  fs::remove(home + "nginx.pid");
  process_ = std::make_unique<ChildProcess>(
      std::vector<std::string>{"/usr/sbin/nginx", "-p", home, "-c", home + "nginx.conf", "-e",
                               home + "logs/error.log"},
      home + "logs/stderr.log", home + "logs/stderr.log");
  // nginx writes its pid file once its listening socket is bound; only then is the port its own.
  const bool up = process_->started() &&
                  PollUntil(
                      [&] {
                        return !process_->running() ||
                               (fs::exists(home + "nginx.pid") && AcceptsConnections(port_));
                      },
                      10s);
  if (up && process_->running()) {
    return true;
  }
  *error = "nginx did not start on port " + std::to_string(port_) + ":" +
           Tail(FileText(home + "logs/stderr.log") + ErrorLog());
  Stop();
  return false;
}

void NginxServer::Stop() {
  if (process_ == nullptr) {
    return;
  }
  process_->signal(SIGTERM);
  process_->wait(5s);
  process_.reset();  // kills it if SIGTERM was not enough
}

PythonUpstream::PythonUpstream(std::string dir, const std::string& script) : dir_(std::move(dir)) {
  fs::create_directories(dir_);
  std::ofstream(dir_ + "/upstream.py") << script;
  process_ = std::make_unique<ChildProcess>(
      std::vector<std::string>{"/usr/bin/python3", "-I", "-u", dir_ + "/upstream.py",
                               dir_ + "/upstream.port"},
      dir_ + "/upstream.log", dir_ + "/upstream.log");
}

bool PythonUpstream::WaitUntilServing(std::string* error) {
  const bool up = process_->started() &&
                  PollUntil(
                      [&] {
                        port_ = std::atoi(FileText(dir_ + "/upstream.port").c_str());
                        return !process_->running() || (port_ > 0 && AcceptsConnections(port_));
                      },
                      10s);
  if (up && process_->running()) {
    return true;
  }
  *error = "the python3 upstream did not start:" + Tail(FileText(dir_ + "/upstream.log"));
  return false;
}

}  // namespace q7test
