#pragma once

// CUUID: a 16-byte identifier, written as 32 upper-case hexadecimal digits in 33-byte text fields
// (getUUIDToHexString). A plain value; copy it freely.

#include <cstdint>
#include <cstring>

struct CUUID {
  uint8_t bytes[16] = {};

  friend bool operator==(const CUUID& a, const CUUID& b) {
    return memcmp(a.bytes, b.bytes, sizeof(a.bytes)) == 0;
  }
};

// Writes id as 32 upper-case hexadecimal digits, two a byte in byte order, and a NUL: text must
// hold 33 bytes.
void getUUIDToHexString(const CUUID& id, char* text);
