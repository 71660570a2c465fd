#pragma once

// CMD5Generator: an MD5 digest computation, from which record identifiers are derived.
// Init, any number of Update calls, then getUUID. One computation at a time per object; an object
// belongs to one thread.

#include <openssl/md5.h>

#include <cstddef>

#include "core/analyzer/intake/uuid.h"

class CMD5Generator {
 public:
  CMD5Generator();
  CMD5Generator(const CMD5Generator&) = delete;
  CMD5Generator& operator=(const CMD5Generator&) = delete;

  // Starts a new computation.
  void Init();
  // Feeds length bytes of data.
  void Update(const void* data, size_t length);
  // Ends the computation and returns the 16-byte digest; Init must come before the next Update.
  CUUID getUUID();

 private:
  MD5_CTX context_;
};
