// Record kinds, the two line layouts as slot tables, the method table, object-to-page conversion
// and the page entry dump.

#include "core/analyzer/intake/sm3_entry.h"

#include <cstring>

#include "core/analyzer/intake/sm3_fields.h"
#include "core/runtime/clog.h"

const SM3_RECORD_TAGS SM3_RECORD_KINDS[4] = {
    {SM3_LINE_HPAGE_HEADER, SM3_LINE_HPAGE_TRAILER, SM3_RECORD_HPAGE},
    {SM3_LINE_HOBJ_HEADER, SM3_LINE_HOBJ_TRAILER, SM3_RECORD_HOBJ},
    {SM3_LINE_AUDIO_HEADER, SM3_LINE_AUDIO_TRAILER, SM3_RECORD_AUDIO},
    {SM3_LINE_VIDEO_HEADER, SM3_LINE_VIDEO_TRAILER, SM3_RECORD_VIDEO},
};

#define Q7_TEXT(E, field, fmt) \
  { SM3FieldKind::kText, offsetof(E, field), sizeof(E::field), fmt }
#define Q7_INT(E, field, fmt) \
  { SM3FieldKind::kInteger, offsetof(E, field), sizeof(int32_t), fmt }
#define Q7_SKIP(E, field) \
  { SM3FieldKind::kSkipped, offsetof(E, field), sizeof(E::field), nullptr }

// Fields 1 to 22, shared by both layouts.
#define Q7_SHARED_FIELDS(E)                                                                      \
  Q7_TEXT(E, szProductVersion, "Product version                  [%s]\n"),                       \
      Q7_TEXT(E, szApplicationID, "Application ID                   [%s]\n"),                    \
      Q7_TEXT(E, szReserved1, "Reserved1                        [%s]\n"),                        \
      Q7_TEXT(E, szCollectorID, "Collector ID                     [%s]\n"),                      \
      Q7_TEXT(E, szTransGUID, "Trans GUID                       [%s]\n"),                        \
      Q7_INT(E, iTransTime, "Trans timeUTC secs               [%d]\n"), Q7_SKIP(E, szTransDate), \
      Q7_SKIP(E, szTransTimeString),                                                             \
      Q7_INT(E, iGMTOffset, "GMT offset                       [%d]\n"),                          \
      Q7_TEXT(E, szTimeZone, "Time Zone                        [%s]\n"),                         \
      Q7_TEXT(E, szIPSourceAddress, "IP Source Address                [%s]\n"),                  \
      Q7_INT(E, iSourcePort, "Source port                      [%d]\n"),                         \
      Q7_TEXT(E, szIPDestinationAddress, "IP Destination Address           [%s]\n"),             \
      Q7_INT(E, iDestinationPort, "Destination port                 [%d]\n"),                    \
      Q7_INT(E, iTotalResponseTime, "Total responst time ms           [%d]\n"),                  \
      Q7_INT(E, iRequestPacketCount, "Request packet count             [%d]\n"),                 \
      Q7_INT(E, iRequestAckPacketCount, "Request ACK packet count         [%d]\n"),              \
      Q7_INT(E, iReplyPacketCount, "Reply packet count               [%d]\n"),                   \
      Q7_INT(E, iReplyAckPacketCount, "Reply ACK packet count           [%d]\n"),                \
      Q7_INT(E, iTotalBytes, "Total bytes                      [%d]\n"),                         \
      Q7_INT(E, iRequestBytes, "Request bytes                    [%d]\n"),                       \
      Q7_INT(E, iReplyBytes, "Reply bytes                      [%d]\n")

