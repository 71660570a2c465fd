#pragma once

// The two line layouts as data: one slot description per field, in line order. The parser reads
// a line by walking its table and the dump writes a page entry by walking the page table, so the
// field order is written down once.

#include <cstdint>

#include "core/analyzer/intake/sm3_entry.h"

enum class SM3FieldKind : uint8_t {
  kText,     // NUL-terminated text slot of `width` bytes
  kInteger,  // signed 32-bit integer
  kSkipped,  // text slot the parser passes over and leaves empty
};

struct SM3_FIELD_SLOT {
  SM3FieldKind kind;
  uint16_t offset;         // byte offset of the slot in its entry
  uint16_t width;          // slot size in bytes
  const char* dumpFormat;  // the dump line of this field; null when it is not dumped
};

inline constexpr int SM3_HPAGE_FIELDS = SM3_HPAGE_CARETS + 1;
inline constexpr int SM3_AV_FIELDS = SM3_AV_CARETS + 1;

// Page line fields 1 to 46 (SM3_HPAGE_ENTRY); object line fields 1 to 31 (_SM3_AV_ENTRY).
extern const SM3_FIELD_SLOT SM3_HPAGE_LAYOUT[SM3_HPAGE_FIELDS];
extern const SM3_FIELD_SLOT SM3_AV_LAYOUT[SM3_AV_FIELDS];
