#pragma once

// TransactionBuilder: web transactions for tests and benchmarks, made the way the intake makes
// them (from a page entry), with only the fields a caller is about named:
//
//   CDPXTransaction t = TransactionBuilder().host("shop.example").url("/cart").status(500).build();
//
// Unnamed fields: a page (record type 1) of "/a" on www.shop.example from 10.1.2.3 to
// 192.0.2.10, 100 ms in all, status 200, time 0, no threshold, no bytes. Header-only.
//
// Thread safety: a builder is a value; build() may be called any number of times.

#include <cstdint>
#include <cstdio>
#include <string>

#include "core/analyzer/intake/dpx_transaction.h"
#include "core/analyzer/intake/sm3_entry.h"

class TransactionBuilder {
 public:
  TransactionBuilder() {
    host("www.shop.example").url("/a").client("10.1.2.3").server("192.0.2.10");
    entry_.iTotalResponseTime = 100;
    entry_.iRequestStatus = 200;
  }

  TransactionBuilder& host(const std::string& name) {
    std::snprintf(entry_.szURLHostName, sizeof(entry_.szURLHostName), "%s", name.c_str());
    return *this;
  }
  TransactionBuilder& url(const std::string& url) {
    std::snprintf(entry_.szURL, sizeof(entry_.szURL), "%s", url.c_str());
    return *this;
  }
  TransactionBuilder& client(const std::string& address) {
    std::snprintf(entry_.szIPSourceAddress, sizeof(entry_.szIPSourceAddress), "%s",
                  address.c_str());
    return *this;
  }
  TransactionBuilder& server(const std::string& address) {
    std::snprintf(entry_.szIPDestinationAddress, sizeof(entry_.szIPDestinationAddress), "%s",
                  address.c_str());
    return *this;
  }
  // Times in milliseconds: the total, and the server, network and load shares of it.
  TransactionBuilder& responseTime(int ms) {
    entry_.iTotalResponseTime = ms;
    return *this;
  }
  TransactionBuilder& serverTime(int ms) {
    entry_.iServerTime = ms;
    return *this;
  }
  TransactionBuilder& networkTime(int ms) {
    entry_.iNetworkTime = ms;
    return *this;
  }
  TransactionBuilder& loadTime(int ms) {
    entry_.iLoadTime = ms;
    return *this;
  }
  TransactionBuilder& status(int code) {
    entry_.iRequestStatus = code;
    return *this;
  }
  TransactionBuilder& totalBytes(int bytes) {
    entry_.iTotalBytes = bytes;
    return *this;
  }
  // When it happened, in seconds since 1970.
  TransactionBuilder& time(int64_t seconds) {
    entry_.iTransTime = static_cast<int32_t>(seconds);
    return *this;
  }
  // The slow threshold a matched pattern would have set.
  TransactionBuilder& minThreshold(int ms) {
    minThreshold_ = ms;
    return *this;
  }
  // An object of a page (record type 2, control flag 1) with the given identifiers, as the
  // monitor links objects to the page before them.
  TransactionBuilder& objectOf(const std::string& parent, const std::string& root,
                               const std::string& current) {
    recordType_ = 2;
    parent_ = parent;
    root_ = root;
    current_ = current;
    return *this;
  }

  CDPXTransaction build() const {
    CDPXTransaction t(entry_);
    t.setRecordType(recordType_);
    if (minThreshold_ >= 0) {
      t.setMinThreshold(minThreshold_);
    }
    if (recordType_ == 2) {
      t.setParentUUID(parent_.c_str());
      t.setRootUUID(root_.c_str());
      t.setCurrentUUID(current_.c_str());
      t.setControlFlags(1);
    }
    return t;
  }

 private:
  SM3_HPAGE_ENTRY entry_{};
  int recordType_ = 1;
  int minThreshold_ = -1;  // -1: left as the constructor sets it
  std::string parent_;
  std::string root_;
  std::string current_;
};
