#pragma once

// Clang's thread-safety attributes, so that what a lock guards is stated to the compiler and not
// only in prose. A Clang build with -Wthread-safety checks every access to a GUARDED_BY field
// and every call to a REQUIRES function; other compilers see nothing.
//
//   mutable fw::Mutex mutex_;
//   int count_ GUARDED_BY(mutex_);
//   void BumpLocked() REQUIRES(mutex_);
//
// std::mutex carries no attributes in libstdc++: guard fields with fw::Mutex (framework/mutex.h)
// or with a CvelMutex.

#if defined(__clang__)
#define Q7_THREAD_ANNOTATION(x) __attribute__((x))
#else
#define Q7_THREAD_ANNOTATION(x)
#endif

// A class whose objects are locks; x names the kind in messages ("mutex").
#define CAPABILITY(x) Q7_THREAD_ANNOTATION(capability(x))
// An RAII class that holds the capabilities its constructor acquires until it is destroyed.
#define SCOPED_CAPABILITY Q7_THREAD_ANNOTATION(scoped_lockable)

// A field (or global) read and written only with x held; PT_: the data it points to.
#define GUARDED_BY(x) Q7_THREAD_ANNOTATION(guarded_by(x))
#define PT_GUARDED_BY(x) Q7_THREAD_ANNOTATION(pt_guarded_by(x))

// Lock order: this lock is taken before / after the ones named.
#define ACQUIRED_BEFORE(...) Q7_THREAD_ANNOTATION(acquired_before(__VA_ARGS__))
#define ACQUIRED_AFTER(...) Q7_THREAD_ANNOTATION(acquired_after(__VA_ARGS__))

// The caller must hold the capabilities (exclusively / at least shared).
#define REQUIRES(...) Q7_THREAD_ANNOTATION(requires_capability(__VA_ARGS__))
#define REQUIRES_SHARED(...) Q7_THREAD_ANNOTATION(requires_shared_capability(__VA_ARGS__))

// The function takes / lets go of the capabilities (no argument: the object itself).
#define ACQUIRE(...) Q7_THREAD_ANNOTATION(acquire_capability(__VA_ARGS__))
#define ACQUIRE_SHARED(...) Q7_THREAD_ANNOTATION(acquire_shared_capability(__VA_ARGS__))
#define RELEASE(...) Q7_THREAD_ANNOTATION(release_capability(__VA_ARGS__))
#define RELEASE_SHARED(...) Q7_THREAD_ANNOTATION(release_shared_capability(__VA_ARGS__))
#define RELEASE_GENERIC(...) Q7_THREAD_ANNOTATION(release_generic_capability(__VA_ARGS__))

// The function takes the capability when it returns the first argument's value.
#define TRY_ACQUIRE(...) Q7_THREAD_ANNOTATION(try_acquire_capability(__VA_ARGS__))
#define TRY_ACQUIRE_SHARED(...) Q7_THREAD_ANNOTATION(try_acquire_shared_capability(__VA_ARGS__))

// The caller must not hold the capabilities: the function takes them itself.
#define EXCLUDES(...) Q7_THREAD_ANNOTATION(locks_excluded(__VA_ARGS__))

// The capability is held when the function returns (it checks, or the caller knows better).
#define ASSERT_CAPABILITY(x) Q7_THREAD_ANNOTATION(assert_capability(x))
#define ASSERT_SHARED_CAPABILITY(x) Q7_THREAD_ANNOTATION(assert_shared_capability(x))

// The function returns a reference to the capability x.
#define RETURN_CAPABILITY(x) Q7_THREAD_ANNOTATION(lock_returned(x))

// Turns the analysis off for one function: for locking it cannot follow; say why beside it.
#define NO_THREAD_SAFETY_ANALYSIS Q7_THREAD_ANNOTATION(no_thread_safety_analysis)
