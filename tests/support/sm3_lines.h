#pragma once

// Test helper: well-formed collector record lines with chosen fields, so a test names only the
// fields it is about. Fields are numbered from 1 as in the line layouts. Header-only.

#include <map>
#include <string>
#include <utility>
#include <vector>

namespace q7test {

// defaults with the numbered fields replaced, joined with '^'.
inline std::string WithFields(std::vector<std::string> defaults,
                              const std::map<int, std::string>& fields) {
  for (const auto& [number, value] : fields) {
    defaults.at(number - 1) = value;
  }
  std::string line;
  for (size_t i = 0; i < defaults.size(); ++i) {
    line += (i == 0 ? "" : "^") + defaults[i];
  }
  return line;
}

// A page-layout line (46 fields): a GET of "/a" on www.shop.example from 10.1.2.3, status 200.
inline std::string PageLine(const std::map<int, std::string>& fields = {}) {
  std::vector<std::string> f(46, "0");
  f[0] = "3.1.0";
  f[1] = "1";
  f[2] = "";
  f[3] = "col-1";
  f[4] = "0123456789ABCDEF0123456789ABCDEF";
  f[5] = "1795000000";
  f[6] = "2026-11-23";
  f[7] = "16:07:00";
  f[9] = "UTC";
  f[10] = "10.1.2.3";
  f[11] = "51000";
  f[12] = "192.0.2.10";
  f[13] = "80";
  f[14] = "120";
  f[22] = "/a";
  f[23] = "N/A";
  f[24] = "Mozilla/5.0";
  f[25] = "Apache/2.4.57";
  f[26] = "HTTP/1.1";
  f[27] = "200";
  f[39] = "www.shop.example";
  f[40] = "/";
  f[41] = "a";
  f[42] = "";
  f[43] = "";
  f[44] = "Shop";
  f[45] = "1";
  return WithFields(std::move(f), fields);
}

// An object-layout line (31 fields) for audio or video: "/media/clip" from 10.1.2.3, status 200.
inline std::string AvLine(const std::map<int, std::string>& fields = {}) {
  std::vector<std::string> f(31, "0");
  f[0] = "3.1.0";
  f[1] = "1";
  f[2] = "";
  f[3] = "col-1";
  f[4] = "FEDCBA9876543210FEDCBA9876543210";
  f[5] = "1795000000";
  f[6] = "2026-11-23";
  f[7] = "16:07:00";
  f[9] = "UTC";
  f[10] = "10.1.2.3";
  f[12] = "192.0.2.20";
  f[13] = "554";
  f[14] = "900";
  f[23] = "/media/clip";
  f[24] = "N/A";
  f[25] = "VLC/3.0";
  f[26] = "Wowza/4.8";
  f[27] = "RTSP/1.0";
  f[28] = "200";
  f[30] = "7";
  return WithFields(std::move(f), fields);
}

// line wrapped in the tags of its record type (1 hpage, 2 hobj, 3 audio, 4 video).
inline std::string Record(int type, const std::string& line, const std::string& eol = "\n") {
  static const char* const kTags[] = {"hpage", "hobj", "audio", "video"};
  const std::string tag = kTags[type - 1];
  return "<" + tag + ">" + line + "</" + tag + ">" + eol;
}

}  // namespace q7test
