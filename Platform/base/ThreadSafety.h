// Names for Clang's thread-safety attributes. Other compilers see nothing.
#pragma once

#if defined(__clang__)
#define TSY_THREAD_ATTRIBUTE(x) __attribute__((x))
#else
#define TSY_THREAD_ATTRIBUTE(x)
#endif

#define CAPABILITY(x) TSY_THREAD_ATTRIBUTE(capability(x))
#define SCOPED_CAPABILITY TSY_THREAD_ATTRIBUTE(scoped_lockable)
#define GUARDED_BY(x) TSY_THREAD_ATTRIBUTE(guarded_by(x))
#define PT_GUARDED_BY(x) TSY_THREAD_ATTRIBUTE(pt_guarded_by(x))
#define REQUIRES(...) TSY_THREAD_ATTRIBUTE(requires_capability(__VA_ARGS__))
#define ACQUIRE(...) TSY_THREAD_ATTRIBUTE(acquire_capability(__VA_ARGS__))
#define RELEASE(...) TSY_THREAD_ATTRIBUTE(release_capability(__VA_ARGS__))
#define EXCLUDES(...) TSY_THREAD_ATTRIBUTE(locks_excluded(__VA_ARGS__))
#define ASSERT_CAPABILITY(x) TSY_THREAD_ATTRIBUTE(assert_capability(x))
#define NO_THREAD_SAFETY_ANALYSIS TSY_THREAD_ATTRIBUTE(no_thread_safety_analysis)
