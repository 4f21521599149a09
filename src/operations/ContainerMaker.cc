// SPDX-License-Identifier: Apache-2.0
#include "operations/ContainerMaker.h"

#include "base/Mutex.h"
#include "fs/Durability.h"
#include "fs/MountFences.h"
#include "os/FileDescriptor.h"
#include "os/FileModes.h"
#include "plist/Codec.h"
#include "store/StorePlaces.h"

#include <algorithm>
#include <cerrno>
#include <fcntl.h>
#include <new>
#include <string_view>
#include <sys/stat.h>
#include <utility>
#include <vector>

namespace zor {

using platform::FileDescriptor;
using platform::openBeneath;

namespace {

constexpr const char* function = "createOrLookupContainerForUser";
constexpr mode_t metadataMode = 0644;

class ContainerBuilder {
public:
    /// Builds `staging`, which has not been made yet, by the layout. `parent` is the open directory that it lies in.
    ContainerBuilder(const Log& log, ZORFileManager& fileManager, int parent, FileURL staging,
                     const ContainerLayout& layout)
        : log_(log), fileManager_(fileManager), disk_(fileManager.disk()), parent_(parent),
          staging_(std::move(staging)), layout_(layout) {}

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
    struct Made {
        int parent = -1;
        /// In it.
        const char* name = nullptr;
        /// Only of a directory that others of the layout lie in.
        platform::FileDescriptor opened;
    };
    /// The descriptor of a subdirectory that a deeper one lies in: the layout names it first.
    [[nodiscard]] int madeBefore(std::string_view subdirectory) const;
    [[nodiscard]] bool holdsOthers(std::string_view subdirectory) const;
    ZORError topLevelError(Here here, Errno error, const char* verb);
    ZORError subdirectoryError(Here here, const char* subdirectory, Errno error, const char* verb);
    enum class Modes { right, unknown };
    Result<void> giveAway(const Made& made, const char* subdirectory, Modes modes);
    /// The process's umask, and what the top directory hands down, change the modes of all subdirectories alike: the
    /// first one, which lies in it, tells of them all. Nobody else can have changed one yet.
    [[nodiscard]] Modes modesOfSubdirectories() const;

