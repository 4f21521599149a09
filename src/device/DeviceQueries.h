// SPDX-License-Identifier: Apache-2.0
// The build that the device runs, from files below DIR/etc. Read anew each time; any thread.
#pragma once

#include "os/SystemRoot.h"
#include "platform/Device.h"

namespace zor::platform {

/// Whether etc/zorvane/internal-build exists.
class LinuxInternalBuildQuery final : public InternalBuildQuery {
public:
    explicit LinuxInternalBuildQuery(const SystemRoot& root) : root_(root) {}
    [[nodiscard]] bool isInternalBuild() const override;

private:
    const SystemRoot& root_;
};

/// BUILD_ID of etc/os-release, else its VERSION_ID.
class LinuxSystemVersionQuery final : public SystemVersionQuery {
public:
    explicit LinuxSystemVersionQuery(const SystemRoot& root) : root_(root) {}
    [[nodiscard]] std::string buildVersion() const override;

private:
    const SystemRoot& root_;
};

/// The value of `key` in text of the form of os-release: shell assignments, one a line, values perhaps quoted. The last
/// of several counts; empty when there is none.
[[nodiscard]] std::string valueInRelease(std::string_view text, std::string_view key);

} // namespace zor::platform
