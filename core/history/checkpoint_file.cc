#include "core/history/checkpoint_file.h"

#include <fcntl.h>

#include <cerrno>
#include <cstring>
#include <utility>

#include "core/runtime/clog.h"
#include "core/runtime/set_aside.h"
#include "framework/atomic_file.h"
#include "framework/file_io.h"
#include "framework/status.h"

namespace history {

namespace {

constexpr std::string_view kMagic = "q7checkpoint ";
constexpr std::string_view kVersion = "1\n";

class Fnv1a {
 public:
  void add(std::string_view bytes) {
    for (const char c : bytes) {
      hash_ = (hash_ ^ static_cast<unsigned char>(c)) * 0x100000001b3ull;
    }
  }
  uint64_t value() const { return hash_; }

 private:
  uint64_t hash_ = 0xcbf29ce484222325ull;
};

template <class T>
std::string_view Bytes(const T& value) {
  return {reinterpret_cast<const char*>(&value), sizeof(value)};
}

// Reads values off the front of a byte string; every read checks what is left.
class Reader {
 public:
  explicit Reader(std::string_view bytes) : rest_(bytes) {}
  template <class T>
  bool get(T* value) {
    if (rest_.size() < sizeof(T)) {
      return false;
    }
    std::memcpy(value, rest_.data(), sizeof(T));
    rest_.remove_prefix(sizeof(T));
    return true;
  }
  bool take(uint64_t n, std::string_view* out) {
    if (rest_.size() < n) {
      return false;
    }
    *out = rest_.substr(0, static_cast<size_t>(n));
    rest_.remove_prefix(static_cast<size_t>(n));
    return true;
  }
  size_t left() const { return rest_.size(); }

 private:
  std::string_view rest_;
};

}  // namespace

CheckpointFile::CheckpointFile(std::string path) : path_(std::move(path)) {}

uint64_t CheckpointFile::checksum(std::string_view bytes) {
  Fnv1a hash;
  hash.add(bytes);
  return hash.value();
}

bool CheckpointFile::save(std::string_view description,
                          const std::vector<RecordSection>& sections) const {
  const auto produce = [&](const fw::ContentSink& sink) {
    Fnv1a hash;
    const auto put = [&](std::string_view bytes) {
      hash.add(bytes);
      return sink(bytes);
    };
    const uint64_t length = description.size();
    const uint32_t count = static_cast<uint32_t>(sections.size());
    if (!put(kMagic) || !put(kVersion) || !put(Bytes(length)) || !put(description) ||
        !put(Bytes(count))) {
      return false;
    }
    std::vector<std::byte> piece;
    for (const RecordSection& section : sections) {
      const uint32_t stemLength = static_cast<uint32_t>(section.stem.size());
      const uint64_t recordSize = section.record_size;
      const uint64_t records = section.count;
      if (!put(Bytes(stemLength)) || !put(section.stem) || !put(Bytes(recordSize)) ||
          !put(Bytes(records))) {
        return false;
      }
      for (size_t first = 0; first < section.count; first += HistoryStore::kPieceRecords) {
        const size_t n = std::min(HistoryStore::kPieceRecords, section.count - first);
        piece.assign(n * section.record_size, std::byte{0});
        section.fill(first, n, piece.data());
        if (!put({reinterpret_cast<const char*>(piece.data()), piece.size()})) {
          return false;
        }
      }
    }
    return sink(Bytes(hash.value()));
  };
  std::string error;
  // A fixed temporary name: what a crash left behind is overwritten by the next save.
  if (fw::ReplaceFileInPieces(path_, produce, {0600, path_ + ".tmp"}, nullptr, &error) != fw::kOk) {
    CLOG::error("%s checkpoint not saved, the previous one stays: %s", "CheckpointFile::save",
                error.c_str());
    return false;
  }
  return true;
}

bool CheckpointFile::parse(std::string_view bytes, CheckpointImage* image, std::string* why) {
  *image = {};
  if (bytes.substr(0, kMagic.size()) != kMagic) {
    *why = "not a checkpoint file";
    return false;
  }
  if (bytes.substr(kMagic.size(), kVersion.size()) != kVersion) {
    *why = "a checkpoint format version this agent does not know";
    return false;
  }
  if (bytes.size() < kMagic.size() + kVersion.size() + sizeof(uint64_t)) {
    *why = "cut short";
    return false;
  }
  const std::string_view body = bytes.substr(0, bytes.size() - sizeof(uint64_t));
  uint64_t stored = 0;
  std::memcpy(&stored, bytes.data() + body.size(), sizeof(stored));
  if (checksum(body) != stored) {
    *why = "torn or damaged (its checksum does not match)";
    return false;
  }
  Reader in(body.substr(kMagic.size() + kVersion.size()));
  uint64_t length = 0;
  std::string_view description;
  uint32_t sections = 0;
  if (!in.get(&length) || !in.take(length, &description) || !in.get(&sections)) {
    *why = "cut short";
    return false;
  }
  image->description.assign(description);
  for (uint32_t i = 0; i < sections; ++i) {
    uint32_t stemLength = 0;
    std::string_view stem;
    uint64_t recordSize = 0;
    uint64_t count = 0;
    std::string_view records;
    if (!in.get(&stemLength) || !in.take(stemLength, &stem) || !in.get(&recordSize) ||
        !in.get(&count) || recordSize == 0 || count > in.left() / recordSize ||
        !in.take(recordSize * count, &records)) {
      *why = "a section that does not fit in the file";
      return false;
    }
    LoadedSection& section = image->sections.emplace_back();
    section.stem.assign(stem);
    section.record_size = static_cast<size_t>(recordSize);
    const auto* first = reinterpret_cast<const std::byte*>(records.data());
    section.records.assign(first, first + records.size());
  }
  if (in.left() != 0) {
    *why = "bytes after its last section";
    return false;
  }
  return true;
}

CheckpointFile::Load CheckpointFile::load(CheckpointImage* image) const {
  fw::UniqueFd fd(::open(path_.c_str(), O_RDONLY | O_CLOEXEC));
  if (!fd.valid()) {
    if (errno == ENOENT) {
      return Load::kMissing;
    }
    setAside(std::string("cannot be opened: ") + std::strerror(errno));
    return Load::kSetAside;
  }
  const off_t size = fw::FileSize(fd.get());
  std::string bytes(size > 0 ? static_cast<size_t>(size) : 0, '\0');
  if (size < 0 ||
      fw::ReadAt(fd.get(), bytes.data(), bytes.size(), 0) != static_cast<ssize_t>(bytes.size())) {
    setAside(std::string("cannot be read: ") + std::strerror(errno));
    return Load::kSetAside;
  }
  std::string why;
  if (!parse(bytes, image, &why)) {
    setAside(why);
    return Load::kSetAside;
  }
  return Load::kLoaded;
}

void CheckpointFile::setAside(const std::string& why) const {
  SetAsideTraced("Checkpoint", path_, why);
}

}  // namespace history
