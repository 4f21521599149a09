// SPDX-License-Identifier: Apache-2.0
#include "identity/LinuxPasswordDatabase.h"

#include "os/Names.h"
#include "os/Openat2.h"

#include <cerrno>
#include <cstdio>
#include <fcntl.h>
#include <memory>
#include <vector>

namespace zor::platform {

namespace {

constexpr std::size_t entryBytesFirst = 4096;
constexpr std::size_t entryBytesMax = 64 * 1024;

struct FileCloser {
    void operator()(std::FILE* file) const { std::fclose(file); }
};

/// Calls a getpw*_r function with a buffer that grows until the entry fits, and hands the entry on.
template <typename Lookup, typename Convert>
std::expected<PasswordEntry, int> lookUp(Lookup lookup, Convert convert) {
    std::vector<char> buffer(entryBytesFirst);
    for (;;) {
        passwd entry{};
        passwd* found = nullptr;
        const int error = lookup(&entry, buffer.data(), buffer.size(), &found);
        if (error == 0)
            return found ? convert(*found) : std::unexpected(ENOENT);
        if (error == EINTR)
            continue;
        if (error != ERANGE || buffer.size() >= entryBytesMax)
            return std::unexpected(error);
        buffer.resize(buffer.size() * 2);
    }
}

} // namespace

std::expected<PasswordEntry, int> LinuxPasswordDatabase::entryForUserId(std::uint32_t uid) const {
    if (!root_.isDeviceRoot())
        return findInFile([uid](const passwd& entry) { return entry.pw_uid == uid; });
    return lookUp([uid](auto... rest) { return ::getpwuid_r(uid, rest...); },
                  [this](const passwd& found) { return entryOf(found); });
}

std::expected<PasswordEntry, int> LinuxPasswordDatabase::entryForName(std::string_view name) const {
    if (!root_.isDeviceRoot())
        return findInFile([name](const passwd& entry) { return name == entry.pw_name; });
    return lookUp([text = std::string(name)](auto... rest) { return ::getpwnam_r(text.c_str(), rest...); },
                  [this](const passwd& found) { return entryOf(found); });
}

std::expected<PasswordEntry, int>
LinuxPasswordDatabase::findInFile(const std::function<bool(const passwd&)>& matches) const {
    auto opened = openInRoot(root_.descriptor(), names::passwordFile, O_RDONLY | O_NONBLOCK);
    if (!opened)
        return std::unexpected(opened.error());
    const std::unique_ptr<std::FILE, FileCloser> file(::fdopen(opened->get(), "re"));
    if (!file)
        return std::unexpected(errno);
    (void)opened->release();
    std::vector<char> buffer(entryBytesMax);
    passwd entry{};
    passwd* found = nullptr;
    int error;
    while ((error = ::fgetpwent_r(file.get(), &entry, buffer.data(), buffer.size(), &found)) == 0) {
        if (matches(*found))
            return entryOf(*found);
    }
    // A line longer than the buffer ends the search: no entry is that long, and behind it nothing can be trusted.
    return std::unexpected(error == ERANGE ? ENOENT : error);
}

std::expected<PasswordEntry, int> LinuxPasswordDatabase::entryOf(const passwd& found) const {
    const std::string_view home = found.pw_dir ? found.pw_dir : "";
    if (!home.starts_with('/'))
        return std::unexpected(ENOENT);
    return PasswordEntry{.name = found.pw_name, .uid = found.pw_uid, .homeDirectory = root_.path(home)};
}

} // namespace zor::platform
