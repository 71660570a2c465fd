#pragma once

// The tables the analyzer keeps and answers, each listed once with everything bound to it. The
// row layouts (kq7_q7<name>_data_t) come from core/layouts/table_layouts.h; every other place
// that names one of these tables is stamped out from this list: the row classes (rows.h), the
// over-time trees and their history stems (analysis/over_time_trees), the queries
// get_tbl<name> (dpx_analyzer.h, analysis/table_queries.cc) and the binding of each exported
// table's sampling to its query (tama/process_parts.cc).
//
//   OVER_TIME(name, Row, keys, Tree, EXPORT)
//     Row: the over-time row class over keys; kept in tree OverTimeTable::Tree; saved as history
//     stem "q7<name>". EXPORT is EXPORTED, or HISTORY_ONLY for the pairings whose only table is
//     their summary. Listed in the order transaction processing updates a page's tables (then
//     the sub-transaction table): the order of the trees.
//   SUMMARY(name, Row, keys, overTime)
//     Row: the summary row class over keys, folded from the over-time table overTime.
//   CURRENT(name, overTime, COLUMNS)
//     Current-status rows: the current interval's overTime rows without aggby (COLUMNS: the
//     layout's column list).
//   INSTANCE(name)
//     Instance rows, kept in the instance files of stem "q7<name>".

// clang-format off
#define Q7_ANALYZER_TABLES(OVER_TIME, SUMMARY, CURRENT, INSTANCE)                                \
  OVER_TIME(appot, CApplicationOverTime, rows::kApplicationKeys, kApplication, EXPORTED)        \
  OVER_TIME(srvappot, CServerAppOverTime, rows::kServerAppOverTimeKeys, kServerApp,             \
            HISTORY_ONLY)                                                                       \
  OVER_TIME(srvot, CServerOverTime, rows::kServerKeys, kServer, EXPORTED)                       \
  OVER_TIME(clntsrvot, CClientServerOverTime, rows::kClientServerKeys, kClientServer,           \
            HISTORY_ONLY)                                                                       \
  OVER_TIME(clntot, CClientOverTime, rows::kClientKeys, kClient, EXPORTED)                      \
  OVER_TIME(txot, CTransactionOverTime, rows::kTransactionOverTimeKeys, kTransaction, EXPORTED) \
  OVER_TIME(clntappot, CClientAppOverTime, rows::kClientAppOverTimeKeys, kClientApp,            \
            HISTORY_ONLY)                                                                       \
  OVER_TIME(subtxot, CSubTransactionOverTime, rows::kSubTransactionKeys, kSubTransaction,       \
            EXPORTED)                                                                           \
  SUMMARY(appsm, CApplicationSummary, rows::kApplicationKeys, appot)                            \
  SUMMARY(clntapp, CClientAppSummary, rows::kClientAppSummaryKeys, clntappot)                   \
  SUMMARY(clntsm, CClientSummary, rows::kClientKeys, clntot)                                    \
  SUMMARY(clntsrv, CClientServerSummary, rows::kClientServerKeys, clntsrvot)                    \
  SUMMARY(srvappsm, CServerAppSummary, rows::kServerAppSummaryKeys, srvappot)                   \
  SUMMARY(srvsm, CServerSummary, rows::kServerKeys, srvot)                                      \
  SUMMARY(txsm, CTransactionSummary, rows::kTransactionSummaryKeys, txot)                       \
  SUMMARY(subtxsm, CSubTransactionSummary, rows::kSubTransactionKeys, subtxot)                  \
  CURRENT(appcs, appot, Q7_COLS_APPCS)                                                          \
  CURRENT(txcs, txot, Q7_COLS_TXCS)                                                             \
  CURRENT(clntcs, clntot, Q7_COLS_CLNTCS)                                                       \
  CURRENT(srvcs, srvot, Q7_COLS_SRVCS)                                                          \
  INSTANCE(txins)                                                                               \
  INSTANCE(subtxins)
// clang-format on

// For the users of the list that need only some kinds of entry.
#define Q7_NO_OVER_TIME(name, Row, keys, Tree, EXPORT)
#define Q7_NO_SUMMARY(name, Row, keys, overTime)
#define Q7_NO_CURRENT(name, overTime, COLUMNS)
#define Q7_NO_INSTANCE(name)
