#pragma once

/// Names for clang's thread-safety attributes; other compilers see nothing.
#if defined(__clang__)
#define CINDRAL_THREAD_ANNOTATION(x) __attribute__((x))
#else
#define CINDRAL_THREAD_ANNOTATION(x)
#endif

#define CAPABILITY(x) CINDRAL_THREAD_ANNOTATION(capability(x))
#define SCOPED_CAPABILITY CINDRAL_THREAD_ANNOTATION(scoped_lockable)
#define GUARDED_BY(x) CINDRAL_THREAD_ANNOTATION(guarded_by(x))
#define PT_GUARDED_BY(x) CINDRAL_THREAD_ANNOTATION(pt_guarded_by(x))
#define REQUIRES(...) CINDRAL_THREAD_ANNOTATION(requires_capability(__VA_ARGS__))
#define ACQUIRE(...) CINDRAL_THREAD_ANNOTATION(acquire_capability(__VA_ARGS__))
#define RELEASE(...) CINDRAL_THREAD_ANNOTATION(release_capability(__VA_ARGS__))
#define TRY_ACQUIRE(...) CINDRAL_THREAD_ANNOTATION(try_acquire_capability(__VA_ARGS__))
#define EXCLUDES(...) CINDRAL_THREAD_ANNOTATION(locks_excluded(__VA_ARGS__))
#define ASSERT_CAPABILITY(x) CINDRAL_THREAD_ANNOTATION(assert_capability(x))
#define NO_THREAD_SAFETY_ANALYSIS CINDRAL_THREAD_ANNOTATION(no_thread_safety_analysis)
