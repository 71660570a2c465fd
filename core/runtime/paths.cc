#include "core/runtime/paths.h"

#include <sys/stat.h>

#include <cstring>

void makeNativePath(char* path) {
  if (path == nullptr) {
    return;
  }
  for (char* p = path; *p != '\0'; ++p) {
    if (*p == '\\') {
      *p = '/';
    }
  }
}

const char* findPathSep(const char* path) {
  if (path == nullptr) {
    return nullptr;
  }
  const char* sep = std::strpbrk(path, "/\\");
  return sep;
}

char* findPathSep(char* path) {
  return const_cast<char*>(findPathSep(static_cast<const char*>(path)));
}

const char* getLastPathSeparator(const char* path) {
  if (path == nullptr) {
    return nullptr;
  }
  const char* slash = std::strrchr(path, '/');
  const char* backslash = std::strrchr(path, '\\');
  if (slash == nullptr) {
    return backslash;
  }
  if (backslash == nullptr) {
    return slash;
  }
  return slash > backslash ? slash : backslash;
}

char* getLastPathSeparator(char* path) {
  return const_cast<char*>(getLastPathSeparator(static_cast<const char*>(path)));
}

bool dirExists(const char* path) {
  struct stat st;
  return path != nullptr && ::stat(path, &st) == 0 && S_ISDIR(st.st_mode);
}
