#include "collector/writer/record_fields.h"

#include <charconv>
#include <string>
#include <vector>

namespace collector {
namespace {

// 0-based field positions.
constexpr size_t kTime = 5;
constexpr size_t kServerAddress = 12;
constexpr size_t kResponse = 14;
constexpr size_t kPageUrl = 22;
constexpr size_t kPageStatus = 27;
constexpr size_t kPageHost = 39;
constexpr size_t kObjectUrl = 23;
constexpr size_t kObjectStatus = 28;

bool ToInt(std::string_view text, int32_t* value) {
  const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), *value);
  return !text.empty() && error == std::errc() && end == text.data() + text.size();
}

}  // namespace

bool ParseRecordFields(std::string_view text, sm3gen::Record* out) {
  while (!text.empty() && (text.back() == '\n' || text.back() == '\r')) {
    text.remove_suffix(1);
  }
  const size_t tag_end = text.find('>');
  if (text.empty() || text.front() != '<' || tag_end == std::string_view::npos) {
    return false;
  }
  const std::string_view tag = text.substr(1, tag_end - 1);
  const std::string trailer = "</" + std::string(tag) + ">";
  if (!text.ends_with(trailer) || text.size() < tag_end + 1 + trailer.size()) {
    return false;
  }
  bool known = false;
  for (int kind = 1; kind <= 4; ++kind) {
    if (sm3gen::KindTag(static_cast<sm3gen::RecordKind>(kind)) == tag) {
      out->kind = static_cast<sm3gen::RecordKind>(kind);
      known = true;
    }
  }
  if (!known) {
    return false;
  }
  std::string_view content = text.substr(tag_end + 1, text.size() - tag_end - 1 - trailer.size());
  std::vector<std::string_view> fields;
  while (true) {
    const size_t caret = content.find('^');
    fields.push_back(content.substr(0, caret));
    if (caret == std::string_view::npos) {
      break;
    }
    content.remove_prefix(caret + 1);
  }
  const bool page_layout = sm3gen::UsesPageLayout(out->kind);
  if (fields.size() !=
      static_cast<size_t>(page_layout ? sm3gen::kPageLayoutFields : sm3gen::kObjectLayoutFields)) {
    return false;
  }
  out->server_address = std::string(fields[kServerAddress]);
  out->url = std::string(fields[page_layout ? kPageUrl : kObjectUrl]);
  out->host = page_layout ? std::string(fields[kPageHost]) : std::string();
  return ToInt(fields[kTime], &out->time_utc) && ToInt(fields[kResponse], &out->response_ms) &&
         ToInt(fields[page_layout ? kPageStatus : kObjectStatus], &out->status);
}

}  // namespace collector
