// SPDX-License-Identifier: Apache-2.0
// The measurement of a tree.
#include "fs/Trees.h"

#include "base/Log.h"
#include "base/ZORError.h"
#include "fs/MountFences.h"
#include "fs/SharedWork.h"
#include "fs/TreeWalker.h"
#include "os/FileDescriptor.h"
#include "os/FileModes.h"

#include <algorithm>
#include <cerrno>
#include <dirent.h>
#include <fcntl.h>
#include <linux/magic.h>
#include <memory>
#include <optional>
#include <sys/stat.h>
#include <sys/vfs.h>
#include <unordered_set>

namespace zor::fs {

using platform::FileDescriptor;

namespace {

/// A second thread costs more than it brings for a tree of fewer entries.
constexpr std::uint64_t entriesForTwoThreads = 512;

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
    case XFS_SUPER_MAGIC:
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

/// The state that the threads of a measurement share.
struct Tree {
    Tree(int rootOpened, const std::string& path, const UsageLog& usageLog)
        : root(rootOpened), rootPath(path), log(usageLog), traits(traitsOf(rootOpened)) {}

    /// Whether a name of a file with several is the first that is met.
    bool isFirstName(ino_t inode) {
        const platform::MutexLock held(mutex);
        return seen.insert(inode).second;
    }
    void write(int level, const std::string& message) {
        const platform::MutexLock held(mutex);
        log.write(level, message);
    }

    const int root;
    const std::string& rootPath;
    const UsageLog& log;
    const FileSystemTraits traits;
    dev_t device = 0;
    DirectoryQueue waiting;
    platform::Mutex mutex;
    std::unordered_set<ino_t> seen ZOR_GUARDED_BY(mutex);
};

/// One thread's part of it.
class Measurement {
public:
    explicit Measurement(Tree& tree)
        : tree_(tree), root_(tree.root), rootPath_(tree.rootPath), log_(tree.log), traits_(tree.traits),
          device_(tree.device) {}

    /// Measures directories until none waits. `met` is called after each.
    void run(const std::function<void()>& met);
    void noteChangeOf(int directory);
    [[nodiscard]] const Usage& usage() const { return usage_; }
    [[nodiscard]] std::uint64_t entries() const { return entries_; }
    void sayUnopened(const std::string& path, Errno error);

private:
    void measureDirectory(const std::string& path);
    void measureEntries(int directory, const std::string& path);
    [[nodiscard]] bool isInTree(int directory) const;
    void noteChange(const struct stat& status);
    void addDirectory(int directory, const std::string& path, const char* name);
    /// `makePath` is called only for a message.
    template <typename MakePath>
    void addNonDirectory(const struct stat& status, MakePath makePath);
    void measureDepthFirst(int parent, const std::string& path, const char* name);
    void addWalkEntry(const WalkEntry& entry, const std::string& top);

    void sayUnexamined(const std::string& path, std::uint64_t index, Errno error);
    void sayEmpty(const std::string& path) const;
    [[nodiscard]] bool logs(int level) const { return log_.write && level <= log_.levelMax; }
    [[nodiscard]] std::string fullPath(const std::string& path) const {
        return path.empty() ? rootPath_ : rootPath_ + '/' + path;
    }

