#pragma once

// ReadPosition: how far the intake has read, as a checkpoint keeps it: the file by name and
// by identity (device and inode, which a rename keeps), and the offset of the first record not
// yet handed over. CPositionMark carries one through the analyzer's queue, behind the records
// it follows, so the analyzer knows which records its trees hold.
//
// Thread safety: plain values; a mark belongs to whoever holds the queue item, as a
// transaction does.

#include <cstdint>
#include <string>
#include <utility>

#include "core/analyzer/intake/transaction.h"

struct ReadPosition {
  std::string file;     // "" when nothing was read yet
  uint64_t device = 0;  // 0 with inode 0: the identity is not known
  uint64_t inode = 0;
  long long offset = 0;
};

class CPositionMark : public CTransaction {
 public:
  explicit CPositionMark(ReadPosition position) : position_(std::move(position)) {}
  const ReadPosition& position() const { return position_; }

 private:
  ReadPosition position_;
};

// The "*.sm3" file of directory with this identity, or "" (none, or identity unknown).
std::string FindFileByIdentity(const char* directory, uint64_t device, uint64_t inode);

// Where to resume reading saved: saved itself while its name still is that file (or the
// identity is unknown); the file of directory's "*.sm3" with saved's identity when the
// collector renamed it since; saved's name at offset 0 when that name now holds another file
// and the old one is gone; saved as it is when the name is missing too (the file manager then
// goes on with what it finds). Traced when it moves the position.
ReadPosition LocateReadPosition(const ReadPosition& saved, const char* directory);
