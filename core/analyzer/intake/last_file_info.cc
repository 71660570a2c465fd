#include "core/analyzer/intake/last_file_info.h"

#include <cstring>

namespace {

constexpr int kTypeAt = 0;
constexpr int kNameAt = 4;
constexpr int kOffsetAt = 4104;
constexpr int kOffsetHighAt = 4112;
constexpr int kLinkAt = 4344;

void putWord(LastFileInfoBytes& bytes, int at, uint32_t value) {
  std::memcpy(bytes.data() + at, &value, sizeof(value));  // host order, as the file is defined
}

uint32_t getWord(const LastFileInfoBytes& bytes, int at) {
  uint32_t value = 0;
  std::memcpy(&value, bytes.data() + at, sizeof(value));
  return value;
}

}  // namespace

LastFileInfoBytes encodeLastFileInfo(const _LAST_FILE_INFO& record) {
  LastFileInfoBytes bytes{};
  putWord(bytes, kTypeAt, static_cast<uint32_t>(record.recordType));
  const size_t length = strnlen(record.fileName, kLastFileInfoNameSize - 4);
  std::memcpy(bytes.data() + kNameAt, record.fileName, length);
  putWord(bytes, kOffsetAt, record.offset);
  putWord(bytes, kOffsetHighAt, record.offsetHigh);
  putWord(bytes, kLinkAt,
          static_cast<uint32_t>(reinterpret_cast<uintptr_t>(record.next) & 0xffffffffu));
  return bytes;
}

void decodeLastFileInfo(const LastFileInfoBytes& bytes, _LAST_FILE_INFO* record) {
  record->recordType = static_cast<int32_t>(getWord(bytes, kTypeAt));
  std::memcpy(record->fileName, bytes.data() + kNameAt, kLastFileInfoNameSize);
  record->fileName[kLastFileInfoNameSize - 4] = '\0';  // at most 4096 characters
  record->offset = getWord(bytes, kOffsetAt);
  record->offsetHigh = getWord(bytes, kOffsetHighAt);
}

void freeLastProcessedFile(_LAST_FILE_INFO* list) {
  while (list != nullptr) {
    _LAST_FILE_INFO* const next = list->next;
    delete list;
    list = next;
  }
}
