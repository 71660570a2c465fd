#include "tests/support/http_references.h"

#include <algorithm>
#include <map>
#include <set>

#include "tests/support/packet_recorder.h"

namespace q7test {

namespace {

// An exchange's segment figures while they are counted.
struct Figures : Reference {
  long pending_acks = 0;  // the client's bare ACKs since the last reply segment
};

// The request/reply pairs tshark finds, in request order, with the frame numbers of interim
// (1xx) replies in *interim_frames. tshark pairs a final reply that follows an interim one with
// no request: it belongs to the oldest request of its connection still waiting.
std::vector<Reference> TsharkExchanges(const std::string& pcap, const std::string& scratch,
                                       std::set<long>* interim_frames, std::string* error) {
  const auto rows = TsharkFields(
      pcap, "http.request or http.response",
      {"frame.number", "tcp.stream", "tcp.srcport", "tcp.dstport", "http.request.method",
       "http.request.uri", "http.host", "http.referer", "http.user_agent", "http.response.code",
       "http.time", "http.request_in", "http.server", "http.transfer_encoding"},
      scratch, error);
  std::vector<Reference> exchanges;
  std::map<long, size_t> by_frame;
  for (const auto& row : rows) {
    if (!row[4].empty()) {
      Reference r;
      r.request_frame = std::stol(row[0]);
      r.stream = std::stoi(row[1]);
      r.client_port = std::stoi(row[2]);
      r.server_port = std::stoi(row[3]);
      r.method = row[4];
      r.uri = row[5];
      r.host = row[6].substr(0, row[6].rfind(':'));
      r.referer = row[7];
      r.user_agent = row[8];
      by_frame[r.request_frame] = exchanges.size();
      exchanges.push_back(r);
      continue;
    }
    if (row[9].empty()) {
      continue;
    }
    const int stream = std::stoi(row[1]);
    const auto waiting = std::find_if(exchanges.begin(), exchanges.end(), [&](const Reference& r) {
      return r.stream == stream && r.status == 0;
    });
    Reference* r = !row[11].empty()             ? &exchanges.at(by_frame.at(std::stol(row[11])))
                   : waiting != exchanges.end() ? &*waiting
                                                : nullptr;
    if (r == nullptr) {
      *error = "a reply without a request in frame " + row[0];
      return {};
    }
    if (std::stoi(row[9]) < 200) {
      interim_frames->insert(std::stol(row[0]));
      r->interim = true;
      continue;
    }
    r->status = std::stoi(row[9]);
    if (!row[10].empty()) {
      r->server_ms = std::stod(row[10]) * 1000;
    }
    r->server = row[12];
    r->chunked = row[13] == "chunked";
  }
  return exchanges;
}

// Fills in what the TCP segments say; the bare ACKs it counts are those that come while the
// request is sent and while the reply is received.
void AddSegmentFigures(const std::string& pcap, const std::string& scratch,
                       const std::set<long>& interim_frames, std::vector<Reference>* exchanges,
                       std::string* error) {
  const auto rows =
      TsharkFields(pcap, "tcp",
                   {"frame.number", "tcp.stream", "frame.time_epoch", "tcp.srcport", "tcp.len",
                    "tcp.flags.syn", "tcp.flags.ack", "tcp.flags.fin", "tcp.flags.reset"},
                   scratch, error);
  struct Connection {
    int client_port = 0;
    double syn = 0;
    std::vector<Figures> exchanges;
  };
  std::map<int, Connection> connections;
  for (const auto& row : rows) {
    Connection& c = connections[std::stoi(row[1])];
    const double time = std::stod(row[2]);
    const int port = std::stoi(row[3]);
    const long length = std::stol(row[4]);
    if (row[5] == "1" && row[6] == "0") {
      c.client_port = port;
      c.syn = time;
    }
    if (length == 0) {
      const bool bare_ack = row[5] == "0" && row[6] == "1" && row[7] == "0" && row[8] == "0";
      if (bare_ack && !c.exchanges.empty()) {
        Figures& e = c.exchanges.back();
        if (port != c.client_port && e.reply_packets == 0) {
          ++e.request_acks;
        } else if (port == c.client_port && e.reply_packets > 0) {
          ++e.pending_acks;
        }
      }
      continue;
    }
    if (port == c.client_port) {
      if (c.exchanges.empty() || c.exchanges.back().first_reply > 0) {
        Figures next;
        next.start = c.exchanges.empty() ? c.syn : time;
        c.exchanges.push_back(next);
      }
      Figures& e = c.exchanges.back();
      e.request_bytes += length;
      ++e.request_packets;
      e.last_request = time;
    } else if (!c.exchanges.empty()) {
      Figures& e = c.exchanges.back();
      e.reply_bytes += length;
      ++e.reply_packets;
      e.last_reply = time;
      e.reply_acks += e.pending_acks;
      e.pending_acks = 0;
      if (e.first_reply == 0 && interim_frames.count(std::stol(row[0])) == 0) {
        e.first_reply = time;
      }
    }
  }
  std::map<int, size_t> next_in_stream;
  for (Reference& r : *exchanges) {
    const auto& segments = connections[r.stream].exchanges;
    const size_t k = next_in_stream[r.stream]++;
    if (k >= segments.size()) {
      *error = "no request segments for " + r.describe();
      return;
    }
    const Figures& e = segments[k];
    r.start = e.start;
    r.last_request = e.last_request;
    r.first_reply = e.first_reply;
    r.last_reply = e.last_reply;
    r.request_bytes = e.request_bytes;
    r.reply_bytes = e.reply_bytes;
    r.request_packets = e.request_packets;
    r.reply_packets = e.reply_packets;
    r.request_acks = e.request_acks;
    r.reply_acks = e.reply_acks;
  }
}

}  // namespace

std::vector<Reference> ReferenceExchanges(const std::string& pcap_path,
                                          const std::string& scratch_dir, std::string* error) {
  std::set<long> interim_frames;
  std::vector<Reference> exchanges =
      TsharkExchanges(pcap_path, scratch_dir, &interim_frames, error);
  if (error->empty()) {
    AddSegmentFigures(pcap_path, scratch_dir, interim_frames, &exchanges, error);
  }
  return error->empty() ? exchanges : std::vector<Reference>{};
}

}  // namespace q7test
