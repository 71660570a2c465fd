#pragma once

// Path helpers that accept both '/' and '\' as separators (collector paths may come from
// configuration written on other systems). Null inputs give null / false.
//
// Thread safety: plain functions over caller-owned strings.

// Turns every '\' into '/' in place.
void makeNativePath(char* path);

// The first '/' or '\' of the string, or null. The result points into the argument.
char* findPathSep(char* path);
const char* findPathSep(const char* path);

// The last '/' or '\' of the string, or null. The result points into the argument.
char* getLastPathSeparator(char* path);
const char* getLastPathSeparator(const char* path);

// True when the path exists and is a directory.
bool dirExists(const char* path);
