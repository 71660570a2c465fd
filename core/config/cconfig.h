#pragma once

// CConfig: the process-wide typed settings of the agent (directories, interval lengths, the
// outlier limit, the zero-records switch). Static members only: there is one set per process.
//
// Thread safety: every setter runs on the main thread during start-up, before the analyzer and
// the other worker threads start; afterwards the values are read-only and readers on any thread
// take no lock. Directory getters return pointers to static buffers that live for the process.

#include <cstddef>

class CConfig {
 public:
  CConfig() = delete;

  static constexpr std::size_t kDirSize = 4096;
  static constexpr int kDefaultOverTimeInterval = 5;  // minutes
  static constexpr int kDefaultSummaryInterval = 24;  // hours
  static constexpr int kDefaultMaxThreads = 40;
  static constexpr int kNoOutlierLimit = -1;
  static constexpr int kDefaultCheckpointSeconds = 10;
  static constexpr int kDefaultMetricsMaxSeries = 2000;

  static int getOverTimeInterval() { return VOverTimeInterval; }
  static long getOverTimeIntervalSeconds() { return static_cast<long>(VOverTimeInterval) * 60; }
  static int getSummaryInterval() { return VSummaryInterval; }
  static int getExcludeOutlierMillis() { return VExcludeOutlierMillis; }
  static int getMaxThreads() { return VMaxThreads; }
  static bool getReportZeroRecords() { return VReportZeroRecords; }
  // Seconds between the analyzer's checkpoints; 0: none are taken or read.
  static int getCheckpointSeconds() { return VCheckpointSeconds; }
  // The most application/transaction series /metrics keeps.
  static int getMetricsMaxSeries() { return VMetricsMaxSeries; }
  static const char* getBaseDirectory() { return baseDirectory; }
  static const char* getLogDirectory() { return logDirectory; }
  static const char* getOdiDataDirectory() { return odiDataDirectory; }
  static const char* getArmDataDirectory() { return armDataDirectory; }
  static const char* getDpxDataDirectory() { return dpxDataDirectory; }
  static const char* getLynDataDirectory() { return lynDataDirectory; }
  static const char* getDpxOdiDataDirectory() { return dpxOdiDataDirectory; }
  static const char* getArmOdiDataDirectory() { return armOdiDataDirectory; }
  static const char* getLynOdiDataDirectory() { return lynOdiDataDirectory; }

  // Stores the base and builds (creating what is missing, mode 0755) the directory tree under
  // it: logs/, odi/ with dpx/, lyn/ and arm/, arm/log/<$OXA_COLLECTOR or lyn>/delete and
  // lyn/Mgmt/Log. A directory that cannot be created is traced and skipped. Null is ignored.
  static void setBaseDirectory(const char* base);
  // Stores the collector data directory and creates it when missing. Null is ignored.
  static void setDpxDataDirectory(const char* dir);
  // Store the text (cut to 4095 characters); null is ignored.
  static void setArmDataDirectory(const char* dir);
  static void setLynDataDirectory(const char* dir);
  static void setOdiDataDirectory(const char* dir);

  // 0 is invalid: logged as an error and replaced by the default. Negative values are kept.
  static void setOverTimeInterval(int minutes);
  static void setSummaryInterval(int hours);
  static void setMaxThreads(int n);

  // Stores seconds x 1000 in 32-bit arithmetic: anything above 2147483 wraps to -1000, and that
  // wrap is kept on purpose. Zero and negative values are multiplied without check.
  static void setExcludeOutlierSeconds(int seconds);
  // Stores the limit unchanged; -1 means no limit.
  static void setExcludeOutlierMillis(int millis) { VExcludeOutlierMillis = millis; }
  static void setReportZeroRecords(bool on) { VReportZeroRecords = on; }
  // Negative is invalid: logged as an error and replaced by the default. 0 turns checkpoints
  // off.
  static void setCheckpointSeconds(int seconds);
  // Below 1 is invalid: logged as an error and replaced by the default.
  static void setMetricsMaxSeries(int series);

  // Restores every default and empties the directories, as at process start.
  static void resetForTesting();

 private:
  static int VOverTimeInterval;      // minutes per over-time interval
  static int VSummaryInterval;       // hours per summary period
  static int VExcludeOutlierMillis;  // drop transactions at or above this; -1: no limit
  static int VMaxThreads;            // thread limit; no one reads it
  static bool VReportZeroRecords;    // report zero-record rows for some tables
  static int VCheckpointSeconds;     // seconds between checkpoints; 0: none
  static int VMetricsMaxSeries;      // series /metrics keeps

  static char baseDirectory[kDirSize];        // agent base directory
  static char logDirectory[kDirSize];         // base + "/logs/"
  static char odiDataDirectory[kDirSize];     // base + "/odi"
  static char armDataDirectory[kDirSize];     // ARM transaction data directory
  static char dpxDataDirectory[kDirSize];     // collector data file directory
  static char lynDataDirectory[kDirSize];     // base + "/lyn/Mgmt/Log"
  static char dpxOdiDataDirectory[kDirSize];  // odi + "/dpx/": this agent's historical files
  static char armOdiDataDirectory[kDirSize];  // odi + "/arm/"
  static char lynOdiDataDirectory[kDirSize];  // odi + "/lyn/"
};
