// SPDX-License-Identifier: Apache-2.0
// Keeps a client that is refused over and over from filling the log: of each user so many lines a second are written,
// the rest is counted and said in one line.
//
// Users are kept in a table of fixed size; the one that was quiet longest makes room for a new one, its count being
// said first. So a flood under many uids cannot make it grow. Any thread.
#pragma once

#include "platform/Mutex.h"

#include <array>
#include <chrono>
#include <cstdint>
#include <functional>
#include <sys/types.h>

namespace zor::platform {

class RefusalLimiter {
public:
    using Clock = std::chrono::steady_clock;
    /// Told how many lines of one user were left out. Called without any lock held.
    using Report = std::function<void(uid_t uid, std::uint64_t linesLeftOut)>;

    static constexpr unsigned linesPerSecondMax = 200;
    static constexpr std::size_t usersMax = 64;

    explicit RefusalLimiter(Report report, std::function<Clock::time_point()> now = Clock::now);

    /// Whether a line about `uid` is to be written now. Reports every count whose second is over before it returns.
    [[nodiscard]] bool admit(uid_t uid);
    /// Reports every count there is: when somebody looks, or at the end.
    void reportAll();

private:
    struct Slot {
        bool used = false;
        uid_t uid = 0;
        Clock::time_point begun;
        Clock::time_point lastSeen;
        unsigned written = 0;
        std::uint64_t leftOut = 0;
    };
    struct Ended {
        uid_t uid = 0;
        std::uint64_t leftOut = 0;
    };
    struct EndedList {
        std::array<Ended, usersMax + 1> items;
        std::size_t count = 0;
    };

    Slot& slotOf(uid_t uid, Clock::time_point now, EndedList& ended) ZOR_REQUIRES(mutex_);
    void collectEnded(Clock::time_point now, EndedList& ended) ZOR_REQUIRES(mutex_);
    static void take(Slot& slot, EndedList& ended);
    void say(const EndedList& ended) const;

    const Report report_;
    const std::function<Clock::time_point()> now_;
    Mutex mutex_;
    std::array<Slot, usersMax> slots_ ZOR_GUARDED_BY(mutex_);
};

} // namespace zor::platform
