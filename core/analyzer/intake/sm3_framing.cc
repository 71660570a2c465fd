#include "core/analyzer/intake/sm3_framing.h"

#include <cstring>
#include <new>

#include "core/analyzer/intake/common.h"
#include "core/analyzer/intake/sm3_entry.h"
#include "core/runtime/clog.h"

namespace {

struct TagInfo {
  const char* header;
  const char* trailer;
  int headerLength;
  int trailerLength;
  int recordType;
};

const TagInfo* TagAt(const char* p) {
  static const TagInfo kTags[4] = {
      {SM3_LINE_HPAGE_HEADER, SM3_LINE_HPAGE_TRAILER, 7, 8, SM3_RECORD_HPAGE},
      {SM3_LINE_HOBJ_HEADER, SM3_LINE_HOBJ_TRAILER, 6, 7, SM3_RECORD_HOBJ},
      {SM3_LINE_AUDIO_HEADER, SM3_LINE_AUDIO_TRAILER, 7, 8, SM3_RECORD_AUDIO},
      {SM3_LINE_VIDEO_HEADER, SM3_LINE_VIDEO_TRAILER, 7, 8, SM3_RECORD_VIDEO},
  };
  for (const TagInfo& tag : kTags) {
    if (strncmp(p, tag.header, tag.headerLength) == 0) {
      return &tag;
    }
  }
  return nullptr;
}

// The earliest header of any kind. No two headers can begin at one position, so the first '<'
// that starts a header is exactly what searching each kind over the whole buffer and keeping the
// earliest would give, without scanning the rest of the chunk for the rare kinds.
const TagInfo* EarliestHeader(char* buffer, char** headerStart) {
  for (char* p = strchr(buffer, '<'); p != nullptr; p = strchr(p + 1, '<')) {
    if (const TagInfo* tag = TagAt(p)) {
      *headerStart = p;
      return tag;
    }
  }
  return nullptr;
}

}  // namespace

int sm3_internal::findHeaderQuiet(char* buffer, char** headerStart, char** trailerStart,
                                  int* headerLength, int* trailerLength, int* recordType) {
  char* header = nullptr;
  const TagInfo* tag = EarliestHeader(buffer, &header);
  if (tag == nullptr) {
    return 1;
  }
  char* trailer = strstr(header + tag->headerLength, tag->trailer);
  // The positions are filled even without a trailer, so the caller can name the tags.
  *headerStart = header;
  *trailerStart = trailer;
  *headerLength = tag->headerLength;
  *trailerLength = tag->trailerLength;
  *recordType = tag->recordType;
  return trailer == nullptr ? 2 : 0;
}

int findHeader(char* buffer, char** headerStart, char** trailerStart, int* headerLength,
               int* trailerLength, int* recordType, bool fullBuffer) {
  static const char* const kWhere = "findHeader";
  char* header = nullptr;
  char* trailer = nullptr;
  int hl = 0;
  int tl = 0;
  int type = 0;
  const int result = sm3_internal::findHeaderQuiet(buffer, &header, &trailer, &hl, &tl, &type);
  if (result == 1) {
    if (fullBuffer) {
      CLOG::med("%s Unable to find any sm3 record header.  May be because of MAX_BUFFER", kWhere);
    } else {
      CLOG::med("%s ERROR: unable to find any sm3 record header!", kWhere);
    }
    return 1;
  }
  const char* headerTag = SM3_RECORD_KINDS[type - 1].header;
  const char* trailerTag = SM3_RECORD_KINDS[type - 1].trailer;
  if (result == 2) {
    if (fullBuffer) {
      CLOG::med(
          "%s Found sm3 record header[%s] but not it's associated trailer[%s].  May be because of "
          "MAX_BUFFER.",
          kWhere, headerTag, trailerTag);
    } else {
      CLOG::min("%s ERROR: Found sm3 record header[%s] but not it's associated trailer[%s]!",
                kWhere, headerTag, trailerTag);
    }
    return 2;
  }
  *headerStart = header;
  *trailerStart = trailer;
  *headerLength = hl;
  *trailerLength = tl;
  *recordType = type;
  return 0;
}

