#include "collector/capture/tcp_segment.h"

#include <arpa/inet.h>
#include <sys/socket.h>

namespace capture {

void FormatAddress(const IpAddress& address, char* out, unsigned size) {
  if (size == 0) {
    return;
  }
  if (::inet_ntop(address.v6 ? AF_INET6 : AF_INET, address.bytes.data(), out, size) == nullptr) {
    out[0] = '\0';
  }
}

}  // namespace capture
