#pragma once

// Parsing one record's content (the text between its tags) into a transaction.
//
// A line is rejected unless it has exactly the caret count of its layout; a too-long field is cut
// to its slot; an integer field without digits reads 0. The last field of a line has no caret
// behind it and is read as its first character only: a page's method code is one digit, and an
// object's network time is read from its first digit ("250" reads 2, "-5" reads 0).
//
// Thread safety: no shared state.

#include <memory>

#include "core/analyzer/intake/dpx_transaction.h"

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
