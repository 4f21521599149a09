// SPDX-License-Identifier: Apache-2.0
#include "operations/ContainerMaker.h"

#include "base/BlockingScope.h"
#include "fs/AtomicFile.h"
#include "fs/DictionaryFile.h"
#include "os/FileDescriptor.h"
#include "os/Openat2.h"
#include "plist/Binary.h"
#include "store/ContainerLayout.h"
#include "store/Names.h"

#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <new>
#include <string_view>
#include <utility>
#include <vector>

namespace zor {

using platform::FileDescriptor;
using platform::openBeneath;

namespace {

constexpr mode_t closedMode = 0700;
constexpr const char* function = "createOrLookupContainerForUser";
constexpr mode_t metadataMode = 0644;

class ContainerBuilder {
public:
    /// Builds `staging` (whose parent exists) by the layout. `staging` has not been made yet.
    ContainerBuilder(const Log& log, ZORFileManager& fileManager, FileURL staging, const ContainerLayout& layout)
        : log_(log), fileManager_(fileManager), disk_(fileManager.disk()), staging_(std::move(staging)),
          layout_(layout) {}

    /// The container's own directory. Error 7.
    Result<void> _createTopLevelContainerDirectory();
    /// Its standard subdirectories, in the layout's order, stopping at the first failure. Error 6.
    Result<void> _createSubDirectories();
    /// The metadata file of the record: a new file, 0644 and the daemon's own. Error 34.
    Result<void> writeMetadata(const ZORMetadata& record);
    /// Modes and owners. Errors 6 and 7.
    Result<void> giveAway();
    /// Sees to it that a move cannot become durable before what it moves. Error 34.
    Result<void> orderBeforeMove(const fs::Durability& durability);

private:
    /// The descriptor of a subdirectory that a deeper one lies in: the layout names it first.
    [[nodiscard]] int madeBefore(std::string_view subdirectory) const;
    ZORError topLevelError(Here here, int number, const char* verb);
    ZORError subdirectoryError(Here here, const char* subdirectory, int number, const char* verb);
    Result<void> attributesOf(int directory, mode_t mode, std::uint32_t owner, const char* subdirectory);

    const Log& log_;
    ZORFileManager& fileManager_;
    platform::Disk& disk_;
    const FileURL staging_;
    const ContainerLayout layout_;
    platform::FileDescriptor directory_;
    std::vector<platform::FileDescriptor> subdirectories_; // in the layout's order
    platform::FileDescriptor metadata_;
};

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
        return topLevelError(ZOR_HERE, parent.error().number(), "open of the parent");
    const char* name = parent->name.c_str();
    if (const int made = disk_.makeDirectory(parent->directory.get(), name, closedMode); made < 0)
        return topLevelError(ZOR_HERE, -made, "mkdir");
    auto directory = openBeneath(parent->directory.get(), name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW);
    if (!directory)
        return topLevelError(ZOR_HERE, directory.error().number(), "opendir");
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
            return subdirectoryError(ZOR_HERE, subdirectory, opened.error().number(), "opendir");
        subdirectories_.push_back(std::move(*opened));
    }
    return {};
}

Result<void> ContainerBuilder::writeMetadata(const ZORMetadata& record) {
    const auto bytes = plist::writeBinary(record.fileContent());
    int status = bytes ? -EFBIG : -EINVAL;
    // A file that no reader would take must not be acknowledged.
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

} // namespace

template <typename Step>
auto ContainerMaker::orCleanUp(const FileURL& staging, Step&& step) -> decltype(step()) {
    try {
        auto result = step();
        if (result)
            return result;
        const auto moved = needs_.deathRow._moveItemAtURLToDeathRow(staging, StartDeletionThread::yes);
        if (moved)
            return result;
        return makeError(needs_.log, {function, __LINE__}, ErrorCode::stagingRemovalFailed, &moved.error(),
                         LogFlag::yes, "Failed to remove staging dir: %s", staging.c_str());
    } catch (...) {
        (void)needs_.deathRow._moveItemAtURLToDeathRow(staging, StartDeletionThread::yes);
        throw;
    }
}

Result<ContainerMaker::Built> ContainerMaker::build(std::uint32_t userId, const std::string& identifier,
                                                    ContainerClass containerClass) {
    FileURL staging = needs_.configuration.stagingDirectory().appendingDirectory(UUID::random().string());
    auto record = std::make_shared<ZORMetadata>(userId, UUID::random(), containerClass, identifier, nullptr,
                                                ContainerPlace(staging));
    record->setDurable(false);
    TRY(orCleanUp(staging, [&] { return buildIn(staging, *record); }));
    return Built{.record = std::move(record), .staging = std::move(staging)};
}

Result<FileURL> ContainerMaker::putInPlace(const Built& built, bool transient, std::uint64_t homeGeneration) {
    return orCleanUp(built.staging, [&] { return moveIntoPlace(built, transient, homeGeneration); });
}

void ContainerMaker::discard(const Built& built) noexcept {
    try {
        (void)needs_.deathRow._moveItemAtURLToDeathRow(built.staging, StartDeletionThread::yes);
    } catch (const std::bad_alloc&) {
        return; // the next launch sweeps staging
    }
}

Result<void> ContainerMaker::buildIn(const FileURL& staging, const ZORMetadata& record) {
    ContainerBuilder builder(needs_.log, needs_.fileManager, staging, layoutOf(record.containerClass(), record.uid()));
    TRY(builder._createTopLevelContainerDirectory());
    TRY(builder._createSubDirectories());
    TRY(builder.writeMetadata(record));
    TRY(builder.giveAway());
    const platform::BlockingScope blocking; // the disk must not take one of the few threads from all clients
    return builder.orderBeforeMove(needs_.durability);
}

Result<FileURL> ContainerMaker::moveIntoPlace(const Built& built, bool transient, std::uint64_t homeGeneration) {
    const FileURL& staging = built.staging;
    const std::uint32_t userId = built.record->uid();
    const ContainerClass containerClass = built.record->containerClass();
    constexpr Here here{function, __LINE__};
    // The fixed name is the live one's; a transient one has a name with which it can take its place.
    const std::string* wellKnown =
        transient ? nullptr : needs_.whitelist.wellknownContainerForId(built.record->identifier(), containerClass);
    FileURL live;
    const auto moved = [&]() -> Result<void> {
        const auto classDirectory = needs_.configuration.openClassDirectory(userId, containerClass, transient);
        // A container that was looked for in one home is not made in another.
        const UserHome* const home = isPerUserClass(containerClass) ? needs_.configuration.homeOf(userId) : nullptr;
        if (!classDirectory || (home && home->generation() != homeGeneration))
            return posixError(here, ENOENT, "the home of user %u is not there, or has just changed", userId);
        live = classDirectory->url.appendingDirectory(wellKnown ? std::string_view(*wellKnown)
                                                                : staging.lastPathComponent());
        const auto from = needs_.fileManager.resolver().openParent(staging);
        if (!from)
            return posixError(here, from.error(), "rename of %s to %s failed: %s", staging.c_str(), live.c_str(),
                              errorText(from.error()));
        if (!classDirectory->opened)
            return classDirectory->opened.error();
        TRY(needs_.fileManager.moveItem(from->directory.get(), staging, classDirectory->opened->get(), live));
        return {};
    }();
    if (!moved)
        return makeError(needs_.log, here, ErrorCode::moveToLiveFailed, &moved.error(), LogFlag::yes,
                         "Failed to move staging dir: %s to live dir: %s", staging.c_str(), live.c_str());
    return live;
}

} // namespace zor
