#include "core/analyzer/file_manager.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <new>

#include "core/analyzer/common.h"
#include "core/runtime/clog.h"
#include "tama/cconfig.h"

namespace {

// Closes a descriptor on every path out of a persist-file read.
class FileDescriptor {
 public:
  explicit FileDescriptor(int fd) : fd(fd) {}
  ~FileDescriptor() {
    if (fd >= 0) {
      ::close(fd);
    }
  }
  FileDescriptor(const FileDescriptor&) = delete;
  FileDescriptor& operator=(const FileDescriptor&) = delete;
  int get() const { return fd; }
  // Closes now and returns close's result; the destructor then does nothing.
  int release() {
    const int result = ::close(fd);
    fd = -1;
    return result;
  }

 private:
  int fd;
};

// Reads up to size bytes, retrying interrupted and partial reads; the count read.
long readFully(int fd, unsigned char* buffer, long size) {
  long total = 0;
  while (total < size) {
    const ssize_t n = ::read(fd, buffer + total, static_cast<size_t>(size - total));
    if (n < 0 && errno == EINTR) {
      continue;
    }
    if (n <= 0) {
      break;
    }
    total += n;
  }
  return total;
}

}  // namespace

CFileManager::CFileManager(const char* threadName) : CvelThread(threadName) {
  setDirToWatch(CConfig::getDpxDataDirectory());
}

CFileManager::~CFileManager() = default;

void CFileManager::Shutdown() {
  stopRequested.store(true);
}

_FILE_INFO_LL* CFileManager::findFiles(const char* pattern) {
  return CCommon::findFiles(dirToWatch, pattern);
}

void CFileManager::deleteFoundFiles(_FILE_INFO_LL* list) {
  CCommon::deleteFoundFiles(list);
}

void CFileManager::setExcludeOutlierSeconds(int seconds) {
  // The 32-bit wrap of seconds x 1000 is intended; compute it without signed overflow.
  excludeOutlierMillis = static_cast<int>(static_cast<uint32_t>(seconds) * 1000u);
}

void CFileManager::setDirToWatch(const char* dir) {
  const size_t length = dir != nullptr ? strnlen(dir, kFileInfoMaxPath) : 0;
  std::memcpy(dirToWatch, dir != nullptr ? dir : "", length);
  dirToWatch[length] = '\0';
}

bool CFileManager::persistLastProcessedFile(_LAST_FILE_INFO* list) {
  static const char* const kWhere = "CFileManager::persistLastProcessedFile()";
  char path[kPersistSpecSize];
  if (!getPersistFileSpec(path, sizeof(path))) {
    CLOG::error("%s \aERROR: getPersistFileSpec returned false", kWhere);
    return false;
  }
  CLOG::max("%s Need to persist to [%s] that the last file was[%s] and offset[%ld]", kWhere, path,
            list != nullptr ? list->fileName : "",
            list != nullptr ? static_cast<long>(list->fullOffset()) : 0L);
  FileDescriptor fd(::open(path, O_RDWR | O_CREAT | O_TRUNC, 0600));
  if (fd.get() < 0) {
    CLOG::error("ERROR opening persist file[%s] errno[%d]", path, errno);
    return false;
  }
  bool ok = true;
  for (_LAST_FILE_INFO* record = list; record != nullptr; record = record->next) {
    record->recordType = persistRecordType;
    const LastFileInfoBytes bytes = encodeLastFileInfo(*record);
    const ssize_t written = ::write(fd.get(), bytes.data(), bytes.size());
    if (written != static_cast<ssize_t>(bytes.size())) {
      CLOG::error("\aERROR: Failed[%d] to write [%d] bytes", static_cast<int>(written),
                  kLastFileInfoRecordSize);
      ok = false;
      break;
    }
  }
  // The next start resumes from this record: make it survive a power cut.
  ::fsync(fd.get());
  const int handle = fd.get();
  if (fd.release() != 0) {
    CLOG::error("ERROR failed[%d] to close persist file, handle[%d]", errno, handle);
    ok = false;
  }
  return ok;
}

_LAST_FILE_INFO* CFileManager::getLastProcessedFile() {
  static const char* const kWhere = "CFileManager::getLastProcessedFile()";
  char path[kPersistSpecSize];
  if (!getPersistFileSpec(path, sizeof(path))) {
    CLOG::error("%s \aERROR, failed to get the persist file spec", kWhere);
    return nullptr;
  }
  FileDescriptor fd(::open(path, O_RDONLY));
  if (fd.get() < 0) {
    CLOG::error("%s Failed[%d] to open the persist file[%s]", kWhere, errno, path);
    return nullptr;
  }
  CLOG::max("%s Opened the persist file [%s]", kWhere, path);
  _LAST_FILE_INFO* list = nullptr;
  for (;;) {
    LastFileInfoBytes bytes{};
    const long got = readFully(fd.get(), bytes.data(), kLastFileInfoRecordSize);
    if (got < kLastFileInfoRecordSize) {
      CLOG::max(
          "%s read of [%d] bytes failed, only read in [%d].  May be because of end of file "
          "and not an error.",
          kWhere, kLastFileInfoRecordSize, static_cast<int>(got));
      break;
    }
    auto* record = new (std::nothrow) _LAST_FILE_INFO;
    if (record == nullptr) {
      CLOG::error("%s malloc failed for [%d] bytes", kWhere,
                  static_cast<int>(sizeof(_LAST_FILE_INFO)));
      freeLastProcessedFile(list);
      return nullptr;
    }
    decodeLastFileInfo(bytes, record);
    CLOG::max("%s Read in %d bytes for record for [%s][%ld]", kWhere, static_cast<int>(got),
              record->fileName, static_cast<long>(record->fullOffset()));
    record->next = list;  // the last record of the file comes first
    list = record;
  }
  return list;
}
