#pragma once

// CvelThreadLibrary: process-wide set-up of the runtime thread layer, thread-specific keys and
// thread names.
//
// The library is initialised once per process, lazily by the first object or call that needs
// it, and never torn down. Initialisation names the calling thread "Main Thread" and gives it an
// error stack; threads started through CvelThread get a name and an error stack of their own.
// Calls made before initialisation initialise the library and return -102 if that fails.
//
// Thread safety: every function may be called from any thread.

class CvelThread;

class CvelThreadLibrary {
 public:
  CvelThreadLibrary() = delete;

  // The size of a thread name buffer: 33 characters and a terminator.
  static constexpr int kNameSize = 34;

  // 0, or -101 when already initialised.
  static long Initialize();
  static bool IsInitialized();
  // Initialises the library unless that is done: 0, or -102 when initialising failed.
  static long EnsureInitialized();

  // Thread-specific keys. A new key has the value null in every thread.
  static long CreateNewKey(unsigned* key);             // 0 or -103
  static long SetKeyValue(unsigned key, void* value);  // 0, -104 or -105
  static long GetKeyValue(unsigned key, void** value);

  // Joins threads[0..n) in order and stops at the first failure, which it returns.
  static long JoinAll(CvelThread** threads, int n);

  // Copies the calling thread's name into name (kNameSize bytes); -114 when it has none.
  static long GetCurrentThreadName(char* name);
  static long GetCurrentThreadID(unsigned long* id);
  static bool SameThreadIDs(unsigned long a, unsigned long b);
  // Yields the processor.
  static long GiveWay();

  // The calling thread's name, or null. The text belongs to whoever named the thread.
  static char* GetThreadName();
  // Names the calling thread, for GetThreadName and for trace records. Only the pointer is
  // kept: name must stay alive while the thread runs.
  static long SetThreadName(char* name);
};
