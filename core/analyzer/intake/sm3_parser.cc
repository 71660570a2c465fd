#include "core/analyzer/intake/sm3_parser.h"

#include <cstring>

#if defined(__SSE2__)
#include <emmintrin.h>
#endif

#include "core/analyzer/intake/common.h"
#include "core/analyzer/intake/sm3_fields.h"
#include "core/runtime/clog.h"

namespace {

// Longest content quoted whole in the failure trace.
constexpr size_t kMaxQuotedLine = 7000;

// The value of a field's first min(length, 16) characters, as getNextInteger reads them.
int32_t FieldInteger(const char* start, size_t length) {
  char field[17];
  const size_t n = length < 16 ? length : 16;
  memcpy(field, start, n);
  field[n] = '\0';
  return static_cast<int32_t>(decimalFieldValue(field));
}

}  // namespace

namespace sm3_internal {

int FindCarets(const char* line, const char** carets, int capacity) {
  // Sixteen bytes at a time (SSE2, which every x86-64 has): one compare and one mask per block,
  // then a step per caret found.
  static_assert(CARET == 0x5E);
  const size_t length = strlen(line);
  int count = 0;
  const auto note = [&](size_t at) {
    if (count < capacity) {
      carets[count] = line + at;
    }
    ++count;
  };
  size_t i = 0;
#if defined(__SSE2__)
  const __m128i caret = _mm_set1_epi8(CARET);
  for (; i + 16 <= length; i += 16) {
    const __m128i block = _mm_loadu_si128(reinterpret_cast<const __m128i*>(line + i));
    unsigned mask = static_cast<unsigned>(_mm_movemask_epi8(_mm_cmpeq_epi8(block, caret)));
    while (mask != 0) {
      note(i + static_cast<size_t>(__builtin_ctz(mask)));
      mask &= mask - 1;
    }
  }
#endif
  for (; i < length; ++i) {
    if (line[i] == CARET) {
      note(i);
    }
  }
  return count;
}

void ReadFieldsAt(const char* line, const char* const* carets, const SM3_FIELD_SLOT* layout,
                  size_t fields, void* entry) {
  char* base = static_cast<char*>(entry);
  for (size_t k = 0; k < fields; ++k) {
    const SM3_FIELD_SLOT& slot = layout[k];
    const char* start = k == 0 ? line : carets[k - 1] + 1;
    // The last field has no caret behind it and is read as its first character only.
    const size_t length =
        k + 1 < fields ? static_cast<size_t>(carets[k] - start) : (*start != '\0' ? 1 : 0);
    char* field = base + slot.offset;
    switch (slot.kind) {
      case SM3FieldKind::kText: {
        const size_t n = length < static_cast<size_t>(slot.width - 1) ? length : slot.width - 1;
        memcpy(field, start, n);
        field[n] = '\0';
        break;
      }
      case SM3FieldKind::kInteger: {
        const int32_t value = FieldInteger(start, length);
        memcpy(field, &value, sizeof(value));
        break;
      }
      case SM3FieldKind::kSkipped:
        break;
    }
  }
}

void ReadFieldsLiteral(char* line, const SM3_FIELD_SLOT* layout, size_t fields, void* entry) {
  char* cursor = line;
  char* base = static_cast<char*>(entry);
  for (size_t k = 0; k < fields; ++k) {
    const SM3_FIELD_SLOT& slot = layout[k];
    char* field = base + slot.offset;
    switch (slot.kind) {
      case SM3FieldKind::kText:
        CCommon::getNextField(&cursor, field, slot.width);
        break;
      case SM3FieldKind::kInteger: {
        const int32_t value = CCommon::getNextInteger(&cursor);
        memcpy(field, &value, sizeof(value));
        break;
      }
      case SM3FieldKind::kSkipped:
        cursor = CCommon::skipField(cursor);
        break;
    }
  }
}

}  // namespace sm3_internal

namespace {

// Checks the caret count and reads the fields of line into entry by its layout, finding every
// caret in one pass. False, with the trace, when the count is wrong.
template <size_t N>
bool ReadFields(char* line, const SM3_FIELD_SLOT (&layout)[N], void* entry, const char* where) {
  const char* carets[N];
  if (sm3_internal::FindCarets(line, carets, N) != static_cast<int>(N) - 1) {
    // The BEL after the location marks the record as an error for whoever reads the trace.
    CLOG::trace(64, "%s \aERROR Wrong number of carets in this line\n", where);
    return false;
  }
  sm3_internal::ReadFieldsAt(line, carets, layout, N, entry);
  return true;
}

void ClampNetworkTime(int32_t* networkTime, const char* where) {
  if (*networkTime < 0) {
    CLOG::min("%s Parsed in a negative networktime[%ld]", where, static_cast<long>(*networkTime));
    CLOG::min("%s setting networktime to 0", where);
    *networkTime = 0;
  }
}

}  // namespace

std::unique_ptr<CDPXTransaction> processHSM3Line(char* line) {
  static const char* const kWhere = "processHSM3Line";
  // Parsed straight into the transaction's own entry: no copy of the record on the way.
  bool parsed = false;
  auto transaction = std::make_unique<CDPXTransaction>(
      CDPXTransaction::kFilledInPlace, [&](SM3_HPAGE_ENTRY& entry) {
        parsed = ReadFields(line, SM3_HPAGE_LAYOUT, &entry, kWhere);
        if (parsed) {
          ClampNetworkTime(&entry.iNetworkTime, kWhere);
        }
        return parsed;
      });
  return parsed ? std::move(transaction) : nullptr;
}

std::unique_ptr<CDPXTransaction> processAVSM3Line(char* line) {
  static const char* const kWhere = "processAVSM3Line";
  _SM3_AV_ENTRY object;
  memset(&object, 0, sizeof(object));
  if (!ReadFields(line, SM3_AV_LAYOUT, &object, kWhere)) {
    return nullptr;
  }
  ClampNetworkTime(&object.iNetworkTime, kWhere);
  SM3_HPAGE_ENTRY entry;
  convertAVEtoHPE(&object, &entry);
  return std::make_unique<CDPXTransaction>(entry);
}

std::unique_ptr<CDPXTransaction> createDPXTransaction(char* line, int recordType) {
  static const char* const kWhere = "processSM3Line";
  std::unique_ptr<CDPXTransaction> transaction;
  switch (recordType) {
    case SM3_RECORD_HPAGE:
    case SM3_RECORD_HOBJ:
      transaction = processHSM3Line(line);
      break;
    case SM3_RECORD_AUDIO:
    case SM3_RECORD_VIDEO:
      transaction = processAVSM3Line(line);
      break;
    default:
      break;
  }
  if (transaction) {
    return transaction;
  }
  if (strlen(line) < kMaxQuotedLine) {
    CLOG::min(
        "%s\aERROR: Failed to create a CDPXTransaction object from input pszSM3Line[%s] of "
        "type[%d]",
        kWhere, line, recordType);
  } else {
    char quoted[kMaxQuotedLine + 1];
    memcpy(quoted, line, kMaxQuotedLine);
    quoted[kMaxQuotedLine] = '\0';
    CLOG::min(
        "%s\aERROR: Failed to create a CDPXTransaction object from WAY TOO BIG input pszSM3Line "
        "(truncated)[%s] of type[%d]",
        kWhere, quoted, recordType);
  }
  CLOG::min("%s  Line will be ignored", kWhere);
  return nullptr;
}
