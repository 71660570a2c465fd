#include "collector/sm3gen/record_stream.h"

#include "collector/sm3gen/record_format.h"

namespace sm3gen {

RecordStream::RecordStream(const ModelOptions& model, const StreamOptions& stream)
    : model_(model),
      options_(stream),
      rng_(Mix64(model.seed ^ 0x6e6f697365000000ULL)),
      truth_(model.seed) {}

void RecordStream::MaybeAppendJunk(std::string* out) {
  ++started_;
  if (options_.junk_every <= 0 || started_ % options_.junk_every != 0) {
    return;
  }
  const int64_t length = rng_.UniformInt(1, 40);
  for (int64_t i = 0; i < length; ++i) {
    // Mostly printable, some high bytes; never '<', which would look like a tag, and never NUL.
    int64_t byte = rng_.Chance(0.15) ? rng_.UniformInt(0x80, 0xff) : rng_.UniformInt(0x20, 0x7e);
    if (byte == '<') {
      byte = '#';
    }
    out->push_back(static_cast<char>(byte));
  }
  truth_.AddJunkBlock();
  truth_.AddBytes(static_cast<uint64_t>(length));
}

void RecordStream::AppendRecord(std::string* out) {
  MaybeAppendJunk(out);
  const size_t begin = out->size();
  const Record record = model_.Next();
  sm3gen::AppendRecord(record, out);
  const bool crlf = options_.line_end == LineEnd::kCrLf ||
                    (options_.line_end == LineEnd::kMixed && rng_.Chance(0.5));
  out->append(crlf ? "\r\n" : "\n");
  truth_.AddRecord(record);
  truth_.AddBytes(out->size() - begin);
}

void RecordStream::AppendTruncatedRecord(std::string* out) {
  MaybeAppendJunk(out);
  const std::string text = FormatRecord(model_.Next());
  // Keep the header tag and a quarter to three quarters of the rest; the trailer is far
  // shorter than the last quarter, so none of it survives.
  const size_t tag_end = text.find('>') + 1;
  const size_t rest = text.size() - tag_end;
  const size_t keep =
      tag_end + static_cast<size_t>(rng_.UniformInt(static_cast<int64_t>(rest / 4),
                                                    static_cast<int64_t>(rest * 3 / 4)));
  out->append(text, 0, keep);
  truth_.SetTruncatedTail();
  truth_.AddBytes(keep);
}

}  // namespace sm3gen
