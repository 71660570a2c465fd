#pragma once

// CDPXTransaction: a transaction built from one collector line. It carries the whole page entry
// of the line (an object line is converted to a page entry first) and the record type, and names
// itself from the line: application = URL host name (the server address when the line has none),
// transaction = URL, server = destination address, client = source address. An address goes to
// the IPv6 field when it holds a ':' and to the IPv4 field otherwise. No name resolution is done.
//
// Ownership and threads as CTransaction.

#include <cstdint>

#include "core/analyzer/intake/sm3_entry.h"
#include "core/analyzer/intake/transaction.h"

class CDPXTransaction : public CTransaction {
 public:
  // An empty record: zeroed entry, record type 0.
  CDPXTransaction();
  // Copies the entry, clamps a negative network time to 0 (with a trace), names the record from
  // it and sets the true trans type to 5.
  explicit CDPXTransaction(const SM3_HPAGE_ENTRY& entry);
  // The same with the entry written in place: fill(entry) gets it zeroed and returns whether it
  // filled it; only then is the record named as above. Spares the parser a copy of the entry.
  enum FilledInPlace { kFilledInPlace };
  template <class Fill>
  CDPXTransaction(FilledInPlace, Fill fill) : entry_{}, recordType_(0) {
    if (fill(entry_)) {
      adoptEntry();
    }
  }
  CDPXTransaction(const CDPXTransaction&) = default;
  CDPXTransaction& operator=(const CDPXTransaction&) = default;

  const char* getProductVersion() const { return entry_.szProductVersion; }
  const char* getReserved1() const { return entry_.szReserved1; }
  const char* getCollectorID() const { return entry_.szCollectorID; }
  const char* getTransGUID() const { return entry_.szTransGUID; }
  int32_t getTransTime() const { return entry_.iTransTime; }
  const char* getTransDate() const { return entry_.szTransDate; }
  const char* getTransTimeString() const { return entry_.szTransTimeString; }
  int32_t getGMTOffset() const { return entry_.iGMTOffset; }
  const char* getTimeZone() const { return entry_.szTimeZone; }
  const char* getIPSourceAddress() const { return entry_.szIPSourceAddress; }
  int32_t getSourcePort() const { return entry_.iSourcePort; }
  const char* getIPDestinationAddress() const { return entry_.szIPDestinationAddress; }
  int32_t getDestinationPort() const { return entry_.iDestinationPort; }
  int32_t getTotalResponseTime() const { return entry_.iTotalResponseTime; }
  int32_t getRequestPacketCount() const { return entry_.iRequestPacketCount; }
  int32_t getRequestAckPacketCount() const { return entry_.iRequestAckPacketCount; }
  int32_t getReplyPacketCount() const { return entry_.iReplyPacketCount; }
  int32_t getReplyAckPacketCount() const { return entry_.iReplyAckPacketCount; }
  int32_t getTotalBytes() const { return entry_.iTotalBytes; }
  int32_t getRequestBytes() const { return entry_.iRequestBytes; }
  int32_t getReplyBytes() const { return entry_.iReplyBytes; }
  const char* getURL() const { return entry_.szURL; }
  const char* getReferrerURL() const { return entry_.szReferrerURL; }
  const char* getBrowserDescription() const { return entry_.szBrowserDescription; }
  const char* getServerDescription() const { return entry_.szServerDescription; }
  const char* getApplicationProtocol() const { return entry_.szApplicationProtocol; }
  int32_t getRequestStatus() const { return entry_.iRequestStatus; }
  int32_t getServerTime() const { return entry_.iServerTime; }
  int32_t getResolveTime() const { return entry_.iResolveTime; }
  int32_t getLoadTime() const { return entry_.iLoadTime; }
  int32_t getTotalObjectCount() const { return entry_.iTotalObjectCount; }
  int32_t getTotalObjectSize() const { return entry_.iTotalObjectSize; }
  int32_t getTotalHeaderRequestsCount() const { return entry_.iTotalHeaderRequestsCount; }
  int32_t getTotalHeaderRequestResolveTime() const { return entry_.iTotalHeaderRequestResolveTime; }
  int32_t getNetworkTime() const { return entry_.iNetworkTime; }
  int32_t getReserved2() const { return entry_.iReserved2; }
  int32_t getReserved3() const { return entry_.iReserved3; }
  int32_t getReserved4() const { return entry_.iReserved4; }
  const char* getURLHostName() const { return entry_.szURLHostName; }
  const char* getURLPath() const { return entry_.szURLPath; }
  const char* getURLFile() const { return entry_.szURLFile; }
  const char* getURLQuery() const { return entry_.szURLQuery; }
  const char* getURLAnchor() const { return entry_.szURLAnchor; }
  const char* getPageTitle() const { return entry_.szPageTitle; }
  int32_t getiMethod() const { return entry_.iMethod; }

  // The collector's own time stamp (Trans timeUTC secs): the analyzer moves a record in time by
  // rewriting it.
  long getTimeRecorded() const { return entry_.iTransTime; }
  void setTimeRecorded(long seconds) { entry_.iTransTime = static_cast<int32_t>(seconds); }

  // Status 401 and above; 400 counts as good.
  bool isBadStatusCode() const { return entry_.iRequestStatus >= 401; }
  static const char* getMethodString(int method) { return ::getMethodString(method); }

  void setRecordType(int type) { recordType_ = type; }
  int getRecordType() const { return recordType_; }

  // Writes the record to the trace log under the detail class.
  void dump() const;

 private:
  // What the entry constructors do once entry_ holds the record: clamp, terminate, name.
  void adoptEntry();

  SM3_HPAGE_ENTRY entry_;
  int32_t recordType_;  // SM3_RECORD_*
};
