#pragma once

// Clang checks these under -Wthread-safety; for GCC they are empty. A capability is a mutex or a
// serial queue: only blocks that run on a queue may use the members that it guards. Write a
// member's guard at its declaration, and a function's need behind its parameters.

#if defined(__clang__)
#define QUARVEL_ANNOTATION(x) __attribute__((x))
#else
#define QUARVEL_ANNOTATION(x)
#endif

// On a class whose objects are capabilities, and on one that holds a capability for a scope.
#define QUARVEL_CAPABILITY(name) QUARVEL_ANNOTATION(capability(name))
#define QUARVEL_SCOPED_CAPABILITY QUARVEL_ANNOTATION(scoped_lockable)
// On a member: only for holders of `x`. The second guards the object that a pointer points to.
#define QUARVEL_GUARDED_BY(x) QUARVEL_ANNOTATION(guarded_by(x))
#define QUARVEL_PT_GUARDED_BY(x) QUARVEL_ANNOTATION(pt_guarded_by(x))
// On a function: the caller holds the capability, or must not hold it.
#define QUARVEL_REQUIRES(...) QUARVEL_ANNOTATION(requires_capability(__VA_ARGS__))
#define QUARVEL_EXCLUDES(...) QUARVEL_ANNOTATION(locks_excluded(__VA_ARGS__))
// On a function: it takes the capability, or gives it back.
#define QUARVEL_ACQUIRE(...) QUARVEL_ANNOTATION(acquire_capability(__VA_ARGS__))
#define QUARVEL_RELEASE(...) QUARVEL_ANNOTATION(release_capability(__VA_ARGS__))
// On a function that checks at run time, with an assertion, that its caller holds the capability.
#define QUARVEL_ASSERT_CAPABILITY(x) QUARVEL_ANNOTATION(assert_capability(x))
// On a function that the analysis cannot follow; a comment there gives the reason.
#define QUARVEL_NO_THREAD_SAFETY_ANALYSIS QUARVEL_ANNOTATION(no_thread_safety_analysis)
