// SPDX-License-Identifier: Apache-2.0
#include "fs/DiskUsage.h"

#include "base/Log.h"
#include "base/ZORError.h"
#include "fs/BulkDirectoryRead.h"
#include "fs/ItemStatus.h"
#include "fs/TreeWalker.h"
#include "os/Openat2.h"

#include <algorithm>
#include <cerrno>
#include <climits>
#include <deque>
#include <dirent.h>
#include <fcntl.h>
#include <linux/magic.h>
#include <optional>
#include <sys/stat.h>
#include <sys/vfs.h>
#include <unordered_set>

namespace zor::fs {

using platform::FileDescriptor;

namespace {

// The directories that may wait at once; beyond that a directory is measured when it is met.
constexpr std::size_t queuedDirectoriesMax = 65'536;
constexpr std::size_t queuedBytesMax = 16 * 1024 * 1024;
constexpr std::uint64_t blockBytes = 512;
constexpr std::uint32_t xfsMagic = 0x58465342;

/// The traits that the type of the tree's file system tells.
struct FileSystemTraits {
    /// The greatest size that a directory without entries has, where every directory with entries is larger. There a
    /// status tells what would else take an open and a read.
    std::optional<off_t> emptyDirectoryBytes;
    /// Whether a part of it can have another device number without a mount point.
    bool hasSubvolumes = true;
};

FileSystemTraits traitsOf(int directory) {
    struct statfs status{};
    if (::fstatfs(directory, &status) != 0)
        return {};
    switch (static_cast<std::uint32_t>(status.f_type)) {
    case BTRFS_SUPER_MAGIC:
        return {.emptyDirectoryBytes = 0};
    case xfsMagic:
        return {.emptyDirectoryBytes = 10, .hasSubvolumes = false};
    case TMPFS_MAGIC:
        return {.emptyDirectoryBytes = 40, .hasSubvolumes = false};
    case EXT4_SUPER_MAGIC:
        return {.hasSubvolumes = false};
    default:
        return {};
    }
}

std::string joined(const std::string& path, const char* name) {
    return path.empty() ? std::string(name) : path + '/' + name;
}

class Measurement {
public:
    Measurement(int root, const std::string& rootPath, const UsageLog& log)
        : root_(root), rootPath_(rootPath), log_(log), traits_(traitsOf(root)) {}

    Usage run();

private:
    void measureDirectory(const std::string& path);
    void measureEntries(int directory, const std::string& path);
    [[nodiscard]] bool isInTree(int directory) const;
    void noteChange(const struct stat& status);
    void noteChangeOf(int directory);
    void addDirectory(int directory, const std::string& path, const char* name);
    /// `makePath` is called only for a message.
    template <typename MakePath>
    void addNonDirectory(const struct stat& status, MakePath makePath);
    void measureDepthFirst(int parent, const std::string& path, const char* name);
    void addWalkEntry(const WalkEntry& entry, const std::string& top);

    void sayUnopened(const std::string& path, int error);
    void sayUnexamined(const std::string& path, std::uint64_t index, int error);
    void sayEmpty(const std::string& path) const;
    [[nodiscard]] bool logs(int level) const { return log_.write && level <= log_.levelMax; }
    [[nodiscard]] std::string fullPath(const std::string& path) const {
        return path.empty() ? rootPath_ : rootPath_ + '/' + path;
    }

