#pragma once

// Which queue or lock protects what, in a form that clang's -Wthread-safety proves; other compilers skip it.
#if defined(__clang__)
#define KEL_ATTRIBUTE(x) __attribute__((x))
#else
#define KEL_ATTRIBUTE(x)
#endif

#define KEL_CAPABILITY(name) KEL_ATTRIBUTE(capability(name))
#define KEL_RETURNS_CAPABILITY(x) KEL_ATTRIBUTE(lock_returned(x))
#define KEL_ASSERTS_CAPABILITY(...) KEL_ATTRIBUTE(assert_capability(__VA_ARGS__))

/// A member that is touched only on the given queue.
#define KEL_ON(queue) KEL_ATTRIBUTE(guarded_by(queue))

/// A pointer whose target is touched only on the given queue.
#define KEL_TARGET_ON(queue) KEL_ATTRIBUTE(pt_guarded_by(queue))

/// A function that is called only on the given queue.
#define KEL_RUNS_ON(...) KEL_ATTRIBUTE(requires_capability(__VA_ARGS__))
