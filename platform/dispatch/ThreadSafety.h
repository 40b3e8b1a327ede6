// Clang thread-safety annotations. A serial queue is a capability: state that lives on a queue is
// GUARDED_BY it, functions that must run there REQUIRE it, and code that enters the queue tells the
// analysis so with Queue::assertCurrent() (an ASSERT_CAPABILITY). Other compilers see nothing.
#pragma once

#if defined(__clang__)
#define AX_TSA(x) __attribute__((x))
#else
#define AX_TSA(x)
#endif

#define CAPABILITY(x) AX_TSA(capability(x))
#define GUARDED_BY(x) AX_TSA(guarded_by(x))
#define PT_GUARDED_BY(x) AX_TSA(pt_guarded_by(x))
#define REQUIRES(...) AX_TSA(requires_capability(__VA_ARGS__))
#define EXCLUDES(...) AX_TSA(locks_excluded(__VA_ARGS__))
#define ACQUIRE(...) AX_TSA(acquire_capability(__VA_ARGS__))
#define RELEASE(...) AX_TSA(release_capability(__VA_ARGS__))
#define ASSERT_CAPABILITY(x) AX_TSA(assert_capability(x))
#define RETURN_CAPABILITY(x) AX_TSA(lock_returned(x))
#define NO_THREAD_SAFETY_ANALYSIS AX_TSA(no_thread_safety_analysis)
