#pragma once

// CTransaction: the record of one observed web request as the analyzer works on it: the names
// pattern matching assigns (application, transaction, client, server), addresses, the record's
// identity within a page (root, parent and current UUID, instance root), importance, threshold
// and kind.
//
// Records are created by an intake thread, handed through the analyzer's queue (which owns them
// from then on) and used by the analyzer thread alone; a record is never shared between threads
// at one time. Polymorphic: held and deleted through CTransaction pointers.
//
// Text fields are fixed-size. Every text setter keeps at most width - 1 characters and always
// terminates; longer text is cut silently. The UUID setters copy at most 33 bytes as they are.

#include <cstdint>

struct SMetricRecord;  // a metric of the ARM record kind; not used by the web kind

// Text widths, in bytes with the terminating NUL.
inline constexpr int kTransactionNameWidth = 128;
inline constexpr int kIPv4AddressWidth = 16;
inline constexpr int kUUIDTextWidth = 33;

// Control flags.
inline constexpr int TRANSACTION_CONTROL_PAGE = 0;
inline constexpr int TRANSACTION_CONTROL_OBJECT = 1;  // an object of a page

// True trans type of a record built from a collector line; also the queue item type carrying it.
inline constexpr int TRUE_TRANS_TYPE_DPX = 5;

class CTransaction {
 public:
  CTransaction();
  virtual ~CTransaction() = default;
  CTransaction(const CTransaction&) = default;
  CTransaction& operator=(const CTransaction&) = default;

  void setApplicationName(const char* text);
  void setTransactionName(const char* text);
  void setClientName(const char* text);
  void setServerName(const char* text);
  void setServerHostname(const char* text);
  void setServerIPAddress(const char* text);
  void setClientIPAddress(const char* text);
  void setClientHostname(const char* text);
  void setRootUUID(const char* text);
  void setParentUUID(const char* text);
  void setCurrentUUID(const char* text);
  void setInstanceRoot(int64_t value) { instanceRoot_ = value; }
  void setImportance(int32_t value) { importance_ = value; }
  void setMinThreshold(int32_t value) { minThreshold_ = value; }
  void setControlFlags(int32_t value) { controlFlags_ = value; }
  void setTrueTransType(int32_t value) { trueTransType_ = value; }
  void setAggBy(int32_t value) { aggBy_ = value; }
  void setClientIPv6Address(const char* text);
  void setServerIPv6Address(const char* text);

  const char* getApplicationName() const { return applicationName_; }
  const char* getTransactionName() const { return transactionName_; }
  const char* getClientName() const { return clientName_; }
  const char* getServerName() const { return serverName_; }
  const char* getServerHostname() const { return serverHostname_; }
  const char* getServerIPAddress() const { return serverIPAddress_; }
  const char* getClientIPAddress() const { return clientIPAddress_; }
  const char* getClientHostname() const { return clientHostname_; }
  const char* getRootUUID() const { return rootUUID_; }
  const char* getParentUUID() const { return parentUUID_; }
  const char* getCurrentUUID() const { return currentUUID_; }
  int64_t getInstanceRoot() const { return instanceRoot_; }
  int32_t getImportance() const { return importance_; }
  int32_t getMinThreshold() const { return minThreshold_; }
  int32_t getControlFlags() const { return controlFlags_; }
  int32_t getTrueTransType() const { return trueTransType_; }
  int32_t getAggBy() const { return aggBy_; }
  const char* getClientIPv6Address() const { return clientIPv6Address_; }
  const char* getServerIPv6Address() const { return serverIPv6Address_; }

  // Does nothing for the web kind; the ARM kind collects its metrics here.
  virtual void addMetricRecord(SMetricRecord& record);

 private:
  char applicationName_[kTransactionNameWidth];
  char transactionName_[kTransactionNameWidth];
  char clientName_[kTransactionNameWidth];
  char serverName_[kTransactionNameWidth];
  char serverHostname_[kTransactionNameWidth];
  char serverIPAddress_[kIPv4AddressWidth];  // dotted IPv4
  char clientIPAddress_[kIPv4AddressWidth];
  char clientHostname_[kTransactionNameWidth];
  char rootUUID_[kUUIDTextWidth];     // 32 hexadecimal digits: the page this record belongs to
  char parentUUID_[kUUIDTextWidth];   // empty for a page
  char currentUUID_[kUUIDTextWidth];  // this record's own identifier
  int64_t instanceRoot_;              // tells occurrences of one current UUID apart
  int32_t importance_;
  int32_t minThreshold_;               // response-time threshold, ms
  [[maybe_unused]] int32_t reserved_;  // kept for the record layout; unused
  int32_t controlFlags_;               // TRANSACTION_CONTROL_*
  int32_t trueTransType_;
  int32_t aggBy_;  // which own identities aggregation kept (1 application, 2 client, 4 transaction)
  char clientIPv6Address_[kTransactionNameWidth];
  char serverIPv6Address_[kTransactionNameWidth];
};
