// SPDX-License-Identifier: Apache-2.0
#include "fs/DirectoryStack.h"

#include "base/Assert.h"
#include "os/Openat2.h"

#include <fcntl.h>
#include <sys/stat.h>

namespace zor::fs {

using platform::FileDescriptor;

int DirectoryStack::descriptor(std::size_t level) const {
    const Slot& slot = slots_[slotOf(level)];
    return slot.level == level ? slot.directory.get() : -1;
}

std::string_view DirectoryStack::nameOf(std::size_t level) const {
    if (level == 0)
        return {};
    // The root has no name, so no separator follows it.
    const std::size_t begin = level == 1 ? 0 : levels_[level - 1].pathBytes + 1;
    return std::string_view(path_).substr(begin, levels_[level].pathBytes - begin);
}

void DirectoryStack::push(FileDescriptor directory, dev_t device, ino_t inode, std::string_view name) {
    ZOR_ASSERT(directory.valid());
    if (levels_.empty()) {
        device_ = device;
    } else {
        // A component with a separator would name another level when the way down is gone once more.
        ZOR_ASSERT(!name.empty() && name.find('/') == std::string_view::npos);
        if (levels_.size() > 1)
            path_ += '/';
        path_ += name;
    }
    levels_.push_back({.inode = inode, .pathBytes = path_.size()});
    install(levels_.size() - 1, std::move(directory));
}

void DirectoryStack::pop() {
    ZOR_ASSERT(!levels_.empty());
    truncate(levels_.size() - 1);
}

void DirectoryStack::clear() {
    truncate(0);
}

void DirectoryStack::install(std::size_t level, FileDescriptor directory) {
    Slot& slot = slots_[slotOf(level)];
    if (slot.directory.valid() && slot.reader && slot.level < levels_.size())
        levels_[slot.level].resume = slot.reader->position();
    slot.reader.reset();
    slot.directory = std::move(directory);
    slot.level = level;
}

void DirectoryStack::truncate(std::size_t levels) {
    for (Slot& slot : slots_)
        if (slot.directory.valid() && slot.level >= levels) {
            slot.reader.reset();
            slot.directory.reset();
        }
    levels_.resize(levels);
    path_.resize(levels == 0 ? 0 : levels_.back().pathBytes);
}

bool DirectoryStack::isLevel(int directory, std::size_t level) const {
    struct stat status{};
    return ::fstat(directory, &status) == 0 && status.st_dev == device_ && status.st_ino == levels_[level].inode;
}

bool DirectoryStack::ensureParent(std::size_t& levelsLost) {
    levelsLost = 0;
    if (levels_.size() < 2 || parent() >= 0)
        return true;
    const std::size_t above = levels_.size() - 2;
    FileDescriptor directory;
    if (const int below = top(); below >= 0)
        directory.reset(::openat(below, "..", O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    if (directory.valid() && isLevel(directory.get(), above)) {
        install(above, std::move(directory));
        return true;
    }
    const std::size_t reached = reopenFromRoot(above);
    if (reached > above)
        return true;
    levelsLost = levels_.size() - reached;
    truncate(reached);
    return false;
}

std::size_t DirectoryStack::reopenFromRoot(std::size_t last) {
    FileDescriptor current;
    for (std::size_t level = 1; level <= last; ++level) {
        const std::string name(nameOf(level));
        const int from = level == 1 ? root() : current.get();
        auto opened = platform::openBeneathOnMount(from, name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW);
        if (!opened || !isLevel(opened->get(), level)) {
            if (level > 1)
                install(level - 1, std::move(current));
            return level;
        }
        // The last levels stay open, so that what made ".." useless does not cost a walk from the root for each of
        // them. The slot after them is the deepest level's own.
        if (level > 1 && level - 1 + openMax > last + 1)
            install(level - 1, FileDescriptor(::fcntl(current.get(), F_DUPFD_CLOEXEC, 0)));
        current = std::move(*opened);
    }
    install(last, std::move(current));
    return last + 1;
}

BulkDirectoryRead& DirectoryStack::reader() {
    ZOR_ASSERT(!levels_.empty());
    Slot& slot = slots_[slotOf(levels_.size() - 1)];
    if (!slot.reader) {
        if (!slot.buffer)
            slot.buffer = std::make_unique<BulkDirectoryRead::Buffer>();
        slot.reader.emplace(slot.directory.get(), *slot.buffer);
        if (levels_.back().resume != 0)
            (void)slot.reader->seek(levels_.back().resume);
    }
    return *slot.reader;
}

void DirectoryStack::rewind() {
    Level& level = levels_.back();
    ++level.pass;
    level.entries = 0;
    level.resume = 0;
    (void)reader().seek(0); // the reader keeps the error
}

} // namespace zor::fs
