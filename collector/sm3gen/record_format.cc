#include "collector/sm3gen/record_format.h"

#include <cassert>
#include <charconv>
#include <string_view>

namespace sm3gen {
namespace {

// Appends fields with a '^' between each pair.
class FieldJoiner {
 public:
  explicit FieldJoiner(std::string* out) : out_(out) {}

  void Text(std::string_view value) {
    assert(value.find_first_of(std::string_view("^<\r\n\0", 5)) == std::string_view::npos &&
           "a value would break the record framing");
    Separate();
    out_->append(value);
  }
  void Int(int32_t value) {
    Separate();
    char buffer[16];
    const auto result = std::to_chars(buffer, buffer + sizeof(buffer), value);
    out_->append(buffer, result.ptr);
  }
  int count() const { return count_; }

 private:
  void Separate() {
    if (count_++ > 0) {
      out_->push_back('^');
    }
  }

  std::string* out_;
  int count_ = 0;
};

void AppendCommonFields(const Record& r, FieldJoiner* f) {
  f->Text(r.product_version);
  f->Text(r.application_id);
  f->Text(r.reserved1);
  f->Text(r.collector_id);
  f->Text(r.guid);
  f->Int(r.time_utc);
  f->Text(r.date);
  f->Text(r.time_of_day);
  f->Int(r.gmt_offset);
  f->Text(r.time_zone);
  f->Text(r.client_address);
  f->Int(r.client_port);
  f->Text(r.server_address);
  f->Int(r.server_port);
  f->Int(r.response_ms);
  f->Int(r.request_packets);
  f->Int(r.request_ack_packets);
  f->Int(r.reply_packets);
  f->Int(r.reply_ack_packets);
  f->Int(r.total_bytes);
  f->Int(r.request_bytes);
  f->Int(r.reply_bytes);
}

void AppendPageLayout(const Record& r, FieldJoiner* f) {
  AppendCommonFields(r, f);
  f->Text(r.url);
  f->Text(r.referrer);
  f->Text(r.browser);
  f->Text(r.server_description);
  f->Text(r.protocol);
  f->Int(r.status);
  f->Int(r.server_ms);
  f->Int(r.resolve_ms);
  f->Int(r.load_ms);
  f->Int(r.object_count);
  f->Int(r.object_bytes);
  f->Int(r.header_requests);
  f->Int(r.header_resolve_ms);
  f->Int(r.network_ms);
  f->Int(0);  // reserved 2-4
  f->Int(0);
  f->Int(0);
  f->Text(r.host);
  f->Text(r.url_path);
  f->Text(r.url_file);
  f->Text(r.url_query);
  f->Text(r.url_anchor);
  f->Text(r.title);
  f->Int(static_cast<int32_t>(r.method));
  assert(f->count() == kPageLayoutFields);
}

void AppendObjectLayout(const Record& r, FieldJoiner* f) {
  AppendCommonFields(r, f);
  f->Int(r.duration_ms);
  f->Text(r.url);
  f->Text(r.referrer);
  f->Text(r.browser);
  f->Text(r.server_description);
  f->Text(r.protocol);
  f->Int(r.status);
  f->Int(r.bit_rate_kbps);
  f->Int(r.network_ms);
  assert(f->count() == kObjectLayoutFields);
}

}  // namespace

void AppendRecord(const Record& record, std::string* out) {
  const std::string_view tag = KindTag(record.kind);
  out->push_back('<');
  out->append(tag);
  out->push_back('>');
  FieldJoiner fields(out);
  if (UsesPageLayout(record.kind)) {
    AppendPageLayout(record, &fields);
  } else {
    AppendObjectLayout(record, &fields);
  }
  out->append("</");
  out->append(tag);
  out->push_back('>');
}

std::string FormatRecord(const Record& record) {
  std::string out;
  AppendRecord(record, &out);
  return out;
}

}  // namespace sm3gen
