// SPDX-License-Identifier: Apache-2.0
// A last message kept where a crash report is looked for.
#pragma once

#include <string_view>

namespace zor::platform {

class CrashAnnotation {
public:
    virtual ~CrashAnnotation() = default;
    /// Records the message; the process ends right after. Any thread, one at a time.
    virtual void record(std::string_view message) = 0;
};

} // namespace zor::platform
