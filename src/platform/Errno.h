// SPDX-License-Identifier: Apache-2.0
// The ways to fail below the store, and how a failure is handed on.
//
// A function that can fail answers an Errno, success or the number of an error as the kernel gives it, or an ErrnoOr<T>
// when it has a value to give. A number is always positive here, and nobody has to remember with which sign it came: an
// order, a minus and a comparison with a number that may be none of the constants of <cerrno> do not compile. TRY hands
// an error on; ZOR_ASSERT is for what is no error but a mistake. Any thread.
#pragma once

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <expected>
#include <type_traits>
#include <utility>

namespace zor {

class [[nodiscard]] Errno {
public:
    /// A constant of <cerrno>. Negative ones, 0, and what is known at run time alone do not compile.
    struct Constant {
        consteval Constant(int constant) : number(constant) {
            if (constant <= 0)
                throw "the number of an error is positive, and success is told by the bool";
        }
        int number;
    };

    /// Success.
    constexpr Errno() = default;
    /// 0 is success. A negative number ends the process: its sign was lost somewhere, and so would be the error.
    constexpr explicit Errno(int number) : number_(number) {
        if (number < 0)
            std::abort();
    }
    /// The error of the last system call of this thread that failed.
    static Errno last() { return Errno(errno); }

    /// Whether there is an error.
    constexpr explicit operator bool() const { return number_ != 0; }
    [[nodiscard]] constexpr int number() const { return number_; }
    /// For people. Static.
    [[nodiscard]] const char* text() const {
        const char* const known = ::strerrordesc_np(number_);
        return known ? known : "Unknown error";
    }

    friend constexpr bool operator==(Errno, Errno) = default;
    friend constexpr bool operator==(Errno error, Constant constant) { return error.number_ == constant.number; }

    Errno operator-() const = delete;
    template <typename T>
    friend bool operator<=>(Errno, const T&) = delete;

private:
    int number_ = 0;
};

/// A value, or the error in its place.
template <typename T>
class [[nodiscard]] ErrnoOr : public std::expected<T, Errno> {
public:
    using std::expected<T, Errno>::expected;
    ErrnoOr(Errno error) : std::expected<T, Errno>(std::unexpect, error) {}
};

/// A shortage of this process or system: it says nothing of the thing that was looked at.
[[nodiscard]] constexpr bool isOwnShortage(Errno error) {
    return error == EMFILE || error == ENFILE || error == ENOMEM;
}

// TRY: the value of an expression, or the end of the function with its error. It takes whatever can fail: an Errno, an
// ErrnoOr, a Result, a std::expected; the function has to answer something that can carry the error.

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

// Conditions that only a mistake of the daemon's own can break, checked in every build: going on would cost more than a
// restart, which loses nothing that was acknowledged. Nothing that a client or a file says is judged so.

namespace zor {

[[noreturn]] inline void assertionFailed(const char* condition, const char* file, int line) {
    std::fprintf(stderr, "%s:%d: does not hold: %s\n", file, line, condition);
    std::abort();
}

} // namespace zor

#define ZOR_ASSERT(condition)                                                                                          \
    ((condition) ? static_cast<void>(0) : ::zor::assertionFailed(#condition, __FILE_NAME__, __LINE__))
