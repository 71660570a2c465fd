#pragma once

// Whether two wildcard patterns have a text in common: is there a text that
// CCommon::patternMatches accepts for both? Decided exactly on the compiled patterns, never by
// trying sample texts, so the answer holds for every text the matcher could ever see.
//
// The answer follows the matcher in all its details: texts are compared case-folded (ICU default
// folding of the UTF-8 text), "*" alone matches every text, a pattern that compiles to no list
// ("", "**") matches nothing and so overlaps nothing, and the matcher's habit of moving its
// position by an element's length in bytes while it searches in UTF-16 units (which makes
// "é*é" refuse "éé") is modelled as it is.
//
// Thread safety: plain functions; compiled lists may be shared with concurrent matchers.

#include <string>

#include "core/analyzer/intake/parse_info.h"

// True when some text matches both pattern a and pattern b. A null pattern matches nothing.
// When witness is non-null and the answer is true, *witness receives one such text (UTF-8,
// already case-folded); it is left alone otherwise.
bool patternsOverlap(const char* a, const char* b, std::string* witness = nullptr);

// The same with lists compiled by CCommon::getParseInfo, borrowed for the call. As with
// CCommon::patternMatches, a null list is compiled from its pattern on the spot, and the "*"
// pattern matches everything whatever its list.
bool patternsOverlap(const char* a, const _PARSE_INFO* aList, const char* b,
                     const _PARSE_INFO* bList, std::string* witness = nullptr);
