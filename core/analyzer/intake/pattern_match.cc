// Wildcard patterns: compiling a pattern into a _PARSE_INFO list and matching texts against it.

#include <string.h>
#include <unicode/stringpiece.h>
#include <unicode/uchar.h>

#include <new>
#include <string>

#include "core/analyzer/intake/common.h"
#include "core/analyzer/intake/pattern_match_internal.h"
#include "framework/trace.h"

namespace {

// Builds one element of the given type over literal[0, length), folded once here so that
// matching never folds the pattern again. Null when memory runs out.
_PARSE_INFO* newElement(int type, const char* literal, size_t length) {
  _PARSE_INFO* e = new (std::nothrow) _PARSE_INFO;
  if (e == nullptr) {
    return nullptr;
  }
  noteParseInfoAlloc();
  e->matchType = type;
  e->length = static_cast<int>(length);
  e->text = new (std::nothrow) char[length + 1];
  if (e->text == nullptr) {
    CCommon::freeParseInfo(e);
    return nullptr;
  }
  noteParseInfoAlloc();
  memcpy(e->text, literal, length);
  e->text[length] = '\0';

  e->folded = icu::UnicodeString::fromUTF8(icu::StringPiece(e->text, static_cast<int32_t>(length)));
  e->folded.foldCase(U_FOLD_CASE_DEFAULT);
  if (e->folded.isBogus()) {
    CCommon::freeParseInfo(e);
    return nullptr;
  }
  const int32_t units = e->folded.length();
  bool ascii = true;
  for (int32_t i = 0; i < units && ascii; ++i) {
    ascii = e->folded.charAt(i) < 0x80;
  }
  if (ascii) {
    e->asciiFolded = new (std::nothrow) char[units + 1];
    if (e->asciiFolded == nullptr) {
      CCommon::freeParseInfo(e);
      return nullptr;
    }
    for (int32_t i = 0; i < units; ++i) {
      e->asciiFolded[i] = static_cast<char>(e->folded.charAt(i));
    }
    e->asciiFolded[units] = '\0';
  }
  return e;
}

// Matching over folded ASCII bytes. Valid only when the text is ASCII and every element has
// asciiFolded: ICU's default folding of ASCII is exactly A-Z to a-z, so each step below sees the
// same units, indexes and lengths as the ICU path.
bool matchAscii(const _PARSE_INFO* list, const char* text, size_t n) {
  long pos = 0;
  for (const _PARSE_INFO* e = list; e != nullptr; e = e->next) {
    const char* f = e->asciiFolded;
    const size_t flen = static_cast<size_t>(e->folded.length());
    switch (e->matchType) {
      case NOWILD:
        if (n != flen || memcmp(text, f, n) != 0) {
          return false;
        }
        break;
      case STARTSWITH:
        if (n < flen || memcmp(text, f, flen) != 0) {
          return false;
        }
        pos = e->length;
        break;
      case CONTAINS: {
        const long from = pos < 0 ? 0 : (pos > static_cast<long>(n) ? static_cast<long>(n) : pos);
        if (flen == 0) {
          return false;
        }
        const void* hit = memmem(text + from, n - from, f, flen);
        if (hit == nullptr) {
          return false;
        }
        pos = (static_cast<const char*>(hit) - text) + e->length;
        break;
      }
      case ENDSWITH:
        // The last occurrence ends at the end exactly when the text ends with the element.
        if (flen == 0 || n < flen || memcmp(text + n - flen, f, flen) != 0 ||
            static_cast<long>(n - flen) < pos) {
          return false;
        }
        break;
      default:
        return false;
    }
  }
  return true;
}

}  // namespace

namespace pattern_internal {

bool matchIcu(const _PARSE_INFO* list, const char* text) {
  icu::UnicodeString folded = icu::UnicodeString::fromUTF8(text);
  folded.foldCase(U_FOLD_CASE_DEFAULT);
  const int32_t n = folded.length();
  // Positions advance by the element's length in bytes while searches count UTF-16 units; the
  // two agree for ASCII, and the mixture is kept so results stay those operators already know.
  long pos = 0;
  for (const _PARSE_INFO* e = list; e != nullptr; e = e->next) {
    const icu::UnicodeString& f = e->folded;
    switch (e->matchType) {
      case NOWILD:
        if (folded != f) {
          return false;
        }
        break;
      case STARTSWITH:
        if (!folded.startsWith(f)) {
          return false;
        }
        pos = e->length;
        break;
      case CONTAINS: {
        const int32_t from = pos < 0 ? 0 : (pos > n ? n : static_cast<int32_t>(pos));
        if (f.isEmpty()) {
          return false;
        }
        const int32_t at = folded.indexOf(f, from);
        if (at < 0) {
          return false;
        }
        pos = static_cast<long>(at) + e->length;
        break;
      }
      case ENDSWITH: {
        if (f.isEmpty()) {
          return false;
        }
        const int32_t at = folded.lastIndexOf(f);
        if (at < 0 || at + f.length() != n || at < pos) {
          return false;
        }
        break;
      }
      default:
        return false;
    }
  }
  return true;
}

}  // namespace pattern_internal

