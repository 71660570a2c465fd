#pragma once

// The tables the analyzer answers, listed once for the query declarations and definitions, and
// the current-status conversions.

#include "core/layouts/table_layouts.h"

// Over-time tables: name (kq7_q7<name>_data_t, history stem q7<name>).
#define Q7_OVER_TIME_QUERIES(X) \
  X(appot) X(clntappot) X(clntot) X(clntsrvot) X(srvappot) X(srvot) X(txot) X(subtxot)
// Summary tables.
#define Q7_SUMMARY_QUERIES(X) \
  X(appsm) X(clntapp) X(clntsm) X(clntsrv) X(srvappsm) X(srvsm) X(txsm) X(subtxsm)
// Instance tables.
#define Q7_INSTANCE_QUERIES(X) X(txins) X(subtxins)

// Largest number of historical rows one query loads.
inline constexpr int MAX_ROWS = 25000;

// A current-status row from an over-time row: every column of the same name, aggby left out.
void q7_convert_appot_to_appcs(const kq7_q7appot_data_t& from, kq7_q7appcs_data_t& to);
void q7_convert_txot_to_txcs(const kq7_q7txot_data_t& from, kq7_q7txcs_data_t& to);
void q7_convert_clntot_to_clntcs(const kq7_q7clntot_data_t& from, kq7_q7clntcs_data_t& to);
void q7_convert_srvot_to_srvcs(const kq7_q7srvot_data_t& from, kq7_q7srvcs_data_t& to);
