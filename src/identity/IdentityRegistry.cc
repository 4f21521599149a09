// SPDX-License-Identifier: Apache-2.0
#include "identity/IdentityRegistry.h"

#include "base/Log.h"
#include "os/FileChanges.h"
#include "os/RunLoop.h"
#include "os/SystemRoot.h"
#include "plist/Value.h"

#include <algorithm>
#include <map>

namespace zor::platform {

namespace {

constexpr std::int64_t lookEveryMilliseconds = 1000;
/// A crowd of unknown peers must not have the registry looked at for each of them.
constexpr std::int64_t lookAgainMilliseconds = 20;
/// A file that somebody writes, and has not closed, may be wrong for so long without its being said.
constexpr std::int64_t writingNanosecondsMax = 2'000'000'000;
constexpr int levelError = 3;

std::shared_ptr<const RegistryEntry> entryNamed(const IdentityRegistry::Snapshot& snapshot, const std::string& name) {
    const auto found = std::ranges::find(snapshot.entries, name, &IdentityRegistry::Registered::fileName);
    return found == snapshot.entries.end() ? nullptr : found->entry;
}

} // namespace

IdentityRegistry::IdentityRegistry(const SystemRoot& root, PlatformLog& log, uid_t daemonUserId)
    : log_(log), directory_(root, daemonUserId), watches_(root), noticeDescriptor_(watches_.descriptor()) {
    const MutexLock lock(reading_);
    publish({});
}

bool IdentityRegistry::follow(RunLoop& loop) {
    return noticeDescriptor_ >= 0 && loop.watch(noticeDescriptor_, [this] { takeNotices(); });
}

void IdentityRegistry::unfollow(RunLoop& loop) {
    if (noticeDescriptor_ >= 0)
        loop.unwatch(noticeDescriptor_);
}

std::shared_ptr<const IdentityRegistry::Snapshot> IdentityRegistry::snapshot() const {
    const MutexLock lock(publishing_);
    return snapshot_;
}

void IdentityRegistry::lookIfDue(std::int64_t now) {
    std::int64_t due = dueMilliseconds_.load(std::memory_order_relaxed);
    // One of the threads that come by does it; the others go on with what is known.
    if (now < due || !dueMilliseconds_.compare_exchange_strong(due, now + lookEveryMilliseconds))
        return;
    const MutexLock lock(reading_);
    lookAtNotices();
    look(Read::changed);
}

void IdentityRegistry::takeNotices() {
    const MutexLock lock(reading_);
    lookAtNotices();
}

bool IdentityRegistry::lookAgain() {
    const MutexLock lock(reading_);
    if (coarseMilliseconds() - lookedMilliseconds_ < lookAgainMilliseconds)
        return false;
    look(Read::changed);
    return true;
}

void IdentityRegistry::lookAtNotices() {
    const RegistryWatches::Noticed noticed = watches_.take();
    const bool mayHaveMissed = !hasLooked_ || !watches_.isComplete();
    if (noticed != RegistryWatches::Noticed::nothing)
        look(noticed == RegistryWatches::Noticed::registry ? Read::all : Read::changed);
    else if (mayHaveMissed && coarseMilliseconds() - lookedMilliseconds_ >= lookAgainMilliseconds)
        look(Read::changed);
}

void IdentityRegistry::look(Read read) {
    lookedMilliseconds_ = coarseMilliseconds();
    dueMilliseconds_.store(lookedMilliseconds_ + lookEveryMilliseconds, std::memory_order_relaxed);
    // A directory that a look could not finish is read whole by the next one: the notice that it was for has been
    // taken.
    if (!hasLooked_)
        read = Read::all;
    else if (read == Read::changed && !holdsBack_ && looksUnchanged(*snapshot()))
        return;
    hasLooked_ = false;
    holdsBack_ = false;
    // A watch comes before the look at what it watches: what changes in between is then told, and read once more.
    watches_.begin();
    watches_.watchRegistry();
    RegistryListing listing = directory_.list();
    std::vector<RegistryProblem> problems;
    if (listing.problem)
        problems.push_back({.text = formatted("%s %s", names::identityDirectory, listing.problem->text.c_str()),
                            .isShortage = listing.problem->isShortage});
    std::vector<Registered> entries = readEntries(listing, read, problems);
    if (std::ranges::any_of(problems, &RegistryProblem::isShortage))
        return sayProblems(std::move(problems));
    for (Registered& registered : entries) {
        const auto found = watches_.watchExecutable(registered.entry->executable, executables_);
        if (found)
            registered.executable = found->file;
        else
            problems.push_back({.text = formatted("%s names %s, whose file system does not answer",
                                                  registered.fileName.c_str(), registered.entry->executable.c_str())});
    }
    watches_.end();
    uniteIdentifiers(entries);
    listing_ = std::move(listing);
    publish(std::move(entries));
    hasLooked_ = true;
    sayProblems(std::move(problems));
}

bool IdentityRegistry::looksUnchanged(const Snapshot& old) const {
    return directory_.list().sameAs(listing_) && std::ranges::all_of(old.entries, [this](const Registered& registered) {
               return executableAt(registered.entry->executable) == registered.executable;
           });
}

std::vector<IdentityRegistry::Registered> IdentityRegistry::readEntries(const RegistryListing& listing, Read read,
                                                                        std::vector<RegistryProblem>& problems) {
    std::vector<Registered> entries;
    const auto old = snapshot();
    std::size_t bytesLeft = RegistryDirectory::allBytesMax;
    for (const auto& [name, stamp] : listing.files) {
        const auto before = listing_.files.find(name);
        auto entry = entryNamed(*old, name);
        const bool isAsBefore = entry && before != listing_.files.end() && before->second == stamp;
        const auto bytes = static_cast<std::size_t>(stamp.bytes);
        if (bytes > bytesLeft) {
            problems.push_back({.text = formatted("%s is ignored: all files together are too large", name.c_str())});
            continue;
        }
        bytesLeft -= bytes;
        if (read == Read::all || !isAsBefore) {
            auto parsed = directory_.read(listing, name);
            if (!parsed) {
                // One that is being copied there will be read again when it is whole.
                if (!parsed.error().isShortage && isBeingWritten(name, stamp)) {
                    holdsBack_ = true;
                    continue;
                }
                problems.push_back({.text = formatted("%s is ignored: %s", name.c_str(), parsed.error().text.c_str()),
                                    .isShortage = parsed.error().isShortage});
                continue;
            }
            // A peer that was granted the same keeps the same object.
            if (!entry || *entry != *parsed)
                entry = std::make_shared<const RegistryEntry>(std::move(*parsed));
        }
        entries.push_back({.fileName = name, .entry = std::move(entry), .executable = {}});
    }
    return entries;
}

bool IdentityRegistry::isBeingWritten(const std::string& name, const FileStamp& stamp) const {
    timespec now{};
    ::clock_gettime(CLOCK_REALTIME, &now);
    const std::int64_t age = nanosecondsOf(now) - stamp.changedNanoseconds;
    return age < writingNanosecondsMax && watches_.isBeingWritten(name);
}

void IdentityRegistry::uniteIdentifiers(std::vector<Registered>& entries) {
    std::map<std::string, std::vector<Registered*>, std::less<>> holders;
    for (Registered& registered : entries)
        if (const auto& identifier = registered.entry->grant->identifier)
            holders[*identifier].push_back(&registered);
    for (const auto& [identifier, all] : holders) {
        std::optional<plist::Dictionary> together;
        if (all.size() > 1) {
            together.emplace();
            for (const Registered* registered : all)
                if (const auto& entitlements = registered->entry->grant->entitlements)
                    together = plist::united(std::move(*together), *entitlements);
        }
        for (Registered* registered : all) {
            if (registered->entry->grant->identifierEntitlements == together)
                continue;
            auto grant = std::make_shared<IdentityGrant>(*registered->entry->grant);
            grant->identifierEntitlements = together;
            auto entry = std::make_shared<RegistryEntry>(*registered->entry);
            entry->grant = std::move(grant);
            registered->entry = std::move(entry);
        }
    }
}

void IdentityRegistry::publish(std::vector<Registered> entries) {
    const MutexLock lock(publishing_);
    if (snapshot_ && snapshot_->entries == entries)
        return;
    const std::uint64_t generation = generation_.load(std::memory_order_relaxed) + 1;
    snapshot_ = std::make_shared<const Snapshot>(Snapshot{.generation = generation, .entries = std::move(entries)});
    generation_.store(generation, std::memory_order_release);
}

void IdentityRegistry::sayProblems(std::vector<RegistryProblem> problems) {
    for (const RegistryProblem& problem : problems) {
        if (std::ranges::find(problemsSaid_, problem) == problemsSaid_.end())
            log_.write(levelError, "IdentityRegistry", problem.text);
    }
    problemsSaid_ = std::move(problems);
}

} // namespace zor::platform
