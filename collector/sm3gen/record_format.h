#pragma once

// Writing one record in the collector's text form: "<tag>" + the fields joined by '^' +
// "</tag>", without the line end (the caller chooses it). Values are written as they are; the
// traffic model is responsible for keeping them free of '^', '<' and line-end characters.

#include <string>

#include "collector/sm3gen/record.h"

namespace sm3gen {

// Appends record to *out.
void AppendRecord(const Record& record, std::string* out);

// The record as one string.
std::string FormatRecord(const Record& record);

}  // namespace sm3gen