    const int root_;
    const std::string& rootPath_;
    const UsageLog& log_;
    const FileSystemTraits traits_;
    dev_t device_ = 0;
    Usage usage_;
    std::unordered_set<ino_t> seen_;
    /// Relative to the root, which is "".
    std::deque<std::string> queue_;
    std::size_t queuedBytes_ = 0;
    BulkDirectoryRead::Buffer buffer_;
};

Usage Measurement::run() {
    struct stat status{};
    if (::fstat(root_, &status) != 0 || ::lseek(root_, 0, SEEK_SET) < 0) {
        sayUnopened({}, errno);
        return usage_;
    }
    device_ = status.st_dev;
    queue_.emplace_back();
    while (!queue_.empty()) {
        const std::string path = std::move(queue_.front());
        queue_.pop_front();
        queuedBytes_ -= path.size();
        measureDirectory(path);
    }
    noteChangeOf(root_); // as it is after the walk
    return usage_;
}

void Measurement::noteChange(const struct stat& status) {
    const auto sinceEpoch =
        std::chrono::seconds(status.st_ctim.tv_sec) + std::chrono::nanoseconds(status.st_ctim.tv_nsec);
    usage_.lastChange = std::max(usage_.lastChange, std::chrono::system_clock::time_point(sinceEpoch));
}

void Measurement::noteChangeOf(int directory) {
    struct stat status{};
    if (::fstat(directory, &status) == 0)
        noteChange(status);
}

void Measurement::measureDirectory(const std::string& path) {
    if (path.empty()) {
        measureEntries(root_, path);
        return;
    }
    const auto directory = platform::openBeneathOnMount(root_, path.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW);
    if (!directory) {
        // A mount point is not part of the tree.
        if (directory.error() != EXDEV)
            sayUnopened(path, directory.error().number());
        return;
    }
    if (isInTree(directory->get()))
        measureEntries(directory->get(), path);
}

bool Measurement::isInTree(int directory) const {
    struct stat status{};
    return !traits_.hasSubvolumes || (::fstat(directory, &status) == 0 && status.st_dev == device_);
}

void Measurement::measureEntries(int directory, const std::string& path) {
    noteChangeOf(directory);
    BulkDirectoryRead entries(directory, buffer_);
    std::uint64_t index = 0;
    for (; const BulkDirectoryRead::Entry* entry = entries.next(); ++index) {
        struct stat status{};
        if (entry->type == DT_DIR && !traits_.emptyDirectoryBytes) {
            addDirectory(directory, path, entry->name);
        } else if (const int error = statusOfName(directory, entry->name, status); error != 0 && error != EXDEV) {
            sayUnexamined(path, index, error);
        } else if (error == EXDEV || status.st_dev != device_) {
            continue;
        } else if (!S_ISDIR(status.st_mode)) {
            addNonDirectory(status, [&] { return joined(path, entry->name); });
        } else if (traits_.emptyDirectoryBytes && status.st_size <= *traits_.emptyDirectoryBytes) {
            sayEmpty(joined(path, entry->name));
        } else {
            addDirectory(directory, path, entry->name);
        }
    }
    usage_.cutShort |= isOwnShortage(entries.error());
    if (entries.error() != 0 && logs(logLevelError))
        log_.write(logLevelError,
                   formatted("scanbatch on entry %llu in %s returned error %s", static_cast<unsigned long long>(index),
                             ZOR_SHOWN(fullPath(path)), errorText(entries.error())));
    // The end, where only the reading tells that there is nothing.
    if (index == 0 && entries.error() == 0 && !path.empty())
        sayEmpty(path);
}

void Measurement::addDirectory(int directory, const std::string& path, const char* name) {
    std::string child = joined(path, name);
    if (child.size() >= PATH_MAX || queue_.size() >= queuedDirectoriesMax ||
        queuedBytes_ + child.size() > queuedBytesMax) {
        measureDepthFirst(directory, path, name);
        return;
    }
    queuedBytes_ += child.size();
    queue_.push_back(std::move(child));
}

template <typename MakePath>
void Measurement::addNonDirectory(const struct stat& status, MakePath makePath) {
    noteChange(status);
    if (status.st_nlink == 1 || seen_.insert(status.st_ino).second)
        usage_.bytes += static_cast<std::uint64_t>(status.st_blocks) * blockBytes;
    else if (logs(logLevelDebug))
        log_.write(logLevelDebug, formatted("Skipping hardlinked file at %s", ZOR_SHOWN(fullPath(makePath()))));
}

void Measurement::measureDepthFirst(int parent, const std::string& path, const char* name) {
    const std::string top = joined(path, name);
    const auto directory = platform::openBeneathOnMount(parent, name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW);
    if (!directory) {
        if (directory.error() != EXDEV)
            sayUnopened(top, directory.error().number());
        return;
    }
    if (!isInTree(directory->get()))
        return;
    TreeWalker walker(WalkStatus::full);
    const int result = walker.walk(directory->get(), ".", [&](const WalkEntry& entry) {
        addWalkEntry(entry, top);
        return WalkStep::proceed;
    });
    if (result < 0)
        sayUnopened(top, -result);
}

void Measurement::addWalkEntry(const WalkEntry& entry, const std::string& top) {
    if (entry.onOtherFileSystem)
        return;
    const auto path = [&] { return entry.depth == 0 ? top : top + '/' + entry.path(); };
    switch (entry.kind) {
    case WalkEntryKind::directory:
        noteChange(entry.status);
        return;
    case WalkEntryKind::directoryEnd:
        return;
    case WalkEntryKind::unreadableDirectory:
        sayUnopened(path(), entry.error);
        return;
    case WalkEntryKind::noStatus: {
        const std::string whole = path();
        sayUnexamined(whole.substr(0, whole.rfind('/')), entry.index, entry.error);
        return;
    }
    default:
        addNonDirectory(entry.status, path);
    }
}

void Measurement::sayUnopened(const std::string& path, int error) {
    usage_.cutShort |= isOwnShortage(error);
    if (logs(logLevelError))
        log_.write(logLevelError,
                   formatted("Failed to open directory %s : %s", ZOR_SHOWN(fullPath(path)), errorText(error)));
}

void Measurement::sayUnexamined(const std::string& path, std::uint64_t index, int error) {
    usage_.cutShort |= isOwnShortage(error);
    if (logs(logLevelError))
        log_.write(logLevelError, formatted("Got error %s while processing entry %llu in %s", errorText(error),
                                            static_cast<unsigned long long>(index), ZOR_SHOWN(fullPath(path))));
}

void Measurement::sayEmpty(const std::string& path) const {
    if (logs(logLevelDebug))
        log_.write(logLevelDebug, formatted("skipping empty directory at %s", ZOR_SHOWN(fullPath(path))));
}

} // namespace

Usage diskUsage(int directory, const std::string& path, const UsageLog& log) {
    return Measurement(directory, path, log).run();
}

} // namespace zor::fs
