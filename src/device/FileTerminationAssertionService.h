// SPDX-License-Identifier: Apache-2.0
// Termination assertions as locked files: DIR/run/zorvane/assertions/IDENTIFIER holds the reason's number and is locked
// with flock while the assertion is. A launcher of programs tries the lock for sharing, and starts nothing that it
// does not get.
//
// Several assertions on one application share its file; the last to end removes it. A kill ends the lock with the
// process and leaves a file that nobody has locked, which means nothing and is taken over by the next assertion. The
// file is the daemon's alone, mode 0600: who could open it could lock it, and keep the daemon waiting. Any thread.
#pragma once

#include "base/Mutex.h"
#include "os/FileDescriptor.h"
#include "os/SystemRoot.h"
#include "platform/Device.h"
#include "platform/Disk.h"
#include "platform/Errno.h"

#include <map>

namespace zor::platform {

class FileTerminationAssertionService final : public TerminationAssertionService {
public:
    FileTerminationAssertionService(const SystemRoot& root, Disk& disk) : root_(root), disk_(disk) {}

    /// The handler runs before this returns. nullptr for an identifier that is too long for a file's name.
    std::unique_ptr<Assertion> acquire(std::string_view bundleIdentifier, TerminationReason reason,
                                       AcquisitionHandler handler) override ZOR_EXCLUDES(mutex_);
    [[nodiscard]] std::vector<std::string> held() const override ZOR_EXCLUDES(mutex_);

private:
    class FileAssertion;
    struct Held {
        FileDescriptor file;
        unsigned holders = 0;
    };

    Errno hold(const std::string& identifier, TerminationReason reason) ZOR_EXCLUDES(mutex_);
    void release(const std::string& identifier) ZOR_EXCLUDES(mutex_);
    [[nodiscard]] ErrnoOr<FileDescriptor> lockFile(const std::string& identifier, TerminationReason reason);
    [[nodiscard]] ErrnoOr<FileDescriptor> openDirectory();

    const SystemRoot& root_;
    Disk& disk_;
    mutable Mutex mutex_;
    std::map<std::string, Held, std::less<>> held_ ZOR_GUARDED_BY(mutex_);
};

} // namespace zor::platform
