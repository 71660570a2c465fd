#include "core/analyzer/intake/dpx_file_manager.h"

#include <sys/stat.h>

#include <cstdio>
#include <cstring>
#include <string>

#include "core/analyzer/intake/common.h"
#include "core/analyzer/intake/dpx_data_file_monitor.h"
#include "core/config/cconfig.h"
#include "core/runtime/clog.h"
#include "core/runtime/misc.h"
#include "core/runtime/set_aside.h"

namespace {

constexpr unsigned long kSummaryFlag = 2;
constexpr unsigned long kFlowFlag = 64;
constexpr unsigned long kPollMillis = 5000;
constexpr int kFinishWaitSeconds = 30;
constexpr const char* kPersistName = "DPXLastFile";
constexpr const char* kPattern = "*.sm3";

}  // namespace

CDPXFileManager::CDPXFileManager() : CFileManager("DPXFileManager") {
  objectInit();
}

CDPXFileManager::~CDPXFileManager() {
  // Normally Shutdown has stopped everything; never leave a monitor thread behind.
  if (currentMonitor) {
    currentMonitor->Shutdown();
    currentMonitor->Join();
  }
}

void CDPXFileManager::objectInit() {
  _LAST_FILE_INFO* list = getLastProcessedFile();
  // A record of another type, or a file holding no whole record, is not a position this agent
  // wrote: resuming from it would skip or repeat records at random.
  char path[kPersistSpecSize];
  long long size = 0;
  if (getPersistFileSpec(path, sizeof(path)) && CMisc::getFileSize64(path, &size) && size > 0) {
    if (list == nullptr) {
      SetAsideTraced("Last processed file record", path, "no whole record");
    } else if (list->recordType != 1) {
      SetAsideTraced("Last processed file record", path,
                     "record type " + std::to_string(list->recordType) + ", not 1");
      freeLastProcessedFile(list);
      list = nullptr;
    }
  }
  if (list != nullptr) {
    CLOG::min("Found last processed file of [%s] offset[%lu] offsetHigh[%lu]", list->fileName,
              static_cast<unsigned long>(list->offset),
              static_cast<unsigned long>(list->offsetHigh));
    setLastProcessed(list->fileName, list->fullOffset());
  } else {
    CLOG::min("Found NO last processed file info");
    setLastProcessed("", 0);
  }
  freeLastProcessedFile(list);
}

bool CDPXFileManager::getPersistFileSpec(char* buffer, int size) {
  const char* const dir = CConfig::getDpxOdiDataDirectory();
  if (static_cast<long>(std::strlen(dir)) + 12 > size) {
    return false;
  }
  std::snprintf(buffer, static_cast<size_t>(size), "%s%s", dir, kPersistName);
  return true;
}

void CDPXFileManager::resumeAt(const char* file, long long offset, uint64_t device,
                               uint64_t inode) {
  CLOG::min("%s Resuming at the checkpoint's file [%s] offset[%lld]", "CDPXFileManager::resumeAt",
            file, offset);
  setLastProcessed(file, offset);
  resumeFile = lastProcessedFile;
  resumeDevice = device;
  resumeInode = inode;
}

void CDPXFileManager::setLastProcessed(const char* file, long long offset) {
  lastProcessedFile.assign(file, strnlen(file, kFileInfoMaxPath));
  lastProcessedOffset = offset;
}

void CDPXFileManager::noteNewest(const _FILE_INFO_LL* list) {
  while (list != nullptr && list->next != nullptr) {
    list = list->next;
  }
  struct stat st {};
  if (list == nullptr || ::stat(list->fileName, &st) != 0) {
    listedFile.clear();
    return;
  }
  listedFile = list->fileName;
  listedDevice = static_cast<uint64_t>(st.st_dev);
  listedInode = static_cast<uint64_t>(st.st_ino);
}

void CDPXFileManager::startANewMonitor() {
  CLOG::min("%s Starting a new monitor for [%s] at offset[%lld]",
            "CDPXFileManager::startANewMonitor", lastProcessedFile.c_str(), lastProcessedOffset);
  currentMonitor =
      std::make_unique<CDPXDataFileMonitor>(lastProcessedFile.c_str(), lastProcessedOffset);
  currentMonitor->setExcludeOutlierMillis(getExcludeOutlierMillis());
  if (!resumeFile.empty() && resumeFile == lastProcessedFile && lastProcessedOffset > 0) {
    currentMonitor->setReadIdentity(resumeDevice, resumeInode);
  } else if (listedFile == lastProcessedFile) {
    // The file as listed: renamed before the monitor's first read (reading older files can
    // take a while), it is found again by identity rather than skipped.
    currentMonitor->setReadIdentity(listedDevice, listedInode);
  }
  resumeFile.clear();
  currentMonitor->setSink(getSink());
  CLOG::min("%s Start processing [%s]", "CDPXFileManager::startANewMonitor",
            lastProcessedFile.c_str());
  currentMonitor->Start();
}