    const Log& log_;
    ZORFileManager& fileManager_;
    platform::Disk& disk_;
    const int parent_;
    const FileURL staging_;
    const ContainerLayout layout_;
    platform::FileDescriptor directory_;
    std::vector<Made> subdirectories_; // in the layout's order
    platform::FileDescriptor metadata_;
};

ZORError ContainerBuilder::topLevelError(Here here, Errno error, const char* verb) {
    const ZORError cause = posixError(here, error, "%s of %s failed: %s", verb, staging_.c_str(), error.text());
    return Reporter(log_, here.function)
        .error({ErrorCode::stagingDirectoryFailed, here.line}, &cause, "Failed to create staging dir at %s : %s",
               staging_.c_str(), cause.text().c_str());
}

ZORError ContainerBuilder::subdirectoryError(Here here, const char* subdirectory, Errno error, const char* verb) {
    const ZORError cause =
        posixError(here, error, "%s of %s/%s failed: %s", verb, staging_.c_str(), subdirectory, error.text());
    return Reporter(log_, here.function)
        .error({ErrorCode::subdirectoryFailed, here.line}, &cause, "Failed to create sub-dir at %s%s", staging_.c_str(),
               subdirectory);
}

Result<void> ContainerBuilder::_createTopLevelContainerDirectory() {
    const std::string name(staging_.lastPathComponent());
    if (const Errno made = disk_.makeDirectory(parent_, name.c_str(), platform::closedMode))
        return topLevelError(ZOR_HERE, made, "mkdir");
    auto directory = openBeneath(parent_, name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW);
    if (!directory)
        return topLevelError(ZOR_HERE, directory.error(), "opendir");
    directory_ = std::move(*directory);
    if (const Errno failed = fileManager_.setClassOfNew(directory_.get(), layout_.topLevelProtectionClass))
        return topLevelError(ZOR_HERE, failed, "setclass");
    return {};
}

int ContainerBuilder::madeBefore(std::string_view subdirectory) const {
    for (std::size_t i = 0; i < subdirectories_.size(); ++i)
        if (layout_.subdirectories[i] == subdirectory)
            return subdirectories_[i].opened.get();
    return -1; // a layout that names it too late; making anything there fails
}

bool ContainerBuilder::holdsOthers(std::string_view subdirectory) const {
    return std::ranges::any_of(layout_.subdirectories, [&](std::string_view other) {
        return other.size() > subdirectory.size() && other.starts_with(subdirectory) &&
               other[subdirectory.size()] == '/';
    });
}

Result<void> ContainerBuilder::_createSubDirectories() {
    subdirectories_.reserve(layout_.subdirectories.size());
    for (const char* subdirectory : layout_.subdirectories) {
        const std::string_view path = subdirectory;
        const std::size_t slash = path.rfind('/');
        const int parent = slash == path.npos ? directory_.get() : madeBefore(path.substr(0, slash));
        const char* name = subdirectory + (slash == path.npos ? 0 : slash + 1);
        if (const Errno made = disk_.makeDirectory(parent, name, layout_.subdirectoryMode))
            return subdirectoryError(ZOR_HERE, subdirectory, made, "mkdir");
        Made& made = subdirectories_.emplace_back(Made{.parent = parent, .name = name, .opened = {}});
        if (!holdsOthers(path))
            continue;
        auto opened = openBeneath(parent, name, O_PATH | O_DIRECTORY | O_NOFOLLOW);
        if (!opened)
            return subdirectoryError(ZOR_HERE, subdirectory, opened.error(), "opendir");
        made.opened = std::move(*opened);
    }
    return {};
}

Result<void> ContainerBuilder::writeMetadata(const ZORMetadata& record) {
    const auto bytes = plist::writeBinary(record.fileContent());
    const auto written = [&]() -> Errno {
        // A file that no reader would take must not be acknowledged.
        if (!bytes || bytes->size() > fs::metadataFileBytesMax)
            return Errno(bytes ? EFBIG : EINVAL);
        metadata_ = TRY(fs::writeNewFile(disk_, directory_.get(), names::metadataFile, metadataMode, *bytes));
        return fileManager_.setClassOfNew(metadata_.get(), classWithoutProtection);
    }();
    if (!written)
        return {};
    const ZORError cause = posixError(ZOR_HERE, written, "write of %s failed: %s", names::metadataFile,
                                      bytes ? written.text() : bytes.error().reason);
    return Reporter(log_, __func__)
        .error(ErrorCode::propertyListNotWritten, &cause, "Failed to write metadata dictionary to URL %s",
               staging_.c_str());
}

ContainerBuilder::Modes ContainerBuilder::modesOfSubdirectories() const {
    struct stat status{};
    const bool isRight = !subdirectories_.empty() && subdirectories_.front().parent == directory_.get() &&
                         !fs::statusOfName(directory_.get(), subdirectories_.front().name, status) &&
                         (status.st_mode & platform::permissionBits) == layout_.subdirectoryMode;
    return isRight ? Modes::right : Modes::unknown;
}

Result<void> ContainerBuilder::giveAway(const Made& made, const char* subdirectory, Modes modes) {
    Errno error;
    const char* verb = "chmod";
    if (modes != Modes::right) {
        const auto opened = openBeneath(made.parent, made.name, O_PATH | O_DIRECTORY | O_NOFOLLOW);
        error = opened ? disk_.changeMode(opened->get(), layout_.subdirectoryMode) : opened.error();
    }
    if (const std::uint32_t owner = layout_.subdirectoryOwner; !error && owner != ownerUnchanged) {
        error = disk_.changeOwnerOf(made.parent, made.name, owner, owner);
        verb = "chown";
    }
    return error ? Result<void>(subdirectoryError(ZOR_HERE, subdirectory, error, verb)) : Result<void>();
}

Result<void> ContainerBuilder::giveAway() {
    const Modes modes = modesOfSubdirectories();
    for (std::size_t i = subdirectories_.size(); i-- > 0;)
        TRY(giveAway(subdirectories_[i], layout_.subdirectories[i], modes));
    const std::uint32_t owner = layout_.topLevelOwner;
    Errno error = owner == ownerUnchanged ? Errno() : disk_.changeOwner(directory_.get(), owner, owner);
    const char* verb = "chown";
    if (!error) {
        error = disk_.changeMode(directory_.get(), layout_.topLevelMode);
        verb = "chmod";
    }
    return error ? Result<void>(topLevelError(ZOR_HERE, error, verb)) : Result<void>();
}

Result<void> ContainerBuilder::orderBeforeMove(const fs::Durability& durability) {
    const Errno error = durability.beforeMove(metadata_.get());
    if (!error)
        return {};
    const ZORError cause = posixError(ZOR_HERE, error, "sync of %s failed: %s", names::metadataFile, error.text());
    return Reporter(log_, __func__)
        .error(ErrorCode::propertyListNotWritten, &cause, "Failed to write metadata dictionary to URL %s",
               staging_.c_str());
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
        return Reporter(needs_.log, function)
            .error(ErrorCode::stagingRemovalFailed, &moved.error(), "Failed to remove staging dir: %s",
                   staging.c_str());
    } catch (...) {
        (void)needs_.deathRow._moveItemAtURLToDeathRow(staging, StartDeletionThread::yes);
        throw;
    }
}

Result<ContainerMaker::Built> ContainerMaker::build(std::uint32_t userId, const std::string& identifier,
                                                    ContainerClass containerClass) {
    UsableDirectory directory = needs_.configuration.openStagingDirectory();
    FileURL staging = directory.url.appendingDirectory(UUID::random().string());
    if (!directory.opened)
        return Reporter(needs_.log, function)
            .error(ErrorCode::stagingDirectoryFailed, &directory.opened.error(),
                   "Failed to create staging dir at %s : %s", staging.c_str(), directory.opened.error().text().c_str());
    auto record = std::make_shared<ZORMetadata>(userId, UUID::random(), containerClass, identifier, nullptr,
                                                ContainerPlace(staging));
    record->setDurable(false);
    TRY(orCleanUp(staging, [&] { return buildIn(directory.opened->get(), staging, *record); }));
    return Built{
        .record = std::move(record), .staging = std::move(staging), .stagingDirectory = std::move(*directory.opened)};
}

Result<ContainerMaker::Placed> ContainerMaker::putInPlace(const Built& built, bool transient,
                                                          std::uint64_t homeGeneration) {
    return orCleanUp(built.staging, [&] { return moveIntoPlace(built, transient, homeGeneration); });
}

void ContainerMaker::discard(const Built& built) noexcept {
    try {
        (void)needs_.deathRow._moveItemAtURLToDeathRow(built.staging, StartDeletionThread::yes);
    } catch (const std::bad_alloc&) {
        return; // the next launch sweeps staging
    }
}

Result<void> ContainerMaker::buildIn(int stagingDirectory, const FileURL& staging, const ZORMetadata& record) {
    ContainerBuilder builder(needs_.log, needs_.fileManager, stagingDirectory, staging,
                             layoutOf(record.containerClass(), record.uid()));
    TRY(builder._createTopLevelContainerDirectory());
    TRY(builder._createSubDirectories());
    TRY(builder.writeMetadata(record));
    TRY(builder.giveAway());
    const platform::BlockingScope blocking; // the disk must not take one of the few threads from all clients
    return builder.orderBeforeMove(needs_.durability);
}

Result<ContainerMaker::Placed> ContainerMaker::moveIntoPlace(const Built& built, bool transient,
                                                             std::uint64_t homeGeneration) {
    const FileURL& staging = built.staging;
    const std::uint32_t userId = built.record->uid();
    const ContainerClass containerClass = built.record->containerClass();
    const Reporter report(needs_.log, function);
    // The fixed name is the live one's; a transient one has a name with which it can take its place.
    const std::string* wellKnown =
        transient ? nullptr : needs_.whitelist.wellknownContainerForId(built.record->identifier(), containerClass);
    FileURL live;
    auto moved = [&]() -> Result<Placed> {
        auto classDirectory = needs_.configuration.openClassDirectory(userId, containerClass, transient);
        // A container that was looked for in one home is not made in another.
        const UserHome* const home = isPerUserClass(containerClass) ? needs_.configuration.homeOf(userId) : nullptr;
        if (!classDirectory || (home && home->generation() != homeGeneration))
            return posixError({function, __LINE__}, Errno(ENOENT),
                              "the home of user %u is not there, or has just changed", userId);
        live = classDirectory->url.appendingDirectory(wellKnown ? std::string_view(*wellKnown)
                                                                : staging.lastPathComponent());
        if (!classDirectory->opened)
            return classDirectory->opened.error();
        TRY(needs_.fileManager.moveItem(built.stagingDirectory.get(), staging, classDirectory->opened->get(), live));
        return Placed{.url = live, .classDirectory = std::move(*classDirectory->opened)};
    }();
    if (!moved)
        return report.error(ErrorCode::moveToLiveFailed, &moved.error(),
                            "Failed to move staging dir: %s to live dir: %s", staging.c_str(), live.c_str());
    return moved;
}

} // namespace zor
