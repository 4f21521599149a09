// SPDX-License-Identifier: Apache-2.0
#include "identity/Users.h"

#include "os/FileDescriptor.h"
#include "os/SystemRoot.h"
#include "platform/Errno.h"

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <cstdio>
#include <ctime>
#include <fcntl.h>
#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>
#include <utility>

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

namespace {

constexpr std::size_t entryBytesFirst = 4096;
constexpr std::size_t entryBytesMax = 64 * 1024;
/// A thousand accounts. A longer file is read each time, for its entries would be most of an idle daemon's memory.
constexpr off_t contentBytesMax = 64 * 1024;
/// A change within one tick of the clock leaves the stamp as it is, so a younger content is not kept. File systems that
/// count whole seconds have longer ticks.
constexpr std::int64_t tickNanosecondsMax = 20'000'000;
constexpr std::int64_t nanosecondsPerSecond = 1'000'000'000;

struct FileCloser {
    void operator()(std::FILE* file) const { std::fclose(file); }
};

bool isSettled(std::int64_t changedNanoseconds) {
    timespec now{};
    ::clock_gettime(CLOCK_REALTIME_COARSE, &now);
    const bool wholeSeconds = changedNanoseconds % nanosecondsPerSecond == 0;
    return nanosecondsOf(now) - changedNanoseconds > (wholeSeconds ? 2 * nanosecondsPerSecond : tickNanosecondsMax);
}

ErrnoOr<FileStamp> stampOfOpen(int file) {
    struct stat status{};
    return ::fstat(file, &status) == 0 ? ErrnoOr<FileStamp>(stampOf(status)) : Errno::last();
}

PasswordEntry named(const passwd& found) {
    return {.name = found.pw_name, .uid = found.pw_uid, .homeDirectory = found.pw_dir ? found.pw_dir : ""};
}

/// Hands over each entry until `visit` wants no more. ENOENT when that never came, any other error when the file cannot
/// be read.
Errno visitEntries(std::FILE* file, const std::function<bool(PasswordEntry)>& visit) {
    const auto buffer = std::make_unique_for_overwrite<char[]>(entryBytesMax);
    passwd entry{};
    passwd* found = nullptr;
    int error = 0;
    while ((error = ::fgetpwent_r(file, &entry, buffer.get(), entryBytesMax, &found)) == 0) {
        if (!visit(named(*found)))
            return Errno();
    }
    // A line longer than the buffer ends the search: no entry is that long, and behind it nothing can be trusted.
    return Errno(error == ERANGE ? ENOENT : error);
}

/// Calls a getpw*_r function with a buffer that grows until the entry fits, and hands the entry on.
template <typename Lookup, typename Convert>
ErrnoOr<PasswordEntry> lookUp(Lookup lookup, Convert convert) {
    std::vector<char> buffer(entryBytesFirst);
    for (;;) {
        passwd entry{};
        passwd* found = nullptr;
        const int error = lookup(&entry, buffer.data(), buffer.size(), &found);
        if (error == 0)
            return found ? convert(named(*found)) : Errno(ENOENT);
        if (error == EINTR)
            continue;
        if (error != ERANGE || buffer.size() >= entryBytesMax)
            return Errno(error);
        buffer.resize(buffer.size() * 2);
    }
}

} // namespace

ErrnoOr<PasswordEntry> LinuxPasswordDatabase::entryForUserId(std::uint32_t uid) const {
    if (!root_.isDeviceRoot())
        return findInFile([uid](const PasswordEntry& entry) { return entry.uid == uid; });
    return lookUp([uid](auto... rest) { return ::getpwuid_r(uid, rest...); },
                  [this](PasswordEntry found) { return entryOf(std::move(found)); });
}

ErrnoOr<PasswordEntry> LinuxPasswordDatabase::entryForName(std::string_view name) const {
    if (!root_.isDeviceRoot())
        return findInFile([name](const PasswordEntry& entry) { return entry.name == name; });
    return lookUp([text = std::string(name)](auto... rest) { return ::getpwnam_r(text.c_str(), rest...); },
                  [this](PasswordEntry found) { return entryOf(std::move(found)); });
}

ErrnoOr<PasswordEntry> LinuxPasswordDatabase::findInFile(const Matches& matches) const {
    FileDescriptor opened = TRY(openInRoot(root_.descriptor(), names::passwordFile, O_RDONLY | O_NONBLOCK));
    const FileStamp stamp = TRY(stampOfOpen(opened.get()));
    std::shared_ptr<const Content> content;
    {
        const MutexLock held(mutex_);
        content = content_;
    }
    Errno end(ENOENT);
    if (!content || content->stamp != stamp) {
        const bool settled = isSettled(stamp.changedNanoseconds);
        const std::unique_ptr<std::FILE, FileCloser> file(::fdopen(opened.get(), "re"));
        if (!file)
            return Errno::last();
        const int descriptor = opened.release();
        auto read = std::make_shared<Content>(Content{.stamp = stamp, .entries = {}});
        const bool keeps = stamp.bytes <= contentBytesMax;
        end = visitEntries(file.get(), [&](PasswordEntry entry) {
            if (!keeps && !matches(entry))
                return true;
            read->entries.push_back(std::move(entry));
            return keeps;
        });
        const auto after = stampOfOpen(descriptor);
        if (keeps && settled && end == ENOENT && after && *after == stamp) {
            const MutexLock held(mutex_);
            content_ = read;
        }
        content = std::move(read);
    }
    const auto found = std::ranges::find_if(content->entries, matches);
    return found == content->entries.end() ? end : entryOf(*found);
}

ErrnoOr<PasswordEntry> LinuxPasswordDatabase::entryOf(PasswordEntry named) const {
    if (!named.homeDirectory.starts_with('/'))
        return Errno(ENOENT);
    named.homeDirectory = root_.path(named.homeDirectory);
    return named;
}

} // namespace zor::platform
