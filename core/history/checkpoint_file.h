#pragma once

// CheckpointFile: the analyzer's checkpoint on disk, one file replaced whole (fw::ReplaceFile)
// so that a crash or a power cut leaves either the previous checkpoint or the new one. It holds
// a description (text the caller makes and reads back; the analyzer uses JSON) and sections
// of fixed-size records, each under a stem, in the layout of the history files.
//
// Layout (integers in host byte order, the file never leaves the host):
//   "q7checkpoint 1\n"                      magic and format version
//   u64 length, description bytes
//   u32 sections; per section: u32 stem length, stem, u64 record size, u64 count, records
//   u64 FNV-1a hash of every byte before it
// A file that is short, has bytes past the hash, a wrong hash, another magic or another
// version does not load; load() then sets it aside (".bad") and traces why.
//
// Thread safety: none of its own; one thread (the analyzer's) saves and loads.

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

#include "core/history/history_store.h"

namespace history {

// A section to save: count records of record_size bytes, made a stretch at a time by fill.
struct RecordSection {
  std::string stem;
  size_t record_size = 0;
  size_t count = 0;
  HistoryStore::RecordFill fill;
};

// A section as loaded: its records back to back.
struct LoadedSection {
  std::string stem;
  size_t record_size = 0;
  std::vector<std::byte> records;
  size_t count() const { return record_size == 0 ? 0 : records.size() / record_size; }
};

struct CheckpointImage {
  std::string description;
  std::vector<LoadedSection> sections;
};

class CheckpointFile {
 public:
  explicit CheckpointFile(std::string path);

  const std::string& path() const { return path_; }

  // Replaces the file with description and sections. False, traced with the reason, when it
  // could not be written; the previous checkpoint then stays in place.
  bool save(std::string_view description, const std::vector<RecordSection>& sections) const;

  enum class Load { kLoaded, kMissing, kSetAside };
  // Reads the file into *image. A file that does not load is set aside and traced.
  Load load(CheckpointImage* image) const;
  // Sets the file aside and traces why: for a file whose description the caller cannot use.
  void setAside(const std::string& why) const;

  // The checksum a file ends with, over the bytes before it.
  static uint64_t checksum(std::string_view bytes);
  // Decodes a whole file's bytes; false with *why when they are not a checkpoint.
  static bool parse(std::string_view bytes, CheckpointImage* image, std::string* why);

 private:
  const std::string path_;
};

}  // namespace history
