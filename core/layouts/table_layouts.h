#pragma once

// The exported tables and row layouts, described once.
//
// Every table (and the over-time layouts of the three pairings that have no exported table) is
// a list of columns COL(kind, name, width) in row order:
//   S  fixed-width string, stored byte-wise at full width, unterminated when full
//   I  signed 32-bit integer (width 4)
//   H  signed 16-bit integer (width 2)
//   X  long text of the given width
// Integers are aligned to their own size, which is exactly how a C++ struct of these members is
// laid out, so the row types below are plain structs and a column's position is its offsetof.
//
// From these lists come the row types (kq7_<table>_data_t), the column descriptions reported to
// the framework, and the four classes that serve each table. Nothing else lists columns.
//
// Header-only; row types are plain data and may be copied between threads freely.

#include <cstddef>
#include <cstdint>

namespace q7tema {

// Column type codes as reported to the framework.
inline constexpr int kColumnString = 9;
inline constexpr int kColumnInteger = 3;
inline constexpr int kColumnShort = 5;
inline constexpr int kColumnLongText = 12;

}  // namespace q7tema

// clang-format off
// The web times and counts, shared by the aggregate rows (as per-request averages) and the
// instance rows (one transaction's values).
#define Q7_WEB_TIMES(COL) \
  COL(I, clienttime, 4) COL(I, loadtime, 4) COL(I, netwtime, 4) COL(I, servtime, 4) \
  COL(I, resolvtime, 4) COL(I, reqpacket, 4) COL(I, ackpacket, 4) COL(I, replypckt, 4) \
  COL(I, replyack, 4) COL(I, totbytes, 4) COL(I, reqbytes, 4) COL(I, replybyt, 4) \
  COL(I, objcnt, 4) COL(I, objsize, 4) COL(I, headrreq, 4) COL(I, hdrreqrslv, 4)

// ---- The shared aggregate columns (AGG), in four runs around the optional columns. ----

#define Q7_AGG_COUNTS(COL) \
  COL(S, originnode, 32) COL(S, timestamp, 16) COL(I, dintval, 4) COL(I, pcfail, 4) \
  COL(I, pcslow, 4) COL(I, pcgood, 4) COL(I, pcavail, 4) COL(I, oatime, 4) COL(I, failreq, 4) \
  COL(I, totreq, 4) COL(I, slowreq, 4) COL(I, succreq, 4)
#define Q7_AGG_RANGE(COL) \
  COL(I, minrtt, 4) COL(I, maxrtt, 4) COL(S, datcoltype, 32) COL(S, sampletime, 16) \
  COL(I, rank, 4)
#define Q7_AGG_WEB(COL) \
  Q7_WEB_TIMES(COL) \
  COL(I, num1xx, 4) COL(I, num2xx, 4) COL(I, num3xx, 4) COL(I, num4xx, 4) COL(I, num5xx, 4) \
  COL(I, num403, 4) COL(I, num404, 4) COL(I, num500, 4)
#define Q7_AGG_PCTS(COL) \
  COL(I, pct1xx, 4) COL(I, pct2xx, 4) COL(I, pct3xx, 4) COL(I, pct4xx, 4) COL(I, pct5xx, 4) \
  COL(I, pct403, 4) COL(I, pct404, 4) COL(I, pct500, 4)

// The optional columns, and their absence.
#define Q7_NO_COLUMN(COL)
#define Q7_MRTTHRES(COL) COL(I, mrtthres, 4)
#define Q7_AGGBY(COL) COL(I, aggby, 4)
#define Q7_IPV6(COL) COL(S, ipv6, 128)

// AGG with mrtthres, aggby and ipv6 each present or not.
#define Q7_AGG(COL, MRTTHRES, AGGBY, IPV6) \
  Q7_AGG_COUNTS(COL) MRTTHRES(COL) Q7_AGG_RANGE(COL) AGGBY(COL) Q7_AGG_WEB(COL) IPV6(COL) \
  Q7_AGG_PCTS(COL)
#define Q7_AGG_FULL(COL) Q7_AGG(COL, Q7_MRTTHRES, Q7_AGGBY, Q7_NO_COLUMN)
#define Q7_AGG_CS(COL) Q7_AGG(COL, Q7_MRTTHRES, Q7_NO_COLUMN, Q7_NO_COLUMN)

// ---- Aggregate tables. ----