const SM3_FIELD_SLOT SM3_HPAGE_LAYOUT[SM3_HPAGE_FIELDS] = {
    Q7_SHARED_FIELDS(SM3_HPAGE_ENTRY),
    Q7_TEXT(SM3_HPAGE_ENTRY, szURL, "URL                              [%s]\n"),
    Q7_TEXT(SM3_HPAGE_ENTRY, szReferrerURL, "Referrer URL                     [%s]\n"),
    Q7_TEXT(SM3_HPAGE_ENTRY, szBrowserDescription, "Browser description              [%s]\n"),
    Q7_TEXT(SM3_HPAGE_ENTRY, szServerDescription, "Server description               [%s]\n"),
    Q7_TEXT(SM3_HPAGE_ENTRY, szApplicationProtocol, "Application Protocol             [%s]\n"),
    Q7_INT(SM3_HPAGE_ENTRY, iRequestStatus, "Request status                   [%d]\n"),
    Q7_INT(SM3_HPAGE_ENTRY, iServerTime, "Server time ms                   [%d]\n"),
    Q7_INT(SM3_HPAGE_ENTRY, iResolveTime, "Resolve time ms                  [%d]\n"),
    Q7_INT(SM3_HPAGE_ENTRY, iLoadTime, "Load time ms                     [%d]\n"),
    Q7_INT(SM3_HPAGE_ENTRY, iTotalObjectCount, "Total object count               [%d]\n"),
    Q7_INT(SM3_HPAGE_ENTRY, iTotalObjectSize, "Total object size                [%d]\n"),
    Q7_INT(SM3_HPAGE_ENTRY, iTotalHeaderRequestsCount, "Total header requests count      [%d]\n"),
    Q7_INT(SM3_HPAGE_ENTRY, iTotalHeaderRequestResolveTime,
           "Total header req. resolve time ms[%d]\n"),
    Q7_INT(SM3_HPAGE_ENTRY, iNetworkTime, "Network time ms                  [%d]\n"),
    Q7_INT(SM3_HPAGE_ENTRY, iReserved2, "Reserved2                        [%d]\n"),
    Q7_INT(SM3_HPAGE_ENTRY, iReserved3, "Reserved3                        [%d]\n"),
    Q7_INT(SM3_HPAGE_ENTRY, iReserved4, "Reserved4                        [%d]\n"),
    Q7_TEXT(SM3_HPAGE_ENTRY, szURLHostName, "URL Host name                    [%s]\n"),
    Q7_TEXT(SM3_HPAGE_ENTRY, szURLPath, "URL Path                         [%s]\n"),
    Q7_TEXT(SM3_HPAGE_ENTRY, szURLFile, "URL File                         [%s]\n"),
    Q7_TEXT(SM3_HPAGE_ENTRY, szURLQuery, "URL Query                        [%s]\n"),
    Q7_TEXT(SM3_HPAGE_ENTRY, szURLAnchor, "URL Anchor                       [%s]\n"),
    Q7_TEXT(SM3_HPAGE_ENTRY, szPageTitle, "PageTitle                        [%s]\n"),
    Q7_INT(SM3_HPAGE_ENTRY, iMethod, "Method                           [%d:%s]\n"),
};

const SM3_FIELD_SLOT SM3_AV_LAYOUT[SM3_AV_FIELDS] = {
    Q7_SHARED_FIELDS(_SM3_AV_ENTRY),
    Q7_INT(_SM3_AV_ENTRY, iObjectValue1, nullptr),
    Q7_TEXT(_SM3_AV_ENTRY, szURL, nullptr),
    Q7_TEXT(_SM3_AV_ENTRY, szReferrerURL, nullptr),
    Q7_TEXT(_SM3_AV_ENTRY, szBrowserDescription, nullptr),
    Q7_TEXT(_SM3_AV_ENTRY, szServerDescription, nullptr),
    Q7_TEXT(_SM3_AV_ENTRY, szApplicationProtocol, nullptr),
    Q7_INT(_SM3_AV_ENTRY, iRequestStatus, nullptr),
    Q7_INT(_SM3_AV_ENTRY, iObjectValue2, nullptr),
    Q7_INT(_SM3_AV_ENTRY, iNetworkTime, nullptr),
};

#undef Q7_SHARED_FIELDS
#undef Q7_SKIP
#undef Q7_INT
#undef Q7_TEXT

const char* getMethodString(int method) {
  static constexpr const char* kMethods[] = {"GET",     "POST",   "HEAD",  "PUT",
                                             "OPTIONS", "DELETE", "TRACE", "CONNECT"};
  if (method >= 1 && method <= 8) {
    return kMethods[method - 1];
  }
  return "UNDEFINED";
}

void convertAVEtoHPE(const _SM3_AV_ENTRY* object, SM3_HPAGE_ENTRY* page) {
  memset(page, 0, sizeof(*page));
  memcpy(page, object, SM3_SHARED_PREFIX_SIZE);
  memcpy(page->szURL, object->szURL, sizeof(page->szURL));
  memcpy(page->szReferrerURL, object->szReferrerURL, sizeof(page->szReferrerURL));
  memcpy(page->szBrowserDescription, object->szBrowserDescription,
         sizeof(page->szBrowserDescription));
  memcpy(page->szServerDescription, object->szServerDescription, sizeof(page->szServerDescription));
  memcpy(page->szApplicationProtocol, object->szApplicationProtocol,
         sizeof(page->szApplicationProtocol));
  page->iRequestStatus = object->iRequestStatus;
  page->iNetworkTime = object->iNetworkTime;
}

void dumpSM3Record(const SM3_HPAGE_ENTRY* entry) {
  dumpSM3Record(entry, 64);
}

void dumpSM3Record(const SM3_HPAGE_ENTRY* entry, unsigned long mask) {
  if (entry == nullptr) {
    CLOG::trace(mask, "ERROR: Input psm3 is NULL, can't dump the record\n");
    return;
  }
  const char* base = reinterpret_cast<const char*>(entry);
  for (const SM3_FIELD_SLOT& slot : SM3_HPAGE_LAYOUT) {
    const char* field = base + slot.offset;
    switch (slot.kind) {
      case SM3FieldKind::kSkipped:
        break;
      case SM3FieldKind::kText:
        CLOG::trace(mask, slot.dumpFormat, field);
        break;
      case SM3FieldKind::kInteger: {
        int32_t value;
        memcpy(&value, field, sizeof(value));
        if (slot.offset == offsetof(SM3_HPAGE_ENTRY, iMethod)) {
          CLOG::trace(mask, slot.dumpFormat, value, getMethodString(value));
        } else {
          CLOG::trace(mask, slot.dumpFormat, value);
        }
        break;
      }
    }
  }
}
