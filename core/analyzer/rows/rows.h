#pragma once

// The sixteen row classes: eight over-time rows (one key in one interval, fed transaction by
// transaction) and eight summary rows (one key over the summary period, folded from exported
// over-time rows). Each is its key (fields in storage order, and the order its tree sorts by)
// and its layouts; rows/keyed_row.h does the rest.
//
// The over-time and summary sort orders differ on purpose for the client/application,
// server/application and transaction rows. CClientAppSummary labels its client "ClientNAme".
//
// Threads and ownership as CBaseTable: rows live in the analyzer's trees, which own them.

#include "core/analyzer/rows/analyzer_tables.h"
#include "core/analyzer/rows/keyed_row.h"

namespace rows {

using K = Key;

// Storage order first; then the sort order as indexes into it.
inline constexpr KeySpec<1> kApplicationKeys{{K::kApplication}, {0}};
inline constexpr KeySpec<2> kClientAppOverTimeKeys{{K::kApplication, K::kClient}, {0, 1}};
inline constexpr KeySpec<2> kClientAppSummaryKeys{
    {K::kApplication, K::kClient}, {1, 0}, "ClientNAme=%s\n"};
inline constexpr KeySpec<2> kServerAppOverTimeKeys{{K::kApplication, K::kServer}, {0, 1}};
inline constexpr KeySpec<2> kServerAppSummaryKeys{{K::kApplication, K::kServer}, {1, 0}};
inline constexpr KeySpec<4> kTransactionOverTimeKeys{
    {K::kApplication, K::kServer, K::kClient, K::kTransaction}, {3, 0, 2, 1}};
inline constexpr KeySpec<4> kTransactionSummaryKeys{
    {K::kApplication, K::kServer, K::kClient, K::kTransaction}, {0, 1, 3, 2}};
inline constexpr KeySpec<3> kSubTransactionKeys{{K::kTransaction, K::kParentId, K::kCurrentId},
                                                {1, 2, 0}};
inline constexpr KeySpec<3> kClientKeys{{K::kClient, K::kClientIP, K::kHostname}, {1, 2, 0}};
inline constexpr KeySpec<2> kClientServerKeys{{K::kClient, K::kServer}, {1, 0}};
inline constexpr KeySpec<2> kServerKeys{{K::kServer, K::kServerIP}, {0, 1}};

}  // namespace rows

#define Q7_OVER_TIME_ROW(Name, keys, layout)                   \
  class Name final : public rows::TOverTimeRow<keys, layout> { \
   public:                                                     \
    using rows::TOverTimeRow<keys, layout>::TOverTimeRow;      \
  };
#define Q7_SUMMARY_ROW(Name, keys, overTime, layout)                    \
  class Name final : public rows::TSummaryRow<keys, overTime, layout> { \
   public:                                                              \
    using rows::TSummaryRow<keys, overTime, layout>::TSummaryRow;       \
  };

#define Q7_OVER_TIME_ROW_ENTRY(name, Row, keys, Tree, EXPORT) \
  Q7_OVER_TIME_ROW(Row, keys, kq7_q7##name##_data_t)
#define Q7_SUMMARY_ROW_ENTRY(name, Row, keys, overTime) \
  Q7_SUMMARY_ROW(Row, keys, kq7_q7##overTime##_data_t, kq7_q7##name##_data_t)
Q7_ANALYZER_TABLES(Q7_OVER_TIME_ROW_ENTRY, Q7_SUMMARY_ROW_ENTRY, Q7_NO_CURRENT, Q7_NO_INSTANCE)
#undef Q7_SUMMARY_ROW_ENTRY
#undef Q7_OVER_TIME_ROW_ENTRY

#undef Q7_SUMMARY_ROW
#undef Q7_OVER_TIME_ROW
