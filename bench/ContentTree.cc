// SPDX-License-Identifier: Apache-2.0
#include "ContentTree.h"

#include "Processes.h"
#include "Report.h"
#include "Statistics.h"
#include "os/FileDescriptor.h"

#include <algorithm>
#include <dirent.h>
#include <fcntl.h>
#include <string_view>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/xattr.h>
#include <unistd.h>
#include <vector>

namespace zor::bench {

using platform::FileDescriptor;

namespace {

constexpr int entriesEach = 100;
constexpr int directoryFlags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;
constexpr std::size_t bufferBytes = std::size_t{32} << 10;

void must(long result) {
    if (result < 0)
        failWithErrno("a bare walk");
}

FileDescriptor openDirectory(int parent, const char* name) {
    FileDescriptor directory(::openat(parent, name, directoryFlags));
    must(directory.get());
    return directory;
}

FileDescriptor makeDirectory(int parent, const char* name) {
    must(::mkdirat(parent, name, 0755));
    return openDirectory(parent, name);
}

/// Depth first, as deep as the trees here are. `onFile(directory, name)` for each file, `onEnd(parent, name,
/// directory)` for each directory when all in it was met. The number of files.
template <typename OnFile, typename OnEnd>
int walk(int parent, const char* name, OnFile&& onFile, OnEnd&& onEnd) {
    const FileDescriptor directory = openDirectory(parent, name);
    alignas(dirent64) char buffer[bufferBytes];
    int files = 0;
    for (;;) {
        const long bytes = ::syscall(SYS_getdents64, directory.get(), buffer, sizeof buffer);
        must(bytes);
        if (bytes == 0)
            break;
        for (long at = 0; at < bytes;) {
            const auto* entry = reinterpret_cast<const dirent64*>(buffer + at);
            at += entry->d_reclen;
            const std::string_view entryName(entry->d_name);
            if (entryName == "." || entryName == "..")
                continue;
            if (entry->d_type == DT_DIR) {
                files += walk(directory.get(), entry->d_name, onFile, onEnd);
            } else {
                onFile(directory.get(), entry->d_name);
                ++files;
            }
        }
    }
    onEnd(parent, name, directory.get());
    return files;
}

} // namespace

ContentTree::ContentTree(std::string path, const Shape& shape) : path_(std::move(path)), shape_(shape) {
    const std::vector<char> content(shape.fileBytes, 'z');
    const FileDescriptor root = makeDirectory(AT_FDCWD, path_.c_str());
    FileDescriptor upper;
    FileDescriptor lower;
    for (int i = 0; i < shape.files; ++i) {
        if (i % (entriesEach * entriesEach) == 0)
            upper = makeDirectory(root.get(), text("%04d", i / (entriesEach * entriesEach)).c_str());
        if (i % entriesEach == 0)
            lower = makeDirectory(upper.get(), text("%02d", i / entriesEach % entriesEach).c_str());
        const std::string name = text("file-%07d.data", i);
        const FileDescriptor file(::openat(lower.get(), name.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0644));
        const std::size_t bytes = i % shape.contentEvery == 0 ? content.size() : 0;
        if (!file.valid() || ::write(file.get(), content.data(), bytes) != static_cast<ssize_t>(bytes))
            failWithErrno(path_);
    }
}

void ContentTree::checkCount(int files) const {
    if (files != shape_.files)
        throw Failure(text("%d files in %s instead of %d", files, path_.c_str(), shape_.files));
}

ContentTree::Usage ContentTree::measure() const {
    Usage usage;
    const auto begin = Clock::now();
    const auto addFile = [&](int directory, const char* name) {
        struct stat status{};
        must(::fstatat(directory, name, &status, AT_SYMLINK_NOFOLLOW));
        usage.bytes += static_cast<std::uint64_t>(status.st_blocks) * 512;
    };
    checkCount(walk(AT_FDCWD, path_.c_str(), addFile, [](int, const char*, int) {}));
    usage.seconds = secondsSince(begin);
    return usage;
}

double ContentTree::remove() const {
    const auto begin = Clock::now();
    checkCount(walk(
        AT_FDCWD, path_.c_str(), [](int directory, const char* name) { must(::unlinkat(directory, name, 0)); },
        [](int parent, const char* name, int) { must(::unlinkat(parent, name, AT_REMOVEDIR)); }));
    return secondsSince(begin);
}

double ContentTree::setAttributes(const char* attribute, char from, char to) const {
    const auto change = [&](int fd) {
        char value = 0;
        const bool had = ::fgetxattr(fd, attribute, &value, 1) == 1;
        must(::fsetxattr(fd, attribute, &to, 1, 0));
        return had ? value : '\0';
    };
    const auto begin = Clock::now();
    int others = 0;
    const auto changeFile = [&](int directory, const char* name) {
        const FileDescriptor file(::openat(directory, name, O_RDONLY | O_NOFOLLOW | O_CLOEXEC));
        must(file.get());
        others += change(file.get()) == from ? 0 : 1;
    };
    checkCount(walk(AT_FDCWD, path_.c_str(), changeFile, [&](int, const char*, int directory) { change(directory); }));
    const double seconds = secondsSince(begin);
    if (others != 0 && from != '\0')
        throw Failure(text("%d files had another attribute than %c", others, from));
    return seconds;
}

void ContentTree::initializeAttributes(const char* attribute, char value) const {
    (void)setAttributes(attribute, '\0', value);
}

} // namespace zor::bench
