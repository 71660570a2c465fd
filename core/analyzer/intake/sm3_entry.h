#pragma once

// The collector's data-file records as the agent reads them: the record tags, the two line
// layouts and the entries a parsed line fills, and the method code table.
//
// A data file holds records of the form  <tag>field^field^...^field</tag>  followed by any number
// of line feeds and carriage returns. Page lines (hpage, hobj) have 46 fields, object lines
// (audio, video) 31. Values are never escaped, so a caret inside a value cannot be represented.
//
// Both entries are plain data: NUL-terminated text slots of fixed width and signed 32-bit
// integers, zero-filled before parsing so that a missing value reads as "" or 0.

#include <cstddef>
#include <cstdint>

// Field separator of a record line (the same character as CARET).
inline constexpr char SM3_DELIMETER = '^';
// The collector's value for a request without referrer; stored like any other text.
inline constexpr const char* SM3_NO_REFERRER = "N/A";

inline constexpr const char* SM3_LINE_HPAGE_HEADER = "<hpage>";
inline constexpr const char* SM3_LINE_HPAGE_TRAILER = "</hpage>";
inline constexpr const char* SM3_LINE_HOBJ_HEADER = "<hobj>";
inline constexpr const char* SM3_LINE_HOBJ_TRAILER = "</hobj>";
inline constexpr const char* SM3_LINE_AUDIO_HEADER = "<audio>";
inline constexpr const char* SM3_LINE_AUDIO_TRAILER = "</audio>";
inline constexpr const char* SM3_LINE_VIDEO_HEADER = "<video>";
inline constexpr const char* SM3_LINE_VIDEO_TRAILER = "</video>";

// Record types, kept on the transaction (CDPXTransaction::setRecordType).
inline constexpr int SM3_RECORD_HPAGE = 1;  // a page
inline constexpr int SM3_RECORD_HOBJ = 2;   // an embedded object of a page, page layout
inline constexpr int SM3_RECORD_AUDIO = 3;  // an audio object, object layout
inline constexpr int SM3_RECORD_VIDEO = 4;  // a video object, object layout

// Carets of a well-formed line of each layout.
inline constexpr int SM3_HPAGE_CARETS = 45;
inline constexpr int SM3_AV_CARETS = 30;

// One record kind: its tags and type.
struct SM3_RECORD_TAGS {
  const char* header;
  const char* trailer;
  int recordType;
};

// The four kinds in the order they are searched for: hpage, hobj, audio, video.
extern const SM3_RECORD_TAGS SM3_RECORD_KINDS[4];

// Fields 1 to 22, the same in both line layouts. iTransTime is seconds since 1970, UTC;
// szIPSourceAddress is the client and szIPDestinationAddress the server; iTotalResponseTime is
// in ms.
#define SM3_SHARED_ENTRY_FIELDS    \
  char szProductVersion[11];       \
  char szApplicationID[3];         \
  char szReserved1[65];            \
  char szCollectorID[32];          \
  char szTransGUID[65];            \
  int32_t iTransTime;              \
  char szTransDate[11];            \
  char szTransTimeString[9];       \
  int32_t iGMTOffset;              \
  char szTimeZone[33];             \
  char szIPSourceAddress[65];      \
  int32_t iSourcePort;             \
  char szIPDestinationAddress[65]; \
  int32_t iDestinationPort;        \
  int32_t iTotalResponseTime;      \
  int32_t iRequestPacketCount;     \
  int32_t iRequestAckPacketCount;  \
  int32_t iReplyPacketCount;       \
  int32_t iReplyAckPacketCount;    \
  int32_t iTotalBytes;             \
  int32_t iRequestBytes;           \
  int32_t iReplyBytes;

// The request's description, fields 23 to 28 of a page line and 24 to 29 of an audio or video
// line: the same fields, at different offsets.
#define SM3_REQUEST_FIELDS        \
  char szURL[255];                \
  char szReferrerURL[255];        \
  char szBrowserDescription[255]; \
  char szServerDescription[255];  \
  char szApplicationProtocol[33]; \
  int32_t iRequestStatus;

// A page line (record types 1 and 2), the 46 fields in line order. Text slots keep at most
// width - 1 characters. Trans date and Trans time string are skipped by the parser and stay empty.
struct SM3_HPAGE_ENTRY {
  SM3_SHARED_ENTRY_FIELDS
  SM3_REQUEST_FIELDS
  int32_t iServerTime;   // ms
  int32_t iResolveTime;  // ms
  int32_t iLoadTime;     // ms
  int32_t iTotalObjectCount;
  int32_t iTotalObjectSize;
  int32_t iTotalHeaderRequestsCount;
  int32_t iTotalHeaderRequestResolveTime;  // ms
  int32_t iNetworkTime;                    // ms, never negative once parsed
  int32_t iReserved2;
  int32_t iReserved3;
  int32_t iReserved4;
  char szURLHostName[255];
  char szURLPath[255];
  char szURLFile[255];
  char szURLQuery[255];
  char szURLAnchor[127];
  char szPageTitle[255];
  int32_t iMethod;  // see getMethodString
};

// An audio or video line (record types 3 and 4), the 31 fields in line order. Fields 1 to 22
// are those of the page line, laid out identically.
struct _SM3_AV_ENTRY {
  SM3_SHARED_ENTRY_FIELDS
  int32_t iObjectValue1;  // kept here only; not carried into a page entry
  SM3_REQUEST_FIELDS
  int32_t iObjectValue2;  // kept here only; not carried into a page entry
  int32_t iNetworkTime;   // ms; read from the line's first character only
};
#undef SM3_REQUEST_FIELDS
#undef SM3_SHARED_ENTRY_FIELDS

// The shared leading fields must sit at the same offsets, so they convert as one block.
static_assert(offsetof(SM3_HPAGE_ENTRY, iReplyBytes) == offsetof(_SM3_AV_ENTRY, iReplyBytes));
inline constexpr std::size_t SM3_SHARED_PREFIX_SIZE =
    offsetof(SM3_HPAGE_ENTRY, iReplyBytes) + sizeof(int32_t);

// "GET", "POST", "HEAD", "PUT", "OPTIONS", "DELETE", "TRACE", "CONNECT" for codes 1 to 8;
// "UNDEFINED" for any other code, 0 included.
const char* getMethodString(int method);

// Fills page from an object entry: page is zero-filled, fields 1 to 22 are copied, then URL,
// referrer, browser, server description, application protocol, request status and network time.
// Everything else (method included) stays empty or 0.
void convertAVEtoHPE(const _SM3_AV_ENTRY* object, SM3_HPAGE_ENTRY* page);

// Writes the entry to the trace log under the flow class (0x40), one record a field in line
// order (the two skipped fields left out). A null entry writes an error line instead.
void dumpSM3Record(const SM3_HPAGE_ENTRY* entry);
// The same under the given trace class mask.
void dumpSM3Record(const SM3_HPAGE_ENTRY* entry, unsigned long mask);
