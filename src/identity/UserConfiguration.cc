// SPDX-License-Identifier: Apache-2.0
#include "identity/UserConfiguration.h"

#include "base/Try.h"
#include "identity/LinuxPasswordDatabase.h"
#include "os/FileDescriptor.h"
#include "os/Names.h"
#include "os/Openat2.h"

#include <cerrno>
#include <charconv>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

namespace zor::platform {

std::expected<std::uint32_t, std::string> userNumberOf(const SystemRoot& root, const std::string& text) {
    std::uint32_t number = 0;
    const char* const end = text.data() + text.size();
    const auto [last, failure] = std::from_chars(text.data(), end, number);
    if (failure == std::errc() && last == end)
        return number;
    if (const auto entry = LinuxPasswordDatabase(root).entryForName(text))
        return entry->uid;
    return std::unexpected("'" + text + "' is neither a user id nor a user of " +
                           (root.isDeviceRoot() ? "this system" : root.path("etc/passwd")));
}

namespace {

/// Four short lines and whatever comments somebody may write.
constexpr std::size_t fileBytesMax = 64 * 1024;

std::expected<std::string, std::string> readConfiguration(const SystemRoot& root) {
    const auto file = openInRoot(root.descriptor(), names::configurationFile, O_RDONLY | O_NONBLOCK);
    if (!file && file.error() == ENOENT)
        return "";
    struct stat status{};
    const Errno error = !file ? file.error() : ::fstat(file->get(), &status) != 0 ? Errno::last() : Errno();
    if (error)
        return std::unexpected(std::string("cannot be opened: ") + error.text());
    const bool isTrusted = status.st_uid == 0 || status.st_uid == ::geteuid();
    if (!isTrusted || (status.st_mode & (S_IWGRP | S_IWOTH)) != 0)
        return std::unexpected("can be written by others; give it to root and run chmod go-w on it");
    auto text = readSmallFile(file->get(), fileBytesMax);
    if (!text)
        return std::unexpected(std::string("cannot be read: ") + text.error().text());
    return std::move(*text);
}

ErrnoOr<ipc::Account> accountOf(const ErrnoOr<PasswordEntry>& found) {
    const PasswordEntry entry = TRY(found);
    return ipc::Account{.name = entry.name, .number = entry.uid};
}

} // namespace

std::expected<ipc::ConfiguredUsers, std::string> configuredUsers(const SystemRoot& root,
                                                                 const PasswordDatabase& passwords) {
    const std::string path = root.path(names::configurationFile);
    const auto text = readConfiguration(root);
    if (!text)
        return std::unexpected(path + " " + text.error());
    const ipc::Accounts accounts{
        .named = [&](std::string_view name) { return accountOf(passwords.entryForName(name)); },
        .numbered = [&](std::uint32_t number) { return accountOf(passwords.entryForUserId(number)); },
    };
    auto users = ipc::readUserNumbers(*text, accounts);
    if (!users)
        return std::unexpected(path + ": " + users.error());
    return std::move(*users);
}

} // namespace zor::platform
