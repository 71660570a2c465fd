// Found-file lists: listing a directory, and the order in which data files are read.

#include <dirent.h>
#include <errno.h>
#include <stdio.h>
#include <string.h>

#include <memory>

#include "core/analyzer/intake/common.h"
#include "framework/trace.h"

namespace {

constexpr const char* kUnit = "intake";

struct DirCloser {
  void operator()(DIR* dir) const { closedir(dir); }
};

}  // namespace

_FILE_INFO_LL* CCommon::findFiles(const char* directory, const char* pattern) {
  constexpr const char* kWhere = "CCommon::findFiles";
  if (directory == nullptr || pattern == nullptr ||
      strlen(directory) + strlen(pattern) >= static_cast<size_t>(kFileInfoMaxPath)) {
    fw::TracePrintf(kUnit, fw::kTraceError, kWhere, "%s directory or pattern too long", kWhere);
    return nullptr;
  }
  std::unique_ptr<DIR, DirCloser> dir(opendir(directory));
  if (!dir) {
    // The collector may not have created its directory yet; the caller polls again.
    fw::TracePrintf(kUnit, fw::kTraceDetail, kWhere, "%s cannot open [%s]: %s", kWhere, directory,
                    strerror(errno));
    return nullptr;
  }
  // Compiled once for the whole listing.
  _PARSE_INFO* compiled = getParseInfo(pattern);
  _FILE_INFO_LL* head = nullptr;
  while (const dirent* entry = readdir(dir.get())) {
    if (!patternMatches(pattern, entry->d_name, compiled)) {
      continue;
    }
    _FILE_INFO_LL* node = new _FILE_INFO_LL;
    snprintf(node->fileName, kFileInfoMaxPath + 1, "%s/%s", directory, entry->d_name);
    // In front: the list comes out in the reverse of the reading order.
    node->next = head;
    head = node;
  }
  freeParseInfo(compiled);
  return head;
}

void CCommon::deleteFoundFiles(_FILE_INFO_LL* list) {
  while (list != nullptr) {
    _FILE_INFO_LL* next = list->next;
    delete list;
    list = next;
  }
}

bool CCommon::newerFile(const char* a, const char* b) {
  const size_t aLength = strlen(a);
  const size_t bLength = strlen(b);
  const char* aDot = strchr(a, '.');
  const char* bDot = strchr(b, '.');
  if (aLength == bLength || aDot == nullptr || bDot == nullptr) {
    return strcmp(a, b) > 0;
  }
  // The first '.' may lie in the directory part; names are compared as listed all the same.
  const size_t aStem = static_cast<size_t>(aDot - a);
  const size_t bStem = static_cast<size_t>(bDot - b);
  const bool sameStem = aStem == bStem && memcmp(a, b, aStem) == 0;
  if (!sameStem) {
    // The collector renames a finished file with a '-' in its stem, so such a file is older
    // than any live one.
    if (memchr(a, '-', aStem) != nullptr) {
      return false;
    }
    if (memchr(b, '-', bStem) != nullptr) {
      return true;
    }
    const int order = memcmp(a, b, aStem < bStem ? aStem : bStem);
    return order != 0 ? order > 0 : aStem > bStem;
  }
  return aLength - aStem > bLength - bStem;
}

_FILE_INFO_LL* CCommon::sortFilesByName(_FILE_INFO_LL* list) {
  bool swapped = true;
  while (swapped) {
    swapped = false;
    for (_FILE_INFO_LL** link = &list; *link != nullptr && (*link)->next != nullptr;
         link = &(*link)->next) {
      _FILE_INFO_LL* first = *link;
      _FILE_INFO_LL* second = first->next;
      if (newerFile(first->fileName, second->fileName)) {
        first->next = second->next;
        second->next = first;
        *link = second;
        swapped = true;
      }
    }
  }
  return list;
}
