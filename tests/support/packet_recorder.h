#pragma once

// Test helpers around packet captures: recording with tcpdump, knowing when a recording is
// complete, and reading it back with tshark as the reference dissector.

#include <memory>
#include <set>
#include <string>
#include <vector>

#include "tests/support/child_process.h"

namespace q7test {

// Why this process cannot capture packets (neither root nor CAP_NET_RAW in its effective set);
// empty when it can.
std::string CaptureUnavailableReason();

// tcpdump writing the packets of one interface that pass a filter into a pcap file, each packet
// flushed as it comes (so the file can be read while it grows). Stopped when destroyed.
class PacketRecorder {
 public:
  PacketRecorder(std::string interface, std::string filter, std::string pcap_path);
  ~PacketRecorder();
  PacketRecorder(const PacketRecorder&) = delete;
  PacketRecorder& operator=(const PacketRecorder&) = delete;

  // Starts tcpdump and waits until it says it is listening; false with its output in *error.
  bool Start(std::string* error);
  // Stops it with SIGINT and waits for its exit. Returns how many packets it reports dropped by
  // the kernel, or -1 (with its output in *error) when it did not stop cleanly or said nothing.
  long Stop(std::string* error);

 private:
  std::string interface_;
  std::string filter_;
  std::string pcap_path_;
  std::string log_path_;
  std::unique_ptr<ChildProcess> process_;
};

// True when the pcap file holds the end (a FIN from each side, or a RST) of a connection from
// each of client_ports, and of every other connection whose SYN it holds: a recording of
// finished traffic is complete once this holds (tcpdump writes a little after the packets go
// by, so the ports of the last connections must be named). Reads the whole packets written so
// far; false when the file cannot be read.
bool ConnectionsEnded(const std::string& pcap_path, const std::set<int>& client_ports);

// Runs tshark on a pcap file with HTTP bodies left undesegmented (so http.time ends at a reply's
// first segment), keeps the packets passing display_filter and returns, per packet, the values
// of `fields` in order ("" when absent; the first value when repeated). On failure returns no
// rows and sets *error.
std::vector<std::vector<std::string>> TsharkFields(const std::string& pcap_path,
                                                   const std::string& display_filter,
                                                   const std::vector<std::string>& fields,
                                                   const std::string& scratch_dir,
                                                   std::string* error);

}  // namespace q7test
