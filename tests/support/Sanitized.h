// SPDX-License-Identifier: Apache-2.0
// Whether a sanitizer watches over this program: it needs memory and system calls of its own, and replaces new.
#pragma once

#ifdef __has_feature
#if __has_feature(thread_sanitizer) || __has_feature(address_sanitizer)
#define ZOR_IS_SANITIZED 1
#endif
#endif
#if defined(__SANITIZE_THREAD__) || defined(__SANITIZE_ADDRESS__)
#define ZOR_IS_SANITIZED 1
#endif

namespace zor::support {

#ifdef ZOR_IS_SANITIZED
inline constexpr bool isSanitized = true;
#else
inline constexpr bool isSanitized = false;
#endif

} // namespace zor::support
