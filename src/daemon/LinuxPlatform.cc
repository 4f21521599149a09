// SPDX-License-Identifier: Apache-2.0
#include "daemon/LinuxPlatform.h"

#include "fs/Durability.h"
#include "identity/Users.h"
#include "os/SystemRoot.h"
#include "platform/Errno.h"

#include <algorithm>
#include <cerrno>
#include <span>
#include <unistd.h>

namespace zor::platform {

namespace {

constexpr int levelError = 3;
/// Clients of every user read it.
constexpr mode_t usersFileMode = 0644;
constexpr const char* deathRowLabel = "com.veltra.zorvaned.deathrow";
constexpr const char* lockStateLabel = "com.veltra.zorvaned.lockstate";

std::unexpected<std::string> cannot(const std::string& what, Errno error) {
    return std::unexpected(what + ": " + error.text());
}

/// Writes the file that tells clients whose containers are whose, unless an earlier start has.
Errno tellUsers(Disk& disk, int runtimeDirectory, const ipc::UserNumbers& numbers) {
    const std::string text = ipc::textOf(numbers);
    const std::span bytes(reinterpret_cast<const std::uint8_t*>(text.data()), text.size());
    const auto there = fs::readOwnedFile(disk, runtimeDirectory, names::usersFile, bytes.size());
    if (there && std::ranges::equal(*there, bytes))
        return Errno();
    return fs::replaceFileDurably(disk, runtimeDirectory, names::usersFile, usersFileMode, bytes);
}

} // namespace

std::expected<std::unique_ptr<LinuxPlatform>, std::string> LinuxPlatform::open(Options options) {
    if (!LinuxPeerIdentity::procIsOurs())
        return std::unexpected(
            std::string("/proc is not mounted or belongs to another pid namespace: clients would be "
                        "taken for other processes. Mount a /proc of this namespace and start again"));
    auto root = SystemRoot::open(options.rootDirectory);
    if (!root)
        return cannot("cannot open the root " + options.rootDirectory, root.error());
    if (root->isDeviceRoot())
        options.syncs = Syncs::on;
    LinuxDisk disk(options.syncs);
    const std::string runtime = root->path(names::runtimeDirectory);
    if (const Errno error = root->makeRuntimeDirectory(disk))
        return cannot("cannot make " + runtime, error);
    auto lock = DaemonLock::take(*root);
    if (!lock && lock.error() == EWOULDBLOCK)
        return std::unexpected("another daemon serves the root " + root->canonicalPath());
    if (!lock)
        return cannot("cannot lock " + runtime + "/" + names::lockFile, lock.error());
    auto users = TRY(configuredUsers(*root, LinuxPasswordDatabase(*root)));
    if (const Errno failed = tellUsers(disk, root->runtimeDirectory(), users.numbers))
        return cannot("cannot write " + runtime + "/" + names::usersFile, failed);
    return std::unique_ptr<LinuxPlatform>(
        new LinuxPlatform(std::move(*root), std::move(*lock), std::move(users), std::move(options)));
}

LinuxPlatform::LinuxPlatform(SystemRoot root, DaemonLock lock, ipc::ConfiguredUsers users, Options options)
    : root_(std::move(root)), lock_(std::move(lock)), users_(std::move(users)), passed_(std::move(options.passed)),
      disk_(options.syncs), log_(options.foreground), registry_(root_, log_, ::geteuid()),
      peers_(registry_, ::geteuid()), upcallPort_(root_, peers_, passed_.take(names::passedUpcallSocket)),
      listener_(peers_, listenerOptions(options.listenerLimits)),
      deathRowQueue_(deathRowLabel, WorkQueue::Priority::background), lockStateQueue_(lockStateLabel) {
    // The registry looks for itself where the loop cannot follow it.
    (void)registry_.follow(runLoop_);
}

LinuxPlatform::~LinuxPlatform() {
    finish();
    registry_.unfollow(runLoop_);
}

void LinuxPlatform::finish() {
    listener_.stop();
    lockStateQueue_.finish();
    deathRowQueue_.finish();
}

ListenerOptions LinuxPlatform::listenerOptions(const ListenerLimits& limits) {
    ListenerOptions options;
    options.address = {.directory = root_.runtimeDirectory(),
                       .directoryPath = root_.path(names::runtimeDirectory),
                       .name = names::serviceSocket};
    options.passed = passed_.take(names::passedServiceSocket);
    options.limits = limits.forUsers(users_.numbers);
    options.report = [this](std::string_view line) { log_.write(levelError, "ServiceListener", line); };
    return options;
}

Platform LinuxPlatform::roles() {
    return {.root = root_,
            .users = users_.numbers,
            .disk = disk_,
            .log = log_,
            .internalBuild = internalBuild_,
            .systemVersion = systemVersion_,
            .passwords = passwords_,
            .lockState = lockState_,
            .protection = protection_,
            .sandbox = sandbox_,
            .assertions = assertions_,
            .crash = crash_,
            .bootMarker = bootMarker_,
            .transactions = transactions_,
            .deathRowQueue = deathRowQueue_,
            .lockStateQueue = lockStateQueue_,
            .runLoop = runLoop_,
            .peers = peers_,
            .listener = listener_,
            .upcallPort = upcallPort_};
}

} // namespace zor::platform
