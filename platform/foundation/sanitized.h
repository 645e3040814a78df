#pragma once

// gcc says by macros what clang says by features.
#if defined(__has_feature)
#if __has_feature(address_sanitizer)
#define YOMBER_ADDRESS_SANITIZER
#elif __has_feature(thread_sanitizer)
#define YOMBER_THREAD_SANITIZER
#endif
#elif defined(__SANITIZE_ADDRESS__)
#define YOMBER_ADDRESS_SANITIZER
#elif defined(__SANITIZE_THREAD__)
#define YOMBER_THREAD_SANITIZER
#endif

namespace yomber {

/// For tests: whether the address sanitizer watches, which needs descriptors and memory of its own.
#if defined(YOMBER_ADDRESS_SANITIZER)
inline constexpr bool kHasAddressSanitizer = true;
#else
inline constexpr bool kHasAddressSanitizer = false;
#endif

/// For tests: whether the address or the thread sanitizer watches, under which all takes longer.
#if defined(YOMBER_ADDRESS_SANITIZER) || defined(YOMBER_THREAD_SANITIZER)
inline constexpr bool kIsSanitized = true;
#else
inline constexpr bool kIsSanitized = false;
#endif

}  // namespace yomber

#undef YOMBER_ADDRESS_SANITIZER
#undef YOMBER_THREAD_SANITIZER
