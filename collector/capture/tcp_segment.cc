#include "collector/capture/tcp_segment.h"

#include <arpa/inet.h>
#include <sys/socket.h>

namespace capture {

void FormatAddress(const IpAddress& address, char* out, unsigned size) {
  if (size == 0) {
    return;
  }
  if (!address.v6 && size >= 16) {
    // Dotted quads by hand: glibc's inet_ntop formats IPv4 through sprintf, a large share of a
    // record's cost.
    char* p = out;
    for (int i = 0; i < 4; ++i) {
      const unsigned v = address.bytes[static_cast<size_t>(i)];
      if (v >= 100) {
        *p++ = static_cast<char>('0' + v / 100);
      }
      if (v >= 10) {
        *p++ = static_cast<char>('0' + v / 10 % 10);
      }
      *p++ = static_cast<char>('0' + v % 10);
      *p++ = i < 3 ? '.' : '\0';
    }
    return;
  }
  if (::inet_ntop(address.v6 ? AF_INET6 : AF_INET, address.bytes.data(), out, size) == nullptr) {
    out[0] = '\0';
  }
}

}  // namespace capture
