#pragma once

// _TYPED_TRANSACTION: the item of the analyzer's transaction queue, copied by value.
//
// Ownership of the record travels with the item: a producer gives it up when Put succeeds (and
// keeps it when Put fails), the consumer owns it after Get and deletes it when done. The type
// code says what the record is; the codes belong to the analyzer, and 5 is a web transaction.

#include <cstdint>

class CTransaction;  // the transaction record, defined with the intake classes

struct _TYPED_TRANSACTION {
  uint32_t type = 0;                    // kind of transaction record; 5 = web transaction
  CTransaction* transaction = nullptr;  // owning; heap-allocated
};
