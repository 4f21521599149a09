// SPDX-License-Identifier: Apache-2.0
#include "check/StoreCheck.h"

#include "check/Checks.h"
#include "identity/Users.h"
#include "os/SystemRoot.h"
#include "platform/Errno.h"
#include "store/StorePlaces.h"

#include <algorithm>
#include <cerrno>
#include <fcntl.h>
#include <sys/stat.h>
#include <thread>
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

namespace {

/// Things that the whole system lacks or has too much of.
void checkSystem(Look& look) {
    const CheckedSystem& system = look.device();
    for (const std::string& path : missingOf(system.root()))
        look.addForPerson(FindingCode::rootIncomplete, FileURL::file(system.root().path(path)), "is not there",
                          initCommand(system.root()));
    for (const std::string& doubt : system.userDoubts())
        look.addForPerson(FindingCode::userNumberTaken,
                          FileURL::file(system.root().path(platform::names::configurationFile)), doubt,
                          "man zorvaned.conf");
}

std::vector<Finding> lookOnce(CheckedSystem& system, const CheckOptions& options) {
    Look look(system, options);
    checkSystem(look);
    ContainerCheck(look).checkAll();
    ReferenceCheck(look).checkAll();
    WorkCheck(look).checkAll();
    std::vector<Finding> findings = look.take();
    std::ranges::stable_sort(findings, {}, &Finding::path);
    return findings;
}

} // namespace

std::vector<Finding> checkStore(CheckedSystem& system, const CheckOptions& options) {
    std::vector<Finding> findings = lookOnce(system, options);
    if (options.pause.count() == 0 || isWhole(findings))
        return findings;
    std::this_thread::sleep_for(options.pause);
    const std::vector<Finding> again = lookOnce(system, options);
    std::erase_if(findings, [&](const Finding& finding) {
        const auto [first, last] = std::ranges::equal_range(again, finding.path, {}, &Finding::path);
        return std::none_of(first, last, [&](const Finding& seen) { return seen.isSameAs(finding); });
    });
    return findings;
}

bool isWhole(const std::vector<Finding>& findings) {
    return std::ranges::all_of(findings, [](const Finding& finding) { return pageOf(finding.code).isNote; });
}

} // namespace zor::check
