#include "core/analyzer/intake/transaction.h"

#include <cstring>

namespace {

template <size_t N>
void CopyText(char (&dest)[N], const char* text) {
  size_t length = 0;
  if (text != nullptr) {
    length = strnlen(text, N - 1);
    memcpy(dest, text, length);
  }
  dest[length] = '\0';
}

// An identifier always fits; the copy adds no terminator of its own.
template <size_t N>
void CopyUUID(char (&dest)[N], const char* text) {
  static_assert(N == kUUIDTextWidth);
  strncpy(dest, text != nullptr ? text : "", N);
}

}  // namespace

CTransaction::CTransaction()
    : instanceRoot_(0),
      importance_(99),
      minThreshold_(0),
      reserved_(0),
      controlFlags_(TRANSACTION_CONTROL_PAGE),
      trueTransType_(0),
      aggBy_(0) {
  applicationName_[0] = transactionName_[0] = clientName_[0] = serverName_[0] = '\0';
  serverHostname_[0] = serverIPAddress_[0] = clientIPAddress_[0] = clientHostname_[0] = '\0';
  memset(rootUUID_, 0, sizeof(rootUUID_));
  memset(parentUUID_, 0, sizeof(parentUUID_));
  memset(currentUUID_, 0, sizeof(currentUUID_));
  clientIPv6Address_[0] = serverIPv6Address_[0] = '\0';
}

void CTransaction::setApplicationName(const char* text) {
  CopyText(applicationName_, text);
}
void CTransaction::setTransactionName(const char* text) {
  CopyText(transactionName_, text);
}
void CTransaction::setClientName(const char* text) {
  CopyText(clientName_, text);
}
void CTransaction::setServerName(const char* text) {
  CopyText(serverName_, text);
}
void CTransaction::setServerHostname(const char* text) {
  CopyText(serverHostname_, text);
}
void CTransaction::setServerIPAddress(const char* text) {
  CopyText(serverIPAddress_, text);
}
void CTransaction::setClientIPAddress(const char* text) {
  CopyText(clientIPAddress_, text);
}
void CTransaction::setClientHostname(const char* text) {
  CopyText(clientHostname_, text);
}
void CTransaction::setRootUUID(const char* text) {
  CopyUUID(rootUUID_, text);
}
void CTransaction::setParentUUID(const char* text) {
  CopyUUID(parentUUID_, text);
}
void CTransaction::setCurrentUUID(const char* text) {
  CopyUUID(currentUUID_, text);
}
void CTransaction::setClientIPv6Address(const char* text) {
  CopyText(clientIPv6Address_, text);
}
void CTransaction::setServerIPv6Address(const char* text) {
  CopyText(serverIPv6Address_, text);
}

void CTransaction::addMetricRecord(SMetricRecord&) {}
