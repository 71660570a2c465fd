#pragma once

// Instance rows: one row per traced transaction, kept in the instance files rather than
// aggregated. Built from the processed working copy, the patterns it matched and its original
// recorded time.

#include "core/analyzer/intake/dpx_transaction.h"
#include "core/layouts/table_layouts.h"

// The pattern texts an instance row names (empty for a made-up match).
struct InstancePatterns {
  const char* applicationPattern = "";
  const char* transactionPattern = "";
  const char* clientName = "";
  const char* clientHostPattern = "";
  const char* clientIPPattern = "";
};

void buildInstanceRow(const CDPXTransaction& t, const InstancePatterns& patterns,
                      kq7_q7txins_data_t& row);
void buildInstanceRow(const CDPXTransaction& t, const InstancePatterns& patterns,
                      kq7_q7subtxins_data_t& row);
