#pragma once

// Test helper: the HTTP exchanges of a pcap file as the references see them. tshark dissects
// the requests and replies; the TCP segments of each connection, as tshark lists them, give
// each exchange's bytes, packets and times, by the collector's definitions.

#include <optional>
#include <string>
#include <vector>

namespace q7test {

// One exchange as the references see it: tshark's HTTP dissection, and what the TCP segments
// of its connection say about its bytes, packets and times.
struct Reference {
  long request_frame = 0;
  int stream = 0;
  int client_port = 0;
  int server_port = 0;
  std::string method;
  std::string uri;
  std::string host;
  std::string referer;
  std::string user_agent;
  std::string server;               // the reply's Server header
  bool chunked = false;             // the reply's body was sent in chunks
  bool interim = false;             // a 1xx reply came before the final one
  int status = 0;                   // the final reply's
  std::optional<double> server_ms;  // tshark's http.time
  // From the segments, times in seconds.
  double start = 0;  // the SYN for a connection's first exchange, else the first request segment
  double last_request = 0;
  double first_reply = 0;  // the final reply's first segment
  double last_reply = 0;
  long request_bytes = 0;
  long reply_bytes = 0;
  long request_packets = 0;
  long reply_packets = 0;
  long request_acks = 0;  // the server's bare ACKs before the reply
  long reply_acks = 0;    // the client's bare ACKs between the reply's first and last segment

  // "METHOD URI (stream N, port N)", for failure messages.
  std::string describe() const {
    return method + " " + uri + " (stream " + std::to_string(stream) + ", port " +
           std::to_string(client_port) + ")";
  }
};

// The exchanges in request order. Valid for traffic without pipelining, like curl's: in each
// connection an exchange runs from a request segment that follows a final reply (or opens the
// connection) to the last reply segment before the next request. scratch_dir holds tshark's
// output; on failure the result is empty and *error says why.
std::vector<Reference> ReferenceExchanges(const std::string& pcap_path,
                                          const std::string& scratch_dir, std::string* error);

}  // namespace q7test
