// SPDX-License-Identifier: Apache-2.0
// What requests do about replaces that wait. No second container is made beside one that may come back, and none is
// taken away from a place to which another would come back then: the recovery is tried first, and while it fails the
// request is an error. Others' requests go on: what waits in staging says whose it is, also where its journal cannot be
// read.
//
// A try is the launch's own recovery of that journal, so it leaves what that leaves (`ReplaceRecovery.cc`). It syncs
// under the lock where the file system keeps no order: that is rare, and nobody may act on half of it.
#include "fs/AtomicFile.h"
#include "operations/ReplaceRecovery.h"
#include "store/ContainerLayout.h"
#include "store/Names.h"
#include "store/ReplaceJournal.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <sys/stat.h>
#include <unistd.h>

namespace zor {

bool ReplaceRecovery::mayComeBack(const FileURL& staged, const WaitingReplaces::Waiting& waiting,
                                  const ContainerAtStake& atStake) {
    const fs::PathResolver& resolver = needs_.fileManager.resolver();
    if (!atStake.place.empty() && (atStake.place == waiting.oldUrl || atStake.place == waiting.destUrl))
        return true;
    const auto parent = resolver.openParent(staged);
    const auto bytes =
        parent ? fs::readOwnedFile(needs_.fileManager.disk(), parent->directory.get(),
                                   (parent->name + "/" + names::metadataFile).c_str(), fs::metadataFileBytesMax)
               : parent.error();
    if (bytes) {
        const auto record = parseMetadata(*bytes, ContainerPlace(staged), atStake.userId, CheckClassPath::no);
        return record && (*record)->containerClass() == atStake.containerClass &&
               (*record)->identifier() == atStake.identifier;
    }
    // Nothing lies there, or no container.
    if (!isOwnShortage(bytes.error()) && bytes.error() != EIO)
        return false;
    // It cannot be told which one it is. Its class directory or its owner may tell at least whose it is not.
    if (!waiting.oldUrl.empty()) {
        const FileURL place = waiting.oldUrl.deletingLastPathComponent();
        return std::ranges::any_of(std::array{false, true}, [&](bool transient) {
            return needs_.configuration.containerDirectoryURLForUser(atStake.userId, atStake.containerClass,
                                                                     transient) == place;
        });
    }
    struct stat status{};
    if (resolver.status(staged, status))
        return true;
    const std::uint32_t owner = layoutOf(atStake.containerClass, atStake.userId).topLevelOwner;
    return ::geteuid() != 0 || status.st_uid == (owner == ownerUnchanged ? ::geteuid() : owner);
}

Result<void> ReplaceRecovery::refuseIfUnderWay(std::uint32_t userId, ContainerClass containerClass,
                                               std::string_view identifier) const {
    if (!waiting_.isUnderWay(userId, containerClass, identifier))
        return {};
    return posixError(ZOR_HERE, Errno(EINPROGRESS), "a replace of %s is under way", ZOR_SHOWN(std::string(identifier)));
}

Result<bool> ReplaceRecovery::settleReplaces(const ContainerAtStake& atStake, const AllIdentifiersWriteLock& /*held*/) {
    TRY(refuseIfUnderWay(atStake.userId, atStake.containerClass, atStake.identifier));
    if (waiting_.none())
        return false;
    if (waiting_.unlisted())
        TRY(listReplacesAgain(atStake));
    bool settled = false;
    for (const WaitingReplaces::Waiting& one : waiting_.all()) {
        const FileURL staged = one.waitingUrl.empty() ? needs_.configuration.stagingDirectory().appendingDirectory(
                                                            ReplaceJournal::stagingNameFor(one.journalUrl))
                                                      : one.waitingUrl;
        if (!mayComeBack(staged, one, atStake))
            continue;
        auto journal = ReplaceJournal::_readAndValidateReplaceFileAtUrl(needs_.log, needs_.fileManager, one.journalUrl);
        if (!journal && ReplaceJournal::mayStillBeRead(journal.error()))
            return std::move(journal).error();
        const auto recovered = recoverReplace(one.journalUrl, journal ? &*journal : nullptr);
        // The container that came back is not in the cache; also a try that failed may have brought it back, and only
        // not rid the journal.
        needs_.cache.dropAll();
        TRY(recovered);
        // A replace that was done; one that was undone has left nothing there.
        (void)needs_.deathRow._moveItemAtURLToDeathRow(staged, StartDeletionThread::yes);
        settled = true;
    }
    return settled;
}

Result<void> ReplaceRecovery::listReplacesAgain(const ContainerAtStake& atStake) {
    const auto journals = needs_.fileManager.urlsForItemsInDirectoryAtURL(needs_.configuration.replaceDirectory());
    if (journals) {
        for (const FileURL& url : *journals)
            waiting_.add({.journalUrl = url});
        waiting_.setUnlisted(false);
        return {};
    }
    const FileURL staging = needs_.configuration.stagingDirectory();
    const auto staged = needs_.fileManager.urlsForItemsInDirectoryAtURL(staging);
    const bool mayBeOne =
        !staged || std::ranges::any_of(*staged, [&](const FileURL& url) { return mayComeBack(url, {}, atStake); });
    if (!mayBeOne)
        return {};
    return makeError(needs_.log, {"settleReplaces", __LINE__}, ErrorCode::journalUnusable,
                     staged ? &journals.error() : &staged.error(), LogFlag::yes,
                     "A container of %s in %s may come back from %s, and the journals cannot be listed",
                     ZOR_SHOWN(atStake.identifier), className(atStake.containerClass), staging.c_str());
}

Result<std::shared_ptr<ZORMetadata>> ReplaceRecovery::settledContainer(std::uint32_t userId,
                                                                       ContainerClass containerClass,
                                                                       const std::string* identifier, const UUID& uuid,
                                                                       const AllIdentifiersWriteLock& lock) {
    const std::string uuidString = uuid.string();
    auto record = TRY(needs_.cache.containerForUser(userId, containerClass, identifier, uuidString));
    const bool settled = TRY(settleReplaces({.userId = userId,
                                             .containerClass = containerClass,
                                             .identifier = identifier ? *identifier : std::string(),
                                             .place = record ? record->url() : FileURL()},
                                            lock));
    return settled ? needs_.cache.containerForUser(userId, containerClass, identifier, uuidString) : record;
}

} // namespace zor
