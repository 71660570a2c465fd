#pragma once

// Status codes of the runtime thread layer (threads, mutexes, events, thread library, error
// stacks). Every operation returns 0 on success or one of these negative codes, and records the
// failure in the calling thread's error stack (cvel_error_stack.h).

namespace cvel {

inline constexpr long kOk = 0;

inline constexpr long kPriorityUnsupported = -2;  // SetPriority, GetPriority
inline constexpr long kLibraryAlreadyInitialized = -101;
inline constexpr long kLibraryNotInitialized = -102;  // and initialising it failed
inline constexpr long kKeyCreateFailed = -103;        // the system refused a new key
inline constexpr long kKeyInvalid = -104;             // set key value: invalid key
inline constexpr long kKeySetFailed = -105;           // set key value: other failure
inline constexpr long kThreadBadState = -106;         // the thread's state forbids the operation
inline constexpr long kJoinDeadlock = -109;           // the thread would join itself
inline constexpr long kJoinFailed = -110;
inline constexpr long kGiveWayWrongThread = -111;  // GiveWay from another thread
inline constexpr long kTerminateFailed = -112;
inline constexpr long kThreadHasNoName = -114;  // GetCurrentThreadName
inline constexpr long kDetachFailed = -117;
inline constexpr long kMutexNotInitialized = -120;
inline constexpr long kMutexLockFailed = -122;
inline constexpr long kMutexUnlockFailed = -123;
inline constexpr long kMutexBusy = -124;  // TryLock: held by someone
inline constexpr long kEventNotInitialized = -130;
inline constexpr long kEventTimeout = -132;  // timed Wait ran out
inline constexpr long kEventWaitFailed = -133;
inline constexpr long kEventSignalFailed = -134;  // Signal, Pulse
inline constexpr long kErrorStackExists = -200;   // the thread already has a stack
inline constexpr long kErrorStackStoreFailed = -201;
inline constexpr long kErrorStackWrapped = -202;  // the ring dropped its oldest entry
inline constexpr long kErrorStackMissing = -203;  // the calling thread has no stack
inline constexpr long kErrorManagerInitFailed = -204;
inline constexpr long kErrorStackClearFailed = -205;

}  // namespace cvel
