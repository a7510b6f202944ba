#pragma once

// Clang checks these under -Wthread-safety; for GCC they are empty. A capability is a mutex or a
// serial queue: only blocks that run on a queue may use the members that it guards.

#if defined(__clang__)
#define QUARVEL_ANNOTATION(x) __attribute__((x))
#else
#define QUARVEL_ANNOTATION(x)
#endif

#define QUARVEL_CAPABILITY(name) QUARVEL_ANNOTATION(capability(name))
#define QUARVEL_SCOPED_CAPABILITY QUARVEL_ANNOTATION(scoped_lockable)
#define QUARVEL_GUARDED_BY(x) QUARVEL_ANNOTATION(guarded_by(x))
#define QUARVEL_PT_GUARDED_BY(x) QUARVEL_ANNOTATION(pt_guarded_by(x))
#define QUARVEL_REQUIRES(...) QUARVEL_ANNOTATION(requires_capability(__VA_ARGS__))
#define QUARVEL_EXCLUDES(...) QUARVEL_ANNOTATION(locks_excluded(__VA_ARGS__))
#define QUARVEL_ACQUIRE(...) QUARVEL_ANNOTATION(acquire_capability(__VA_ARGS__))
#define QUARVEL_RELEASE(...) QUARVEL_ANNOTATION(release_capability(__VA_ARGS__))
#define QUARVEL_ASSERT_CAPABILITY(x) QUARVEL_ANNOTATION(assert_capability(x))
#define QUARVEL_NO_THREAD_SAFETY_ANALYSIS QUARVEL_ANNOTATION(no_thread_safety_analysis)
