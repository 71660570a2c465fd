// OpenSSL 3 deprecates the low-level MD5 calls; this is the one place that uses them.
#define OPENSSL_SUPPRESS_DEPRECATED

#include "core/analyzer/intake/md5_generator.h"

CMD5Generator::CMD5Generator() {
  MD5_Init(&context_);
}

void CMD5Generator::Init() {
  MD5_Init(&context_);
}

void CMD5Generator::Update(const void* data, size_t length) {
  MD5_Update(&context_, data, length);
}

CUUID CMD5Generator::getUUID() {
  CUUID id;
  MD5_Final(id.bytes, &context_);
  return id;
}

void getUUIDToHexString(const CUUID& id, char* text) {
  static constexpr char kDigits[] = "0123456789ABCDEF";
  for (int i = 0; i < 16; ++i) {
    text[2 * i] = kDigits[id.bytes[i] >> 4];
    text[2 * i + 1] = kDigits[id.bytes[i] & 0x0F];
  }
  text[32] = '\0';
}
