// SPDX-License-Identifier: Apache-2.0
// The data-protection class of a container, and the lock that a change of it may wait for.
#include "Commands.h"
#include "KnownContainer.h"
#include "PendingChanges.h"
#include "device/DataProtection.h"
#include "os/FileDescriptor.h"
#include "os/SystemRoot.h"
#include "platform/Errno.h"

#include <cerrno>
#include <cstring>
#include <dirent.h>
#include <fcntl.h>
#include <map>
#include <memory>
#include <sys/stat.h>
#include <unistd.h>

namespace zorvanectl {

namespace names = zor::platform::names;
using zor::Errno;
using zor::platform::defaultProtectionClass;
using zor::platform::FileDescriptor;
using zor::platform::FileDeviceLockState;
using zor::platform::SystemRoot;
using zor::platform::XattrProtectionClass;

namespace {

/// How long an answer may take before it counts as one that comes after the next unlock.
constexpr std::uint32_t pendingAfterMilliseconds = 1000;

/// A class, or why it cannot be told. The daemon keeps it where a file's owner cannot change it, if it can.
std::string classOnDisk(int directory) {
    for (const char* attribute : {names::protectionAttribute, names::protectionAttributeUser}) {
        const auto found = XattrProtectionClass::classIn(directory, attribute);
        if (!found)
            return found.error().text();
        if (*found)
            return std::to_string(**found);
    }
    return std::to_string(defaultProtectionClass);
}

/// The class of each directory that lies in the container.
content::Outcome<std::map<std::string, std::string>> classesOnDisk(const std::string& path, std::uint64_t kind) {
    FileDescriptor container = TRY(content::openToldContainer(path, fenceKind(kind)));
    std::map<std::string, std::string> classes;
    const int fd = container.release();
    const std::unique_ptr<DIR, int (*)(DIR*)> entries(::fdopendir(fd), ::closedir);
    if (!entries) {
        ::close(fd);
        return content::failed("the container " + printable(path) + " cannot be read", Errno(ENOMEM));
    }
    while (const dirent* entry = ::readdir(entries.get())) {
        if (entry->d_name[0] == '.')
            continue;
        if (const auto item = zor::platform::openBeneathOnMount(fd, entry->d_name, O_RDONLY | O_DIRECTORY))
            classes.emplace(entry->d_name, classOnDisk(item->get()));
    }
    return classes;
}

/// The change of this container that has not ended.
std::optional<PendingChange> pendingChange(const zorvane::ConnectOptions& connect,
                                           const zorvane::Client::Address& address) {
    const auto status = zorvane::status(connect);
    if (status)
        for (const PendingChange& change : pendingChangesIn(*status))
            if (change.uuid == zorvane::uuidText(address.uuid))
                return change;
    return std::nullopt;
}

int showProtection(const Output& output, const zorvane::Client::Address& address, std::int64_t recorded,
                   const std::map<std::string, std::string>& onDisk, const std::optional<PendingChange>& pending) {
    if (output.isJson()) {
        nlohmann::json json = {{"identifier", address.identifier}, {"recorded", recorded}, {"onDisk", onDisk}};
        json["pending"] = pending ? nlohmann::json(pending->protectionClass) : nlohmann::json();
        json["waitsForUnlock"] = pending && pending->locked;
        output.json(json);
        return exitDone;
    }
    output.line(printable(address.identifier));
    output.line("  recorded   " + std::to_string(recorded));
    for (const auto& [name, text] : onDisk)
        output.line("  on disk    " + text + "  " + printable(name));
    if (pending)
        output.line("  pending    " + std::to_string(pending->protectionClass) +
                    (pending->locked ? ", waiting for the device to be unlocked" : ", being made"));
    return exitDone;
}

zorvane::Error unreachable(const std::string& what, Errno error) {
    return {.kind = zorvane::Error::Kind::unreachable, .code = 0, .message = printable(what) + ": " + error.text()};
}

/// By rename, so that nobody reads half a state.
Errno writeLockState(int directory, int state) {
    const std::string temporary = std::string(".") + names::lockState;
    const std::string text = std::to_string(state) + "\n";
    (void)::unlinkat(directory, temporary.c_str(), 0);
    const FileDescriptor file(
        ::openat(directory, temporary.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0644));
    if (!file.valid())
        return Errno::last();
    const ssize_t written = ::write(file.get(), text.data(), text.size());
    if (written >= 0 && written < static_cast<ssize_t>(text.size()))
        return Errno(ENOSPC);
    if (written < 0 || ::fchmod(file.get(), 0644) != 0 ||
        ::renameat(directory, temporary.c_str(), directory, names::lockState) != 0)
        return Errno::last();
    return Errno();
}

} // namespace

int protect(const zorvane::ConnectOptions& connect, const Output& output, const Target& target,
            const Protection& protection) {
    const std::string what = "set the data protection of " + target.identifier;
    zorvane::ConnectOptions options = connect;
    if (protection.noWait)
        options.timeoutMilliseconds = pendingAfterMilliseconds;
    auto client = zorvane::Client::connect(options);
    if (!client)
        return output.error(client.error(), what);
    const auto done = client->setDataProtection({.containerClass = target.containerClass,
                                                 .user = userOf(target),
                                                 .identifier = target.identifier,
                                                 .protectionClass = protection.protectionClass,
                                                 .thirdParty = protection.thirdParty,
                                                 .retryIfLocked = !protection.failIfLocked});
    const bool pending =
        !done && protection.noWait && !protection.failIfLocked && done.error().kind == zorvane::Error::Kind::timedOut;
    if (!done && !pending)
        return output.error(done.error(), what);
    if (output.isJson())
        output.json({{"identifier", target.identifier},
                     {"class", target.containerClass},
                     {"protectionClass", protection.protectionClass},
                     {"pending", pending}});
    else
        output.line(printable(target.identifier) + (pending
                                                        ? " gets class " + std::to_string(protection.protectionClass) +
                                                              " when it has ended; "
                                                              "'zorvanectl protection' shows what it waits for"
                                                        : " has class " + std::to_string(protection.protectionClass)));
    return exitDone;
}

int protection(const zorvane::ConnectOptions& connect, const Output& output, const Target& target) {
    const std::string what = "show the data protection of " + target.identifier;
    return withContainer(
        connect, output, target, what, [&](zorvane::Client& client, const zorvane::Client::Address& address) {
            const auto metadata = client.metadata(address);
            if (!metadata)
                return output.error(metadata.error(), what);
            const auto onDisk = classesOnDisk(metadata->path, target.containerClass);
            if (!onDisk)
                return output.localError(exitLocalError, onDisk.error().what, "try again when the cause is gone", what);
            const auto found = metadata->info.find(std::string(zorvane::protectionClassInfoKey()));
            const auto* number =
                found == metadata->info.end() ? nullptr : std::get_if<std::int64_t>(&found->second.content);
            return showProtection(output, address, number ? *number : defaultProtectionClass, *onDisk,
                                  pendingChange(connect, address));
        });
}

int lockState(const zorvane::ConnectOptions& connect, const Output& output, const std::optional<int>& state) {
    const std::string what = state ? "set the lock state" : "show the lock state";
    auto root = SystemRoot::open(connect.root);
    if (!root)
        return output.error(unreachable("the root " + connect.root + " cannot be opened", root.error()), what);
    if (state && root->isDeviceRoot())
        return output.localError(exitUsage, "the lock state of a device is the device's to set",
                                 "name another root with --root", what);
    const std::string directory = root->path(names::runtimeDirectory);
    if (const Errno failure = root->openRuntimeDirectory())
        return output.error(unreachable(directory + " cannot be opened", failure), what);
    if (state)
        if (const Errno failure = writeLockState(root->runtimeDirectory(), *state))
            return output.error(unreachable(directory + " cannot be written to", failure), what);
    const int now = FileDeviceLockState(*root).currentState();
    if (output.isJson())
        output.json({{"lockState", now}, {"locked", now == FileDeviceLockState::locked}});
    else
        output.line(now == FileDeviceLockState::unlocked ? "unlocked"
                    : now == FileDeviceLockState::locked ? "locked"
                                                         : "neither locked nor unlocked (" + std::to_string(now) + ")");
    return exitDone;
}

} // namespace zorvanectl
