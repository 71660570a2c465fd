#pragma once

// The query parameters of a table sample over HTTP (where, limit, format) and the two forms of
// its answer. Kept apart from the server so both can be tested without a socket.
//
//   where=COLUMN OP VALUE   COLUMN an attribute name in any case; OP one of EQ NE LT LE GT GE
//                           in any case; VALUE everything after the second blank
//   limit=N                 at most N rows, counted after filtering
//   format=json|csv
//
// Thread safety: pure functions of their arguments.

#include <cstddef>
#include <nlohmann/json.hpp>
#include <span>
#include <string>
#include <string_view>

#include "framework/request.h"
#include "framework/table_sample.h"
#include "framework/tables.h"

namespace fw {

enum class SampleFormat { kJson, kCsv };

// Parses "COLUMN OP VALUE" against a table's columns into *condition (column spelled as the
// table spells it). Returns kOk, or kInvalidArgument with *error naming the problem: fewer than
// three parts, a column the table lacks, an unknown operator, or a value that is not a whole
// number for an integer column.
int ParseWhere(std::string_view text, std::span<const ColumnInfo> columns, Condition* condition,
               std::string* error);

// Parses a non-negative decimal row count. Returns kOk or kInvalidArgument with *error.
int ParseLimit(std::string_view text, std::size_t* limit, std::string* error);

// Parses "json" or "csv". Returns kOk or kInvalidArgument with *error.
int ParseSampleFormat(std::string_view text, SampleFormat* format, std::string* error);

// {"table": NAME, "rows": [{attribute: value, ...}, ...]}: attributes in column order, text
// without its padding, integers as numbers. Text is copied byte for byte; dump it with a
// replacing error handler, since rows need not be valid UTF-8.
nlohmann::ordered_json SampleToJson(const Sample& sample);

// SampleToJson(sample) as an HTTP reply carries it: dumped with an indent of 2 and the
// replacing error handler, then "\n". Written straight from the rows, without the document
// tree, which costs far more than the text for samples of thousands of rows.
std::string SampleToJsonText(const Sample& sample);

// A header line of attribute names, then one line per row, each ended by '\n'. Fields holding a
// comma, a quote or a line end are quoted, with quotes doubled.
std::string SampleToCsv(const Sample& sample);

}  // namespace fw
