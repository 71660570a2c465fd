#include "core/analyzer/intake/sm3_parser.h"

#include <cstring>

#include "core/analyzer/intake/common.h"
#include "core/analyzer/intake/sm3_fields.h"
#include "core/runtime/clog.h"

namespace {

// Longest content quoted whole in the failure trace.
constexpr size_t kMaxQuotedLine = 7000;

// Reads the fields of line into entry by its layout. The caret count has been checked, so
// every field is present.
template <size_t N>
void ReadFields(char* line, const SM3_FIELD_SLOT (&layout)[N], void* entry) {
  char* cursor = line;
  char* base = static_cast<char*>(entry);
  for (const SM3_FIELD_SLOT& slot : layout) {
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

bool HasCarets(char* line, int expected, const char* where) {
  if (CCommon::countCarets(line) == expected) {
    return true;
  }
  // The BEL after the location marks the record as an error for whoever reads the trace.
  CLOG::trace(64, "%s \aERROR Wrong number of carets in this line\n", where);
  return false;
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
  if (!HasCarets(line, SM3_HPAGE_CARETS, kWhere)) {
    return nullptr;
  }
  SM3_HPAGE_ENTRY entry;
  memset(&entry, 0, sizeof(entry));
  ReadFields(line, SM3_HPAGE_LAYOUT, &entry);
  ClampNetworkTime(&entry.iNetworkTime, kWhere);
  return std::make_unique<CDPXTransaction>(entry);
}

std::unique_ptr<CDPXTransaction> processAVSM3Line(char* line) {
  static const char* const kWhere = "processAVSM3Line";
  if (!HasCarets(line, SM3_AV_CARETS, kWhere)) {
    return nullptr;
  }
  _SM3_AV_ENTRY object;
  memset(&object, 0, sizeof(object));
  ReadFields(line, SM3_AV_LAYOUT, &object);
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