// One pass without early exit, so the compiler can vectorise it.
bool CCommon::foldAscii(const char* text, size_t n, char* dest) {
  unsigned char seen = 0;
  for (size_t i = 0; i < n; ++i) {
    const unsigned char c = static_cast<unsigned char>(text[i]);
    seen |= c;
    dest[i] = static_cast<char>(c + (static_cast<unsigned char>(c - 'A') < 26 ? 'a' - 'A' : 0));
  }
  dest[n] = '\0';
  return seen < 0x80;
}

namespace {

bool asciiList(const _PARSE_INFO* list) {
  bool ascii = true;
  for (const _PARSE_INFO* e = list; e != nullptr && ascii; e = e->next) {
    ascii = e->asciiFolded != nullptr;
  }
  return ascii;
}

bool matchList(const _PARSE_INFO* list, const char* text) {
  if (asciiList(list)) {
    const size_t n = strlen(text);
    char small[512];
    std::string large;
    char* buffer = small;
    if (n >= sizeof(small)) {
      large.resize(n + 1);
      buffer = large.data();
    }
    if (CCommon::foldAscii(text, n, buffer)) {
      return matchAscii(list, buffer, n);
    }
  }
  return pattern_internal::matchIcu(list, text);
}

}  // namespace

_PARSE_INFO* CCommon::getParseInfo(const char* pattern) {
  if (pattern == nullptr || pattern[0] == '\0') {
    return nullptr;
  }
  // A leading run of '*' means the same as one: start at its last '*'.
  const char* seg = pattern;
  if (seg[0] == '*' && seg[1] == '*') {
    while (seg[1] == '*') {
      ++seg;
    }
  }
  _PARSE_INFO* head = nullptr;
  _PARSE_INFO** tail = &head;
  while (*seg != '\0') {
    const char* end = strchr(seg + 1, '*');
    if (end == nullptr) {
      end = seg + strlen(seg);
    }
    const size_t segLength = static_cast<size_t>(end - seg);
    // A lone '*' past the start ("a**b", a trailing '*') adds nothing to the match.
    if (seg == pattern || segLength >= 2) {
      const bool leading = (*seg == '*');
      const bool followed = (*end == '*');
      const int type =
          leading ? (followed ? CONTAINS : ENDSWITH) : (followed ? STARTSWITH : NOWILD);
      _PARSE_INFO* e =
          leading ? newElement(type, seg + 1, segLength - 1) : newElement(type, seg, segLength);
      if (e == nullptr) {
        fw::TracePrintf("analyzer", fw::kTraceError, "CCommon::getParseInfo",
                        "CCommon::getParseInfo out of memory parsing [%s]", pattern);
        freeParseInfo(head);
        return nullptr;
      }
      *tail = e;
      tail = &e->next;
    }
    seg = end;
  }
  return head;
}

void CCommon::freeParseInfo(_PARSE_INFO* list) {
  while (list != nullptr) {
    _PARSE_INFO* next = list->next;
    if (list->text != nullptr) {
      delete[] list->text;
      noteParseInfoFree();
    }
    delete[] list->asciiFolded;
    delete list;
    noteParseInfoFree();
    list = next;
  }
}

bool CCommon::patternMatches(const char* pattern, const char* text, const _PARSE_INFO* list) {
  if (pattern == nullptr || text == nullptr) {
    return false;
  }
  if (pattern[0] == '*' && pattern[1] == '\0') {
    return true;
  }
  if (list != nullptr) {
    return matchList(list, text);
  }
  _PARSE_INFO* parsed = getParseInfo(pattern);
  if (parsed == nullptr) {
    return false;
  }
  const bool result = matchList(parsed, text);
  freeParseInfo(parsed);
  return result;
}

bool CCommon::patternMatches(const char* pattern, const char* text) {
  return patternMatches(pattern, text, nullptr);
}

bool CCommon::patternMatchesFolded(const char* pattern, const char* text, const char* folded,
                                   size_t n, const _PARSE_INFO* list) {
  if (pattern == nullptr || text == nullptr || list == nullptr) {
    return patternMatches(pattern, text, list);
  }
  if (pattern[0] == '*' && pattern[1] == '\0') {
    return true;
  }
  return asciiList(list) ? matchAscii(list, folded, n) : pattern_internal::matchIcu(list, text);
}
