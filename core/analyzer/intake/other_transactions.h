#pragma once

// The two other record kinds an aggregate row can take: ARM measurements (CARMTransaction) and
// client-side browser measurements (CLYNTransaction). This agent's collector produces neither;
// they carry only what the row arithmetic reads. Ownership and threads as CTransaction.

#include <cstdint>

#include "core/analyzer/intake/transaction.h"

// True trans type of a client-side record whose browser flag the rows keep.
inline constexpr int TRUE_TRANS_TYPE_LYN_BROWSER = 4;

class CARMTransaction : public CTransaction {
 public:
  // Metric times of the transaction, ms.
  int32_t connectTime = 0;
  int32_t dnsTime = 0;
  int32_t responseTime = 0;
  int32_t serverTime = 0;
  bool failed = false;  // the application reported the transaction as failed
};

class CLYNTransaction : public CTransaction {
 public:
  int32_t responseTime = 0;  // ms
  int32_t connectTime = 0;   // ms
  int32_t downloadTime = 0;  // ms
  bool failed = false;
};