    Tree& tree_;
    const int root_;
    const std::string& rootPath_;
    const UsageLog& log_;
    const FileSystemTraits traits_;
    const dev_t device_;
    Usage usage_;
    std::uint64_t entries_ = 0;
    BulkDirectoryRead::Buffer buffer_;
};

void Measurement::run(const std::function<void()>& met) {
    tree_.waiting.workOff([&](const std::string& path) {
        measureDirectory(path);
        met();
    });
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
            sayUnopened(path, directory.error());
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
        } else if (const Errno error = statusOfName(directory, entry->name, status); error && error != EXDEV) {
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
    entries_ += index;
    usage_.cutShort |= isOwnShortage(entries.error());
    if (entries.error() && logs(logLevelError))
        tree_.write(logLevelError,
                    formatted("scanbatch on entry %llu in %s returned error %s", static_cast<unsigned long long>(index),
                              ZOR_SHOWN(fullPath(path)), entries.error().text()));
    // The end, where only the reading tells that there is nothing.
    if (index == 0 && !entries.error() && !path.empty())
        sayEmpty(path);
}

void Measurement::addDirectory(int directory, const std::string& path, const char* name) {
    if (!tree_.waiting.add(joined(path, name)))
        measureDepthFirst(directory, path, name);
}

template <typename MakePath>
void Measurement::addNonDirectory(const struct stat& status, MakePath makePath) {
    noteChange(status);
    if (status.st_nlink == 1 || tree_.isFirstName(status.st_ino))
        usage_.bytes += static_cast<std::uint64_t>(status.st_blocks * platform::blockBytes);
    else if (logs(logLevelDebug))
        tree_.write(logLevelDebug, formatted("Skipping hardlinked file at %s", ZOR_SHOWN(fullPath(makePath()))));
}

void Measurement::measureDepthFirst(int parent, const std::string& path, const char* name) {
    const std::string top = joined(path, name);
    const auto directory = platform::openBeneathOnMount(parent, name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW);
    if (!directory) {
        if (directory.error() != EXDEV)
            sayUnopened(top, directory.error());
        return;
    }
    if (!isInTree(directory->get()))
        return;
    TreeWalker walker(WalkStatus::full);
    const Errno result = walker.walk(directory->get(), ".", [&](const WalkEntry& entry) {
        addWalkEntry(entry, top);
        return WalkStep::proceed;
    });
    if (result)
        sayUnopened(top, result);
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

void Measurement::sayUnopened(const std::string& path, Errno error) {
    usage_.cutShort |= isOwnShortage(error);
    if (logs(logLevelError))
        tree_.write(logLevelError,
                    formatted("Failed to open directory %s : %s", ZOR_SHOWN(fullPath(path)), error.text()));
}

void Measurement::sayUnexamined(const std::string& path, std::uint64_t index, Errno error) {
    usage_.cutShort |= isOwnShortage(error);
    if (logs(logLevelError))
        tree_.write(logLevelError, formatted("Got error %s while processing entry %llu in %s", error.text(),
                                             static_cast<unsigned long long>(index), ZOR_SHOWN(fullPath(path))));
}

void Measurement::sayEmpty(const std::string& path) const {
    if (logs(logLevelDebug))
        tree_.write(logLevelDebug, formatted("skipping empty directory at %s", ZOR_SHOWN(fullPath(path))));
}

} // namespace

Usage diskUsage(int directory, const std::string& path, const UsageLog& log) {
    Tree tree(directory, path, log);
    struct stat status{};
    const bool readable = ::fstat(directory, &status) == 0 && ::lseek(directory, 0, SEEK_SET) >= 0;
    const Errno unreadable = readable ? Errno() : Errno::last();
    tree.device = status.st_dev;
    Measurement own(tree);
    if (!readable) {
        own.sayUnopened({}, unreadable);
        return own.usage();
    }
    Usage others;
    const std::function<void()> help = [&] {
        const auto part = std::make_unique<Measurement>(tree);
        part->run([] {});
        others = part->usage();
    };
    Helpers helpers(1);
    helpers.run([&] {
        own.run([&] {
            if (own.entries() >= entriesForTwoThreads && tree.waiting.hasWork())
                helpers.add(help);
        });
    });
    helpers.finish();
    own.noteChangeOf(directory); // as it is after the walk
    Usage usage = own.usage();
    usage.bytes += others.bytes;
    usage.cutShort |= others.cutShort;
    usage.lastChange = std::max(usage.lastChange, others.lastChange);
    return usage;
}

} // namespace zor::fs
