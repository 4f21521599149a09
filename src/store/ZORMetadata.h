// SPDX-License-Identifier: Apache-2.0
// The record of one container, and the file in the container that it is read from and written to.
//
// The file is all that lasts; a record is its copy in memory plus where the container lies. Records in the cache are
// shared between threads and have no lock: whoever changes one holds the identifier or all-identifiers lock of the
// operation, and what a reply needs is read before that lock is released. There may be hundreds of thousands of
// records, so one holds no more than its data: directories are shared between the records that lie in them, a
// directory name that is a UUID is kept as its 16 bytes, and with what shares it, a record fills 128 bytes of memory.
#pragma once

#include "base/ContainerClass.h"
#include "base/ZORError.h"
#include "fs/PathResolver.h"
#include "fs/ZORFileManager.h"
#include "ipc/Identifiers.h"
#include "plist/Value.h"
#include "store/StorePlaces.h"

#include <array>
#include <atomic>
#include <bit>
#include <expected>
#include <memory>
#include <optional>
#include <span>
#include <string>

namespace zor {

class ZORMetadata {
public:
    using Info = std::shared_ptr<const plist::Dictionary>;

    /// No checks. `info` may be nullptr.
    ZORMetadata(std::uint32_t uid, UUID uuid, ContainerClass containerClass, std::string identifier, Info info,
                ContainerPlace place)
        : identifier_(std::move(identifier)), info_(std::move(info)), place_(std::move(place)), uid_(uid),
          containerClass_(static_cast<std::uint8_t>(containerClass)) {
        setUuid(uuid);
    }

    [[nodiscard]] std::uint32_t uid() const { return uid_; }
    void setUid(std::uint32_t uid) { uid_ = uid; }
    /// The internal UUID, which clients know; not the one in the directory's name. A reader without the lock that
    /// guards it may get halves of two UUIDs, and then sees that a writer was there (ZORLocks::quietGeneration).
    [[nodiscard]] UUID uuid() const {
        const std::array<std::uint64_t, 2> halves{uuid_[0].load(std::memory_order_acquire),
                                                  uuid_[1].load(std::memory_order_acquire)};
        return UUID(std::bit_cast<UUID::Bytes>(halves));
    }
    void setUuid(const UUID& uuid) {
        const auto halves = std::bit_cast<std::array<std::uint64_t, 2>>(uuid.bytes());
        uuid_[0].store(halves[0], std::memory_order_release);
        uuid_[1].store(halves[1], std::memory_order_release);
    }
    [[nodiscard]] ContainerClass containerClass() const { return static_cast<ContainerClass>(containerClass_); }
    [[nodiscard]] const std::string& identifier() const { return identifier_; }
    [[nodiscard]] const Info& info() const { return info_; }
    void setInfo(Info info) { info_ = std::move(info); }
    /// The data-protection class that the info says the container was given last. Absent when it says none.
    [[nodiscard]] std::optional<int> recordedProtectionClass() const;
    [[nodiscard]] bool hasUrl() const { return !place_.empty(); }
    [[nodiscard]] FileURL url() const { return place_.url(); }
    [[nodiscard]] const ContainerPlace& place() const { return place_; }
    void setPlace(ContainerPlace place) { place_ = std::move(place); }
    [[nodiscard]] bool transient() const { return transient_; }
    void setTransient(bool transient) { transient_ = transient; }
    /// Whether it was found rather than made, when it was last asked for. Set by lookups, which may be several at once.
    [[nodiscard]] bool existed() const { return (marks_.load(std::memory_order_relaxed) & existedMark) != 0; }
    void setExisted(bool existed) { setMark(existedMark, existed, std::memory_order_relaxed); }
    /// False from a move into its place until that move has been synced: who finds it meanwhile syncs before it tells
    /// anybody. Set to true without the identifier locks.
    [[nodiscard]] bool durable() const { return (marks_.load(std::memory_order_acquire) & durableMark) != 0; }
    void setDurable(bool durable) { setMark(durableMark, durable, std::memory_order_release); }

