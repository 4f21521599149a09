// SPDX-License-Identifier: Apache-2.0
#include "identity/RegistryFiles.h"

#include "ipc/Identifiers.h"
#include "os/FileDescriptor.h"
#include "os/SystemRoot.h"
#include "platform/Errno.h"
#include "platform/Service.h"
#include "plist/Codec.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <fcntl.h>
#include <limits>

namespace zor::platform {

namespace {

constexpr std::string_view keyIdentifier = "Identifier";
constexpr std::string_view keyExecutable = "Executable";
constexpr std::string_view keyUserIds = "UserIDs";
constexpr std::string_view keyUnit = "Unit";
constexpr std::string_view keySecurityLabel = "SecurityLabel";
constexpr std::string_view keyEntitlements = "Entitlements";
constexpr std::string_view keyKernelAgent = "KernelAgent";
constexpr std::string_view keyOnlyOwnIdentifier = "OnlyOwnIdentifier";
constexpr std::string_view keyPassedSockets = "PassedSockets";
constexpr std::array keysKnown = {keyIdentifier,  keyExecutable,        keyUserIds,
                                  keyUnit,        keySecurityLabel,     keyEntitlements,
                                  keyKernelAgent, keyOnlyOwnIdentifier, keyPassedSockets};

using Problem = std::optional<std::string>;

std::string wrong(std::string_view key, std::string_view what) {
    return "\"" + std::string(key) + "\" is " + std::string(what);
}

Problem readString(const plist::Dictionary& file, std::string_view key, std::optional<std::string>& out) {
    const plist::Value* const value = file.find(key);
    if (!value)
        return {};
    const std::string* const text = value->asString();
    if (!text || text->empty() || text->find('\0') != std::string::npos)
        return wrong(key, "no string, or an empty one");
    out = *text;
    return {};
}

Problem readFlag(const plist::Dictionary& file, std::string_view key, bool& out) {
    const plist::Value* const value = file.find(key);
    if (!value)
        return {};
    const bool* const flag = value->asBoolean();
    if (!flag)
        return wrong(key, "no boolean");
    out = *flag;
    return {};
}

Problem readUserIds(const plist::Dictionary& file, RegistryEntry& entry) {
    const plist::Value* const value = file.find(keyUserIds);
    if (!value)
        return {};
    const plist::Array* const array = value->asArray();
    if (!array)
        return wrong(keyUserIds, "no array");
    entry.userIds.emplace();
    for (const plist::Value& element : *array) {
        const auto uid = element.asUnsigned();
        // The largest number is what the kernel calls no user at all.
        if (!uid || *uid >= std::numeric_limits<std::uint32_t>::max())
            return wrong(keyUserIds, "not an array of user ids");
        entry.userIds->push_back(static_cast<std::uint32_t>(*uid));
    }
    return {};
}

Problem readGrant(const plist::Dictionary& file, RegistryEntry& entry) {
    auto grant = std::make_shared<IdentityGrant>();
    if (Problem problem = readString(file, keyIdentifier, grant->identifier))
        return problem;
    if (grant->identifier && !ipc::isIdentifier(*grant->identifier))
        return wrong(keyIdentifier, "longer than " + std::to_string(ipc::identifierBytesMax) + " bytes");
    if (const plist::Value* const value = file.find(keyEntitlements)) {
        const plist::Dictionary* const entitlements = value->asDictionary();
        if (!entitlements)
            return wrong(keyEntitlements, "no dictionary");
        grant->entitlements = *entitlements;
    }
    if (Problem problem = readFlag(file, keyKernelAgent, grant->kernelAgent))
        return problem;
    if (Problem problem = readFlag(file, keyOnlyOwnIdentifier, grant->onlyOwnIdentifier))
        return problem;
    entry.grant = std::move(grant);
    return {};
}

Problem readEntry(const plist::Dictionary& file, RegistryEntry& entry) {
    for (const auto& [key, value] : file) {
        if (std::ranges::find(keysKnown, key) == keysKnown.end())
            return wrong(key, "not a key of this file");
    }
    std::optional<std::string> executable;
    if (Problem problem = readString(file, keyExecutable, executable))
        return problem;
    if (!executable || executable->front() != '/')
        return wrong(keyExecutable, "missing or no absolute path");
    entry.executable = std::move(*executable);
    if (Problem problem = readString(file, keyUnit, entry.unit))
        return problem;
    if (Problem problem = readString(file, keySecurityLabel, entry.securityLabel))
        return problem;
    if (Problem problem = readUserIds(file, entry))
        return problem;
    if (Problem problem = readFlag(file, keyPassedSockets, entry.passedSockets))
        return problem;
    return readGrant(file, entry);
}

/// The entitlements that let their holder act on containers of others.
bool isPowerful(const IdentityGrant& grant) {
    if (grant.kernelAgent)
        return true;
    return grant.entitlements && (grant.entitlements->isTrue(entitlementKeys::allowed) ||
                                  grant.entitlements->isTrue(entitlementKeys::otherIdLookup) ||
                                  grant.entitlements->array(entitlementKeys::wipeContainer));
}

} // namespace

bool RegistryEntry::admitsUser(std::uint32_t reportedUserId) const {
    if (userIds)
        return std::ranges::find(*userIds, reportedUserId) != userIds->end();
    return reportedUserId == 0 || !isPowerful(*grant);
}

bool RegistryEntry::operator==(const RegistryEntry& other) const {
    return executable == other.executable && userIds == other.userIds && unit == other.unit &&
           securityLabel == other.securityLabel && passedSockets == other.passedSockets &&
           grant->identifier == other.grant->identifier && grant->entitlements == other.grant->entitlements &&
           grant->kernelAgent == other.grant->kernelAgent && grant->onlyOwnIdentifier == other.grant->onlyOwnIdentifier;
}

std::expected<RegistryEntry, std::string> parseIdentityFile(std::span<const std::uint8_t> bytes) {
    const auto list = plist::readPropertyList(bytes);
    if (!list)
        return std::unexpected(list.error().text());
    const plist::Dictionary* const file = list->asDictionary();
    if (!file)
        return std::unexpected("the property list is no dictionary");
    RegistryEntry entry;
    if (Problem problem = readEntry(*file, entry))
        return std::unexpected(std::move(*problem));
    return entry;
}

namespace {

RegistryProblem cannot(const char* what, Errno error) {
    return {.text = std::string("cannot be ") + what + ": " + error.text(), .isShortage = isOwnShortage(error)};
}

bool isRegistryName(std::string_view name) {
    return !name.starts_with('.') && name.ends_with(names::identityFileSuffix);
}

} // namespace

std::optional<RegistryProblem> RegistryDirectory::ownershipProblem(const struct stat& status) const {
    if (status.st_uid != 0 && status.st_uid != daemonUserId_)
        return RegistryProblem{.text = "belongs to uid " + std::to_string(status.st_uid)};
    if ((status.st_mode & (S_IWGRP | S_IWOTH)) != 0)
        return RegistryProblem{.text = "can be written to by others than its owner"};
    return std::nullopt;
}

RegistryListing RegistryDirectory::list() const {
    RegistryListing listing;
    auto opened = openBeneath(root_.descriptor(), names::identityDirectory, O_RDONLY | O_DIRECTORY);
    if (!opened) {
        if (opened.error() != ENOENT)
            listing.problem = cannot("opened", opened.error());
        return listing;
    }
    struct stat status{};
    if (::fstat(opened->get(), &status) != 0)
        return listing;
    listing.problem = ownershipProblem(status);
    if (listing.problem)
        return listing;
    auto names = directoryNames(opened->get());
    if (!names) {
        listing.problem = cannot("read", names.error());
        return listing;
    }
    for (std::string& name : *names) {
        if (!isRegistryName(name) || ::fstatat(opened->get(), name.c_str(), &status, AT_SYMLINK_NOFOLLOW) != 0)
            continue;
        if (listing.files.size() == filesMax) {
            listing.problem = RegistryProblem{.text = "holds more than " + std::to_string(filesMax) +
                                                      " files; the last ones do not count"};
            break;
        }
        listing.files[std::move(name)] = stampOf(status);
    }
    listing.directory = std::move(*opened);
    return listing;
}

std::expected<std::string, RegistryProblem> RegistryDirectory::bytes(const RegistryListing& listing,
                                                                     const std::string& name) const {
    const auto file = openBeneath(listing.directory.get(), name.c_str(), O_RDONLY | O_NONBLOCK | O_NOCTTY);
    if (!file)
        return std::unexpected(cannot("opened", file.error()));
    struct stat status{};
    if (::fstat(file->get(), &status) != 0)
        return std::unexpected(cannot("examined", Errno::last()));
    if (!S_ISREG(status.st_mode))
        return std::unexpected(RegistryProblem{.text = "is no regular file"});
    if (auto problem = ownershipProblem(status))
        return std::unexpected(std::move(*problem));
    auto bytes = readSmallFile(file->get(), fileBytesMax);
    if (!bytes)
        return std::unexpected(cannot("read", bytes.error()));
    return std::move(*bytes);
}

std::expected<RegistryEntry, RegistryProblem> RegistryDirectory::read(const RegistryListing& listing,
                                                                      const std::string& name) const {
    const std::string content = TRY(bytes(listing, name));
    auto parsed = parseIdentityFile({reinterpret_cast<const std::uint8_t*>(content.data()), content.size()});
    if (!parsed)
        return std::unexpected(RegistryProblem{.text = std::move(parsed.error())});
    return std::move(*parsed);
}

} // namespace zor::platform
