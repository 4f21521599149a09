// SPDX-License-Identifier: Apache-2.0
#include "SealedDirectory.h"

#include "fs/TreeWalker.h"
#include "fs/Trees.h"
#include "os/FileDescriptor.h"
#include "zorvane/Text.h"

#include <array>
#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <fcntl.h>
#include <memory>
#include <sys/random.h>

namespace zorvanectl::content {

using zor::fs::BulkDirectoryRead;

namespace {

/// How often the owner may put something in the way of one item.
constexpr int attemptsMax = 16;

} // namespace

Outcome<SealedDirectory> SealedDirectory::make(zor::platform::Disk& disk, int container) {
    SealedDirectory sealed(disk, container);
    // Not to be guessed: nothing of the source can have this name.
    std::uint64_t random = 0;
    if (::getrandom(&random, sizeof random, 0) != static_cast<ssize_t>(sizeof random))
        return failed("no random number", zor::Errno::last());
    std::array<char, 32> name{};
    std::snprintf(name.data(), name.size(), ".install-%016llx", static_cast<unsigned long long>(random));
    sealed.name_ = name.data();
    if (const zor::Errno error = disk.makeDirectory(container, name.data(), 0700))
        return failed("the container cannot be written to", error);
    auto directory = zor::platform::openBeneathOnMount(container, name.data(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW);
    if (!directory)
        return failed("the new content's directory cannot be opened", directory.error());
    if (!zor::fs::isFreshDirectory(directory->get()))
        return failed("somebody put something else in the place of the new content's directory");
    sealed.directory_ = std::move(*directory);
    return sealed;
}

Outcome<void> SealedDirectory::raise() {
    const auto buffer = std::make_unique<BulkDirectoryRead::Buffer>();
    for (bool found = true; found;) {
        found = false;
        BulkDirectoryRead entries(directory_.get(), *buffer);
        if (const zor::Errno error = entries.seek(0))
            return failed("the new content cannot be listed", error);
        while (const BulkDirectoryRead::Entry* entry = entries.next()) {
            found = true;
            if (auto raised = raiseItem(entry->name); !raised)
                return raised;
        }
        if (entries.error())
            return failed("the new content cannot be listed", entries.error());
    }
    // An empty directory stays where its owner moved it meanwhile.
    if (const zor::Errno error = disk_->removeDirectory(container_, name_.c_str()); error && error != ENOENT)
        return failed("the new content's directory cannot be removed", error);
    return {};
}

Outcome<void> SealedDirectory::raiseItem(const char* name) {
    const std::string shown = zorvane::printable(name);
    for (int attempt = 0;; ++attempt) {
        const zor::Errno raised = disk_->rename(directory_.get(), name, container_, name, RENAME_NOREPLACE);
        if (!raised)
            return {};
        if (raised != EEXIST || attempt == attemptsMax)
            return failed(shown + " cannot be moved into the container", raised);
        // A standard subdirectory, or what the container's owner put there.
        if (const zor::Errno error = zor::fs::removeTree(*disk_, container_, name); error && error != ENOENT)
            return failed("the container's own " + shown + " cannot be removed", error);
    }
}

} // namespace zorvanectl::content
