// SPDX-License-Identifier: Apache-2.0
#include "Users.h"

#include "identity/Users.h"
#include "os/SystemRoot.h"
#include "zorvane/Client.h"

#include <cerrno>

namespace zorvanectl {

namespace {

using zor::platform::LinuxPasswordDatabase;
using zor::platform::PasswordEntry;
using zor::platform::SystemRoot;

zor::ErrnoOr<PasswordEntry> entryFor(const std::string& root, std::uint32_t number) {
    const auto opened = SystemRoot::open(root);
    return opened ? LinuxPasswordDatabase(*opened).entryForUserId(number) : opened.error();
}

} // namespace

std::expected<std::uint32_t, std::string> userNumber(const std::string& root, const std::string& text) {
    if (text == "current")
        return zorvane::currentMobileUser;
    const auto opened = SystemRoot::open(root);
    if (!opened)
        return std::unexpected("the root " + root + " cannot be opened: " + opened.error().text());
    return zor::platform::userNumberOf(*opened, text);
}

std::string shownUser(const std::string& root, std::uint32_t number) {
    const auto entry = entryFor(root, number);
    return std::to_string(number) + (entry ? " " + entry->name : "");
}

std::vector<NamedUser> ownersOfClass(const std::string& root, std::uint64_t containerClass) {
    std::vector<NamedUser> owners;
    const std::uint32_t usual = zorvane::defaultUserOfClass(containerClass, root);
    const zorvane::ContainerOwners configured = zorvane::containerOwners(root);
    const bool isSystems = usual != zorvane::currentMobileUser;
    const std::uint32_t last = isSystems ? usual : configured.last;
    for (std::uint32_t number = isSystems ? usual : configured.first; number <= last; ++number) {
        const auto entry = entryFor(root, number);
        if (entry || isSystems || entry.error() != ENOENT)
            owners.push_back({.number = number, .name = entry ? entry->name : std::string()});
    }
    return owners;
}

} // namespace zorvanectl
