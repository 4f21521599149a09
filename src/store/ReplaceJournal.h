// SPDX-License-Identifier: Apache-2.0
// The journal of one replace: what moves where. It is on the disk, whole, before the first move, and goes after the
// last; so the next launch knows of each replace that was under way.
//
// Its name is a random UUID, which also names the place in staging where the old container waits meanwhile.
#pragma once

#include "base/ContainerClass.h"
#include "base/Mutex.h"
#include "base/ZORError.h"
#include "fs/PathResolver.h"
#include "fs/ZORFileManager.h"
#include "ipc/Identifiers.h"

#include <array>
#include <atomic>
#include <cerrno>
#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

namespace zor {

struct ReplaceJournal {
    FileURL oldUrl;     // the old container
    FileURL newUrl;     // the new one, before the replace
    FileURL stagingUrl; // where the old one waits
    FileURL destUrl;    // where the new one ends up
    /// The place where the old one waits when staging is on another file system: beside the death row of its own. Else
    /// empty.
    FileURL asideUrl{};

    /// The place where the old one waits.
    [[nodiscard]] const FileURL& waitingUrl() const { return asideUrl.empty() ? stagingUrl : asideUrl; }
    /// "UUID.plist" in the Replace directory.
    [[nodiscard]] static FileURL urlFor(const FileURL& replaceDirectory, const UUID& uuid);
    /// The name in staging of the old container of the journal at `url`, which need not be readable.
    [[nodiscard]] static std::string_view stagingNameFor(const FileURL& url);

    /// Writes it durably, or nothing. Error 33 when an URL is missing, 34.
    [[nodiscard]] Result<void> _writeToDiskReplaceAt(const Log& log, ZORFileManager& fileManager,
                                                     const FileURL& url) const;
    /// Error 35, logged, for a file that cannot be read or lacks a path.
    [[nodiscard]] static Result<ReplaceJournal>
    _readAndValidateReplaceFileAtUrl(const Log& log, ZORFileManager& fileManager, const FileURL& url);
    /// Whether such a failed reading says nothing of the content: the file may be a good journal, and another time may
    /// tell.
    [[nodiscard]] static bool mayStillBeRead(const ZORError& readFailure);
    /// The paths are absolute. If the whole root was moved since the journal was written, they are made to lie below it
    /// again: its old place is what precedes the staging directory's own path in `stagingUrl`.
    void moveToRoot(const std::string& rootPath, const FileURL& stagingDirectory);
    /// For the log.
    [[nodiscard]] std::string text() const;
};

/// Replaces whose journal is on the disk and counts.
///
/// Those that wait are neither done nor undone although nobody is at work on them, since a move back failed, or the
/// sync behind a move, or the reading of the journal: the old container of each may still come back, at a later try or
/// at the next launch. Those that are under way have moved something, and their thread waits for the disk without a
/// lock: whoever has to do with one of their containers waits for that one to end.
///
/// Ordinarily there are none, and a look costs one load. One mutex; any thread. All of it ends with the process:
/// the next launch reads the journals.
class WaitingReplaces {
public:
    struct Waiting {
        FileURL journalUrl;
        // The old container's place, the one meant for the new, and the one where the old one waits; empty while the
        // journal cannot be read.
        FileURL oldUrl{};
        FileURL destUrl{};
        FileURL waitingUrl{};
    };
    /// The containers of a replace that is under way are of one user and class.
    struct Containers {
        std::uint32_t userId = 0;
        ContainerClass containerClass = ContainerClass::undefined;
        std::array<std::string, 2> identifiers{};
    };

    /// Whether none waits.
    [[nodiscard]] bool none() const { return none_.load(std::memory_order_acquire); }
    void add(Waiting waiting);
    void remove(const FileURL& journalUrl);
    [[nodiscard]] std::vector<Waiting> all() const;
    /// Whether there may be others, because the journals could not be listed.
    [[nodiscard]] bool unlisted() const;
    void setUnlisted(bool unlisted);

    void begin(Waiting replace, Containers containers);
    /// One that has not come to its end waits from now on. Needs no memory; no journal of that name: nothing happens.
    enum class Ended { settled, waits };
    void end(const FileURL& journalUrl, Ended how) noexcept;
    /// Whether a replace of this identifier is under way; nullptr: of any of the class.
    [[nodiscard]] bool isUnderWay(std::uint32_t userId, ContainerClass containerClass,
                                  const std::string_view* identifier) const;
    /// An error while one is: whoever holds a lock lets go of it, and comes again when that one has ended.
    [[nodiscard]] Result<void> refuseIfUnderWay(std::uint32_t userId, ContainerClass containerClass,
                                                std::string_view identifier) const;
    [[nodiscard]] Result<void> refuseIfUnderWay(std::uint32_t userId, ContainerClass containerClass) const;
    /// Whether an error says that: nothing has been done.
    [[nodiscard]] static bool metOneUnderWay(const ZORError& error) { return error.isPosix(EINPROGRESS); }
    /// Runs `step`, which takes the lock, until it meets no replace that is under way and has to do with its container:
    /// before it comes again, that one has ended. Without a lock.
    template <typename Step>
    auto undisturbed(Step&& step) const -> decltype(step()) {
        for (;;) {
            const std::uint64_t before = ended();
            auto result = step();
            if (result || !metOneUnderWay(result.error()))
                return result;
            awaitMoreThan(before);
        }
    }
    [[nodiscard]] bool noneUnderWay() const { return noneUnderWay_.load(std::memory_order_acquire); }
    /// How many have ended. A caller that met one under way after it had asked waits until there are more.
    [[nodiscard]] std::uint64_t ended() const;
    void awaitMoreThan(std::uint64_t ended) const;

private:
    struct UnderWay {
        Waiting replace;
        Containers containers;
    };
    void update() ZOR_REQUIRES(mutex_) {
        none_.store(!unlisted_ && waiting_.empty(), std::memory_order_release);
        noneUnderWay_.store(underWay_.empty(), std::memory_order_release);
    }

    mutable platform::Mutex mutex_;
    mutable platform::ConditionVariable oneEnded_;
    std::vector<Waiting> waiting_ ZOR_GUARDED_BY(mutex_);
    std::vector<UnderWay> underWay_ ZOR_GUARDED_BY(mutex_);
    std::uint64_t ended_ ZOR_GUARDED_BY(mutex_) = 0;
    bool unlisted_ ZOR_GUARDED_BY(mutex_) = false;
    std::atomic<bool> none_{true};
    std::atomic<bool> noneUnderWay_{true};
};

} // namespace zor
