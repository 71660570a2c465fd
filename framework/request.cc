#include "framework/request.h"

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
