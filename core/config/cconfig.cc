#include "core/config/cconfig.h"

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <string>
#include <string_view>

#include "core/runtime/clog.h"
#include "core/runtime/misc.h"
#include "core/runtime/paths.h"
#include "framework/trace.h"

int CConfig::VOverTimeInterval = CConfig::kDefaultOverTimeInterval;
int CConfig::VSummaryInterval = CConfig::kDefaultSummaryInterval;
int CConfig::VCheckpointSeconds = CConfig::kDefaultCheckpointSeconds;
int CConfig::VMetricsMaxSeries = CConfig::kDefaultMetricsMaxSeries;
int CConfig::VExcludeOutlierMillis = CConfig::kNoOutlierLimit;
int CConfig::VMaxThreads = CConfig::kDefaultMaxThreads;
bool CConfig::VReportZeroRecords = false;

char CConfig::baseDirectory[kDirSize] = {};
char CConfig::logDirectory[kDirSize] = {};
char CConfig::odiDataDirectory[kDirSize] = {};
char CConfig::armDataDirectory[kDirSize] = {};
char CConfig::dpxDataDirectory[kDirSize] = {};
char CConfig::lynDataDirectory[kDirSize] = {};
char CConfig::dpxOdiDataDirectory[kDirSize] = {};
char CConfig::armOdiDataDirectory[kDirSize] = {};
char CConfig::lynOdiDataDirectory[kDirSize] = {};

namespace {

constexpr const char* kUnit = "tama";
// Log level of the directory messages; also the summary class when CLOG tests it as a mask.
constexpr unsigned long kDirLogLevel = 2;

// Stores the concatenation, cut to kDirSize - 1 characters.
void StoreText(char (&dest)[CConfig::kDirSize], std::string_view a, std::string_view b = {},
               std::string_view c = {}) {
  std::string joined;
  joined.reserve(a.size() + b.size() + c.size());
  joined.append(a).append(b).append(c);
  std::size_t n = std::min(joined.size(), CConfig::kDirSize - 1);
  std::memcpy(dest, joined.data(), n);
  dest[n] = '\0';
}

// Creates one directory when it is missing. Start-up goes on either way, so a failure is
// only traced.
void CreateIfMissing(const char* dir) {
  if (dirExists(dir)) {
    return;
  }
  if (CMisc::mkdir(dir, 0755) != 0) {
    Q7_TRACE(kUnit, fw::kTraceError, "Could not create directory %s: %s", dir,
             std::strerror(errno));
  }
}

}  // namespace

void CConfig::setBaseDirectory(const char* base) {
  if (base == nullptr) {
    return;
  }
  StoreText(baseDirectory, base);
  // On a first start the framework home exists but the base under it does not.
  CreateIfMissing(baseDirectory);

  StoreText(logDirectory, baseDirectory, "/logs/");
  CreateIfMissing(logDirectory);
  CLOG::trace(kDirLogLevel, "Base dir=%s\n", baseDirectory);

  StoreText(odiDataDirectory, baseDirectory, "/odi");
  CreateIfMissing(odiDataDirectory);

  // The ARM data directory passes through each level so that every parent exists.
  StoreText(armDataDirectory, baseDirectory, "/arm");
  CreateIfMissing(armDataDirectory);
  StoreText(armDataDirectory, baseDirectory, "/arm/log");
  CreateIfMissing(armDataDirectory);
  const char* collector = std::getenv("OXA_COLLECTOR");
  StoreText(armDataDirectory, baseDirectory, "/arm/log/", collector != nullptr ? collector : "lyn");
  CreateIfMissing(armDataDirectory);
  CLOG::trace(kDirLogLevel, "ARM data dir=%s\n", armDataDirectory);

  char arm_delete[kDirSize];
  StoreText(arm_delete, armDataDirectory, "/delete");
  CreateIfMissing(arm_delete);
  CLOG::trace(kDirLogLevel, "ARM data delete dir=%s\n", arm_delete);

  StoreText(dpxOdiDataDirectory, odiDataDirectory, "/dpx/");
  CreateIfMissing(dpxOdiDataDirectory);
  CLOG::trace(kDirLogLevel, "DPX ODI dir=%s\n", dpxOdiDataDirectory);

  StoreText(lynOdiDataDirectory, odiDataDirectory, "/lyn/");
  CreateIfMissing(lynOdiDataDirectory);
  CLOG::trace(kDirLogLevel, "LYN ODI dir=%s\n", lynOdiDataDirectory);

  StoreText(armOdiDataDirectory, odiDataDirectory, "/arm/");
  CreateIfMissing(armOdiDataDirectory);
  CLOG::trace(kDirLogLevel, "ARM ODI dir=%s\n", armOdiDataDirectory);

  StoreText(lynDataDirectory, baseDirectory, "/", "lyn/Mgmt/Log");
  if (!dirExists(lynDataDirectory) && CMisc::mkdirs(lynDataDirectory) != 0) {
    Q7_TRACE(kUnit, fw::kTraceError, "Could not create directory %s: %s", lynDataDirectory,
             std::strerror(errno));
  }
  CLOG::trace(kDirLogLevel, "LYN data dir=[%s]\n", lynDataDirectory);
}

