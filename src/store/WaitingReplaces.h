// SPDX-License-Identifier: Apache-2.0
// Replaces that are neither done nor undone: their journal is on the disk although none is under way, since a move back
// failed, or the sync behind a move, or the reading of the journal. The old container of each may still come back from
// staging, at a later try or at the next launch.
//
// Ordinarily there are none, and a look costs one load. One mutex; any thread. All of it ends with the process:
// the next launch reads the journals.
#pragma once

#include "base/FileURL.h"
#include "base/Mutex.h"

#include <atomic>
#include <vector>

namespace zor {

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
