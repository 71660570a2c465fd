#pragma once

// Status codes of the framework layer. Framework operations return 0 on success or one of these
// negative values; the reason, where there is one, goes to the trace or an error string.
namespace fw {

inline constexpr int kOk = 0;
inline constexpr int kNotFound = -1;         // a lookup found nothing
inline constexpr int kIoError = -2;          // a file or socket operation failed
inline constexpr int kParseError = -3;       // text did not have the expected syntax
inline constexpr int kInvalidArgument = -4;  // a caller passed something unusable
inline constexpr int kAlreadyRunning = -5;   // a start was requested twice
inline constexpr int kAlreadyExists = -6;    // a name is already registered

}  // namespace fw
