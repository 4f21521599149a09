// SPDX-License-Identifier: Apache-2.0
// The journal of one replace: what moves where. It is on the disk, whole, before the first move, and goes after the
// last; so the next launch knows of each replace that was under way.
//
// Its name is a random UUID, which also names the place in staging where the old container waits meanwhile.
#pragma once

#include "base/FileURL.h"
#include "base/Mutex.h"
#include "base/ZORError.h"
#include "fs/ZORFileManager.h"
#include "ipc/UUID.h"

#include <atomic>
#include <vector>

namespace zor {

struct ReplaceJournal {
    FileURL oldUrl;     // the old container
    FileURL newUrl;     // the new one, before the replace
    FileURL stagingUrl; // where the old one waits
    FileURL destUrl;    // where the new one ends up

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
    /// The paths are absolute. Where the whole root was moved since the journal was written, they are made to lie below
    /// it again: its old place is what precedes the staging directory's own path in `stagingUrl`.
    void moveToRoot(const std::string& rootPath, const FileURL& stagingDirectory);
    /// For the log.
    [[nodiscard]] std::string text() const;
};

/// Replaces that are neither done nor undone: their journal is on the disk although none is under way, since a move
/// back failed, or the sync behind a move, or the reading of the journal. The old container of each may still come back
/// from staging, at a later try or at the next launch.
///
/// Ordinarily there are none, and a look costs one load. One mutex; any thread. All of it ends with the process:
/// the next launch reads the journals.
class WaitingReplaces {
public:
    struct Waiting {
        FileURL journalUrl;
        // The old container's place, and the one meant for the new; empty while the journal cannot be read.
        FileURL oldUrl{};
        FileURL destUrl{};
    };

    [[nodiscard]] bool none() const { return none_.load(std::memory_order_acquire); }
    void add(Waiting waiting);
    void remove(const FileURL& journalUrl);
    [[nodiscard]] std::vector<Waiting> all() const;
    /// Whether there may be others, because the journals could not be listed.
    [[nodiscard]] bool unlisted() const;
    void setUnlisted(bool unlisted);

private:
    void update() ZOR_REQUIRES(mutex_) { none_.store(!unlisted_ && waiting_.empty(), std::memory_order_release); }

    mutable platform::Mutex mutex_;
    std::vector<Waiting> waiting_ ZOR_GUARDED_BY(mutex_);
    bool unlisted_ ZOR_GUARDED_BY(mutex_) = false;
    std::atomic<bool> none_{true};
};

} // namespace zor
