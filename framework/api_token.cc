#include "framework/api_token.h"

#include <fcntl.h>
#include <sys/random.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <fstream>
#include <iterator>

#include "framework/status.h"

namespace fw {
namespace {

constexpr std::size_t kTokenBytes = 32;

std::string Trimmed(const std::string& text) {
  const auto first = text.find_first_not_of(" \t\r\n");
  if (first == std::string::npos) {
    return "";
  }
  const auto last = text.find_last_not_of(" \t\r\n");
  return text.substr(first, last - first + 1);
}

bool RandomHex(std::string* out) {
  unsigned char bytes[kTokenBytes];
  std::size_t got = 0;
  while (got < sizeof(bytes)) {
    const ssize_t n = ::getrandom(bytes + got, sizeof(bytes) - got, 0);
    if (n < 0 && errno == EINTR) {
      continue;
    }
    if (n <= 0) {
      return false;
    }
    got += static_cast<std::size_t>(n);
  }
  static const char kHex[] = "0123456789abcdef";
  out->clear();
  for (const unsigned char b : bytes) {
    out->push_back(kHex[b >> 4]);
    out->push_back(kHex[b & 0x0f]);
  }
  return true;
}

}  // namespace

int LoadOrCreateApiToken(const std::string& path, std::string* token, std::string* error) {
  std::string fresh;
  if (!RandomHex(&fresh)) {
    *error = std::string("no random bytes for an API token: ") + std::strerror(errno);
    return kIoError;
  }
  // O_EXCL: an existing token is never overwritten, even by two agents starting at once.
  const int fd = ::open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL, 0600);
  if (fd >= 0) {
    const std::string line = fresh + "\n";
    const bool ok = ::write(fd, line.data(), line.size()) == static_cast<ssize_t>(line.size());
    if (::close(fd) != 0 || !ok) {
      *error = "cannot write the API token to " + path + ": " + std::strerror(errno);
      ::unlink(path.c_str());
      return kIoError;
    }
  } else if (errno != EEXIST) {
    *error = "cannot create the API token file " + path + ": " + std::strerror(errno);
    return kIoError;
  }
  std::ifstream in(path, std::ios::binary);
  if (!in) {
    *error = "cannot read the API token file " + path + ": " + std::strerror(errno);
    return kIoError;
  }
  *token = Trimmed(std::string((std::istreambuf_iterator<char>(in)), {}));
  if (token->empty()) {
    *error = "the API token file " + path + " is empty";
    return kIoError;
  }
  return kOk;
}

bool IsLoopbackHost(std::string_view host) {
  if (host.size() >= 2 && host.front() == '[' && host.back() == ']') {
    host = host.substr(1, host.size() - 2);
  }
  return host == "localhost" || host == "::1" || host.substr(0, 4) == "127.";
}

bool BearerMatches(std::string_view header, std::string_view token) {
  constexpr std::string_view kScheme = "Bearer ";
  if (token.empty() || header.size() != kScheme.size() + token.size() ||
      header.substr(0, kScheme.size()) != kScheme) {
    return false;
  }
  const std::string_view given = header.substr(kScheme.size());
  unsigned char difference = 0;
  for (std::size_t i = 0; i < token.size(); ++i) {
    difference |= static_cast<unsigned char>(given[i] ^ token[i]);
  }
  return difference == 0;
}

}  // namespace fw
