#include "core/analyzer/intake/data_file_monitor.h"

#include <sys/stat.h>

#include <cerrno>
#include <cstdio>
#include <new>

#include "core/analyzer/intake/sm3_framing.h"
#include "core/runtime/clog.h"
#include "core/runtime/misc.h"

namespace {

// Closes a FILE* on every path out of a read.
struct FileCloser {
  void operator()(FILE* f) const {
    if (std::fclose(f) != 0) {
      CLOG::error("%s ERROR: Closing of the successfully open file failed[%d]\n",
                  "getNewFileContents", errno);
    }
  }
};

}  // namespace

CDataFileMonitor::CDataFileMonitor(const char* name, const char* file) : CvelThread(name) {
  objectInit(file);
}

CDataFileMonitor::~CDataFileMonitor() = default;

void CDataFileMonitor::objectInit(const char* f) {
  shutdownRequested.store(false);
  lastProcessedOffset.store(0);
  readToOffset.store(0);
  file = f != nullptr ? f : "";
  excludeOutlierMillis = -1;
}

void CDataFileMonitor::Shutdown() {
  shutdownRequested.store(true);
}

bool CDataFileMonitor::anyUpdates() {
  long long size = 0;
  return CMisc::getFileSize64(file.c_str(), &size) && size > readToOffset.load() + 1;
}

void CDataFileMonitor::setLastProcessedOffset(long long offset) {
  lastProcessedOffset.store(offset);
  readToOffset.store(offset);
}

bool CDataFileMonitor::identityChanged() const {
  struct stat st {};
  return readInode != 0 && ::stat(file.c_str(), &st) == 0 &&
         (static_cast<uint64_t>(st.st_dev) != readDevice ||
          static_cast<uint64_t>(st.st_ino) != readInode);
}

std::unique_ptr<char[]> CDataFileMonitor::getNewFileContents(long* length, long long* newOffset) {
  static const char* const kWhere = "getNewFileContents";
  long long size = 0;
  if (!CMisc::getFileSize64(file.c_str(), &size)) {
    CLOG::error("%s ERROR: stat of file[%s] failed[%d]\n", kWhere, file.c_str(), errno);
    return nullptr;
  }
  const long long offset = lastProcessedOffset.load();
  if (size < offset) {
    // The message's "%ul" prints the 32-bit value followed by an 'l'.
    CLOG::error("%s ERROR: offset [%ul] invalid, filesize only [%ul].", kWhere,
                static_cast<unsigned>(offset), static_cast<unsigned>(size));
    return nullptr;
  }
  long count = 0;
  long long end = 0;
  if (size - offset > MAX_BUFFER) {
    count = MAX_BUFFER;
    end = offset + MAX_BUFFER;
  } else {
    count = static_cast<long>(size - offset);
    end = size;
  }
  std::unique_ptr<char[]> buffer(new (std::nothrow) char[count + 1]);
  if (!buffer) {
    CLOG::error("%s ERROR: Failed to allocate a buffer to read in the file contents of size[%ld]\n",
                kWhere, count);
    return nullptr;
  }
  // "rb+": the data file must be writable by the agent, as the collector's installation sets it.
  std::unique_ptr<FILE, FileCloser> in(std::fopen(file.c_str(), "rb+"));
  if (!in) {
    CLOG::error("%s ERROR: Open of file[%s] failed[%d]\n", kWhere, file.c_str(), errno);
    return nullptr;
  }
  struct stat identity {};
  if (::fstat(fileno(in.get()), &identity) == 0) {
    const auto device = static_cast<uint64_t>(identity.st_dev);
    const auto inode = static_cast<uint64_t>(identity.st_ino);
    if (readInode != 0 && (device != readDevice || inode != readInode)) {
      // Renamed between the size check and the open: the offset belongs to the old file.
      CLOG::med("%s [%s] is no longer the file read so far; not read", kWhere, file.c_str());
      return nullptr;
    }
    readDevice = device;
    readInode = inode;
  }
  if (fseeko(in.get(), static_cast<off_t>(offset), SEEK_SET) != 0) {
    CLOG::error("%s fseek to offset[%lld] failed errno[%d]", kWhere, offset, errno);
    return nullptr;
  }
  const long got =
      static_cast<long>(std::fread(buffer.get(), 1, static_cast<size_t>(count), in.get()));
  if (got != count) {
    CLOG::error(
        "%s ERROR: Read from file failed, attempted to read in [%ld] bytes and only read in [%ld] "
        "bytes\n",
        kWhere, count, got);
    return nullptr;
  }
  buffer[count] = '\0';
  *length = count;
  *newOffset = end;
  readToOffset.store(end);
  return buffer;
}
