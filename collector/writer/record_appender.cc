#include "collector/writer/record_appender.h"

#include <unistd.h>

#include <cstdio>
#include <fstream>

#include "collector/common/process.h"
#include "collector/writer/record_fields.h"

namespace collector {

RecordAppender::RecordAppender(LiveFileOptions file, std::string truth_path)
    : file_(std::move(file)), truth_path_(std::move(truth_path)) {}

bool RecordAppender::Open(Clock::time_point now, std::string* error) {
  truth_written_ = now;
  // An empty truth from the start tells a test the writer is up, even before any record.
  return file_.Open(now, error) && WriteTruth(error);
}

bool RecordAppender::Append(std::string_view record, Clock::time_point now, std::string* error) {
  if (!file_.Append(record, now, error)) {
    return false;
  }
  sm3gen::Record fields;
  if (ParseRecordFields(record, &fields)) {
    truth_.AddRecord(fields);
  } else {
    ++unreadable_;
  }
  truth_.AddBytes(record.size());
  truth_dirty_ = true;
  return true;
}

bool RecordAppender::Feed(std::string_view bytes, Clock::time_point now, std::string* error) {
  bool ok = true;
  // Keep going after an error: later records may still fit (a roll can fail, a write can't
  // be undone), and the first error is the one worth reporting.
  cutter_.Feed(bytes, [&](std::string_view record) {
    std::string failure;
    if (!Append(record, now, &failure) && ok) {
      ok = false;
      *error = failure;
    }
  });
  std::string failure;
  if (!file_.Flush(&failure) && ok) {
    ok = false;
    *error = failure;
  }
  return ok;
}

bool RecordAppender::Tick(Clock::time_point now, std::string* error) {
  if (!file_.Tick(now, error)) {
    return false;
  }
  if (truth_dirty_ && now - truth_written_ >= kTruthEvery) {
    truth_written_ = now;
    return WriteTruth(error);
  }
  return true;
}

bool RecordAppender::Finish(Clock::time_point now, std::string* error) {
  bool ok = true;
  cutter_.Finish([&](std::string_view record) { ok = Append(record, now, error) && ok; });
  ok = file_.Flush(error) && ok;
  return WriteTruth(error) && ok;
}

bool RecordAppender::WriteTruth(std::string* error) {
  if (truth_path_.empty()) {
    return true;
  }
  const std::string temp = truth_path_ + ".tmp";
  {
    std::ofstream out(temp, std::ios::trunc);
    out << truth_.ToJson().dump(2, ' ', false, nlohmann::json::error_handler_t::replace) << "\n";
    out.close();
    if (!out) {
      *error = ErrnoText(temp);
      return false;
    }
  }
  if (::rename(temp.c_str(), truth_path_.c_str()) != 0) {
    *error = ErrnoText(truth_path_);
    return false;
  }
  truth_dirty_ = false;
  return true;
}

}  // namespace collector
