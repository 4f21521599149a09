// SPDX-License-Identifier: Apache-2.0
// Emptying a data container: a fresh one takes its path and its UUID.
//
// A stop before the replace leaves a transient container, which the next one of its identifier or the next boot
// discards; from there on it is the replace's own matter. Any thread; the lookup, the creation and the replace take
// their locks themselves.
#pragma once

#include "base/ContainerClass.h"
#include "base/ZORError.h"
#include "operations/Basics.h"
#include "operations/Creation.h"
#include "operations/Replace.h"

#include <cstdint>
#include <string>

namespace zor {

class Wipe {
public:
    struct Needs {
        const Log& log;
        ExceptionBoundary& boundary;
        Creation& creation;
        Replace& replace;
    };
    explicit Wipe(const Needs& needs) : needs_(needs) {}

    /// Replaces all content of a data container by that of a fresh one; path and UUID stay. Errors 11, 18, 55, and
    /// those of creation and replace.
    Result<void> deleteDataContainerContentForUser(const Caller& caller, std::uint32_t userId,
                                                   const std::string* identifier, ContainerClass containerClass);

private:
    Result<void> checkWipe(const Caller& caller, std::uint32_t userId, const std::string* identifier,
                           ContainerClass containerClass);

    const Needs needs_;
};

} // namespace zor
