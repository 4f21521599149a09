// SPDX-License-Identifier: Apache-2.0
// How far one replace has come: for the sources of Replace alone.
#pragma once

#include "operations/Replace.h"
#include "os/FileDescriptor.h"
#include "store/ReplaceJournal.h"
#include "store/ZORMetadata.h"

#include <memory>

namespace zor {

/// The results of the preparation without the lock, for the containers and places that were there then. They count only
/// when the lookup under the lock finds the same ones.
struct Replace::Prepared {
    std::shared_ptr<ZORMetadata> oldRecord; // nullptr: none is replaced
    std::shared_ptr<ZORMetadata> newRecord; // nullptr: nothing could be prepared
    FileURL oldUrl;
    FileURL newUrl;
    FileURL destUrl;
    ZORMetadata::Info newInfo;
    /// The two are to change places, which needs no journal.
    bool exchanges = false;
    /// The new one's file says the old UUID.
    bool newSaysOldUuid = false;
    /// Whether it is on the disk; nothing has moved.
    bool hasJournal = false;
    FileURL journalUrl;
    ReplaceJournal journal;
    /// The directories of the journal and of the place where the old one is to wait.
    platform::FileDescriptor journals;
    platform::FileDescriptor waiting;
    /// A copy of the new one, where that lies on another file system than its destination; else empty.
    FileURL copyUrl;
    platform::FileDescriptor copies;
    platform::FileDescriptor copied; // the directory it was made of
};

struct Replace::Progress {
    Prepared prepared;
    /// The containers have changed since: everything has to be prepared anew.
    bool stale = false;

    std::shared_ptr<ZORMetadata> oldRecord; // nullptr: none is replaced
    std::shared_ptr<ZORMetadata> newRecord;
    bool oldWasTransient = false;
    FileURL oldUrl;
    FileURL newUrl;
    FileURL destUrl;
    FileURL waitingUrl;                // empty until the old one is about to move there, with a journal
    std::optional<UUID> newUuidBefore; // while the record of the new one says the old UUID
    /// The directory of which a move is to be on the disk before the journal can be gone; nullptr: none.
    const platform::FileDescriptor* moved = nullptr;
    /// The new one moves under another hold of the lock, behind a sync.
    bool newMovesLater = false;
    bool isUnderWay = false; // known to others as such
    bool oldWaits = false;   // in its waiting place, and its journal with it, for a later try
    bool swapped = false;    // the old one lies in the new one's place, and needs no journal
    /// The containers themselves.
    platform::FileDescriptor oldOne;
    platform::FileDescriptor newOne;
    /// Opened before the first move, so that want of descriptors stops no replace half-way and leaves no journal of one
    /// that is done: a launch would take it for one to be undone as soon as the new container has gone.
    struct {
        platform::FileDescriptor old;
        platform::FileDescriptor fresh;
        platform::FileDescriptor dest;
    } directories;

    [[nodiscard]] bool hasMovedByJournal() const { return !waitingUrl.empty(); }
    [[nodiscard]] Touches touches() const {
        return oldRecord ? Touches::only({oldRecord->identifier(), newRecord->identifier()})
                         : Touches::only({newRecord->identifier()});
    }
};

/// The operation's name in messages.
inline constexpr const char* replaceFunction = "replaceContainer";

} // namespace zor
