#include "core/analyzer/analysis/instance_rows.h"

#include <cstdio>
#include <cstring>
#include <string>

#include "core/analyzer/rows/keyed_row.h"
#include "framework/agent_runtime.h"
#include "framework/clock.h"

namespace {

const std::string& OriginNode() {
  static const std::string origin = fw::OriginNodeName();
  return origin;
}

template <size_t N>
void Text(char (&column)[N], const char* text) {
  rows::CopyField(column, text != nullptr ? text : "", N);
}

// The columns both instance layouts share, written by name.
template <class Row>
void Fill(const CDPXTransaction& t, const InstancePatterns& p, Row& row) {
  memset(&row, 0, sizeof(row));
  Text(row.originnode, OriginNode().c_str());
  TimeSince70ToMordel(t.getTimeRecorded(), row.timestamp);
  Text(row.applicatin, t.getApplicationName());
  Text(row.apppattern, p.applicationPattern);
  Text(row.transactn, t.getTransactionName());
  Text(row.transpattn, p.transactionPattern);
  Text(row.clientna, p.clientName);
  Text(row.clienthopt, p.clientHostPattern);
  Text(row.clientppt, p.clientIPPattern);
  Text(row.rootuuid, t.getRootUUID());
  row.resptime = t.getTotalResponseTime();
  row.statuscode = static_cast<int16_t>(t.getRequestStatus());
  if constexpr (requires { row.mrtthres; })
    row.mrtthres = t.getMinThreshold();
  if constexpr (requires { row.importance; }) {
    row.importance = static_cast<int16_t>(t.getImportance());
  }
  if constexpr (requires { row.aggby; })
    row.aggby = t.getAggBy();
  if constexpr (requires { row.parentuuid; })
    Text(row.parentuuid, t.getParentUUID());
  if constexpr (requires { row.curruuid; })
    Text(row.curruuid, t.getCurrentUUID());
  Text(row.datcoltype, "DPX");
  row.gmtoffset = static_cast<int16_t>(t.getGMTOffset());
  Text(row.timezone, t.getTimeZone());
  Text(row.ipsrcaddr, t.getIPSourceAddress());
  Text(row.ipdestaddr, t.getIPDestinationAddress());
  row.ipdestport = static_cast<int16_t>(t.getDestinationPort());
  Text(row.url, t.getURL());
  Text(row.refererurl, t.getReferrerURL());
  Text(row.browsedesc, t.getBrowserDescription());
  Text(row.serverdesc, t.getServerDescription());
  Text(row.approtocol, t.getApplicationProtocol());
  Text(row.urlhost, t.getURLHostName());
  Text(row.urlpath, t.getURLPath());
  Text(row.urlfile, t.getURLFile());
  Text(row.urlquery, t.getURLQuery());
  Text(row.urlanchor, t.getURLAnchor());
  Text(row.pagetitle, t.getPageTitle());
  row.method = static_cast<int16_t>(t.getiMethod());
  row.clienttime = t.getTotalResponseTime() - t.getServerTime();
  row.loadtime = t.getLoadTime();
  row.netwtime = t.getNetworkTime();
  row.servtime = t.getServerTime();
  row.resolvtime = t.getResolveTime();
  row.reqpacket = t.getRequestPacketCount();
  row.ackpacket = t.getRequestAckPacketCount();
  row.replypckt = t.getReplyPacketCount();
  row.replyack = t.getReplyAckPacketCount();
  row.totbytes = t.getTotalBytes();
  row.reqbytes = t.getRequestBytes();
  row.replybyt = t.getReplyBytes();
  row.objcnt = t.getTotalObjectCount();
  row.objsize = t.getTotalObjectSize();
  row.headrreq = t.getTotalHeaderRequestsCount();
  row.hdrreqrslv = t.getTotalHeaderRequestResolveTime();
  char root[17];
  snprintf(root, sizeof(root), "%016llX", static_cast<unsigned long long>(t.getInstanceRoot()));
  memcpy(row.instroot, root, sizeof(row.instroot));
}

}  // namespace

void buildInstanceRow(const CDPXTransaction& t, const InstancePatterns& patterns,
                      kq7_q7txins_data_t& row) {
  Fill(t, patterns, row);
}

void buildInstanceRow(const CDPXTransaction& t, const InstancePatterns& patterns,
                      kq7_q7subtxins_data_t& row) {
  Fill(t, patterns, row);
}
