#include "core/runtime/misc.h"

#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstring>
#include <thread>

#include "core/runtime/paths.h"

namespace {

constexpr unsigned long kNapStepMs = 200;
// Room for 4097 characters of path and the terminator.
constexpr std::size_t kMkdirsBufferSize = 4098;

// Creates one level unless it is already a directory. A concurrent creator winning the race
// counts as success. Keeps errno of the failed mkdir for the caller.
bool EnsureDirectory(const char* path) {
  if (dirExists(path)) {
    return true;
  }
  if (::mkdir(path, 0755) == 0) {
    return true;
  }
  int saved = errno;
  if (dirExists(path)) {
    return true;
  }
  errno = saved;
  return false;
}

}  // namespace

void CMisc::sleep(unsigned long ms) {
  std::this_thread::sleep_for(std::chrono::microseconds(ms * 1000));
}

void CMisc::napWhileBoolFalse(unsigned long ms, const std::atomic<bool>* stop) {
  napWhileBoolFalse(ms, stop, [](unsigned long step) { CMisc::sleep(step); });
}

void CMisc::napWhileBoolFalse(unsigned long ms, const std::atomic<bool>* stop,
                              const std::function<void(unsigned long)>& sleeper) {
  if (ms % kNapStepMs != 0) {
    sleeper(ms % kNapStepMs);
  }
  for (unsigned long step = 0; step < ms / kNapStepMs; ++step) {
    if (stop != nullptr && stop->load()) {
      return;
    }
    sleeper(kNapStepMs);
  }
}

int CMisc::mkdir(const char* path, int mode) {
  return ::mkdir(path, static_cast<mode_t>(mode));
}

int CMisc::mkdirs(const char* path) {
  if (path == nullptr) {
    return 1;
  }
  char buffer[kMkdirsBufferSize];
  std::strncpy(buffer, path, kMkdirsBufferSize - 1);
  buffer[kMkdirsBufferSize - 1] = '\0';
  makeNativePath(buffer);
  std::size_t len = std::strlen(buffer);
  if (len > 1 && buffer[len - 1] == '/') {
    buffer[len - 1] = '\0';
  }
  if (buffer[0] == '\0') {
    return 1;
  }
  if (dirExists(buffer)) {
    return 0;
  }
  // Cut the path at each separator in turn, creating every prefix that is missing.
  char* cursor = buffer[0] == '/' ? buffer + 1 : buffer;
  while (char* sep = std::strchr(cursor, '/')) {
    *sep = '\0';
    bool made = EnsureDirectory(buffer);
    *sep = '/';
    if (!made) {
      return 1;
    }
    cursor = sep + 1;
  }
  return EnsureDirectory(buffer) ? 0 : 1;
}

int CMisc::truncateFile(const char* path, unsigned long length) {
  if (path == nullptr) {
    return 1;
  }
  return ::truncate(path, static_cast<off_t>(length)) == 0 ? 0 : 2;
}

bool CMisc::getFileSize64(const char* path, long long* size) {
  struct stat st;
  if (path == nullptr || size == nullptr || ::stat(path, &st) != 0) {
    return false;
  }
  *size = static_cast<long long>(st.st_size);
  return true;
}
