// SPDX-License-Identifier: Apache-2.0
// Keeps a client that is refused over and over from filling the log: of each user so many lines a second and so many
// bytes a minute are written, the rest is counted and said in one line when that time is over.
//
// Users that the system does not know count as one (UserNumbers.h). Users are kept in a table of fixed size; the one
// that was quiet longest makes room for a new one, its count being said first. So a flood under many uids cannot make
// it grow. Any thread.
#pragma once

#include "base/Mutex.h"
#include "ipc/UserNumbers.h"

#include <array>
#include <chrono>
#include <cstdint>
#include <functional>
#include <optional>
#include <sys/types.h>

namespace zor::platform {

class RefusalLimiter {
public:
    using Clock = std::chrono::steady_clock;
    /// Told how many lines of one user, or of ipc::strangersUserId, were left out. Called without any lock held.
    using Report = std::function<void(uid_t uid, std::uint64_t linesLeftOut)>;
    /// Sees to it that reportEnded is called after that time, or earlier. Called without any lock held.
    using Later = std::function<void(std::chrono::milliseconds delay)>;

    static constexpr unsigned linesPerSecondMax = 200;
    /// A fifth of the smallest log: what others have in it is still there minutes later.
    static constexpr std::size_t bytesPerMinuteMax = 20 * 1024;
    static constexpr std::size_t usersMax = 64;

    RefusalLimiter(const ipc::UserNumbers& users, Report report, Later later,
                   std::function<Clock::time_point()> now = Clock::now);

    /// Whether a line about `uid`, of so many bytes, is to be written.
    [[nodiscard]] bool admit(uid_t uid, std::size_t bytes);
    /// Reports every count whose time is over.
    void reportEnded();
    /// Reports every count there is: when somebody looks, or at the end.
    void reportAll();

private:
    /// Lines written in the second or minute that began then.
    struct Window {
        Clock::time_point begun;
        std::size_t written = 0;
    };
    struct Slot {
        bool used = false;
        uid_t uid = 0;
        Clock::time_point lastSeen;
        Window lines;
        Window bytes;
        std::uint64_t leftOut = 0;
        /// When the count is said.
        Clock::time_point saidAt;
    };
    struct Ended {
        uid_t uid = 0;
        std::uint64_t leftOut = 0;
    };
    /// Left to be done without the lock.
    struct Outcome {
        std::array<Ended, usersMax + 1> ended;
        std::size_t count = 0;
        std::optional<Clock::duration> later;
    };

    Slot& slotOf(uid_t uid, Clock::time_point now, Outcome& outcome) ZOR_REQUIRES(mutex_);
    void collectEnded(Clock::time_point now, Outcome& outcome) ZOR_REQUIRES(mutex_);
    static void take(Slot& slot, Outcome& outcome);
    void act(const Outcome& outcome) const;

    const ipc::UserNumbers users_;
    const Report report_;
    const Later later_;
    const std::function<Clock::time_point()> now_;
    Mutex mutex_;
    std::array<Slot, usersMax> slots_ ZOR_GUARDED_BY(mutex_);
};

} // namespace zor::platform
