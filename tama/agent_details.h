#pragma once

// The agent-details table (Q7AGNTDTS): one row per agent property, as a sample sees them.

#include "core/layouts/table_layouts.h"

// A new[] array of one row per agent property, or null with count 0 when there are none or the
// sample type is not 3. timestamp and sampletime are the sample time.
kq7_q7agntdts_data_t* getAgentDetailRows(int sampleType, int* count);
