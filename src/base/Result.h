// SPDX-License-Identifier: Apache-2.0
// The value of an operation, or its ZORError. An operation logs an error or hands it on, as its description says.
#pragma once

#include "base/ZORError.h"

#include <expected>
#include <utility>

namespace zor {

template <typename T>
class [[nodiscard]] Result : public std::expected<T, ZORError> {
public:
    using std::expected<T, ZORError>::expected;
    Result(ZORError error) : std::expected<T, ZORError>(std::unexpect, std::move(error)) {}
};

template <>
class [[nodiscard]] Result<void> : public std::expected<void, ZORError> {
public:
    using std::expected<void, ZORError>::expected;
    Result(ZORError error) : std::expected<void, ZORError>(std::unexpect, std::move(error)) {}
};

} // namespace zor

/// The value of a Result; an error leaves the function with it.
#define TRY(expression)                                                                                                \
    __extension__({                                                                                                    \
        auto zorResult_ = (expression);                                                                                \
        if (!zorResult_)                                                                                               \
            return std::move(zorResult_).error();                                                                      \
        ::zor::takeValue(zorResult_);                                                                                  \
    })

namespace zor {
template <typename T>
T takeValue(Result<T>& result) {
    return std::move(*result);
}
inline void takeValue(Result<void>&) {}
} // namespace zor
