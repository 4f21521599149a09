// SPDX-License-Identifier: Apache-2.0
#include "operations/ContainerBuilder.h"

#include "fs/AtomicFile.h"
#include "fs/DictionaryFile.h"
#include "os/Openat2.h"
#include "plist/Binary.h"
#include "store/Names.h"

#include <cstring>
#include <fcntl.h>
#include <string_view>
#include <utility>

namespace zor {

using platform::FileDescriptor;
using platform::openBeneath;

namespace {

constexpr mode_t closedMode = 0700;
constexpr mode_t metadataMode = 0644;

} // namespace

ZORError ContainerBuilder::topLevelError(Here here, int number, const char* verb) {
    const ZORError cause = posixError(here, number, "%s of %s failed: %s", verb, staging_.c_str(), errorText(number));
    return makeError(log_, here, ErrorCode::stagingDirectoryFailed, &cause, LogFlag::yes,
                     "Failed to create staging dir at %s : %s", staging_.c_str(), cause.text().c_str());
}

ZORError ContainerBuilder::subdirectoryError(Here here, const char* subdirectory, int number, const char* verb) {
    const ZORError cause =
        posixError(here, number, "%s of %s/%s failed: %s", verb, staging_.c_str(), subdirectory, errorText(number));
    return makeError(log_, here, ErrorCode::subdirectoryFailed, &cause, LogFlag::yes,
                     "Failed to create sub-dir at %s%s", staging_.c_str(), subdirectory);
}

Result<void> ContainerBuilder::_createTopLevelContainerDirectory() {
    auto parent = fileManager_.resolver().openParent(staging_);
    if (!parent)
        return topLevelError(ZOR_HERE, parent.error(), "open of the parent");
    const char* name = parent->name.c_str();
    if (const int made = disk_.makeDirectory(parent->directory.get(), name, closedMode); made < 0)
        return topLevelError(ZOR_HERE, -made, "mkdir");
    auto directory = openBeneath(parent->directory.get(), name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW);
    if (!directory)
        return topLevelError(ZOR_HERE, directory.error(), "opendir");
    directory_ = std::move(*directory);
    if (const int failed = fileManager_.setClassAtCreation(directory_.get(), layout_.topLevelProtectionClass))
        return topLevelError(ZOR_HERE, failed, "setclass");
    return {};
}

int ContainerBuilder::madeBefore(std::string_view subdirectory) const {
    for (std::size_t i = 0; i < subdirectories_.size(); ++i)
        if (layout_.subdirectories[i] == subdirectory)
            return subdirectories_[i].get();
    return -1; // a layout that names it too late; making anything there fails
}

Result<void> ContainerBuilder::_createSubDirectories() {
    subdirectories_.reserve(layout_.subdirectories.size());
    for (const char* subdirectory : layout_.subdirectories) {
        const std::string_view path = subdirectory;
        const std::size_t slash = path.rfind('/');
        const int parent = slash == path.npos ? directory_.get() : madeBefore(path.substr(0, slash));
        const char* name = subdirectory + (slash == path.npos ? 0 : slash + 1);
        if (const int made = disk_.makeDirectory(parent, name, closedMode); made < 0)
            return subdirectoryError(ZOR_HERE, subdirectory, -made, "mkdir");
        auto opened = openBeneath(parent, name, O_PATH | O_DIRECTORY | O_NOFOLLOW);
        if (!opened)
            return subdirectoryError(ZOR_HERE, subdirectory, opened.error(), "opendir");
        subdirectories_.push_back(std::move(*opened));
    }
    return {};
}

Result<void> ContainerBuilder::writeMetadata(const ZORMetadata& record) {
    const auto bytes = plist::writeBinary(record.fileContent());
    int status = bytes ? -EFBIG : -EINVAL;
    // What no reader would take must not be acknowledged.
    if (bytes && bytes->size() <= fs::metadataFileBytesMax)
        status = fs::writeNewFile(disk_, directory_.get(), names::metadataFile, metadataMode, *bytes);
    if (status >= 0) {
        metadata_ = FileDescriptor(status);
        status = -fileManager_.setClassAtCreation(metadata_.get(), classWithoutProtection);
    }
    if (status >= 0)
        return {};
    const ZORError cause = posixError(ZOR_HERE, -status, "write of %s failed: %s", names::metadataFile,
                                      bytes ? errorText(-status) : bytes.error().reason);
    return makeError(log_, ZOR_HERE, ErrorCode::propertyListNotWritten, &cause, LogFlag::yes,
                     "Failed to write metadata dictionary to URL %s", staging_.c_str());
}

Result<void> ContainerBuilder::attributesOf(int directory, mode_t mode, std::uint32_t owner, const char* subdirectory) {
    int status = owner == ownerUnchanged ? 0 : disk_.changeOwner(directory, owner, owner);
    const char* verb = "chown";
    if (status == 0) {
        status = disk_.changeMode(directory, mode);
        verb = "chmod";
    }
    if (status == 0)
        return {};
    return subdirectory ? subdirectoryError(ZOR_HERE, subdirectory, -status, verb)
                        : topLevelError(ZOR_HERE, -status, verb);
}

Result<void> ContainerBuilder::giveAway() {
    for (std::size_t i = subdirectories_.size(); i-- > 0;)
        TRY(attributesOf(subdirectories_[i].get(), layout_.subdirectoryMode, layout_.subdirectoryOwner,
                         layout_.subdirectories[i]));
    return attributesOf(directory_.get(), layout_.topLevelMode, layout_.topLevelOwner, nullptr);
}

Result<void> ContainerBuilder::orderBeforeMove(const fs::Durability& durability) {
    const int status = durability.beforeMove(metadata_.get());
    if (status == 0)
        return {};
    const ZORError cause =
        posixError(ZOR_HERE, -status, "sync of %s failed: %s", names::metadataFile, errorText(-status));
    return makeError(log_, ZOR_HERE, ErrorCode::propertyListNotWritten, &cause, LogFlag::yes,
                     "Failed to write metadata dictionary to URL %s", staging_.c_str());
}

} // namespace zor
