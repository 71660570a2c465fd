// libFuzzer target over loading a checkpoint: the file's framing (CheckpointFile::parse), its
// description (CheckpointState::decode) and its sections built into rows (COverTimeTrees), as
// a start after a crash does; the bytes also go through CheckpointFile::load from a file, which
// sets aside what does not parse.
//
// Input: one mode byte, then the file. Mode bit 0 set: the target appends the file's correct
// checksum, so that the fuzzer explores what lies behind it rather than the checksum itself.
//
// Beyond not crashing, it checks:
// - parse and load agree, and a file that does not load is set aside and nothing else;
// - the trees never hold more rows than the sections have records;
// - a decoded description encodes and decodes to the same values;
// - a latency book loaded from a section encodes and decodes to the same book.

#include <cstdint>
#include <cstring>
#include <filesystem>
#include <string>

#include "core/analyzer/analysis/checkpoint_state.h"
#include "core/analyzer/analysis/over_time_trees.h"
#include "core/history/checkpoint_file.h"
#include "tests/fuzz/fuzz_support.h"

namespace {

void Check(bool ok, const char* what) {
  if (!ok) {
    fuzzing::Fail("checkpoint_fuzz", what);
  }
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  fuzzing::QuietTraces("checkpoint_fuzz_trace.log");
  fuzzing::ScratchDirectory();
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size < 1) {
    return 0;
  }
  std::string bytes(reinterpret_cast<const char*>(data + 1), size - 1);
  if ((data[0] & 1) != 0) {
    const uint64_t hash = history::CheckpointFile::checksum(bytes);
    bytes.append(reinterpret_cast<const char*>(&hash), sizeof(hash));
  }

  history::CheckpointImage image;
  std::string why;
  const bool parsed = history::CheckpointFile::parse(bytes, &image, &why);
  Check(parsed || !why.empty(), "a refused file without a reason");

  const std::string path = fuzzing::ScratchDirectory() + "/q7checkpoint.dat";
  fuzzing::WriteWholeFile(path, reinterpret_cast<const uint8_t*>(bytes.data()), bytes.size());
  history::CheckpointImage loaded;
  const history::CheckpointFile file(path);
  const auto result = file.load(&loaded);
  Check((result == history::CheckpointFile::Load::kLoaded) == parsed, "load and parse disagree");
  Check(std::filesystem::exists(path) == parsed, "a loaded file moved, or a bad one kept");
  Check(std::filesystem::exists(path + ".bad") == !parsed, "a bad file not set aside");
  std::filesystem::remove(path);
  std::filesystem::remove(path + ".bad");
  if (!parsed) {
    return 0;
  }
  Check(loaded.description == image.description && loaded.sections.size() == image.sections.size(),
        "load and parse read different things");

  CheckpointState state;
  if (CheckpointState::decode(image.description, &state, &why)) {
    CheckpointState again;
    Check(CheckpointState::decode(state.encode(), &again, &why), "an encoding does not decode");
    Check(again.interval == state.interval && again.position.offset == state.position.offset &&
              again.instanceFiles.size() == state.instanceFiles.size() &&
              again.patterns.size() == state.patterns.size(),
          "an encoding decodes to other values");
  }
  COverTimeTrees trees;
  size_t records = 0;
  for (const history::LoadedSection& section : image.sections) {
    if (trees.loadSection(section)) {
      records += section.count();
    }
  }
  Check(static_cast<size_t>(trees.totalRows()) <= records,
        "the trees hold more rows than the sections have records");
  LatencyBook again;
  Check(LatencyBook::decode(trees.latency().encode(), &again) && again == trees.latency(),
        "a latency book does not read back as itself");
  return 0;
}
