#pragma once

// SetAsideTraced: what the agent does with one of its own files that fails to load (torn,
// truncated, foreign, of a newer format): it renames it "<path>.bad" (fw::SetFileAside), so
// that it starts and serves without it while an operator can still look at it, and traces
// what, why and where it went.
//
// Thread safety: a plain function.

#include <string>

// what names the file in the trace ("Checkpoint", "Pattern file", ...); why says what is wrong
// with it. False when the rename failed (traced too).
bool SetAsideTraced(const char* what, const std::string& path, const std::string& why);
