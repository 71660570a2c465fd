#pragma once

// _LAST_FILE_INFO: where reading stopped, as the file manager persists it in "DPXLastFile" so
// that the next start resumes there.
//
// On disk every record is kLastFileInfoRecordSize bytes in the host's byte order (32-bit words):
//   0     record type word (1)
//   4     file name, NUL-terminated, at most 4096 characters, rest zero (4100 bytes)
//   4104  low 32 bits of the offset
//   4108  zero
//   4112  high 32 bits of the offset
//   4116  zero (228 bytes)
//   4344  link word: the low 32 bits of the in-memory next pointer when written, 0 in the last
//         record; ignored when read
//
// In memory the records form a singly linked list owned by whoever holds the head; free it with
// freeLastProcessedFile. Not shared between threads.

#include <array>
#include <cstdint>

inline constexpr int kLastFileInfoRecordSize = 4348;
inline constexpr int kLastFileInfoNameSize = 4100;

struct _LAST_FILE_INFO {
  int32_t recordType = 0;
  char fileName[kLastFileInfoNameSize] = {};  // NUL-terminated, at most 4096 characters
  uint32_t offset = 0;                        // low 32 bits of the offset
  uint32_t offsetHigh = 0;                    // high 32 bits of the offset
  _LAST_FILE_INFO* next = nullptr;            // owned through the list

  long long fullOffset() const {
    return static_cast<long long>((static_cast<uint64_t>(offsetHigh) << 32) | offset);
  }
  void setFullOffset(long long value) {
    offset = static_cast<uint32_t>(static_cast<uint64_t>(value) & 0xffffffffu);
    offsetHigh = static_cast<uint32_t>(static_cast<uint64_t>(value) >> 32);
  }
};

using LastFileInfoBytes = std::array<unsigned char, kLastFileInfoRecordSize>;

// The record's bytes as written to the persist file.
LastFileInfoBytes encodeLastFileInfo(const _LAST_FILE_INFO& record);
// Fills record (next left alone) from bytes read from the persist file; the name is always
// terminated within its field.
void decodeLastFileInfo(const LastFileInfoBytes& bytes, _LAST_FILE_INFO* record);

// Frees a whole list; null is fine.
void freeLastProcessedFile(_LAST_FILE_INFO* list);