void CConfig::setDpxDataDirectory(const char* dir) {
  if (dir == nullptr) {
    return;
  }
  StoreText(dpxDataDirectory, dir);
  if (dpxDataDirectory[0] == '\0') {
    // Nothing to create; say plainly why no collector data will arrive.
    Q7_TRACE(kUnit, fw::kTraceError,
             "No collector data directory: KQ7DPXLOGPATH is not set in the configuration file");
  } else {
    CreateIfMissing(dpxDataDirectory);
  }
  CLOG::trace(kDirLogLevel, "DPX data dir=%s\n", dpxDataDirectory);
}

void CConfig::setArmDataDirectory(const char* dir) {
  if (dir != nullptr) {
    StoreText(armDataDirectory, dir);
  }
}

void CConfig::setLynDataDirectory(const char* dir) {
  if (dir != nullptr) {
    StoreText(lynDataDirectory, dir);
  }
}

void CConfig::setOdiDataDirectory(const char* dir) {
  if (dir != nullptr) {
    StoreText(odiDataDirectory, dir);
  }
}

void CConfig::setOverTimeInterval(int minutes) {
  VOverTimeInterval = minutes;
  if (minutes == 0) {
    CLOG::error("Invalid Overtime Interval %d", minutes);
    VOverTimeInterval = kDefaultOverTimeInterval;
  }
  CLOG::min("Overtime Interval set to %d", VOverTimeInterval);
}

void CConfig::setCheckpointSeconds(int seconds) {
  VCheckpointSeconds = seconds;
  if (seconds < 0) {
    CLOG::error("Invalid checkpoint interval %d", seconds);
    VCheckpointSeconds = kDefaultCheckpointSeconds;
  }
  CLOG::min("Checkpoint interval set to %d seconds%s", VCheckpointSeconds,
            VCheckpointSeconds == 0 ? " (checkpoints off)" : "");
}

void CConfig::setMetricsMaxSeries(int series) {
  VMetricsMaxSeries = series;
  if (series < 1) {
    CLOG::error("Invalid metrics series limit %d", series);
    VMetricsMaxSeries = kDefaultMetricsMaxSeries;
  }
}

void CConfig::setSummaryInterval(int hours) {
  VSummaryInterval = hours;
  if (hours == 0) {
    // The over-time text is reused here deliberately.
    CLOG::error("Invalid Overtime Interval %d", hours);
    VSummaryInterval = kDefaultSummaryInterval;
  }
  CLOG::min("Summary Interval set to %d", VSummaryInterval);
}

void CConfig::setMaxThreads(int n) {
  VMaxThreads = n;
  if (n == 0) {
    CLOG::error("Invalid Max Threads %d", n);
    VMaxThreads = kDefaultMaxThreads;
  }
  CLOG::min("Max Threads set to %d", VMaxThreads);
}

void CConfig::setExcludeOutlierSeconds(int seconds) {
  constexpr int kLargestExactSeconds = 2147483;
  if (seconds > kLargestExactSeconds) {
    seconds = 2147483647;
  }
  // Large values keep their 32-bit wrap-around; unsigned arithmetic computes it without
  // signed overflow.
  VExcludeOutlierMillis = static_cast<int>(static_cast<std::uint32_t>(seconds) * 1000u);
}

void CConfig::resetForTesting() {
  VOverTimeInterval = kDefaultOverTimeInterval;
  VSummaryInterval = kDefaultSummaryInterval;
  VExcludeOutlierMillis = kNoOutlierLimit;
  VMaxThreads = kDefaultMaxThreads;
  VReportZeroRecords = false;
  VCheckpointSeconds = kDefaultCheckpointSeconds;
  VMetricsMaxSeries = kDefaultMetricsMaxSeries;
  for (char* dir :
       {baseDirectory, logDirectory, odiDataDirectory, armDataDirectory, dpxDataDirectory,
        lynDataDirectory, dpxOdiDataDirectory, armOdiDataDirectory, lynOdiDataDirectory}) {
    dir[0] = '\0';
  }
}
