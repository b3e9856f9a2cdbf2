#pragma once

// Which sanitizer a test program is built with. GCC says so with __SANITIZE_*__, clang only
// through __has_feature: a test that adapts to a sanitizer must ask both.
#if defined(__SANITIZE_ADDRESS__)
#define TAMBER_TESTS_ASAN 1
#elif defined(__has_feature)
#if __has_feature(address_sanitizer)
#define TAMBER_TESTS_ASAN 1
#endif
#endif

#if defined(__SANITIZE_THREAD__)
#define TAMBER_TESTS_TSAN 1
#elif defined(__has_feature)
#if __has_feature(thread_sanitizer)
#define TAMBER_TESTS_TSAN 1
#endif
#endif
