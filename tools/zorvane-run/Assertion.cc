// SPDX-License-Identifier: Apache-2.0
#include "Assertion.h"

#include "ipc/Identifiers.h"
#include "ipc/Protocol.h"
#include "os/FileDescriptor.h"
#include "platform/Device.h"

#include <cerrno>
#include <charconv>
#include <fcntl.h>
#include <string_view>
#include <sys/file.h>
#include <unistd.h>

namespace zorvanerun {

using zor::platform::FileDescriptor;

namespace {

namespace platform = zor::platform;

Failure cannotLook(const std::string& path, zor::Errno error) {
    return {.what = withReason("cannot look whether the program may be started: " + path, error),
            .advice = "look who owns that directory: it is the daemon's"};
}

std::string_view reasonIn(int file) {
    char text[8] = {};
    const ssize_t bytes = ::pread(file, text, sizeof text, 0);
    unsigned number = static_cast<unsigned>(platform::TerminationReason::critical);
    if (bytes > 0)
        std::from_chars(text, text + bytes, number);
    return platform::terminationReasonText(static_cast<platform::TerminationReason>(number));
}

/// EWOULDBLOCK when somebody holds the file.
zor::Errno tryLock(int file, int operation) {
    int result = 0;
    do {
        result = ::flock(file, operation);
    } while (result != 0 && errno == EINTR);
    return result == 0 ? zor::Errno() : zor::Errno::last();
}

} // namespace

Result<Freedom> awaitFreedom(const Root& root, const Options& options) {
    const std::string name = zor::ipc::percentEncode(options.identifier);
    if (name.size() > zor::ipc::componentBytesMax)
        return Freedom::found; // the daemon holds none on such an identifier
    const std::string relative =
        std::string(zor::ipc::runtimeDirectory) + "/" + std::string(zor::ipc::assertionDirectory) + "/" + name;
    // Each assertion has a file of its own: behind one that ended, the next may be held already.
    for (Freedom freedom = Freedom::found;; freedom = Freedom::waitedFor) {
        const auto file = platform::openBeneath(root.descriptor.get(), relative.c_str(), O_RDONLY | O_NONBLOCK);
        if (!file && file.error() == ENOENT)
            return freedom;
        if (!file)
            return std::unexpected(cannotLook(root.below("/" + relative), file.error()));
        zor::Errno failure = tryLock(file->get(), LOCK_SH | LOCK_NB);
        if (failure == EWOULDBLOCK && options.wait)
            failure = tryLock(file->get(), LOCK_SH);
        else if (!failure)
            return freedom; // left by a daemon that was killed
        if (failure == EWOULDBLOCK)
            return std::unexpected(Failure{
                .what = options.identifier + " may not be started now: " + std::string(reasonIn(file->get())),
                .advice = "wait until that has ended (a change of data protection ends after the device has been "
                          "unlocked): --wait does, and 'zorvanectl status' shows what is held"});
        if (failure)
            return std::unexpected(cannotLook(root.below("/" + relative), failure));
    }
}

} // namespace zorvanerun