void CDPXFileManager::stopCurrentMonitor(bool finishFile) {
  if (finishFile) {
    currentMonitor->setStatic();
    currentMonitor->waitUntilFinished(kFinishWaitSeconds);
    currentMonitor->Shutdown();
    currentMonitor->Join();
  } else {
    CLOG::min("Telling current monitor to shutdown");
    currentMonitor->Shutdown();
    CLOG::min("Joining on current monitor");
    currentMonitor->Join();
    CLOG::min("Joined  on current monitor");
  }
  // The monitor tails the last processed file: persist where it really stopped, not where it
  // started, or a restart would read the file again.
  lastProcessedOffset = currentMonitor->getLastProcessedOffset();
  currentMonitor.reset();
}

_FILE_INFO_LL* CDPXFileManager::processOlderFiles(_FILE_INFO_LL* list) {
  const bool haveLast = !lastProcessedFile.empty();
  bool interrupted = false;
  while (list != nullptr && list->next != nullptr) {
    _FILE_INFO_LL* const older = list;
    list = older->next;
    older->next = nullptr;
    const bool isLast = haveLast && lastProcessedFile == older->fileName;
    if (!interrupted &&
        (!haveLast || !CCommon::newerFile(lastProcessedFile.c_str(), older->fileName))) {
      const long long offset = isLast ? lastProcessedOffset : 0;
      // The outlier limit applies here too: whether a record counts must not depend on which
      // files the first listing happened to find together.
      const std::unique_ptr<CDPXDataFileMonitor> finished = CDPXDataFileMonitor::processStatically(
          older->fileName, offset, getExcludeOutlierMillis(), getSink());
      if (finished->wasInterrupted()) {
        // Shutting down in the middle of the backlog: resume here next time, and leave the
        // newer files to be read from 0 then.
        setLastProcessed(older->fileName, finished->getLastProcessedOffset());
        interrupted = true;
      }
    }
    deleteFoundFiles(older);
  }
  if (list != nullptr && !interrupted && lastProcessedFile != list->fileName) {
    setLastProcessed(list->fileName, 0);
  }
  return list;
}

void CDPXFileManager::Run() {
  static const char* const kWhere = "CDPXFileManager::Run()";
  setExcludeOutlierMillis(CConfig::getExcludeOutlierMillis());
  CLOG::max("%s Set exclude outlier millis to [%ld]", kWhere,
            static_cast<long>(getExcludeOutlierMillis()));
  bool firstPass = true;
  bool stopNoted = false;
  for (;;) {
    CLOG::trace(kFlowFlag, "%s Look for a new file at[%s]", kWhere, getDirToWatch());
    _FILE_INFO_LL* list = findFiles(kPattern);
    if (list == nullptr) {
      if (isStopRequested()) {
        stopNoted = true;
      }
      CLOG::trace(kSummaryFlag, "%s None found", kWhere);
    } else {
      list = CCommon::sortFilesByName(list);
      noteNewest(list);
      if (firstPass) {
        firstPass = false;
        list = processOlderFiles(list);
      }
      for (const _FILE_INFO_LL* node = list; node != nullptr; node = node->next) {
        if (isStopRequested()) {
          if (currentMonitor) {
            stopCurrentMonitor(false);
          }
          stopNoted = true;
        } else if (!currentMonitor) {
          if (lastProcessedFile.empty()) {
            setLastProcessed(node->fileName, 0);
          }
          startANewMonitor();
        } else if (CCommon::newerFile(node->fileName, lastProcessedFile.c_str())) {
          CLOG::trace(kFlowFlag, "Must be a rollover");
          stopCurrentMonitor(true);
          setLastProcessed(node->fileName, 0);
          startANewMonitor();
        }
      }
      deleteFoundFiles(list);
    }
    CMisc::napWhileBoolFalse(kPollMillis, stopFlag(),
                             [this](unsigned long ms) { getClock().sleep(ms); });
    if (isStopRequested() && stopNoted) {
      if (currentMonitor) {
        CLOG::min("%s We had a current monitor and last offset is [%lld]", kWhere,
                  currentMonitor->getLastProcessedOffset());
        lastProcessedOffset = currentMonitor->getLastProcessedOffset();
      }
      setShutdownComplete(true);
      return;
    }
  }
}

void CDPXFileManager::Shutdown() {
  static const char* const kWhere = "CDPXFileManager::Shutdown()";
  CFileManager::Shutdown();
  // An unstarted thread waits for Start; there is nothing to join then.
  if (GetState() != kStateCreated) {
    CLOG::min("%s Joining on the file manager thread", kWhere);
    Join();
    CLOG::min("%s Joined on the file manager thread", kWhere);
  }
  if (currentMonitor) {
    stopCurrentMonitor(false);
  }
  auto record = std::make_unique<_LAST_FILE_INFO>();
  std::memcpy(record->fileName, lastProcessedFile.data(), lastProcessedFile.size());
  record->setFullOffset(lastProcessedOffset);
  if (!persistLastProcessedFile(record.get())) {
    CLOG::min("%s Failed to persist the last processed file [%s] offset[%lld]", kWhere,
              lastProcessedFile.c_str(), lastProcessedOffset);
  } else {
    CLOG::max("%s Persisted the last processed file [%s] offset[%lld]", kWhere,
              lastProcessedFile.c_str(), lastProcessedOffset);
  }
}
