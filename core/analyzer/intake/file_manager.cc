#include "core/analyzer/intake/file_manager.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <new>
#include <string>

#include "core/analyzer/intake/common.h"
#include "core/config/cconfig.h"
#include "core/runtime/clog.h"
#include "framework/atomic_file.h"
#include "framework/file_io.h"
#include "framework/status.h"
#include "framework/trace.h"

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
  std::string image;
  for (_LAST_FILE_INFO* record = list; record != nullptr; record = record->next) {
    record->recordType = persistRecordType;
    const LastFileInfoBytes bytes = encodeLastFileInfo(*record);
    image.append(reinterpret_cast<const char*>(bytes.data()), bytes.size());
  }
  // Replaced whole, never rewritten in place: a crash or a power cut while saving leaves the
  // previous record, from which the next start resumes, rather than an empty file.
  fw::ReplaceResult result;
  // A fixed temporary name: what a crash left behind is overwritten by the next save.
  if (fw::ReplaceFile(path, image, {0600, std::string(path) + ".tmp"}, &result) == fw::kOk) {
    return true;
  }
  switch (result.failed) {
    case fw::ReplaceStep::kCreate:
      CLOG::error("ERROR opening persist file[%s] errno[%d]", path, result.error_number);
      break;
    case fw::ReplaceStep::kWrite:
      CLOG::error("\aERROR: Failed[%d] to write [%d] bytes", result.error_number,
                  kLastFileInfoRecordSize);
      break;
    default:
      CLOG::error("ERROR failed[%d] to close persist file, handle[%d]", result.error_number, -1);
  }
  return false;
}

_LAST_FILE_INFO* CFileManager::getLastProcessedFile() {
  static const char* const kWhere = "CFileManager::getLastProcessedFile()";
  char path[kPersistSpecSize];
  if (!getPersistFileSpec(path, sizeof(path))) {
    CLOG::error("%s \aERROR, failed to get the persist file spec", kWhere);
    return nullptr;
  }
  fw::UniqueFd fd(::open(path, O_RDONLY | O_CLOEXEC));
  if (!fd.valid()) {
    // No file yet is every first start's normal case, not a failure.
    const int error = errno;
    fw::TracePrintfAlways("analyzer", error == ENOENT ? fw::kTraceInfo : fw::kTraceError, "",
                          "%s Failed[%d] to open the persist file[%s]", kWhere, error, path);
    return nullptr;
  }
  CLOG::max("%s Opened the persist file [%s]", kWhere, path);
  _LAST_FILE_INFO* list = nullptr;
  for (off_t at = 0;; at += kLastFileInfoRecordSize) {
    LastFileInfoBytes bytes{};
    const long got = static_cast<long>(fw::ReadAt(fd.get(), bytes.data(), bytes.size(), at));
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
