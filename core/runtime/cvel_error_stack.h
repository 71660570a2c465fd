#pragma once

// Per-thread error stacks: the last error code of a thread and the functions it passed through.
//
// CvelErrorStack is a ring of 50 function names. SetErrorCode starts the ring afresh at the
// failing operation; AddFunction appends the callers on the way out and drops the oldest name
// (returning -202) when the ring is full. The names are not copied: they must be string literals
// or otherwise outlive the stack.
//
// CvelErrorManager keeps one CvelErrorStack per thread under a thread-specific key. Threads
// started through CvelThread, and the thread that initialised the library, have one; other
// threads get -203 from every call until they call RegisterThread.
//
// Thread safety: a CvelErrorStack belongs to one thread. CvelErrorManager's functions may be
// called from any thread and act on the calling thread's stack only.

class CvelErrorStack {
 public:
  static constexpr int kRingSize = 50;

  CvelErrorStack();

  // Stores code and makes location the first (and only) name of the ring. Returns 0.
  long SetErrorCode(long code, const char* location);
  // 0, or -202 when the ring was full and its oldest name was dropped.
  long AddFunction(const char* name);
  long GetErrorCode() const { return error_code_; }
  // Writes the names from first to last, each followed by '\n', NUL-terminated. Stops before a
  // name that would fill the buffer. A null buffer writes nothing. Returns 0.
  long GetStackDump(char* buffer, int size) const;

  // Iterates from the first name to the last; after the last returns null and rewinds.
  const char* GetFirstFunction();
  const char* GetNextFunction();
  // last - first + 1, or last - first + 51 when last <= first. A stack holding only its first
  // name (last == first) therefore reports 51, not 1; the count is kept as it is defined.
  int GetStackSize() const;

 private:
  const char* functions_[kRingSize];
  int first_ = 0;   // index of the oldest name
  int last_ = 0;    // index of the newest name
  int cursor_ = 0;  // iteration position
  long error_code_ = 0;
};

class CvelErrorManager {
 public:
  CvelErrorManager() = delete;

  // Initialises the thread library if needed (which initialises the manager): 0 or -204.
  static long Initialize();
  // The calling thread's stack: -204 when the manager cannot be initialised, -203 when the
  // thread has no stack, otherwise the stack's own result.
  static long SetError(long code, const char* location);
  static long AddFunction(const char* name);
  static long GetError(long* code);
  static long GetStackDump(char* buffer, int size);
  // Copies the calling thread's stack into stack.
  static long GetStack(CvelErrorStack& stack);

  // Gives the calling thread a new empty stack: 0, -200 if it has one, -201 if it cannot be
  // stored.
  static long RegisterThread();
  // Deletes the calling thread's stack: 0, -203 if it has none, -205 if the key cannot be cleared.
  static long UnregisterThread();

  // Creates the key and registers the calling thread. Only the library's initialisation calls
  // it, once, while holding its initialisation lock.
  static long InitializeFromLibrary();
};