namespace {

// Finds the next record at *cursor and moves past it as getSM3Line does; returns its content's
// start (in the buffer, not terminated) and sets *trailer, or null.
char* nextRecord(char** cursor, long* remaining, bool fullBuffer, long* consumed, int* recordType,
                 char** trailerAt) {
  *consumed = 0;
  char* header = nullptr;
  char* trailer = nullptr;
  int headerLength = 0;
  int trailerLength = 0;
  if (findHeader(*cursor, &header, &trailer, &headerLength, &trailerLength, recordType,
                 fullBuffer) != 0) {
    if (fullBuffer) {
      CLOG::med("Failed to find sm3 line header, most likely due to MAX_BUFFER.");
    } else {
      CLOG::med("ERROR Failed to find sm3 line header");
    }
    return nullptr;
  }
  char* content = header + headerLength;
  const long contentLength = trailer - content;
  const long eolCount = CCommon::findEOLChars(trailer + trailerLength);
  const long recordLength = headerLength + contentLength + trailerLength + eolCount;
  // The cursor passes any bytes before the header, but only the record itself is consumed.
  *cursor = header + recordLength;
  *remaining -= recordLength;
  *consumed = recordLength;
  *trailerAt = trailer;
  return content;
}

}  // namespace

std::unique_ptr<char[]> getSM3Line(char** cursor, long* remaining, bool fullBuffer, long* consumed,
                                   int* recordType) {
  char* const start = *cursor;
  const long before = *remaining;
  char* trailer = nullptr;
  const char* content = nextRecord(cursor, remaining, fullBuffer, consumed, recordType, &trailer);
  if (content == nullptr) {
    return nullptr;
  }
  const long contentLength = trailer - content;
  std::unique_ptr<char[]> line(new (std::nothrow) char[contentLength + 1]);
  if (!line) {
    CLOG::min("ERROR new failed for linelen[%lu]", static_cast<unsigned long>(contentLength));
    // Not taken after all: the record stays where it was, to be read again later.
    *cursor = start;
    *remaining = before;
    *consumed = 0;
    return nullptr;
  }
  memcpy(line.get(), content, contentLength);
  line[contentLength] = '\0';
  return line;
}

long processDPXContents(char* chunk, long length, bool fullBuffer, CSM3RecordSink& sink) {
  for (char* nul = static_cast<char*>(memchr(chunk, '\0', length)); nul != nullptr;
       nul = static_cast<char*>(memchr(nul + 1, '\0', length - (nul + 1 - chunk)))) {
    *nul = ' ';
  }
  long total = 0;
  char* cursor = chunk;
  long remaining = length;
  do {
    long consumed = 0;
    int recordType = 0;
    char* trailer = nullptr;
    char* line = nextRecord(&cursor, &remaining, fullBuffer, &consumed, &recordType, &trailer);
    if (line == nullptr) {
      break;
    }
    // The content is handed over where it lies, ended for the call by a NUL over the trailer's
    // first byte, which is put back after.
    const char kept = *trailer;
    *trailer = '\0';
    const bool taken = sink.processSM3Line(line, recordType);
    *trailer = kept;
    if (!taken) {
      break;
    }
    total += consumed;
  } while (remaining > 0);
  return total;
}

int sm3_internal::findHeaderLiteral(char* buffer, char** headerStart, char** trailerStart,
                                    int* headerLength, int* trailerLength, int* recordType) {
  const SM3_RECORD_TAGS* kept = nullptr;
  char* keptAt = nullptr;
  for (const SM3_RECORD_TAGS& kind : SM3_RECORD_KINDS) {
    char* at = strstr(buffer, kind.header);
    if (at != nullptr && (keptAt == nullptr || at < keptAt)) {
      kept = &kind;
      keptAt = at;
    }
  }
  if (kept == nullptr) {
    return 1;
  }
  const int hl = static_cast<int>(strlen(kept->header));
  char* trailer = strstr(keptAt + hl, kept->trailer);
  *headerStart = keptAt;
  *trailerStart = trailer;
  *headerLength = hl;
  *trailerLength = static_cast<int>(strlen(kept->trailer));
  *recordType = kept->recordType;
  return trailer == nullptr ? 2 : 0;
}
