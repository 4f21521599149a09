// SPDX-License-Identifier: Apache-2.0
// The files of the identity registry: which of them may be believed, and what one says.
#pragma once

#include "os/FileChanges.h"
#include "os/FileDescriptor.h"
#include "os/SystemRoot.h"
#include "platform/Service.h"

#include <cstdint>
#include <expected>
#include <map>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <sys/stat.h>
#include <vector>

namespace zor::platform {

// One file of the identity registry, as a value: which executable it is about, who may be behind it, what it grants.
//
// Reading is strict: a file with a key of the wrong type, or a key that this version does not know, says nothing at
// all. A fence that was misspelled, or that a later version would understand, must not be left out silently. Pure
// functions.

struct RegistryEntry {
    std::string executable;
    std::optional<std::vector<std::uint32_t>> userIds;
    std::optional<std::string> unit;
    std::optional<std::string> securityLabel;
    /// The identifier's programs may be given sockets that a service manager opened. No power of the client.
    bool passedSockets = false;
    /// Never nullptr.
    std::shared_ptr<const IdentityGrant> grant;

    /// The uid as reported: 0 is the owner of the root.
    [[nodiscard]] bool admitsUser(std::uint32_t reportedUserId) const;
    /// Compares what the files say, not where it lies in memory, nor what other files add to it.
    bool operator==(const RegistryEntry& other) const;
};

/// The entry, or in words what is wrong with the file.
[[nodiscard]] std::expected<RegistryEntry, std::string> parseIdentityFile(std::span<const std::uint8_t> bytes);

// Lists and reads the files of the identity registry, and judges whether they may be believed.
//
// A file counts only when it and its directory belong to root or the daemon's user and nobody else can write to them.
// No link is followed, and a FIFO cannot hold up the reader. Keeps nothing; any thread.

/// Why something does not count.
struct RegistryProblem {
    std::string text;
    /// It says nothing of the file or directory: there was no descriptor or no memory to look at it with.
    bool isShortage = false;
    bool operator==(const RegistryProblem&) const = default;
};

/// The registry's files by name, in the order in which they count; none of them has been read.
struct RegistryListing {
    FileDescriptor directory;
    std::map<std::string, FileStamp> files;
    /// When something is wrong with the directory as a whole.
    std::optional<RegistryProblem> problem;

    [[nodiscard]] bool sameAs(const RegistryListing& other) const {
        return files == other.files && problem == other.problem;
    }
};

class RegistryDirectory {
public:
    static constexpr std::size_t fileBytesMax = std::size_t{1} << 20;
    static constexpr std::size_t filesMax = 1024;
    /// All files together; one of the usual size takes some hundred bytes.
    static constexpr std::size_t allBytesMax = std::size_t{64} << 20;

    RegistryDirectory(const SystemRoot& root, uid_t daemonUserId) : root_(root), daemonUserId_(daemonUserId) {}

    [[nodiscard]] RegistryListing list() const;
    /// The content of a file that may be believed.
    [[nodiscard]] std::expected<std::string, RegistryProblem> bytes(const RegistryListing& listing,
                                                                    const std::string& name) const;
    [[nodiscard]] std::expected<RegistryEntry, RegistryProblem> read(const RegistryListing& listing,
                                                                     const std::string& name) const;

private:
    [[nodiscard]] std::optional<RegistryProblem> ownershipProblem(const struct stat& status) const;

    const SystemRoot& root_;
    const uid_t daemonUserId_;
};

} // namespace zor::platform
