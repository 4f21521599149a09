// SPDX-License-Identifier: Apache-2.0
#include "fs/TreeWalker.h"

#include "fs/MountFences.h"
#include "os/FileDescriptor.h"
#include "platform/Errno.h"

#include <array>
#include <cerrno>
#include <cstring>
#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

namespace zor::fs {

BulkDirectoryRead::BulkDirectoryRead(int directory, std::span<std::byte> buffer)
    : directory_(directory), buffer_(buffer) {}

bool BulkDirectoryRead::fill() {
    long count = 0;
    do
        count = ::syscall(SYS_getdents64, directory_, buffer_.data(), buffer_.size());
    while (count < 0 && errno == EINTR);
    // A directory that is no longer linked anywhere answers ENOENT.
    if (count < 0 && errno != ENOENT)
        error_ = Errno::last();
    used_ = 0;
    filled_ = count > 0 ? static_cast<std::size_t>(count) : 0;
    return filled_ > 0;
}

const BulkDirectoryRead::Entry* BulkDirectoryRead::next() {
    constexpr std::size_t nameOffset = offsetof(dirent64, d_name);
    while (used_ < filled_ || (!error_ && fill())) {
        const auto* record = reinterpret_cast<const dirent64*>(buffer_.data() + used_);
        const std::size_t recordBytes = record->d_reclen;
        if (recordBytes <= nameOffset || recordBytes > filled_ - used_) {
            error_ = Errno(EIO);
            break;
        }
        used_ += recordBytes;
        position_ = record->d_off;
        const char* name = record->d_name;
        const std::size_t nameBytes = ::strnlen(name, recordBytes - nameOffset);
        if (nameBytes == recordBytes - nameOffset) {
            error_ = Errno(EIO);
            break;
        }
        if (name[0] == '.' && (nameBytes == 1 || (nameBytes == 2 && name[1] == '.')))
            continue;
        entry_ = {.name = name, .nameBytes = nameBytes, .inode = record->d_ino, .type = record->d_type};
        return &entry_;
    }
    filled_ = used_ = 0;
    return nullptr;
}

Errno BulkDirectoryRead::seek(off_t position) {
    filled_ = used_ = 0;
    error_ = Errno();
    position_ = position;
    if (::lseek(directory_, position, SEEK_SET) < 0)
        error_ = Errno::last();
    return error_;
}

bool isFreshDirectory(int directory) {
    struct stat status{};
    if (::fstat(directory, &status) != 0 || status.st_uid != ::geteuid() || (status.st_mode & 077) != 0)
        return false;
    std::array<std::byte, 1024> buffer;
    BulkDirectoryRead entries(directory, buffer);
    return !entries.seek(0) && entries.next() == nullptr && !entries.error();
}

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

using platform::FileDescriptor;

namespace {

constexpr int directoryFlags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW;
/// How often a name may change between directory and something else under our hands before it counts as unreadable.
constexpr int changesMax = 16;

WalkEntryKind kindOf(mode_t mode) {
    if (S_ISREG(mode))
        return WalkEntryKind::file;
    return S_ISLNK(mode) ? WalkEntryKind::symbolicLink : WalkEntryKind::other;
}

} // namespace

std::string WalkEntry::path() const {
    if (depth == 0)
        return {};
    // At its end a directory is still the stack's deepest level.
    if (depth < stack->depth())
        return stack->path();
    return stack->path().empty() ? std::string(name) : stack->path() + '/' + name;
}

Errno TreeWalker::walk(int parent, const char* name, const Visitor& visitor) {
    stack_.clear();
    visitor_ = &visitor;
    rootParent_ = parent;
    rootName_ = name;
    rootError_ = Errno();
    vanishedDirectories_ = 0;
    WalkStep step = visitRoot();
    while (step != WalkStep::stop && !stack_.empty()) {
        if (const BulkDirectoryRead::Entry* entry = stack_.reader().next())
            step = visitName({.parent = stack_.top(),
                              .name = entry->name,
                              .status = {.st_ino = entry->inode, .st_mode = static_cast<mode_t>(DTTOIF(entry->type))},
                              .depth = stack_.depth(),
                              .index = stack_.nextIndex(),
                              .stack = &stack_},
                             entry->type);
        else
            step = finishDirectory();
    }
    stack_.clear();
    return step == WalkStep::stop ? Errno(ECANCELED) : rootError_;
}

WalkStep TreeWalker::visitRoot() {
    WalkEntry entry{.parent = rootParent_, .name = rootName_.c_str(), .stack = &stack_};
    const Errno error = statusOfName(rootParent_, entry.name, entry.status);
    if (error == EXDEV)
        return visitMountPoint(entry);
    if (error) {
        rootError_ = error;
        return WalkStep::proceed;
    }
    device_ = entry.status.st_dev;
    return visitName(entry, S_ISDIR(entry.status.st_mode) ? DT_DIR : DT_UNKNOWN);
}

WalkStep TreeWalker::visitName(WalkEntry entry, unsigned char type) {
    for (int change = 0;; ++change) {
        if (type != DT_DIR) {
            if (type == DT_UNKNOWN || statusWanted_ == WalkStatus::full) {
                const Errno error = statusOfName(entry.parent, entry.name, entry.status);
                if (error == EXDEV)
                    return visitMountPoint(entry);
                if (error) {
                    entry.error = error;
                    if (entry.depth == 0)
                        rootError_ = entry.error;
                    else if (entry.error != ENOENT)
                        return (*visitor_)(entry);
                    return WalkStep::proceed;
                }
            }
            if (!S_ISDIR(entry.status.st_mode))
                return visitNonDirectory(entry);
        }
        auto directory = platform::openBeneathOnMount(entry.parent, entry.name, directoryFlags);
        if (directory)
            return visitDirectory(entry, std::move(*directory));
        const Errno error = directory.error();
        if ((error != ENOTDIR && error != ELOOP && error != ENOENT) || change == changesMax)
            return visitUnopened(entry, error);
        if (error == ENOENT && entry.depth > 0)
            return WalkStep::proceed;
        type = DT_UNKNOWN;
    }
}

WalkStep TreeWalker::visitNonDirectory(WalkEntry& entry) {
    entry.kind = kindOf(entry.status.st_mode);
    entry.onOtherFileSystem = statusWanted_ == WalkStatus::full && entry.status.st_dev != device_;
    return (*visitor_)(entry);
}

WalkStep TreeWalker::visitDirectory(WalkEntry& entry, FileDescriptor directory) {
    if (::fstat(directory.get(), &entry.status) != 0)
        return visitUnopened(entry, Errno::last());
    if (atRoot())
        device_ = entry.status.st_dev;
    if (entry.status.st_dev != device_)
        return visitMountPoint(entry);
    entry.kind = WalkEntryKind::directory;
    entry.directory = directory.get();
    const WalkStep step = (*visitor_)(entry);
    if (step == WalkStep::skip) {
        entry.kind = WalkEntryKind::directoryEnd;
        return (*visitor_)(entry);
    }
    if (step != WalkStep::stop)
        stack_.push(std::move(directory), device_, entry.status.st_ino, entry.name);
    return step;
}

WalkStep TreeWalker::visitMountPoint(WalkEntry& entry) {
    const mode_t type = entry.status.st_mode & S_IFMT;
    entry.status = {};
    entry.status.st_mode = type == 0 ? mode_t{S_IFDIR} : type;
    entry.onOtherFileSystem = true;
    if (!S_ISDIR(entry.status.st_mode)) {
        entry.kind = kindOf(type);
        return (*visitor_)(entry);
    }
    entry.kind = WalkEntryKind::directory;
    if (const WalkStep step = (*visitor_)(entry); step == WalkStep::stop)
        return step;
    entry.kind = WalkEntryKind::directoryEnd;
    return (*visitor_)(entry);
}

WalkStep TreeWalker::visitUnopened(WalkEntry& entry, Errno error) {
    if (error == EXDEV)
        return visitMountPoint(entry);
    if (statusWanted_ == WalkStatus::full && statusOfName(entry.parent, entry.name, entry.status) == ENOENT)
        return WalkStep::proceed;
    entry.kind = WalkEntryKind::directory;
    if (const WalkStep step = (*visitor_)(entry); step == WalkStep::stop)
        return step;
    entry.kind = WalkEntryKind::unreadableDirectory;
    entry.error = error;
    return (*visitor_)(entry);
}

WalkStep TreeWalker::finishDirectory() {
    std::size_t levelsLost = 0;
    if (!stack_.ensureParent(levelsLost)) {
        vanishedDirectories_ += levelsLost;
        return WalkStep::proceed;
    }
    const bool isRoot = stack_.depth() == 1;
    const std::string name = isRoot ? rootName_ : stack_.name();
    WalkEntry entry{.kind = WalkEntryKind::directoryEnd,
                    .parent = isRoot ? rootParent_ : stack_.parent(),
                    .name = name.c_str(),
                    .directory = stack_.top(),
                    .error = stack_.reader().error(),
                    .depth = stack_.depth() - 1,
                    .pass = stack_.pass(),
                    .stack = &stack_};
    entry.status.st_mode = S_IFDIR;
    if (statusWanted_ == WalkStatus::full && ::fstat(entry.directory, &entry.status) != 0)
        entry.error = Errno::last();
    if (entry.error)
        entry.kind = WalkEntryKind::unreadableDirectory;
    const WalkStep step = (*visitor_)(entry);
    if (step == WalkStep::again && entry.kind == WalkEntryKind::directoryEnd)
        stack_.rewind();
    else if (step != WalkStep::stop)
        stack_.pop();
    return step;
}

} // namespace zor::fs
