#pragma once
// Clang's thread-safety attributes behind short names, so that `make analyze` can check
// at compile time that guarded members are touched only under their lock. Other compilers
// see nothing.

#if defined(__clang__)
#define PELMORA_THREAD_ATTRIBUTE(x) __attribute__((x))
#else
#define PELMORA_THREAD_ATTRIBUTE(x)
#endif

// A class that is a lock.
#define PELMORA_CAPABILITY(name) PELMORA_THREAD_ATTRIBUTE(capability(name))
// A class whose objects hold a lock for their lifetime.
#define PELMORA_SCOPED_CAPABILITY PELMORA_THREAD_ATTRIBUTE(scoped_lockable)
// A member read or written only with the lock held.
#define PELMORA_GUARDED_BY(lock) PELMORA_THREAD_ATTRIBUTE(guarded_by(lock))
// A pointer whose target is read or written only with the lock held.
#define PELMORA_PT_GUARDED_BY(lock) PELMORA_THREAD_ATTRIBUTE(pt_guarded_by(lock))
// A function called with the lock held (exclusively or shared).
#define PELMORA_REQUIRES(...) PELMORA_THREAD_ATTRIBUTE(requires_capability(__VA_ARGS__))
#define PELMORA_REQUIRES_SHARED(...) PELMORA_THREAD_ATTRIBUTE(requires_shared_capability(__VA_ARGS__))
// A function called without the lock (it takes it itself).
#define PELMORA_EXCLUDES(...) PELMORA_THREAD_ATTRIBUTE(locks_excluded(__VA_ARGS__))
// A function that takes or gives up the lock.
#define PELMORA_ACQUIRE(...) PELMORA_THREAD_ATTRIBUTE(acquire_capability(__VA_ARGS__))
#define PELMORA_ACQUIRE_SHARED(...) PELMORA_THREAD_ATTRIBUTE(acquire_shared_capability(__VA_ARGS__))
#define PELMORA_RELEASE(...) PELMORA_THREAD_ATTRIBUTE(release_capability(__VA_ARGS__))
#define PELMORA_RELEASE_SHARED(...) PELMORA_THREAD_ATTRIBUTE(release_shared_capability(__VA_ARGS__))
#define PELMORA_RELEASE_GENERIC(...) PELMORA_THREAD_ATTRIBUTE(release_generic_capability(__VA_ARGS__))
#define PELMORA_TRY_ACQUIRE(...) PELMORA_THREAD_ATTRIBUTE(try_acquire_capability(__VA_ARGS__))
// A function that returns the lock guarding something.
#define PELMORA_RETURN_CAPABILITY(lock) PELMORA_THREAD_ATTRIBUTE(lock_returned(lock))
// A function whose locking the analysis cannot follow (hand-over-hand, conditional locks).
#define PELMORA_NO_THREAD_SAFETY_ANALYSIS PELMORA_THREAD_ATTRIBUTE(no_thread_safety_analysis)
