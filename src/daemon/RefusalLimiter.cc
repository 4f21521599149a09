// SPDX-License-Identifier: Apache-2.0
#include "daemon/RefusalLimiter.h"

#include <algorithm>
#include <utility>

namespace zor::platform {

namespace {
constexpr std::chrono::seconds second{1};
constexpr std::chrono::minutes minute{1};
} // namespace

RefusalLimiter::RefusalLimiter(const ipc::UserNumbers& users, Report report, Later later,
                               std::function<Clock::time_point()> now)
    : users_(users), report_(std::move(report)), later_(std::move(later)), now_(std::move(now)) {}

bool RefusalLimiter::admit(uid_t uid, std::size_t bytes) {
    Outcome outcome;
    bool admitted = false;
    {
        const MutexLock lock(mutex_);
        const Clock::time_point now = now_();
        collectEnded(now, outcome);
        Slot& slot = slotOf(users_.counted(uid), now, outcome);
        slot.lastSeen = now;
        if (now - slot.lines.begun >= second)
            slot.lines = {.begun = now};
        if (now - slot.bytes.begun >= minute)
            slot.bytes = {.begun = now};
        const bool fewBytes = slot.bytes.written + bytes <= bytesPerMinuteMax;
        admitted = fewBytes && slot.lines.written < linesPerSecondMax;
        if (admitted) {
            ++slot.lines.written;
            slot.bytes.written += bytes;
        } else {
            const Clock::time_point over = fewBytes ? slot.lines.begun + second : slot.bytes.begun + minute;
            const Clock::time_point before = slot.leftOut++ > 0 ? slot.saidAt : Clock::time_point::min();
            slot.saidAt = std::max(before, over);
            if (before < over)
                outcome.later = over - now;
        }
    }
    act(outcome);
    return admitted;
}

void RefusalLimiter::reportEnded() {
    Outcome outcome;
    {
        const MutexLock lock(mutex_);
        const Clock::time_point now = now_();
        collectEnded(now, outcome);
        for (const Slot& slot : slots_) {
            if (slot.leftOut > 0)
                outcome.later = std::min(outcome.later.value_or(Clock::duration::max()), slot.saidAt - now);
        }
    }
    act(outcome);
}

void RefusalLimiter::reportAll() {
    Outcome outcome;
    {
        const MutexLock lock(mutex_);
        for (Slot& slot : slots_)
            take(slot, outcome);
    }
    act(outcome);
}

RefusalLimiter::Slot& RefusalLimiter::slotOf(uid_t uid, Clock::time_point now, Outcome& outcome) {
    Slot* oldest = &slots_.front();
    for (Slot& slot : slots_) {
        if (slot.used && slot.uid == uid)
            return slot;
        if (oldest->used && (!slot.used || slot.lastSeen < oldest->lastSeen))
            oldest = &slot;
    }
    take(*oldest, outcome);
    *oldest = {.used = true, .uid = uid, .lastSeen = now, .lines = {.begun = now}, .bytes = {.begun = now}};
    return *oldest;
}

void RefusalLimiter::collectEnded(Clock::time_point now, Outcome& outcome) {
    for (Slot& slot : slots_) {
        if (slot.saidAt <= now)
            take(slot, outcome);
    }
}

void RefusalLimiter::take(Slot& slot, Outcome& outcome) {
    if (slot.leftOut == 0)
        return;
    outcome.ended[outcome.count++] = {.uid = slot.uid, .leftOut = slot.leftOut};
    slot.leftOut = 0;
}

void RefusalLimiter::act(const Outcome& outcome) const {
    for (std::size_t i = 0; i < outcome.count; ++i)
        report_(outcome.ended[i].uid, outcome.ended[i].leftOut);
    if (outcome.later)
        later_(std::chrono::ceil<std::chrono::milliseconds>(*outcome.later));
}

} // namespace zor::platform
