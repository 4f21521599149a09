// SPDX-License-Identifier: Apache-2.0
#include "check/CheckedSystem.h"

#include "base/Try.h"
#include "identity/UserConfiguration.h"
#include "os/SystemRoot.h"

#include <cerrno>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

namespace zor::check {

std::expected<std::unique_ptr<CheckedSystem>, std::string> CheckedSystem::open(const std::string& rootDirectory) {
    auto root = platform::SystemRoot::open(rootDirectory);
    if (!root)
        return std::unexpected("cannot open the root " + rootDirectory + ": " + root.error().text());
    struct stat status{};
    if (::fstat(root->descriptor(), &status) != 0)
        return std::unexpected("cannot look at the root " + rootDirectory + ": " + Errno::last().text());
    if (status.st_uid != ::geteuid())
        return std::unexpected("the root " + rootDirectory + " belongs to user " + std::to_string(status.st_uid) +
                               "; only that user sees what the daemon sees");
    // Without it nothing has run there since the boot.
    if (const Errno failure = root->openRuntimeDirectory(); failure && failure != ENOENT)
        return std::unexpected("cannot open the daemon's runtime directory: " + std::string(failure.text()));
    auto configured = TRY(platform::configuredUsers(*root, platform::LinuxPasswordDatabase(*root)));
    return std::unique_ptr<CheckedSystem>(new CheckedSystem(std::move(*root), std::move(configured)));
}

CheckedSystem::CheckedSystem(platform::SystemRoot root, ipc::ConfiguredUsers configured)
    : root_(std::move(root)), configured_(std::move(configured)) {
    places_.fenceMounts(fileManager_);
}

bool CheckedSystem::daemonRuns() const {
    return platform::DaemonLock::isHeld(root_);
}

bool CheckedSystem::ownersCount() const {
    return ::geteuid() == 0;
}

std::string CheckedSystem::belowRoot(const FileURL& url) const {
    const std::string prefix = root_.isDeviceRoot() ? "/" : root_.canonicalPath() + "/";
    return url.path().starts_with(prefix) ? url.path().substr(prefix.size()) : url.path();
}

} // namespace zor::check
