// Names for clang's thread-safety attributes, in the words of queues; other compilers see nothing.
#pragma once

#if defined(__clang__)
#define PW_ATTRIBUTE(x) __attribute__((x))
#else
#define PW_ATTRIBUTE(x)
#endif

#define PW_CAPABILITY(name) PW_ATTRIBUTE(capability(name))
#define PW_GUARDED_BY(queue) PW_ATTRIBUTE(guarded_by(queue))
#define PW_REQUIRES(...) PW_ATTRIBUTE(requires_capability(__VA_ARGS__))
#define PW_EXCLUDES(...) PW_ATTRIBUTE(locks_excluded(__VA_ARGS__))
#define PW_ASSERT_CAPABILITY(...) PW_ATTRIBUTE(assert_capability(__VA_ARGS__))
#define PW_NO_ANALYSIS PW_ATTRIBUTE(no_thread_safety_analysis)
