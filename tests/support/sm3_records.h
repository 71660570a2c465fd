#pragma once

// Test helpers: the .sm3 records sm3capture and sm3logs write and the counters it prints at its
// end, read back for comparison with what tshark and curl saw.

#include <map>
#include <string>
#include <vector>

namespace q7test {

// Page-layout field numbers.
enum Field {
  kStartSeconds = 6,
  kClientAddress = 11,
  kClientPort = 12,
  kServerAddress = 13,
  kServerPort = 14,
  kTotalMs = 15,
  kRequestPackets = 16,
  kRequestAcks = 17,
  kReplyPackets = 18,
  kReplyAcks = 19,
  kTotalBytes = 20,
  kRequestBytes = 21,
  kReplyBytes = 22,
  kUrl = 23,
  kReferer = 24,
  kUserAgent = 25,
  kServer = 26,
  kProtocol = 27,
  kStatus = 28,
  kServerMs = 29,
  kLoadMs = 31,
  kObjectCount = 32,
  kNetworkMs = 36,
  kHost = 40,
  kPath = 41,
  kFile = 42,
  kQuery = 43,
  kMethod = 46,
};

// The method code of field 46 (1 GET ... 8 CONNECT); 0 for another method.
int MethodCode(const std::string& method);

// One record of an .sm3 file.
struct Record {
  std::string tag;
  std::vector<std::string> fields;

  // Field `number` (1-based) as text, and as a number (throws when it is none).
  const std::string& text(int number) const { return fields.at(number - 1); }
  long number(int number) const { return std::stol(text(number)); }
  // The exchange's own time: a page's total holds its load time too.
  long exchangeMs() const { return number(kTotalMs) - (tag == "hpage" ? number(kLoadMs) : 0); }
  // "<tag> URL port N", for failure messages.
  std::string describe() const {
    return "<" + tag + "> " + text(kUrl) + " port " + text(kClientPort);
  }
};

// The records of an .sm3 file in file order. Lines that are not whole records of their tag's
// layout are left out and described in *error.
std::vector<Record> ReadRecords(const std::string& path, std::string* error);

// The counters of a collector's closing line, the last one that begins with `opening`
// ("sm3capture: packets=N bytes=N ...", "sm3logs: lines=N ..."), in its standard error text;
// empty when there is none.
std::map<std::string, long> FinalCounters(const std::string& stderr_text,
                                          const std::string& opening = "sm3capture: packets=");

}  // namespace q7test
