#include "core/analyzer/intake/parse_info.h"

#include <stdio.h>
#include <string.h>

#include <atomic>

namespace {

std::atomic<long> g_allocs{0};
std::atomic<long> g_frees{0};

}  // namespace

long getParseInfoAllocCount() {
  return g_allocs.load(std::memory_order_relaxed);
}
long getParseInfoFreeCount() {
  return g_frees.load(std::memory_order_relaxed);
}
void noteParseInfoAlloc() {
  g_allocs.fetch_add(1, std::memory_order_relaxed);
}
void noteParseInfoFree() {
  g_frees.fetch_add(1, std::memory_order_relaxed);
}

const char* getMatchTypeString(int type) {
  switch (type) {
    case NOWILD:
      return "NOWILD";
    case STARTSWITH:
      return "STARTSWITH";
    case ENDSWITH:
      return "ENDSWITH";
    case CONTAINS:
      return "CONTAINS";
    default:
      return "INVALID";
  }
}

void dumpParseInfo(const _PARSE_INFO* list) {
  printf("Dumping PARSE_INFO phead[%p]\n\n", static_cast<const void*>(list));
  for (const _PARSE_INFO* e = list; e != nullptr; e = e->next) {
    printf("match type  [%s]\n", getMatchTypeString(e->matchType));
    printf("Parse string[%s]\n", e->text != nullptr ? e->text : "");
    printf("String len  [%d]\n", e->length);
  }
  printf("Dumping PARSE_INFO END\n");
}

int validateParseInfo(const _PARSE_INFO* list, bool verbose) {
  int faults = 0;
  int index = 0;
  auto fault = [&](const char* what) {
    ++faults;
    if (verbose) {
      printf("validateParseInfo: element %d: %s\n", index, what);
    }
  };
  for (const _PARSE_INFO* e = list; e != nullptr; e = e->next, ++index) {
    const bool first = (e == list);
    const bool last = (e->next == nullptr);
    switch (e->matchType) {
      case NOWILD:
        if (!(first && last)) {
          fault("NOWILD is not the only element");
        }
        break;
      case STARTSWITH:
        if (!first) {
          fault("STARTSWITH is not the first element");
        }
        break;
      case ENDSWITH:
        if (!last) {
          fault("ENDSWITH is not the last element");
        }
        break;
      case CONTAINS:
        break;
      default:
        fault("match type out of range");
        break;
    }
    if (e->text == nullptr) {
      fault("no text");
    } else if (static_cast<size_t>(e->length) != strlen(e->text) || e->length < 0) {
      fault("stored length differs from the text's length");
    }
  }
  return faults;
}
