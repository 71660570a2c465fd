#pragma once

// Parsing one record's content (the text between its tags) into a transaction.
//
// A line is rejected unless it has exactly the caret count of its layout; a too-long field is cut
// to its slot; an integer field without digits reads 0. The last field of a line has no caret
// behind it and is read as its first character only: a page's method code is one digit, and an
// object's network time is read from its first digit ("250" reads 2, "-5" reads 0).
//
// Thread safety: no shared state.

#include <cstddef>
#include <memory>

#include "core/analyzer/intake/dpx_transaction.h"
#include "core/analyzer/intake/sm3_fields.h"

// A page line (record types 1 and 2): 46 fields. Null when the line is rejected (with a trace).
// A negative network time is traced and stored as 0.
std::unique_ptr<CDPXTransaction> processHSM3Line(char* line);

// An audio or video line (record types 3 and 4): 31 fields, converted to a page entry. Null when
// the line is rejected (with a trace).
std::unique_ptr<CDPXTransaction> processAVSM3Line(char* line);

// The parse step of a data file monitor's record processing: types 1 and 2 go to the page-line
// parser, 3 and 4 to the object-line parser. A line that yields no transaction (rejected, or a
// record type outside 1 to 4) is traced with its content, quoted up to 7000 characters, and
// null is returned; the caller moves on to the next record.
std::unique_ptr<CDPXTransaction> createDPXTransaction(char* line, int recordType);

// The field reader's two halves, and the literal cursor-by-cursor reader it replaces, for tests
// that compare them on random lines. Not for production callers.
namespace sm3_internal {

// Counts the carets of line (up to its NUL) and stores the positions of the first capacity.
int FindCarets(const char* line, const char** carets, int capacity);
// Reads fields (a layout's slot count) into entry from line, whose first fields - 1 carets are
// in carets.
void ReadFieldsAt(const char* line, const char* const* carets, const SM3_FIELD_SLOT* layout,
                  size_t fields, void* entry);
// The same through getNextField/getNextInteger/skipField, advancing a cursor field by field.
void ReadFieldsLiteral(char* line, const SM3_FIELD_SLOT* layout, size_t fields, void* entry);

}  // namespace sm3_internal
