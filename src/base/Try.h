// SPDX-License-Identifier: Apache-2.0
// TRY: the value of an expression, or the end of the function with its error. It takes whatever can fail: an Errno, an
// ErrnoOr, a Result, a std::expected; the function has to answer something that can carry the error.
#pragma once

#include "platform/Errno.h"

#include <expected>
#include <type_traits>
#include <utility>

namespace zor {

template <typename T, typename E>
[[nodiscard]] bool hasFailed(const std::expected<T, E>& result) {
    return !result;
}
[[nodiscard]] inline bool hasFailed(Errno error) {
    return static_cast<bool>(error);
}

template <typename T, typename E>
[[nodiscard]] std::unexpected<E> takeError(std::expected<T, E>& result) {
    return std::unexpected(std::move(result).error());
}
template <typename T>
Errno takeError(ErrnoOr<T>& result) {
    return result.error();
}
inline Errno takeError(Errno error) {
    return error;
}

template <typename T, typename E>
T takeValue(std::expected<T, E>& result) {
    if constexpr (!std::is_void_v<T>)
        return std::move(*result);
}
inline void takeValue(Errno) {}

} // namespace zor

#define TRY(expression)                                                                                                \
    __extension__({                                                                                                    \
        auto zorResult_ = (expression);                                                                                \
        if (::zor::hasFailed(zorResult_))                                                                              \
            return ::zor::takeError(zorResult_);                                                                       \
        ::zor::takeValue(zorResult_);                                                                                  \
    })
