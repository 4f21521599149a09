// SPDX-License-Identifier: Apache-2.0
// The data-protection class of a container, and the lock that a change of it may wait for.
#include "Commands.h"
#include "KnownContainer.h"
#include "platform/FileDescriptor.h"
#include "platform/linux/Names.h"
#include "platform/linux/Openat2.h"

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <cstdio>
#include <cstring>
#include <dirent.h>
#include <fcntl.h>
#include <map>
#include <memory>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

namespace zorvanectl {

namespace names = zor::platform::names;
using zor::platform::FileDescriptor;
using zor::platform::openBeneath;

namespace {

/// How long an answer may take before it counts as one that comes after the next unlock.
constexpr std::uint32_t pendingAfterMilliseconds = 1000;
constexpr int classOfNone = 3;
constexpr const char* pendingKey = "PendingProtectionChanges";

/// A class, or why it cannot be told.
std::string classOnDisk(int directory) {
    for (const char* attribute : {names::protectionAttribute, names::protectionAttributeUser}) {
        char text[16];
        const ssize_t bytes = ::fgetxattr(directory, attribute, text, sizeof text);
        if (bytes > 0)
            return {text, static_cast<std::size_t>(bytes)};
        if (bytes < 0 && errno != ENODATA && errno != EOPNOTSUPP)
            return ::strerrordesc_np(errno);
    }
    return std::to_string(classOfNone);
}

/// Of each directory that lies in the container.
std::map<std::string, std::string> classesOnDisk(const std::string& path) {
    std::map<std::string, std::string> classes;
    const FileDescriptor root(::open("/", O_PATH | O_DIRECTORY | O_CLOEXEC));
    auto container = openBeneath(root.get(), path.c_str() + 1, O_RDONLY | O_DIRECTORY);
    if (!container)
        return classes;
    const int fd = container->release();
    const std::unique_ptr<DIR, int (*)(DIR*)> entries(::fdopendir(fd), ::closedir);
    if (!entries) {
        ::close(fd);
        return classes;
    }
    while (const dirent* entry = ::readdir(entries.get())) {
        const auto item = openBeneath(fd, entry->d_name, O_RDONLY | O_DIRECTORY);
        if (entry->d_name[0] != '.' && item)
            classes.emplace(entry->d_name, classOnDisk(item->get()));
    }
    return classes;
}

/// The class that is asked for in a change that has not ended.
std::optional<std::int64_t> pendingClass(const zorvane::ConnectOptions& connect,
                                         const zorvane::Client::Address& address) {
    const auto answer = zorvane::status(connect);
    if (!answer)
        return std::nullopt;
    const nlohmann::json status = toJson(*answer);
    const auto counters = status.find("Counters");
    if (counters == status.end() || !counters->contains(pendingKey))
        return std::nullopt;
    for (const auto& change : counters->at(pendingKey))
        if (change.value("Identifier", "") == address.identifier && change.value("UserID", 0U) == address.user &&
            change.value("ContainerClass", std::uint64_t{0}) == address.containerClass)
            return change.value("ProtectionClass", std::int64_t{0});
    return std::nullopt;
}

int showProtection(const Output& output, const zorvane::Client::Address& address, std::int64_t recorded,
                   const std::map<std::string, std::string>& onDisk, std::optional<std::int64_t> pending) {
    if (output.isJson()) {
        nlohmann::json json = {{"identifier", address.identifier}, {"recorded", recorded}, {"onDisk", onDisk}};
        json["pending"] = pending ? nlohmann::json(*pending) : nlohmann::json();
        output.json(json);
        return exitDone;
    }
    output.line(printable(address.identifier));
    output.line("  recorded   " + std::to_string(recorded));
    for (const auto& [name, text] : onDisk)
        output.line("  on disk    " + text + "  " + printable(name));
    if (pending)
        output.line("  pending    " + std::to_string(*pending) + ", waiting for the device to be unlocked");
    return exitDone;
}

std::optional<int> integerIn(const std::string& text) {
    int number = 0;
    const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), number);
    return error == std::errc() && end == text.data() + text.size() ? std::optional(number) : std::nullopt;
}

int failed(const std::string& what, int number, const char* advice) {
    std::fprintf(stderr, "zorvanectl: %s: %s\n  What to do: %s\n", printable(what).c_str(), ::strerrordesc_np(number),
                 advice);
    return exitUnreachable;
}

/// 0 or an errno. By rename, so that nobody reads half a state.
int writeLockState(int directory, int state) {
    const std::string temporary = std::string(".") + names::lockState;
    const std::string text = std::to_string(state) + "\n";
    (void)::unlinkat(directory, temporary.c_str(), 0);
    const FileDescriptor file(
        ::openat(directory, temporary.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0644));
    if (!file.valid())
        return errno;
    if (::write(file.get(), text.data(), text.size()) != static_cast<ssize_t>(text.size()) ||
        ::fchmod(file.get(), 0644) != 0 || ::renameat(directory, temporary.c_str(), directory, names::lockState) != 0)
        return errno;
    return 0;
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
            const auto found = metadata->info.find(std::string(zorvane::protectionClassInfoKey()));
            const auto* number =
                found == metadata->info.end() ? nullptr : std::get_if<std::int64_t>(&found->second.content);
            return showProtection(output, address, number ? *number : classOfNone, classesOnDisk(metadata->path),
                                  pendingClass(connect, address));
        });
}

int lockState(const zorvane::ConnectOptions& connect, const Output& output, const std::optional<int>& state) {
    const FileDescriptor root(::open(connect.root.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    struct stat device{};
    struct stat given{};
    const bool isDevice = ::stat("/", &device) == 0 && root.valid() && ::fstat(root.get(), &given) == 0 &&
                          device.st_dev == given.st_dev && device.st_ino == given.st_ino;
    if (state && isDevice) {
        std::fputs("zorvanectl: the lock state of a device is the device's to set; name another root with --root\n",
                   stderr);
        return exitUsage;
    }
    const auto directory = openBeneath(root.get(), names::runtimeDirectory, O_RDONLY | O_DIRECTORY);
    if (!directory)
        return failed("cannot open " + connect.root + "/" + names::runtimeDirectory, directory.error(),
                      "start the daemon, or name its root with --root");
    if (state)
        if (const int failure = writeLockState(directory->get(), *state))
            return failed("cannot write the lock state", failure, "do it as the owner of the daemon's root");
    char text[32] = {};
    const auto file = openBeneath(directory->get(), names::lockState, O_RDONLY | O_NONBLOCK);
    if (!file && file.error() != ENOENT)
        return failed("cannot read the lock state", file.error(), "see what lies there");
    const ssize_t bytes = file ? ::read(file->get(), text, sizeof text - 1) : 0;
    std::string shown(text, bytes > 0 ? static_cast<std::size_t>(bytes) : 0);
    std::erase(shown, '\n');
    const int now = shown.empty() ? 0 : integerIn(shown).value_or(-1);
    if (output.isJson())
        output.json({{"lockState", now}, {"locked", now == 1}});
    else
        output.line(now == 0 ? "unlocked" : now == 1 ? "locked" : "state " + std::to_string(now));
    return exitDone;
}

} // namespace zorvanectl
