#pragma once

// _FILE_INFO_LL: one node of a found-file list, as CCommon::findFiles builds it and the file
// manager sorts and walks it.
//
// Lists are built with new and freed with CCommon::deleteFoundFiles; whoever holds the head owns
// the whole list. Not thread-safe: a list belongs to the thread that built it.

// Longest path text a node holds, in characters.
inline constexpr int kFileInfoMaxPath = 4096;

struct _FILE_INFO_LL {
  // NUL-terminated "directory/name", at most kFileInfoMaxPath characters.
  char fileName[4100];
  // The next node, or null at the end; owned through the list.
  _FILE_INFO_LL* next;
};
