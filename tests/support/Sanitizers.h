// Whether this program, and so the programs built with it, run under a sanitizer that changes what memory they
// take and how long they need.
#pragma once

namespace kyt {

#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
inline constexpr bool kSanitized = true;
#elif defined(__has_feature)
#if __has_feature(address_sanitizer) || __has_feature(thread_sanitizer)
inline constexpr bool kSanitized = true;
#else
inline constexpr bool kSanitized = false;
#endif
#else
inline constexpr bool kSanitized = false;
#endif

}  // namespace kyt

// A forked child of a process with threads is nothing that the thread sanitizer follows.
#if defined(__has_feature)
#if __has_feature(thread_sanitizer)
#define KYT_NO_FORK_TEST 1
#endif
#endif
