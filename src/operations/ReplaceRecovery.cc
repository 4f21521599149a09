// SPDX-License-Identifier: Apache-2.0
#include "operations/ReplaceRecovery.h"

#include "fs/Durability.h"
#include "fs/FileSystemDeathRow.h"
#include "fs/MountFences.h"
#include "store/ReplaceJournal.h"
#include "store/StorePlaces.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <iterator>
#include <optional>
#include <sys/stat.h>
#include <unistd.h>

namespace zor {

namespace {

constexpr const char* recoverFunction = "_recoverFromReplaceOperationsWithError";

/// The content of a place. A place that cannot be examined is unknown, and matches only where it does not matter.
enum class Found : std::uint8_t { absent, present, unknown };
enum class Expected : std::uint8_t { absent, present, anything };
enum class Recovery : std::uint8_t { nothing, moveOldBack };

struct State {
    const char* label;
    Expected old;
    Expected destination;
    Expected staging;
    Recovery recovery;
    /// The place where the last move led; nullptr: nothing lies anywhere.
    const FileURL ReplaceJournal::* settled;
    int logLevel;
};
/// The first row that matches holds. If the new one is to take the old one's very place, that place counts as the
/// destination.
constexpr State states[] = {
    {"nothing had moved", Expected::present, Expected::anything, Expected::anything, Recovery::nothing,
     &ReplaceJournal::oldUrl, logLevelNotice},
    {"nothing was waiting any more", Expected::anything, Expected::present, Expected::absent, Recovery::nothing,
     &ReplaceJournal::destUrl, logLevelNotice},
    {"both had moved", Expected::anything, Expected::present, Expected::anything, Recovery::nothing,
     &ReplaceJournal::destUrl, logLevelNotice},
    {"nothing is left", Expected::absent, Expected::absent, Expected::absent, Recovery::nothing, nullptr,
     logLevelError},
    {"the old one had moved", Expected::absent, Expected::absent, Expected::anything, Recovery::moveOldBack,
     &ReplaceJournal::oldUrl, logLevelNotice},
};

bool matches(Expected expected, Found found) {
    switch (expected) {
    case Expected::absent:
        return found == Found::absent;
    case Expected::present:
        return found == Found::present;
    case Expected::anything:
        break;
    }
    return true;
}

Found look(ZORFileManager& fileManager, const FileURL& url) {
    if (fileManager.itemExistsAtURL(url))
        return Found::present;
    return fileManager.itemDoesNotExistAtURL(url) ? Found::absent : Found::unknown;
}

/// Whether the old one is in its waiting place. A closed directory that has gone tells nothing: perhaps its file system
/// is not there yet.
Found lookAside(ZORFileManager& fileManager, const ReplaceJournal& journal) {
    if (journal.asideUrl.empty())
        return look(fileManager, journal.stagingUrl);
    const auto aside = fs::openAsideOf(fileManager.resolver(), journal.asideUrl);
    struct stat status{};
    const Errno failure =
        aside ? fs::statusOfName(aside->get(), std::string(journal.asideUrl.lastPathComponent()).c_str(), status)
              : Errno(EAGAIN);
    return !failure ? Found::present : failure == ENOENT ? Found::absent : Found::unknown;
}

/// nullptr when what matters cannot be examined.
const State* stateOf(ZORFileManager& fileManager, const ReplaceJournal& journal) {
    const Found destination = look(fileManager, journal.destUrl);
    const Found old = journal.oldUrl == journal.destUrl ? Found::absent : look(fileManager, journal.oldUrl);
    const Found staging = lookAside(fileManager, journal);
    const auto* const found = std::ranges::find_if(states, [&](const State& state) {
        return matches(state.old, old) && matches(state.destination, destination) && matches(state.staging, staging);
    });
    return found == std::end(states) ? nullptr : found;
}

WaitingReplaces::Waiting waitingOf(const FileURL& journalUrl, const ReplaceJournal& journal) {
    return {
        .journalUrl = journalUrl, .oldUrl = journal.oldUrl, .destUrl = journal.destUrl, .waitingUrl = journal.asideUrl};
}

} // namespace

Result<void> ReplaceRecovery::_recoverFromReplaceOperationsWithError() {
    // Until all of them have been looked at, whoever asks for what one may name lists them again: want of memory, or a
    // stop, may end this anywhere.
    needs_.waiting.setUnlisted(true);
    const FileURL replace = needs_.configuration.replaceDirectory();
    const auto items = needs_.fileManager.urlsForItemsInDirectoryAtURL(replace);
    if (!items) {
        if (!items.error().isPosix(ENOENT))
            needs_.log.write(logLevelError, recoverFunction, "Failed to get items at replace URL%s : %s",
                             replace.c_str(), items.error().text().c_str());
        needs_.waiting.setUnlisted(!items.error().isPosix(ENOENT));
        return {};
    }
    // A journal has its name for itself alone, so no later write removes what a stop left of this one's.
    for (const FileURL& leftover : needs_.fileManager.writeLeftoversInDirectoryAtURL(replace))
        (void)needs_.deathRow._moveItemAtURLToDeathRow(leftover, StartDeletionThread::no);
    std::optional<ZORError> unread;
    std::optional<ZORError> stopped;
    for (const FileURL& item : *items) {
        if (!needs_.report.goOn())
            return {};
        const auto journal = readJournal(item);
        // It stays, with what it names in staging; the others do not hang on it.
        const bool unreadable = !journal && ReplaceJournal::mayStillBeRead(journal.error());
        if (unreadable)
            unread = journal.error();
        else if (!stopped)
            if (auto recovered = recoverReplace(item, journal ? &*journal : nullptr); !recovered)
                stopped = std::move(recovered).error();
        // Found again by the next launch; until then whoever asks for what it names tries.
        if (unreadable || stopped)
            needs_.waiting.add(journal ? waitingOf(item, *journal) : WaitingReplaces::Waiting{.journalUrl = item});
    }
    needs_.waiting.setUnlisted(false);
    if (stopped)
        return std::move(*stopped);
    return unread ? Result<void>(std::move(*unread)) : Result<void>();
}

std::optional<std::set<std::string, std::less<>>> ReplaceRecovery::stagedByJournals() {
    std::set<std::string, std::less<>> names;
    const auto items = needs_.fileManager.urlsForItemsInDirectoryAtURL(needs_.configuration.replaceDirectory());
    if (!items && !items.error().isPosix(ENOENT))
        return std::nullopt;
    // There are some only when the recovery stopped, perhaps because they could not be read: their names tell.
    for (const FileURL& item : items.value_or(std::vector<FileURL>()))
        names.emplace(ReplaceJournal::stagingNameFor(item));
    return names;
}

std::uint64_t ReplaceRecovery::sweepAside(const std::set<std::string, std::less<>>& kept) {
    std::uint64_t swept = 0;
    for (const FileURL& place : needs_.configuration.placesOfContainers()) {
        const auto top = fs::topOfMount(needs_.fileManager.resolver(), place);
        const auto aside = top ? fs::openAside(top->directory.get()) : fs::OpenResult(top.error());
        if (!aside)
            continue;
        (void)needs_.fileManager.forEachItemIn(
            aside->get(), fs::asideBelow(top->url), ZORFileManager::Leftovers::shown, [&](int, const FileURL& item) {
                if (!kept.contains(item.lastPathComponent()))
                    swept += needs_.deathRow._moveItemAtURLToDeathRow(item, StartDeletionThread::no) ? 1 : 0;
                return needs_.report.goOn();
            });
    }
    return swept;
}

std::size_t ReplaceRecovery::journalCount() {
    const auto items = needs_.fileManager.urlsForItemsInDirectoryAtURL(needs_.configuration.replaceDirectory());
    return items ? items->size() : 0;
}

Result<ReplaceJournal> ReplaceRecovery::readJournal(const FileURL& url) {
    auto journal = ReplaceJournal::_readAndValidateReplaceFileAtUrl(needs_.log, needs_.fileManager, url);
    if (journal)
        journal->moveToRoot(needs_.fileManager.resolver().root().canonicalPath(),
                            needs_.configuration.stagingDirectory());
    return journal;
}

Result<void> ReplaceRecovery::recoverReplace(const FileURL& journalUrl, const ReplaceJournal* journal) {
    const Log& log = needs_.log;
    const Reporter report(log, recoverFunction);
    if (journal) {
        if (log.writes(logLevelDebug))
            report.write(logLevelDebug, "Doing a replace of %s with info: %s", journalUrl.c_str(),
                         journal->text().c_str());
        TRY(applyReplaceJournal(*journal));
    }
    if (const auto moved = needs_.deathRow._moveItemAtURLToDeathRow(journalUrl, StartDeletionThread::no); !moved)
        return report.error(ErrorCode::replaceCleanUpFailed, &moved.error(), "Failed to remove replace file at %s",
                            journalUrl.c_str());
    needs_.waiting.remove(journalUrl);
    return {};
}

Result<void> ReplaceRecovery::applyReplaceJournal(const ReplaceJournal& journal) {
    const Log& log = needs_.log;
    const auto failed = [&](const ZORError* cause) {
        return Reporter(log, recoverFunction)
            .error(ErrorCode::journalUnusable, cause, "Failed to recover replace move: %s to %s",
                   journal.waitingUrl().c_str(), journal.oldUrl.c_str());
    };
    // A place that cannot be examined may hold a container or not. The journal waits for a launch that can tell.
    const State* const state = stateOf(needs_.fileManager, journal);
    if (!state)
        return failed(nullptr);
    log.write(state->logLevel, recoverFunction, "A replace of %s had stopped: %s", journal.oldUrl.c_str(),
              state->label);
    if (state->recovery == Recovery::moveOldBack) {
        if (log.writes(logLevelDebug))
            log.write(logLevelDebug, recoverFunction, "Recovering from failed replace by moving: %s to %s",
                      journal.waitingUrl().c_str(), journal.oldUrl.c_str());
        const auto moved = [&]() -> Result<void> {
            ZORFileManager& fileManager = needs_.fileManager;
            const FileURL place = journal.oldUrl.deletingLastPathComponent();
            const auto owner = needs_.configuration.ownerOfClassDirectory(place);
            if (!owner)
                return posixError({recoverFunction, __LINE__}, Errno(EINVAL), "%s holds no containers", place.c_str());
            const FileURL& waiting = journal.waitingUrl();
            fs::OpenResult aside = fs::openAsideOf(fileManager.resolver(), waiting);
            const auto from =
                !journal.asideUrl.empty() && aside
                    ? std::move(*aside)
                    : TRY(fileManager.openDirectoryOf(ownerUnchanged, journal.stagingUrl.deletingLastPathComponent()));
            const auto to = TRY(fileManager.openDirectoryOf(*owner, place));
            TRY(fileManager.moveItem(from.get(), waiting, to.get(), journal.oldUrl, needs_.report.check()));
            return {};
        }();
        if (!moved)
            return failed(&moved.error());
    }
    if (!state->settled)
        return {};
    const FileURL place = (journal.*state->settled).deletingLastPathComponent();
    if (needs_.moves.orderBetween(place, needs_.configuration.replaceDirectory()))
        return failed(nullptr);
    return {};
}

// Requests and the replaces that wait. No second container is made beside one that may come back, and none is
// taken away from a place to which another would come back then: the recovery is tried first, and while it fails the
// request is an error. Others' requests go on: what waits in staging says whose it is, also where its journal cannot be
// read.
//
// A try is the launch's own recovery of that journal, so it leaves what that leaves. It syncs
// under the lock where the file system keeps no order: that is rare, and nobody may act on half of it.

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
            const auto own =
                needs_.configuration.containerDirectoryURLForUser(atStake.userId, atStake.containerClass, transient);
            return !own || *own == place; // a home that cannot be looked for tells nothing
        });
    }
    struct stat status{};
    if (resolver.status(staged, status))
        return true;
    const std::uint32_t owner = layoutOf(atStake.containerClass, atStake.userId).topLevelOwner;
    return ::geteuid() != 0 || status.st_uid == (owner == ownerUnchanged ? ::geteuid() : owner);
}