#define Q7_COLS_APP(COL) COL(S, applicatin, 128) COL(H, importance, 2) Q7_AGG_FULL(COL)
#define Q7_COLS_APPCS(COL) COL(S, applicatin, 128) COL(H, importance, 2) Q7_AGG_CS(COL)
#define Q7_COLS_CLNTAPP(COL) COL(S, client, 128) COL(S, applicatin, 128) Q7_AGG_FULL(COL)
#define Q7_COLS_CLNTSRV(COL) COL(S, client, 128) COL(S, server, 128) Q7_AGG_FULL(COL)
#define Q7_COLS_SRVAPP(COL) COL(S, server, 128) COL(S, applicatin, 128) Q7_AGG_FULL(COL)
#define Q7_COLS_CLNT(COL) \
  COL(S, client, 128) COL(S, ip, 16) COL(S, hostname, 128) \
  Q7_AGG(COL, Q7_MRTTHRES, Q7_AGGBY, Q7_IPV6)
#define Q7_COLS_CLNTCS(COL) \
  COL(S, client, 128) COL(S, ip, 16) COL(S, hostname, 128) \
  Q7_AGG(COL, Q7_MRTTHRES, Q7_NO_COLUMN, Q7_IPV6)
#define Q7_COLS_SRV(COL) \
  COL(S, server, 128) COL(S, ip, 16) Q7_AGG(COL, Q7_MRTTHRES, Q7_AGGBY, Q7_IPV6)
#define Q7_COLS_SRVCS(COL) \
  COL(S, server, 128) COL(S, ip, 16) Q7_AGG(COL, Q7_MRTTHRES, Q7_NO_COLUMN, Q7_IPV6)
#define Q7_COLS_TX_KEYS(COL) \
  COL(S, applicatin, 128) COL(S, transactn, 128) COL(S, client, 128) COL(S, server, 128) \
  COL(S, rootuuid, 32) COL(H, importance, 2)
#define Q7_COLS_TX(COL) Q7_COLS_TX_KEYS(COL) Q7_AGG_FULL(COL)
#define Q7_COLS_TXCS(COL) Q7_COLS_TX_KEYS(COL) Q7_AGG_CS(COL)
#define Q7_COLS_SUBTX(COL) \
  COL(S, transactn, 128) COL(S, rootuuid, 32) COL(S, parentuuid, 32) COL(S, curruuid, 32) \
  Q7_AGG(COL, Q7_NO_COLUMN, Q7_NO_COLUMN, Q7_NO_COLUMN)

// ---- Instance tables. ----

#define Q7_INS_NAMES(COL) \
  COL(S, originnode, 32) COL(S, timestamp, 16) COL(S, applicatin, 255) COL(S, apppattern, 255) \
  COL(S, transactn, 255) COL(S, transpattn, 255) COL(S, clientna, 255) COL(S, clienthopt, 255) \
  COL(S, clientppt, 255) COL(S, rootuuid, 32) COL(I, resptime, 4) COL(H, statuscode, 2)
#define Q7_INS_LINE(COL) \
  COL(S, sampletime, 16) COL(H, gmtoffset, 2) COL(S, timezone, 32) COL(S, ipsrcaddr, 64) \
  COL(S, ipdestaddr, 64) COL(H, ipdestport, 2) COL(S, url, 254) COL(S, refererurl, 254) \
  COL(S, browsedesc, 254) COL(S, serverdesc, 254) COL(S, approtocol, 32) COL(S, urlhost, 254) \
  COL(S, urlpath, 254) COL(S, urlfile, 254) COL(S, urlquery, 254) COL(S, urlanchor, 126) \
  COL(S, pagetitle, 254) COL(H, method, 2)
#define Q7_COLS_TXINS(COL) \
  Q7_INS_NAMES(COL) COL(I, mrtthres, 4) COL(S, datcoltype, 32) COL(H, importance, 2) \
  Q7_INS_LINE(COL) COL(I, aggby, 4) Q7_WEB_TIMES(COL) COL(S, instroot, 16)
#define Q7_COLS_SUBTXINS(COL) \
  Q7_INS_NAMES(COL) COL(S, datcoltype, 32) Q7_INS_LINE(COL) COL(S, parentuuid, 32) \
  COL(S, curruuid, 32) COL(S, instroot, 16) Q7_WEB_TIMES(COL)

// ---- Pattern and agent tables. ----

#define Q7_COLS_TXPTNS(COL) \
  COL(S, originnode, 32) COL(S, timestamp, 16) COL(S, applicatin, 128) COL(S, apppattern, 255) \
  COL(S, transactn, 128) COL(S, transpattn, 255) COL(H, aggapsuniq, 2) COL(H, aggtxsuniq, 2) \
  COL(H, collinstcs, 2) COL(I, sampercent, 4) COL(H, importance, 2) COL(S, sampletime, 16) \
  COL(I, mrtthres, 4)
