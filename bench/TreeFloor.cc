// SPDX-License-Identifier: Apache-2.0
#include "TreeFloor.h"

#include "Client.h"
#include "Processes.h"
#include "Report.h"
#include "Statistics.h"
#include "fs/Names.h"
#include "os/SystemRoot.h"
#include "plist/Codec.h"
#include "store/ZORMetadata.h"

#include <cerrno>
#include <fcntl.h>
#include <filesystem>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

namespace zor::bench {

using platform::FileDescriptor;

namespace {

constexpr const char* subdirectories[] = {"Documents", "Library", "Library/Caches", "Library/Preferences", "tmp"};

std::vector<unsigned char> metadata() {
    const ZORMetadata record(userId, UUID::random(), ContainerClass::dataApplication, "com.example.create.1234",
                             nullptr, {});
    return plist::writeBinary(record.fileContent()).value();
}

FileDescriptor makeAndOpen(const std::string& path) {
    std::filesystem::create_directories(path);
    FileDescriptor directory(::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!directory.valid())
        failWithErrno(path);
    return directory;
}

void must(long result) {
    if (result < 0)
        failWithErrno("the floor of making a container");
}

} // namespace

const char* protectionAttributeOn(int directory) {
    return ::fsetxattr(directory, platform::names::protectionAttribute, "0", 1, 0) == 0
               ? platform::names::protectionAttribute
               : platform::names::protectionAttributeUser;
}

TreeFloor::TreeFloor(const std::string& place, Syncs syncs)
    : syncs_(syncs), changesOwner_(::geteuid() == 0), content_(metadata()),
      staging_(makeAndOpen(place + "/floor/Staging")), live_(makeAndOpen(place + "/floor/Data/Application")) {
    attribute_ = protectionAttributeOn(staging_.get());
}

double TreeFloor::create() {
    const std::string name = text("%08X-0000-4000-8000-000000000000", static_cast<unsigned>(next_++));
    const auto begin = Clock::now();
    makeTree(name.c_str());
    return secondsSince(begin) * 1e6;
}

void TreeFloor::makeTree(const char* name) {
    must(::mkdirat(staging_.get(), name, 0700));
    const FileDescriptor directory(::openat(staging_.get(), name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    must(directory.get());
    if (::fsetxattr(directory.get(), attribute_, "0", 1, 0) != 0 && errno != EOPNOTSUPP)
        must(-1);
    for (const char* subdirectory : subdirectories) {
        must(::mkdirat(directory.get(), subdirectory, 0700));
        if (changesOwner_)
            must(::fchownat(directory.get(), subdirectory, userId, userId, AT_SYMLINK_NOFOLLOW));
        must(::fchmodat(directory.get(), subdirectory, 0755, 0));
    }
    const FileDescriptor file(
        ::openat(directory.get(), names::metadataFile, O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0644));
    must(file.get());
    must(::write(file.get(), content_.data(), content_.size()));
    if (changesOwner_)
        must(::fchown(directory.get(), userId, userId));
    must(::fchmod(directory.get(), 0755));
    if (syncs_ == Syncs::on) {
        must(::fsync(file.get()));
        must(::fsync(directory.get()));
    }
    must(::renameat(staging_.get(), name, live_.get(), name));
    if (syncs_ == Syncs::on)
        must(::fsync(live_.get()));
}

} // namespace zor::bench
