// SPDX-License-Identifier: Apache-2.0
#include "ClassTree.h"

#include "Client.h"
#include "Processes.h"
#include "Report.h"
#include "Statistics.h"
#include "fs/Names.h"
#include "plist/Codec.h"
#include "store/ZORMetadata.h"

#include <array>
#include <dirent.h>
#include <fcntl.h>
#include <memory>
#include <sys/stat.h>
#include <unistd.h>

namespace zor::bench {

using platform::FileDescriptor;

ClassTree::ClassTree(const std::string& directory, ContainerClass containerClass, int count)
    : directory_(directory), count_(count) {
    const FileDescriptor parent(::open(directory.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    for (int i = 0; i < count; ++i) {
        const ZORMetadata record(userId, UUID::random(), containerClass, identifier(i), nullptr, {});
        const auto bytes = plist::writeBinary(record.fileContent());
        const std::string name = UUID::random().string();
        const std::string path = name + "/" + names::metadataFile;
        if (!bytes || ::mkdirat(parent.get(), name.c_str(), 0755) != 0)
            failWithErrno(directory);
        const FileDescriptor file(::openat(parent.get(), path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0644));
        if (::write(file.get(), bytes->data(), bytes->size()) != static_cast<ssize_t>(bytes->size()))
            failWithErrno(path);
    }
}

std::string ClassTree::identifier(int index) {
    return text("com.example.application.%07d", index);
}

template <typename Look>
double ClassTree::forEach(Look&& look) const {
    const auto begin = Clock::now();
    const std::unique_ptr<DIR, int (*)(DIR*)> stream(::opendir(directory_.c_str()), ::closedir);
    if (!stream)
        failWithErrno(directory_);
    int found = 0;
    while (const dirent* entry = ::readdir(stream.get())) {
        if (entry->d_name[0] == '.')
            continue;
        char path[NAME_MAX + 64];
        std::snprintf(path, sizeof path, "%s/%s", entry->d_name, names::metadataFile);
        if (!look(::dirfd(stream.get()), path))
            failWithErrno(path);
        ++found;
    }
    if (found != count_)
        throw Failure(text("%d containers in %s instead of %d", found, directory_.c_str(), count_));
    return secondsSince(begin);
}

double ClassTree::readAll() const {
    std::array<char, 4096> buffer;
    return forEach([&](int directory, const char* path) {
        const FileDescriptor file(::openat(directory, path, O_RDONLY | O_NOFOLLOW | O_CLOEXEC));
        struct stat status{};
        return file.valid() && ::fstat(file.get(), &status) == 0 &&
               ::read(file.get(), buffer.data(), buffer.size()) > 0;
    });
}

double ClassTree::lookAtAll() const {
    return forEach([](int directory, const char* path) { return ::faccessat(directory, path, F_OK, 0) == 0; });
}

} // namespace zor::bench