#define Q7_COLS_CLNTPTNS(COL) \
  COL(S, originnode, 32) COL(S, timestamp, 16) COL(S, clientna, 128) COL(S, clienthopt, 255) \
  COL(S, clientppt, 255) COL(H, agguniqly, 2) COL(S, sampletime, 16)
#define Q7_COLS_AGNTDTS(COL) \
  COL(S, originnode, 32) COL(S, timestamp, 16) COL(S, property, 255) COL(S, value, 255) \
  COL(S, sampletime, 16)
#define Q7_COLS_AGNTMSGS(COL) \
  COL(S, originnode, 32) COL(S, msgdattime, 16) COL(S, sdate_time, 16) COL(I, severity, 4) \
  COL(S, component, 32) COL(S, msgid, 32) COL(X, msgtext, 1024) COL(X, msgsource, 512)

// ---- The tables: TABLE(lower-case name, exported name, columns), in load order. ----

#define Q7_EXPORTED_TABLES(TABLE) \
  TABLE(q7agntdts, "Q7AGNTDTS", Q7_COLS_AGNTDTS) \
  TABLE(q7agntmsgs, "Q7AGNTMSGS", Q7_COLS_AGNTMSGS) \
  TABLE(q7appot, "Q7APPOT", Q7_COLS_APP) \
  TABLE(q7appsm, "Q7APPSM", Q7_COLS_APP) \
  TABLE(q7clntapp, "Q7CLNTAPP", Q7_COLS_CLNTAPP) \
  TABLE(q7clntot, "Q7CLNTOT", Q7_COLS_CLNT) \
  TABLE(q7clntptns, "Q7CLNTPTNS", Q7_COLS_CLNTPTNS) \
  TABLE(q7clntsm, "Q7CLNTSM", Q7_COLS_CLNT) \
  TABLE(q7clntsrv, "Q7CLNTSRV", Q7_COLS_CLNTSRV) \
  TABLE(q7srvappsm, "Q7SRVAPPSM", Q7_COLS_SRVAPP) \
  TABLE(q7srvot, "Q7SRVOT", Q7_COLS_SRV) \
  TABLE(q7srvsm, "Q7SRVSM", Q7_COLS_SRV) \
  TABLE(q7txins, "Q7TXINS", Q7_COLS_TXINS) \
  TABLE(q7txot, "Q7TXOT", Q7_COLS_TX) \
  TABLE(q7txptns, "Q7TXPTNS", Q7_COLS_TXPTNS) \
  TABLE(q7txsm, "Q7TXSM", Q7_COLS_TX) \
  TABLE(q7txcs, "Q7TXCS", Q7_COLS_TXCS) \
  TABLE(q7appcs, "Q7APPCS", Q7_COLS_APPCS) \
  TABLE(q7clntcs, "Q7CLNTCS", Q7_COLS_CLNTCS) \
  TABLE(q7srvcs, "Q7SRVCS", Q7_COLS_SRVCS) \
  TABLE(q7subtxsm, "Q7SUBTXSM", Q7_COLS_SUBTX) \
  TABLE(q7subtxot, "Q7SUBTXOT", Q7_COLS_SUBTX) \
  TABLE(q7subtxins, "Q7SUBTXINS", Q7_COLS_SUBTXINS)

// Over-time layouts of the pairings whose only exported table is a summary: kept in history.
#define Q7_UNEXPORTED_LAYOUTS(TABLE) \
  TABLE(q7clntappot, "Q7CLNTAPPOT", Q7_COLS_CLNTAPP) \
  TABLE(q7clntsrvot, "Q7CLNTSRVOT", Q7_COLS_CLNTSRV) \
  TABLE(q7srvappot, "Q7SRVAPPOT", Q7_COLS_SRVAPP)

// clang-format on

// ---- Row types. ----

#define Q7_MEMBER_S(name, width) char name[width];
#define Q7_MEMBER_X(name, width) char name[width];
#define Q7_MEMBER_I(name, width) int32_t name;
#define Q7_MEMBER_H(name, width) int16_t name;
#define Q7_MEMBER(kind, name, width) Q7_MEMBER_##kind(name, width)
#define Q7_ROW_TYPE(lower, exported, COLUMNS) \
  struct kq7_##lower##_data_t {               \
    COLUMNS(Q7_MEMBER)                        \
  };

Q7_EXPORTED_TABLES(Q7_ROW_TYPE)
Q7_UNEXPORTED_LAYOUTS(Q7_ROW_TYPE)

#undef Q7_ROW_TYPE
#undef Q7_MEMBER
#undef Q7_MEMBER_H
#undef Q7_MEMBER_I
#undef Q7_MEMBER_X
#undef Q7_MEMBER_S
