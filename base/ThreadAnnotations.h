// Clang thread-safety attributes under the names its documentation uses; nothing under other
// compilers. Source: https://clang.llvm.org/docs/ThreadSafetyAnalysis.html
#pragma once

#if defined(__clang__)
#define VX_THREAD_ATTRIBUTE(x) __attribute__((x))
#else
#define VX_THREAD_ATTRIBUTE(x)
#endif

#define CAPABILITY(x) VX_THREAD_ATTRIBUTE(capability(x))
#define SCOPED_CAPABILITY VX_THREAD_ATTRIBUTE(scoped_lockable)
#define GUARDED_BY(x) VX_THREAD_ATTRIBUTE(guarded_by(x))
#define PT_GUARDED_BY(x) VX_THREAD_ATTRIBUTE(pt_guarded_by(x))
#define REQUIRES(...) VX_THREAD_ATTRIBUTE(requires_capability(__VA_ARGS__))
#define ACQUIRE(...) VX_THREAD_ATTRIBUTE(acquire_capability(__VA_ARGS__))
#define RELEASE(...) VX_THREAD_ATTRIBUTE(release_capability(__VA_ARGS__))
#define TRY_ACQUIRE(...) VX_THREAD_ATTRIBUTE(try_acquire_capability(__VA_ARGS__))
#define EXCLUDES(...) VX_THREAD_ATTRIBUTE(locks_excluded(__VA_ARGS__))
#define ASSERT_CAPABILITY(x) VX_THREAD_ATTRIBUTE(assert_capability(x))
#define RETURN_CAPABILITY(x) VX_THREAD_ATTRIBUTE(lock_returned(x))
#define NO_THREAD_SAFETY_ANALYSIS VX_THREAD_ATTRIBUTE(no_thread_safety_analysis)
