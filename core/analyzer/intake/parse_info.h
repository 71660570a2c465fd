#pragma once

// _PARSE_INFO: a compiled wildcard pattern, a singly linked list of literal parts with the way
// each must be found in a text (see CCommon::getParseInfo and CCommon::patternMatches).
//
// A list is built by CCommon::getParseInfo and freed by CCommon::freeParseInfo; the holder of the
// head owns the list, its elements and their texts. A built list is never modified, so any number
// of threads may match against it at once while its owner keeps it alive.

#include <unicode/unistr.h>

// Match types of an element.
inline constexpr int NOWILD = 0;      // the whole text equals the element
inline constexpr int STARTSWITH = 1;  // the text begins with the element
inline constexpr int ENDSWITH = 2;    // the text ends with the element
inline constexpr int CONTAINS = 3;    // the element occurs at or after the current position

struct _PARSE_INFO {
  // NOWILD, STARTSWITH, ENDSWITH or CONTAINS.
  int matchType = NOWILD;
  // Owned NUL-terminated literal part (no '*'), allocated with new[] one byte longer than it.
  char* text = nullptr;
  // Length of text in bytes. Positions advance by it during matching.
  int length = 0;
  // The next element, or null; owned through the list.
  _PARSE_INFO* next = nullptr;

  // Filled when the list is built so that matching never folds a pattern again:
  // text read as UTF-8 and case-folded,
  icu::UnicodeString folded;
  // and, when every unit of folded is ASCII, the same units as bytes (owned, NUL-terminated),
  // which lets ASCII texts be matched without ICU. Null otherwise.
  char* asciiFolded = nullptr;
};

// Process-wide counters of element and text allocations and frees, for leak tracing. Each
// element counts once and each text once. Safe from any thread.
long getParseInfoAllocCount();
long getParseInfoFreeCount();
void noteParseInfoAlloc();
void noteParseInfoFree();

// "NOWILD", "STARTSWITH", "ENDSWITH", "CONTAINS", or "INVALID" for any other value.
const char* getMatchTypeString(int type);

// Prints the list to standard output. list may be null.
void dumpParseInfo(const _PARSE_INFO* list);

// Returns how many faults the list has (0 for a well-formed one): a NOWILD element that is not
// the only element, a STARTSWITH element that is not the first, an ENDSWITH element that is not
// the last, an unknown match type, an element without text, or a length that differs from its
// text's. With verbose set each fault is also printed to standard output.
int validateParseInfo(const _PARSE_INFO* list, bool verbose);
