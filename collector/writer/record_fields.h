#pragma once

// Reading back the few fields of a record text that the ground truth needs: kind, time stamp,
// server address, response time, URL, status and (page layout) URL host. The layouts are the
// ones sm3gen writes: 46 '^'-separated fields for <hpage> and <hobj>, 31 for <audio> and
// <video>.

#include <string_view>

#include "collector/sm3gen/record.h"

namespace collector {

// Parses one complete record (its line end may follow). False when the tag, the field count
// or a number is not what the layout says; *out is then unspecified.
bool ParseRecordFields(std::string_view text, sm3gen::Record* out);

}  // namespace collector
