// Thread-safety annotations, checked by clang's -Wthread-safety.
//
// A mutex is declared a capability; the data it protects says GUARDED_BY it,
// and functions say which locks they need (REQUIRES), take (ACQUIRE) or give
// back (RELEASE). clang then rejects code that touches guarded data without
// the lock or leaves a function still holding one. Other compilers see
// nothing: every macro expands to nothing there, so g++ builds the same code.
//
// The analysis is local to one function and does not follow a lock across
// threads, through a lambda or through a callback. Where a correct pattern
// is beyond it, the one function says NO_THREAD_SAFETY_ANALYSIS together
// with the reason.
#pragma once

#if defined(__clang__) && defined(__has_attribute)
#if __has_attribute(guarded_by)
#define QRV_THREAD_ANNOTATION(x) __attribute__((x))
#endif
#endif
#ifndef QRV_THREAD_ANNOTATION
#define QRV_THREAD_ANNOTATION(x)
#endif

// On a class: objects of it are locks ("mutex" names the kind in messages).
#define CAPABILITY(x) QRV_THREAD_ANNOTATION(capability(x))
// On a class: an object holds a lock from its construction to its
// destruction (or to an explicit release).
#define SCOPED_CAPABILITY QRV_THREAD_ANNOTATION(scoped_lockable)

// On data: read and written only with the lock held.
#define GUARDED_BY(x) QRV_THREAD_ANNOTATION(guarded_by(x))
// On a pointer: what it points at is read and written only with the lock.
#define PT_GUARDED_BY(x) QRV_THREAD_ANNOTATION(pt_guarded_by(x))

// Lock order: this lock is taken after / before the ones named.
#define ACQUIRED_AFTER(...) QRV_THREAD_ANNOTATION(acquired_after(__VA_ARGS__))
#define ACQUIRED_BEFORE(...) QRV_THREAD_ANNOTATION(acquired_before(__VA_ARGS__))

// On functions: the caller must hold the lock (exclusively / at least shared).
#define REQUIRES(...) QRV_THREAD_ANNOTATION(requires_capability(__VA_ARGS__))
#define REQUIRES_SHARED(...) QRV_THREAD_ANNOTATION(requires_shared_capability(__VA_ARGS__))

// On functions: the lock is held on return (and was not on entry).
#define ACQUIRE(...) QRV_THREAD_ANNOTATION(acquire_capability(__VA_ARGS__))
#define ACQUIRE_SHARED(...) QRV_THREAD_ANNOTATION(acquire_shared_capability(__VA_ARGS__))

// On functions: the lock was held on entry and is not on return.
#define RELEASE(...) QRV_THREAD_ANNOTATION(release_capability(__VA_ARGS__))
#define RELEASE_SHARED(...) QRV_THREAD_ANNOTATION(release_shared_capability(__VA_ARGS__))
#define RELEASE_GENERIC(...) QRV_THREAD_ANNOTATION(release_generic_capability(__VA_ARGS__))

// On functions: the lock is taken only when the result equals the first
// argument.
#define TRY_ACQUIRE(...) QRV_THREAD_ANNOTATION(try_acquire_capability(__VA_ARGS__))
#define TRY_ACQUIRE_SHARED(...) QRV_THREAD_ANNOTATION(try_acquire_shared_capability(__VA_ARGS__))

// On functions: the caller must not hold the lock (the function takes it, and
// the locks are not recursive).
#define EXCLUDES(...) QRV_THREAD_ANNOTATION(locks_excluded(__VA_ARGS__))

// On functions: checks at run time that the lock is held; the analysis
// trusts it from there on.
#define ASSERT_CAPABILITY(x) QRV_THREAD_ANNOTATION(assert_capability(x))
#define ASSERT_SHARED_CAPABILITY(x) QRV_THREAD_ANNOTATION(assert_shared_capability(x))

// On functions: returns the lock named.
#define RETURN_CAPABILITY(x) QRV_THREAD_ANNOTATION(lock_returned(x))

// On functions: the analysis is not run on this one. Always say why beside it.
#define NO_THREAD_SAFETY_ANALYSIS QRV_THREAD_ANNOTATION(no_thread_safety_analysis)