bool ReplaceRecovery::mayBeAside(std::string_view name, const ContainerAtStake& atStake) {
    for (const bool transient : {false, true}) {
        const auto place =
            needs_.configuration.containerDirectoryURLForUser(atStake.userId, atStake.containerClass, transient);
        if (!place)
            return true; // a home that cannot be looked for tells nothing
        const auto top = fs::topOfMount(needs_.fileManager.resolver(), *place);
        const auto aside = top ? fs::openAside(top->directory.get()) : fs::OpenResult(top.error());
        if (!aside && (isOwnShortage(aside.error()) || aside.error() == EIO))
            return true;
        bool mayBe = false;
        const auto look = [&](int, const FileURL& item) {
            mayBe = (name.empty() || item.lastPathComponent() == name) && mayComeBack(item, {}, atStake);
            return !mayBe;
        };
        if (aside && !needs_.fileManager.forEachItemIn(aside->get(), fs::asideBelow(top->url),
                                                       ZORFileManager::Leftovers::shown, look))
            return true;
        if (mayBe)
            return true;
    }
    return false;
}

Result<bool> ReplaceRecovery::settleReplaces(const ContainerAtStake& atStake, const AllIdentifiersWriteLock& lock) {
    TRY(needs_.waiting.refuseIfUnderWay(atStake.userId, atStake.containerClass, atStake.identifier));
    if (needs_.waiting.none())
        return false;
    if (needs_.waiting.unlisted())
        TRY(listReplacesAgain(atStake));
    bool settled = false;
    // A replace may be of two identifiers, and all class caches are dropped.
    lock.touch(Touches::anything());
    for (WaitingReplaces::Waiting one : needs_.waiting.all()) {
        if (one.oldUrl.empty())
            TRY(learnPlaces(one, atStake));
        const FileURL staged = one.waitingUrl.empty() ? needs_.configuration.stagingDirectory().appendingDirectory(
                                                            ReplaceJournal::stagingNameFor(one.journalUrl))
                                                      : one.waitingUrl;
        if (!mayComeBack(staged, one, atStake))
            continue;
        const auto journal = readJournal(one.journalUrl);
        if (!journal && ReplaceJournal::mayStillBeRead(journal.error()))
            return journal.error();
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

Result<void> ReplaceRecovery::learnPlaces(WaitingReplaces::Waiting& one, const ContainerAtStake& atStake) {
    const auto journal = readJournal(one.journalUrl);
    if (journal) {
        one = waitingOf(one.journalUrl, *journal);
        needs_.waiting.add(one);
        return {};
    }
    const bool mayBeAtStake = ReplaceJournal::mayStillBeRead(journal.error()) &&
                              mayBeAside(ReplaceJournal::stagingNameFor(one.journalUrl), atStake);
    return mayBeAtStake ? Result<void>(journal.error()) : Result<void>();
}

Result<void> ReplaceRecovery::listReplacesAgain(const ContainerAtStake& atStake) {
    const auto journals = needs_.fileManager.urlsForItemsInDirectoryAtURL(needs_.configuration.replaceDirectory());
    if (journals) {
        for (const FileURL& url : *journals)
            needs_.waiting.add({.journalUrl = url});
        needs_.waiting.setUnlisted(false);
        return {};
    }
    const FileURL staging = needs_.configuration.stagingDirectory();
    const auto staged = needs_.fileManager.urlsForItemsInDirectoryAtURL(staging);
    const bool mayBeOne =
        !staged || std::ranges::any_of(*staged, [&](const FileURL& url) { return mayComeBack(url, {}, atStake); }) ||
        mayBeAside("", atStake);
    if (!mayBeOne)
        return {};
    return Reporter(needs_.log, "settleReplaces")
        .error(ErrorCode::journalUnusable, staged ? &journals.error() : &staged.error(),
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
