#pragma once

// Clang thread-safety analysis; expands to nothing on other compilers.
#if defined(__clang__)
#define SORVIK_TSA(x) __attribute__((x))
#else
#define SORVIK_TSA(x)
#endif

#define CAPABILITY(x) SORVIK_TSA(capability(x))
#define SCOPED_CAPABILITY SORVIK_TSA(scoped_lockable)
#define GUARDED_BY(x) SORVIK_TSA(guarded_by(x))
#define PT_GUARDED_BY(x) SORVIK_TSA(pt_guarded_by(x))
#define ACQUIRED_BEFORE(...) SORVIK_TSA(acquired_before(__VA_ARGS__))
#define REQUIRES(...) SORVIK_TSA(requires_capability(__VA_ARGS__))
#define ACQUIRE(...) SORVIK_TSA(acquire_capability(__VA_ARGS__))
#define RELEASE(...) SORVIK_TSA(release_capability(__VA_ARGS__))
#define EXCLUDES(...) SORVIK_TSA(locks_excluded(__VA_ARGS__))
#define ASSERT_CAPABILITY(x) SORVIK_TSA(assert_capability(x))
#define NO_THREAD_SAFETY_ANALYSIS SORVIK_TSA(no_thread_safety_analysis)
