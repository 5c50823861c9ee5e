// Which sanitizer this is compiled for: clang and gcc each say it their own way.
#pragma once

#if defined(__clang__)
#define ZN_ADDRESS_SANITIZER __has_feature(address_sanitizer)
#define ZN_THREAD_SANITIZER __has_feature(thread_sanitizer)
#else
#if defined(__SANITIZE_ADDRESS__)
#define ZN_ADDRESS_SANITIZER 1
#else
#define ZN_ADDRESS_SANITIZER 0
#endif
#if defined(__SANITIZE_THREAD__)
#define ZN_THREAD_SANITIZER 1
#else
#define ZN_THREAD_SANITIZER 0
#endif
#endif
