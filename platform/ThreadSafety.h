// What a lock guards and what a function needs held, in words that clang's thread-safety analysis checks
// (-Wthread-safety). Other compilers read over them.
#pragma once

#if defined(__clang__)
#define TETHER_THREAD_ATTRIBUTE(x) __attribute__((x))
#else
#define TETHER_THREAD_ATTRIBUTE(x)
#endif

#define TETHER_CAPABILITY(name) TETHER_THREAD_ATTRIBUTE(capability(name))
#define TETHER_SCOPED TETHER_THREAD_ATTRIBUTE(scoped_lockable)
#define GUARDED_BY(lock) TETHER_THREAD_ATTRIBUTE(guarded_by(lock))
#define REQUIRES(...) TETHER_THREAD_ATTRIBUTE(requires_capability(__VA_ARGS__))
#define EXCLUDES(...) TETHER_THREAD_ATTRIBUTE(locks_excluded(__VA_ARGS__))
#define ACQUIRE(...) TETHER_THREAD_ATTRIBUTE(acquire_capability(__VA_ARGS__))
#define RELEASE(...) TETHER_THREAD_ATTRIBUTE(release_capability(__VA_ARGS__))
#define TRY_ACQUIRE(...) TETHER_THREAD_ATTRIBUTE(try_acquire_capability(__VA_ARGS__))
#define RETURN_CAPABILITY(lock) TETHER_THREAD_ATTRIBUTE(lock_returned(lock))
#define NO_THREAD_SAFETY_ANALYSIS TETHER_THREAD_ATTRIBUTE(no_thread_safety_analysis)
