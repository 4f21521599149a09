// SPDX-License-Identifier: Apache-2.0
// The home of one mobile user: where it is, whether it is there, whether it is still the one that it was.
//
// Homes come and go while the daemon runs: they are mounted late, unlocked at a login, made for a user who was added.
// One that does not resolve is none for the moment, and is looked for again at each use. Every change of what was seen
// gives a new generation, so that who keeps what was read below a home knows whether it still counts.
//
// Nothing here makes anything. The disk is asked without a lock, and not waited for without end; from the first look on
// no way into the home crosses a mount. Any thread.
#pragma once

#include "base/FileURL.h"
#include "base/Log.h"
#include "base/Mutex.h"
#include "fs/PathResolver.h"
#include "os/BoundedQuestion.h"
#include "platform/Device.h"
#include "platform/Errno.h"

#include <atomic>
#include <cstdint>
#include <memory>
#include <string>

namespace zor {

/// Leads to a home's path without links, or to an error.
using HomeQuestion = platform::BoundedQuestion<ErrnoOr<std::string>>;

class UserHome {
public:
    UserHome(std::uint32_t userId, const Log& log, const fs::PathResolver& resolver,
             const platform::PasswordDatabase& passwords)
        : userId_(userId), log_(log), resolver_(resolver), passwords_(passwords) {}
    UserHome(const UserHome&) = delete;
    UserHome& operator=(const UserHome&) = delete;

    enum class State : std::uint8_t {
        /// Not to be told for want of descriptors or memory, or because the database could not be asked.
        unknown,
        noAccount,
        missing,
        present,
    };
    struct Seen {
        State state = State::unknown;
        /// While it is present: its path, without links; else nullptr.
        std::shared_ptr<const FileURL> directory;
        /// The generation of this state; never 0.
        std::uint64_t generation = 0;
    };
    /// Asks the disk.
    Seen look() ZOR_EXCLUDES(mutex_) { return lookAndOpen().seen; }
    struct Opened {
        Seen seen;
        /// The home that was seen, O_PATH, or an errno.
        fs::OpenResult directory;
    };
    Opened lookAndOpen() ZOR_EXCLUDES(mutex_);
    /// The same, but a home that was seen within the last second is taken to be there still: no system call then.
    Seen lookIfDue() ZOR_EXCLUDES(mutex_);
    /// The last look's; 0 before the first. One atomic read.
    [[nodiscard]] std::uint64_t generation() const { return generation_.load(std::memory_order_acquire); }

    /// The home that the password database names, without links; an error when it names none, or one that is not
    /// there; EHOSTDOWN when what the way to it lies on does not answer. `question` is one for each user.
    [[nodiscard]] static ErrnoOr<FileURL> pathOf(const platform::PasswordDatabase& passwords, std::uint32_t userId,
                                                 HomeQuestion& question);

private:
    struct Found {
        State state = State::unknown;
        std::shared_ptr<const FileURL> directory;
        fs::DirectoryId id;
        [[nodiscard]] bool isAs(const Found& other) const;
    };
    [[nodiscard]] Found find();
    Seen seenOf(const Found& found) const;

    const std::uint32_t userId_;
    const Log& log_;
    const fs::PathResolver& resolver_;
    const platform::PasswordDatabase& passwords_;
    HomeQuestion wayToHome_;
    std::atomic<std::uint64_t> generation_{0};
    platform::Mutex mutex_;
    Found found_ ZOR_GUARDED_BY(mutex_);
    /// Milliseconds of the coarse monotonic clock.
    std::int64_t dueMilliseconds_ ZOR_GUARDED_BY(mutex_) = 0;
};

} // namespace zor
