// SPDX-License-Identifier: Apache-2.0
#include "identity/RegistryDirectory.h"

#include "base/Try.h"
#include "os/Names.h"
#include "os/Openat2.h"

#include <cerrno>
#include <fcntl.h>

namespace zor::platform {

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
