// SPDX-License-Identifier: Apache-2.0
// Exceptions of this daemon, and the boundary at which an operation turns one into error 40.
//
// An exception means that something happened which the code has no road for: memory ran out, an invariant of a library
// was broken. It is caught once, at the boundary of the operation; what the operation holds is released by unwinding.
// Only std::exception and what derives from it counts; anything else passes through and is nobody's to swallow.
#pragma once

#include "base/ZORError.h"
#include "platform/Device.h"

#include <exception>
#include <string>
#include <vector>

namespace zor {

/// The functions on the calling thread's stack, innermost first.
std::vector<std::string> callStackSymbols();

class ZORException : public std::exception {
public:
    ZORException(std::string name, std::string reason);
    [[nodiscard]] const char* what() const noexcept override { return description_.c_str(); }
    [[nodiscard]] const std::string& name() const { return name_; }
    [[nodiscard]] const std::string& reason() const { return reason_; }
    [[nodiscard]] const std::vector<std::string>& callStack() const { return callStack_; }

private:
    std::string name_;
    std::string reason_;
    std::string description_;
    std::vector<std::string> callStack_;
};

class ExceptionBoundary {
public:
    ExceptionBoundary(const Log& log, const platform::InternalBuildQuery& internalBuild,
                      platform::CrashAnnotation& crash)
        : log_(log), internalBuild_(internalBuild), crash_(crash) {}

    /// Runs `body`; an exception becomes error 40, logged under `here`. On internal builds the process ends instead.
    template <typename Body>
    auto run(Here here, Body&& body) -> decltype(body()) {
        try {
            return body();
        } catch (const std::exception& exception) {
            return caught(here, exception);
        }
    }

    /// Error 40 for an exception, built and logged; ends the process on internal builds.
    ZORError caught(Here here, const std::exception& exception);

private:
    [[noreturn]] void reportFatal(const std::exception& exception);

    const Log& log_;
    const platform::InternalBuildQuery& internalBuild_;
    platform::CrashAnnotation& crash_;
};

} // namespace zor
