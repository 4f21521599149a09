// SPDX-License-Identifier: Apache-2.0
// The one way to fail below the store: success, or the number of an error as the kernel gives it.
//
// A function that can fail answers an Errno, or an ErrnoOr<T> when it has a value to give. A number is always positive
// here, and nobody has to remember with which sign it came: an order, a minus and a comparison with a number that may
// be none of the constants of <cerrno> do not compile. Any thread.
#pragma once

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <expected>
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

} // namespace zor
