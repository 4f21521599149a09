// SPDX-License-Identifier: Apache-2.0
// The last message before an abort, in a file beside the log. The file is replaced whole: after a failure in the middle
// the one before it is still there.
#pragma once

#include "os/SystemRoot.h"
#include "platform/Device.h"
#include "platform/Disk.h"
#include "platform/Errno.h"

namespace zor::platform {

class FileCrashAnnotation final : public CrashAnnotation {
public:
    FileCrashAnnotation(const SystemRoot& root, Disk& disk) : root_(root), disk_(disk) {}
    /// The message goes to the system's own log where the file cannot be written.
    void record(std::string_view message) override;

private:
    Errno replaceFile(std::string_view message);

    const SystemRoot& root_;
    Disk& disk_;
};

} // namespace zor::platform
