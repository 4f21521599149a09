// SPDX-License-Identifier: Apache-2.0
// Writes what records (ArchiveRecord.h) tell into a directory that nobody else can reach.
//
// Every record is hostile: names are judged (ItemRules.h), found by descriptors below the directory without following a
// link, and made only where nothing is yet. Directories that no entry made are made with mode 0755. A hard link may
// name only a file that came before it. Owners, extended attributes and access control lists of the archive do not
// count; files keep their times.
//
// The first failure ends it and leaves what was made. One thread.
#pragma once

#include "ArchiveRecord.h"
#include "Course.h"
#include "Failure.h"
#include "os/FileDescriptor.h"
#include "platform/Disk.h"
#include "platform/Errno.h"

#include <cstdint>
#include <span>
#include <string>
#include <string_view>
#include <sys/types.h>
#include <vector>

namespace zorvanectl::content {

/// Whom the content belongs to.
struct Owner {
    uid_t user = 0;
    gid_t group = 0;
};

class Unpacker {
public:
    Unpacker(zor::platform::Disk& disk, int directory, Owner owner, Course& course)
        : disk_(disk), directory_(directory), owner_(owner), course_(course) {}

    /// Reads records to their end. The flags of the end.
    [[nodiscard]] Outcome<std::uint32_t> unpack(int records);

private:
    struct Entry {
        Record record;
        std::string name; // plain
        std::string target;
    };
    struct Place {
        int directory = -1; // good until the next call of parentOf
        std::string name;
    };

    [[nodiscard]] Outcome<void> fill(int records, std::size_t bytes);
    [[nodiscard]] Outcome<std::span<const std::uint8_t>> take(int records, std::size_t bytes);
    [[nodiscard]] Outcome<void> beginEntry(const Record& record, std::string_view name, std::string_view target);
    [[nodiscard]] Outcome<void> finishFile();
    [[nodiscard]] Outcome<void> writeData(const Record& record, std::span<const std::uint8_t> bytes);

    [[nodiscard]] Outcome<Place> placeOf(const std::string& name);
    [[nodiscard]] Outcome<void> makeParents(const std::string& path);
    [[nodiscard]] Outcome<void> makeDirectory(int parent, const std::string& name, mode_t mode);
    [[nodiscard]] Outcome<void> makeFile(const Place& place);
    [[nodiscard]] Outcome<void> makeSymbolicLink(const Place& place);
    [[nodiscard]] Outcome<void> makeHardLink(const Place& place);
    /// The meaning of an errno for the entry that is being made.
    [[nodiscard]] std::unexpected<Failure> cannotMake(zor::Errno error) const;

    zor::platform::Disk& disk_;
    const int directory_;
    const Owner owner_;
    Course& course_;
    std::vector<std::uint8_t> buffer_ = std::vector<std::uint8_t>(2 * recordBytesMax);
    std::size_t begin_ = 0;
    std::size_t end_ = 0;
    Entry entry_;
    /// The descriptor of a regular file, while its data comes.
    zor::platform::FileDescriptor file_;
    std::int64_t fileEnd_ = 0;
    std::string parentPath_;
    zor::platform::FileDescriptor parent_;
};

} // namespace zorvanectl::content
