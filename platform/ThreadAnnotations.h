// Clang thread-safety annotations. Other compilers ignore them.
#pragma once

#if defined(__clang__)
#define OSTREL_ANNOTATION(x) __attribute__((x))
#else
#define OSTREL_ANNOTATION(x)
#endif

/// A class whose objects are held while code runs: a lock or a serial queue.
#define OSTREL_CAPABILITY(name) OSTREL_ANNOTATION(capability(name))
#define OSTREL_SCOPED_CAPABILITY OSTREL_ANNOTATION(scoped_lockable)

/// The field is read and written only while the lock is held or on the queue.
#define OSTREL_GUARDED_BY(x) OSTREL_ANNOTATION(guarded_by(x))

/// The function runs only on the queue, or with the lock held.
#define OSTREL_ON_QUEUE(x) OSTREL_ANNOTATION(requires_capability(x))
#define OSTREL_REQUIRES(x) OSTREL_ANNOTATION(requires_capability(x))

#define OSTREL_ACQUIRE(...) OSTREL_ANNOTATION(acquire_capability(__VA_ARGS__))
#define OSTREL_RELEASE(...) OSTREL_ANNOTATION(release_capability(__VA_ARGS__))
#define OSTREL_ASSERT_CAPABILITY(x) OSTREL_ANNOTATION(assert_capability(x))
#define OSTREL_RETURN_CAPABILITY(x) OSTREL_ANNOTATION(lock_returned(x))
#define OSTREL_NO_THREAD_SAFETY_ANALYSIS OSTREL_ANNOTATION(no_thread_safety_analysis)
