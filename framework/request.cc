#include "framework/request.h"

#include <cctype>

#include "framework/status.h"

namespace fw {

std::string_view ConditionOpName(ConditionOp op) {
  switch (op) {
    case ConditionOp::kEQ:
      return "EQ";
    case ConditionOp::kNE:
      return "NE";
    case ConditionOp::kLT:
      return "LT";
    case ConditionOp::kLE:
      return "LE";
    case ConditionOp::kGT:
      return "GT";
    case ConditionOp::kGE:
      return "GE";
  }
  return "?";
}

bool ParseConditionOp(std::string_view text, ConditionOp* op) {
  for (const ConditionOp candidate : {ConditionOp::kEQ, ConditionOp::kNE, ConditionOp::kLT,
                                      ConditionOp::kLE, ConditionOp::kGT, ConditionOp::kGE}) {
    const std::string_view name = ConditionOpName(candidate);
    bool same = name.size() == text.size();
    for (std::size_t i = 0; same && i < name.size(); ++i) {
      same = std::toupper(static_cast<unsigned char>(text[i])) == name[i];
    }
    if (same) {
      *op = candidate;
      return true;
    }
  }
  return false;
}

int AddRows(Request* request, const void* rows, std::size_t row_size, int count) {
  if (request == nullptr || count < 0 || (rows == nullptr && count > 0) || row_size == 0 ||
      (request->row_size != 0 && request->row_size != row_size)) {
    return kInvalidArgument;
  }
  request->row_size = row_size;
  const auto* bytes = static_cast<const std::byte*>(rows);
  request->rows.insert(request->rows.end(), bytes, bytes + row_size * count);
  return kOk;
}

}  // namespace fw
