#include "tests/support/packet_recorder.h"

#include <arpa/inet.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdint>
#include <cstring>
#include <fstream>
#include <iterator>
#include <map>
#include <regex>
#include <set>
#include <sstream>

#include "tests/support/test_util.h"

namespace q7test {

namespace {

using namespace std::chrono_literals;

uint32_t Read32(const unsigned char* p, bool swapped) {
  uint32_t v;
  std::memcpy(&v, p, 4);
  return swapped ? __builtin_bswap32(v) : v;
}

uint16_t Big16(const unsigned char* p) {
  return static_cast<uint16_t>(p[0] << 8 | p[1]);
}

// One TCP packet's addresses and flags, as far as ConnectionsEnded needs them.
struct TcpPacket {
  std::string from;  // "address port"
  std::string to;
  int from_port = 0;
  uint8_t flags = 0;
};

constexpr uint8_t kFin = 0x01;
constexpr uint8_t kSyn = 0x02;
constexpr uint8_t kRst = 0x04;
constexpr uint8_t kAck = 0x10;

// Decodes Ethernet or Linux cooked frames carrying IPv4 or IPv6 (without extension headers).
bool DecodeTcp(uint32_t link_type, const unsigned char* p, size_t n, TcpPacket* packet) {
  size_t at = 0;
  uint16_t ether_type = 0;
  if (link_type == 1 && n >= 14) {  // Ethernet
    ether_type = Big16(p + 12);
    at = 14;
  } else if (link_type == 113 && n >= 16) {  // Linux cooked v1
    ether_type = Big16(p + 14);
    at = 16;
  } else if (link_type == 276 && n >= 20) {  // Linux cooked v2
    ether_type = Big16(p);
    at = 20;
  } else {
    return false;
  }
  char text[64];
  size_t tcp = 0;
  if (ether_type == 0x0800 && n >= at + 20 && p[at + 9] == 6) {
    tcp = at + (p[at] & 0x0f) * 4u;
    inet_ntop(AF_INET, p + at + 12, text, sizeof(text));
    packet->from = text;
    inet_ntop(AF_INET, p + at + 16, text, sizeof(text));
    packet->to = text;
  } else if (ether_type == 0x86dd && n >= at + 40 && p[at + 6] == 6) {
    tcp = at + 40;
    inet_ntop(AF_INET6, p + at + 8, text, sizeof(text));
    packet->from = text;
    inet_ntop(AF_INET6, p + at + 24, text, sizeof(text));
    packet->to = text;
  } else {
    return false;
  }
  if (n < tcp + 14) {
    return false;
  }
  packet->from_port = Big16(p + tcp);
  packet->from += " " + std::to_string(packet->from_port);
  packet->to += " " + std::to_string(Big16(p + tcp + 2));
  packet->flags = p[tcp + 13];
  return true;
}

}  // namespace

std::string CaptureUnavailableReason() {
  if (::geteuid() == 0) {
    return "";
  }
  std::istringstream status(FileText("/proc/self/status"));
  for (std::string line; std::getline(status, line);) {
    if (line.rfind("CapEff:", 0) == 0) {
      const unsigned long long effective = std::stoull(line.substr(7), nullptr, 16);
      if (effective & (1ull << 13)) {  // CAP_NET_RAW
        return "";
      }
    }
  }
  return "capturing packets needs root or CAP_NET_RAW, and this test runs as uid " +
         std::to_string(::geteuid()) + " without it";
}

PacketRecorder::PacketRecorder(std::string interface, std::string filter, std::string pcap_path)
    : interface_(std::move(interface)),
      filter_(std::move(filter)),
      pcap_path_(std::move(pcap_path)),
      log_path_(pcap_path_ + ".log") {}

PacketRecorder::~PacketRecorder() {
  if (process_ != nullptr && process_->running()) {
    std::string ignored;
    Stop(&ignored);
  }
}

bool PacketRecorder::Start(std::string* error) {
  // Immediate mode: without it, packets wait in the kernel's ring buffer for up to a second and
  // whatever is still there when tcpdump is stopped never reaches the file.
  process_ = std::make_unique<ChildProcess>(
      std::vector<std::string>{"/usr/bin/tcpdump", "-i", interface_, "--immediate-mode", "-B",
                               "65536", "-U", "-w", pcap_path_, filter_},
      log_path_, log_path_);
  const auto listening = [&] {
    return FileText(log_path_).find("listening on") != std::string::npos;
  };
  if (process_->started() && PollUntil([&] { return listening() || !process_->running(); }, 10s) &&
      listening()) {
    return true;
  }
  *error = "tcpdump did not start listening: " + FileText(log_path_);
  return false;
}

long PacketRecorder::Stop(std::string* error) {
  if (process_ == nullptr) {
    *error = "tcpdump was not started";
    return -1;
  }
  process_->signal(SIGINT);
  const auto status = process_->wait(10s);
  const std::string log = FileText(log_path_);
  std::smatch dropped;
  if (status && WIFEXITED(*status) && WEXITSTATUS(*status) == 0 &&
      std::regex_search(log, dropped, std::regex(R"((\d+) packets? dropped by kernel)"))) {
    return std::stol(dropped[1]);
  }
  *error = "tcpdump did not stop cleanly: " + log;
  return -1;
}

bool ConnectionsEnded(const std::string& pcap_path, const std::set<int>& client_ports) {
  const std::string file = FileText(pcap_path);
  if (file.size() < 24) {
    return false;
  }
  const auto* bytes = reinterpret_cast<const unsigned char*>(file.data());
  const uint32_t magic = Read32(bytes, false);
  const bool swapped = magic == 0xd4c3b2a1 || magic == 0x4d3cb2a1;
  if (!swapped && magic != 0xa1b2c3d4 && magic != 0xa1b23c4d) {
    return false;
  }
  const uint32_t link_type = Read32(bytes + 20, swapped) & 0xffff;
  struct Connection {
    bool opened = false;
    int client_port = 0;  // the SYN's source port
    bool reset = false;
    std::set<std::string> finished;  // the endpoints that sent a FIN
  };
  std::map<std::pair<std::string, std::string>, Connection> connections;
  for (size_t at = 24; at + 16 <= file.size();) {
    const uint32_t captured = Read32(bytes + at + 8, swapped);
    if (at + 16 + captured > file.size()) {
      break;  // a packet still being written
    }
    TcpPacket packet;
    if (DecodeTcp(link_type, bytes + at + 16, captured, &packet)) {
      Connection& c = connections[std::minmax(packet.from, packet.to)];
      if ((packet.flags & (kSyn | kAck)) == kSyn) {
        c.opened = true;
        c.client_port = packet.from_port;
      }
      c.reset |= (packet.flags & kRst) != 0;
      if (packet.flags & kFin) {
        c.finished.insert(packet.from);
      }
    }
    at += 16 + captured;
  }
  std::set<int> ended;
  for (const auto& [endpoints, c] : connections) {
    if (!c.opened) {
      continue;
    }
    if (!c.reset && c.finished.size() < 2) {
      return false;
    }
    ended.insert(c.client_port);
  }
  return std::includes(ended.begin(), ended.end(), client_ports.begin(), client_ports.end());
}

std::vector<std::vector<std::string>> TsharkFields(const std::string& pcap_path,
                                                   const std::string& display_filter,
                                                   const std::vector<std::string>& fields,
                                                   const std::string& scratch_dir,
                                                   std::string* error) {
  std::vector<std::string> argv = {"/usr/bin/tshark",
                                   "-r",
                                   pcap_path,
                                   "-n",
                                   "-o",
                                   "http.desegment_body:FALSE",
                                   "-Y",
                                   display_filter,
                                   "-T",
                                   "fields",
                                   "-E",
                                   "separator=/t",
                                   "-E",
                                   "occurrence=f"};
  for (const std::string& field : fields) {
    argv.push_back("-e");
    argv.push_back(field);
  }
  std::string out;
  std::string err;
  const int code =
      RunToEnd(argv, scratch_dir + "/tshark.out", scratch_dir + "/tshark.err", &out, &err);
  std::vector<std::vector<std::string>> rows;
  if (code != 0) {
    *error = "tshark failed (" + std::to_string(code) + "): " + err;
    return rows;
  }
  std::istringstream lines(out);
  for (std::string line; std::getline(lines, line);) {
    std::vector<std::string> row;
    size_t start = 0;
    for (size_t tab; (tab = line.find('\t', start)) != std::string::npos; start = tab + 1) {
      row.push_back(line.substr(start, tab - start));
    }
    row.push_back(line.substr(start));
    if (row.size() != fields.size()) {
      *error = "tshark printed " + std::to_string(row.size()) + " fields instead of " +
               std::to_string(fields.size()) + ": " + line;
      return {};
    }
    rows.push_back(std::move(row));
  }
  return rows;
}

}  // namespace q7test
