#pragma once

// CCommon: stateless helpers shared by intake and analysis: caret-separated field reading, value
// pairs inside a field, wildcard pattern matching, directory listing into a found-file list, the
// order of data files, and cutting an IPv4 address down to a subnet text.
//
// Thread safety: every function may be called from any thread on data the caller owns; a
// _PARSE_INFO list may be shared by concurrent matchers.

#include <cstddef>

#include "core/analyzer/intake/file_info.h"
#include "core/analyzer/intake/parse_info.h"

// Field separator of a data-file line.
inline constexpr char CARET = '^';
// The characters that end a line.
inline constexpr const char* COMMON_EOL_CHARS = "\n\r";

// Hexadecimal text to a value: digits are taken from the last character to the first, each
// times the next power of 16; a character that is not a hexadecimal digit counts as 0 but still
// takes its power. A null text gives 0. Wraps silently past 32 bits.
unsigned int ahextoi(const char* text);

// A field of at most 16 characters read as strtol reads base 10 in the C locale: leading white
// space, an optional sign, then digits up to the first non-digit; no digits give 0.
long decimalFieldValue(const char* text);

class CCommon {
 public:
  CCommon() = delete;

  // ---- Field reading. A cursor points into a NUL-terminated line the caller owns. ----

  // Number of '^' in text; 0 for null.
  static int countCarets(char* text);
  // The position just after the next '^', or the terminating NUL when there is none. Null stays
  // null.
  static char* skipField(char* text);
  // Copies the next field into dest (at most size - 1 characters, always NUL-terminated when
  // size > 0) and moves *cursor past the field and its '^'. A last field (no '^' behind it) is
  // read as its first character only and the cursor moves one character on, never past the NUL.
  static void getNextField(char** cursor, char* dest, int size);
  // The next field (at most 16 characters) as a base-10 integer: leading blanks and a sign
  // accepted, stops at the first non-digit, no digits give 0.
  static int getNextInteger(char** cursor);
  // How many characters from text on are line feeds or carriage returns.
  static int findEOLChars(char* text);

  // Reads the next field (at most 1023 characters) and splits it at the first separator: the
  // part before gives *first, the part after *second (0 without a separator), both hexadecimal
  // (ahextoi) when hex is 1, else base-10.
  static void getNextValuesWithSeparator(char** cursor, char separator, int hex,
                                         unsigned int* first, unsigned int* second);
  // "12.345" gives 12 and 345000000: the digits after the point count thousandths and are
  // scaled by 1000000, so "12.5" gives 12 and 5000000.
  static void getNextTiming(char** cursor, unsigned int* seconds, unsigned int* fraction);
  // "1f-A0" gives 31 and 160.
  static void getNextHexPair(char** cursor, unsigned int* first, unsigned int* second);

  // ---- Wildcard patterns: '*' stands for any run of characters; case is ignored. ----

  // Compiles pattern into a new list the caller owns (free it with freeParseInfo). Returns null
  // for a null or empty pattern, a pattern that yields no element ("**"), or when memory runs out.
  static _PARSE_INFO* getParseInfo(const char* pattern);
  // Frees a whole list; null is fine.
  static void freeParseInfo(_PARSE_INFO* list);
  // True when text matches. A null pattern or text never matches; "*" matches every text. list
  // is pattern compiled by getParseInfo, borrowed for the call; when null the pattern is compiled
  // and freed on the spot. Texts are read as UTF-8.
  static bool patternMatches(const char* pattern, const char* text, const _PARSE_INFO* list);
  static bool patternMatches(const char* pattern, const char* text);
  // The same answer for a text the caller already folded: folded holds foldAscii of text
  // (n bytes), so a caller matching one text against many patterns folds it once. text must be
  // ASCII; it is still read when a pattern has non-ASCII parts.
  static bool patternMatchesFolded(const char* pattern, const char* text, const char* folded,
                                   size_t n, const _PARSE_INFO* list);
  // Folds n bytes of ASCII text as ICU's default case folding does (A-Z to a-z) into dest, which
  // takes n + 1 bytes (a NUL ends it). False when the text holds a byte above 0x7f; dest is then
  // filled but meaningless.
  static bool foldAscii(const char* text, size_t n, char* dest);

  // ---- Found-file lists. ----

  // Lists the entries of directory whose names match pattern, each as "directory/name", in the
  // reverse of the directory's reading order. Returns a list the caller owns (deleteFoundFiles),
  // or null when nothing matches, the directory cannot be opened, or directory and pattern
  // together are 4096 characters or longer.
  static _FILE_INFO_LL* findFiles(const char* directory, const char* pattern);
  // Frees a whole list; null is fine.
  static void deleteFoundFiles(_FILE_INFO_LL* list);
  // True when file a counts as newer than file b. Same-length names compare byte-wise; so do
  // names without a '.'. Otherwise names are cut at their first '.': a stem holding '-' (a file
  // the collector renamed) is older, different stems compare byte-wise, and with equal stems the
  // longer suffix is newer.
  static bool newerFile(const char* a, const char* b);
  // Orders the list from oldest to newest by newerFile (a stable bubble sort relinking the
  // nodes) and returns its new head.
  static _FILE_INFO_LL* sortFilesByName(_FILE_INFO_LL* list);

  // Copies address into out (which must hold it) and keeps its first parts dot-separated parts,
  // the rest replaced by "*": 10.1.2.3 with 2 gives "10.1.*". With parts <= 0 or an empty address
  // out is "*"; with fewer dots than parts, out is the whole address.
  static void stripToSubnet(const char* address, char* out, int parts);
};
