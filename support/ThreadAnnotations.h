#pragma once

// Clang's thread-safety analysis (-Wthread-safety) checks at compile time that a member marked
// GUARDED_BY(m) is only touched with `m` held and that functions marked REQUIRES(m) are only
// called so. Under other compilers the macros expand to nothing and serve as documentation.
//
// std::mutex carries no annotations in libstdc++, so guarded state uses tamber::Mutex and
// tamber::MutexLock (support/Mutex.h, support/MutexLock.h).

#if defined(__clang__)
#define TAMBER_THREAD_ANNOTATION(x) __attribute__((x))
#else
#define TAMBER_THREAD_ANNOTATION(x)
#endif

// A type that acts as a lock ("mutex").
#define CAPABILITY(x) TAMBER_THREAD_ANNOTATION(capability(x))
// An RAII type that holds a capability for its lifetime.
#define SCOPED_CAPABILITY TAMBER_THREAD_ANNOTATION(scoped_lockable)
// The member may be read or written only with the capability held.
#define GUARDED_BY(x) TAMBER_THREAD_ANNOTATION(guarded_by(x))
// What the pointer (not the pointer itself) points to is guarded by the capability.
#define PT_GUARDED_BY(x) TAMBER_THREAD_ANNOTATION(pt_guarded_by(x))
// The caller must hold the capability.
#define REQUIRES(...) TAMBER_THREAD_ANNOTATION(requires_capability(__VA_ARGS__))
// The caller must not hold the capability (the function takes it).
#define EXCLUDES(...) TAMBER_THREAD_ANNOTATION(locks_excluded(__VA_ARGS__))
// The function takes the capability and returns holding it.
#define ACQUIRE(...) TAMBER_THREAD_ANNOTATION(acquire_capability(__VA_ARGS__))
// The function releases the capability, which the caller held.
#define RELEASE(...) TAMBER_THREAD_ANNOTATION(release_capability(__VA_ARGS__))
// The function takes the capability when it returns `true`.
#define TRY_ACQUIRE(...) TAMBER_THREAD_ANNOTATION(try_acquire_capability(__VA_ARGS__))
// Tells the analysis that the capability is held here (checked at run time where possible).
#define ASSERT_CAPABILITY(x) TAMBER_THREAD_ANNOTATION(assert_capability(x))
// Turns the analysis off for one function whose locking it cannot follow; say why beside it.
#define NO_THREAD_SAFETY_ANALYSIS TAMBER_THREAD_ANNOTATION(no_thread_safety_analysis)
