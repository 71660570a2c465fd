#include "collector/sm3gen/file_mode.h"

#include <errno.h>
#include <string.h>

#include <cstdio>
#include <memory>

namespace sm3gen {
namespace {

// Writes are gathered into buffers of about this size.
constexpr size_t kChunk = 1 << 16;

struct FileCloser {
  void operator()(FILE* file) const { std::fclose(file); }
};
using FilePtr = std::unique_ptr<FILE, FileCloser>;

// An output file or standard output, with errors reported against its name.
class Output {
 public:
  explicit Output(std::string path) : path_(std::move(path)) {}

  bool Open(bool append, std::string* error) {
    if (path_ == "-") {
      return true;
    }
    file_.reset(std::fopen(path_.c_str(), append ? "ab" : "wb"));
    return file_ != nullptr || Fail(error);
  }
  bool Write(const std::string& bytes, std::string* error) {
    return bytes.empty() || std::fwrite(bytes.data(), 1, bytes.size(), stream()) == bytes.size() ||
           Fail(error);
  }
  // Flushes and closes; a full disk often shows only here.
  bool Close(std::string* error) {
    if (path_ == "-") {
      return std::fflush(stdout) == 0 || Fail(error);
    }
    FILE* file = file_.release();
    return std::fclose(file) == 0 || Fail(error);
  }

 private:
  FILE* stream() const { return path_ == "-" ? stdout : file_.get(); }
  bool Fail(std::string* error) const {
    *error = (path_ == "-" ? std::string("standard output") : path_) + ": " + ::strerror(errno);
    return false;
  }

  std::string path_;
  FilePtr file_;
};

}  // namespace

bool RunFileMode(const FileJob& job, std::string* error) {
  Output out(job.out_path);
  if (!out.Open(job.append, error)) {
    return false;
  }
  RecordStream stream(job.model, job.stream);
  std::string buffer;
  buffer.reserve(kChunk + 4096);
  for (int64_t i = 0; i < job.records; ++i) {
    stream.AppendRecord(&buffer);
    if (buffer.size() >= kChunk) {
      if (!out.Write(buffer, error)) {
        return false;
      }
      buffer.clear();
    }
  }
  if (job.truncate_tail) {
    stream.AppendTruncatedRecord(&buffer);
  }
  if (!out.Write(buffer, error) || !out.Close(error)) {
    return false;
  }
  if (job.truth_path.empty()) {
    return true;
  }
  Output truth(job.truth_path);
  // Replacement keeps non-UTF-8 text from aborting the dump; the model writes ASCII names.
  const std::string json =
      stream.truth().ToJson().dump(2, ' ', false, nlohmann::json::error_handler_t::replace) + "\n";
  return truth.Open(false, error) && truth.Write(json, error) && truth.Close(error);
}

}  // namespace sm3gen
