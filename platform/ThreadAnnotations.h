// Names for clang's thread-safety attributes; nothing to other compilers.
#pragma once

#if defined(__clang__)
#define VELK_THREAD_ATTRIBUTE(x) __attribute__((x))
#else
#define VELK_THREAD_ATTRIBUTE(x)
#endif

#define VELK_CAPABILITY(name) VELK_THREAD_ATTRIBUTE(capability(name))
#define VELK_SCOPED_CAPABILITY VELK_THREAD_ATTRIBUTE(scoped_lockable)
#define VELK_GUARDED_BY(lock) VELK_THREAD_ATTRIBUTE(guarded_by(lock))
#define VELK_POINTER_GUARDED_BY(lock) VELK_THREAD_ATTRIBUTE(pt_guarded_by(lock))
#define VELK_REQUIRES(...) VELK_THREAD_ATTRIBUTE(requires_capability(__VA_ARGS__))
#define VELK_ACQUIRE(...) VELK_THREAD_ATTRIBUTE(acquire_capability(__VA_ARGS__))
#define VELK_RELEASE(...) VELK_THREAD_ATTRIBUTE(release_capability(__VA_ARGS__))
#define VELK_TRY_ACQUIRE(...) VELK_THREAD_ATTRIBUTE(try_acquire_capability(__VA_ARGS__))
#define VELK_EXCLUDES(...) VELK_THREAD_ATTRIBUTE(locks_excluded(__VA_ARGS__))
#define VELK_ACQUIRED_AFTER(...) VELK_THREAD_ATTRIBUTE(acquired_after(__VA_ARGS__))
#define VELK_ACQUIRED_BEFORE(...) VELK_THREAD_ATTRIBUTE(acquired_before(__VA_ARGS__))
#define VELK_RETURN_CAPABILITY(lock) VELK_THREAD_ATTRIBUTE(lock_returned(lock))
#define VELK_NO_THREAD_SAFETY_ANALYSIS VELK_THREAD_ATTRIBUTE(no_thread_safety_analysis)