    /// False from a write of changed info values that failed until one that did not: clients are shown what is not on
    /// the disk. Under the container's lock for writing; read without.
    [[nodiscard]] bool infoIsSaved() const { return (marks_.load(std::memory_order_relaxed) & infoIsSavedMark) != 0; }
    void setInfoIsSaved(bool isSaved) { setMark(infoIsSavedMark, isSaved, std::memory_order_relaxed); }

    /// The dictionary that the file holds.
    [[nodiscard]] plist::Dictionary fileContent() const;

    /// Replaces the file in one step. Error 34; the previous file is then untouched.
    Result<void> writeMetadataToDiskWithError(const Log& log, ZORFileManager& fileManager) const;

private:
    static constexpr std::uint8_t existedMark = 1U << 0;
    static constexpr std::uint8_t durableMark = 1U << 1;
    static constexpr std::uint8_t infoIsSavedMark = 1U << 2;
    /// Writes nothing that is so already: lookups of one container may be many at once.
    void setMark(std::uint8_t mark, bool isSet, std::memory_order order) {
        if (((marks_.load(std::memory_order_relaxed) & mark) != 0) == isSet)
            return;
        if (isSet)
            marks_.fetch_or(mark, order);
        else
            marks_.fetch_and(static_cast<std::uint8_t>(~mark), order);
    }

    std::string identifier_;
    Info info_;
    ContainerPlace place_;
    std::array<std::atomic<std::uint64_t>, 2> uuid_{};
    std::uint32_t uid_;
    std::uint8_t containerClass_;
    bool transient_ = false;
    std::atomic<std::uint8_t> marks_{durableMark | infoIsSavedMark};
};

enum class CheckClassPath { no, yes };

/// The rules that a metadata file may break, in the order in which they are looked at.
enum class MetadataRule { readable, user, identifier, uuid, containerClass, info, place };

/// Why a metadata file is not believed.
struct MetadataRefusal {
    MetadataRule rule;
    ZORError error; // not logged
};

/// Reads and judges the metadata of the container at `url` for a user; errors 12 and 29, logged. Changes nothing. A
/// file of `formerOwner` is believed as well.
Result<std::shared_ptr<ZORMetadata>> readAndValidateMetadataAtUrl(const Log& log, ZORFileManager& fileManager,
                                                                  const FileURL& url, std::uint32_t userId,
                                                                  CheckClassPath checkClassPath,
                                                                  std::optional<uid_t> formerOwner = std::nullopt);

/// Reads many containers of one directory: the directory is open, and nothing about it is worked out twice. A file that
/// an encryption hides is not missing: the cause is ENOKEY.
/// Errors are made without a log line, so that threads may share the work and one of them can say the errors in order.
class MetadataReader {
public:
    /// `directory` is open and stays so.
    MetadataReader(platform::Disk& disk, int directory, std::string directoryPath, std::uint32_t userId,
                   CheckClassPath checkClassPath, std::optional<uid_t> formerOwner = std::nullopt);
    /// The container `name` in the directory. Any thread.
    [[nodiscard]] Result<std::shared_ptr<ZORMetadata>> read(const char* name) const;
    /// The same, with the rule that it breaks.
    [[nodiscard]] std::expected<std::shared_ptr<ZORMetadata>, MetadataRefusal> judge(const char* name) const;

private:
    platform::Disk& disk_;
    const int directory_;
    const std::shared_ptr<const ContainerParent> parent_;
    const std::uint32_t userId_;
    const CheckClassPath checkClassPath_;
    const std::optional<uid_t> formerOwner_;
};

/// The judgement alone, on the bytes of a file: what a fuzzer calls.
[[nodiscard]] std::expected<std::shared_ptr<ZORMetadata>, MetadataRefusal>
parseMetadata(std::span<const std::uint8_t> bytes, const ContainerPlace& place, std::uint32_t userId,
              CheckClassPath checkClassPath);

} // namespace zor
