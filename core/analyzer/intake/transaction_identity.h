#pragma once

// The identity of a collector record within its page: the record's own UUID is the MD5 of the
// agent's origin node name followed by the URL, so every record of one URL seen by one agent
// shares it; the instance root tells their occurrences apart. Objects name the page before them
// as root and parent, and share its instance root.
//
// The identity state (previous page identifier, instance counter, page-seen flag) belongs to one
// data file monitor run and is touched by that monitor's thread only.

#include <cstdint>

#include "core/analyzer/intake/md5_generator.h"

class CDPXTransaction;

// Starts generator afresh and feeds it the origin node name, then the URL (no separator).
void initDPXTransMD5(const char* originNode, const char* url, CMD5Generator& generator);

// The instance counter a monitor run starts with: now, in seconds since 1970, in the upper 32
// bits.
int64_t initialInstanceCounter();

// Gives transaction its current, root and parent UUID, instance root and control flags from its
// URL and record type. A page (record type 1, or any type that is not an object) takes the next
// counter value and becomes *previousPage; an object (types 2 to 4) names *previousPage as root
// and parent and takes the counter value of the page before it. previousPage must not be null.
void doUUIDs(CDPXTransaction& transaction, CUUID* previousPage, int64_t* instanceCounter,
             bool* pageSeen);
