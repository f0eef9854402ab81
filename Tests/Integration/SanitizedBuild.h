// How much slower this build's programs are.
#pragma once

#include <cstddef>

#if defined(__has_feature)
#if __has_feature(address_sanitizer) || __has_feature(thread_sanitizer)
#define TESSARY_SANITIZED 1
#endif
#endif
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
#define TESSARY_SANITIZED 1
#endif

// Tests that go through all points of an operation take every so manieth of them.
#ifdef TESSARY_SANITIZED
constexpr size_t kSanitizedStride = 4;
#else
constexpr size_t kSanitizedStride = 1;
#endif
