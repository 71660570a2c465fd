#pragma once

// Reference path of CCommon::patternMatches, for tests and benchmarks that compare the ASCII
// fast path against it. Not for production callers.

#include "core/analyzer/intake/parse_info.h"

namespace pattern_internal {

// Matches text against list always through ICU folding, never the ASCII fast path. Both must
// be non-null.
bool matchIcu(const _PARSE_INFO* list, const char* text);

}  // namespace pattern_internal
