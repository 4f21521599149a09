// SPDX-License-Identifier: Apache-2.0
#include "platform/RefusalLimiter.h"

#include <utility>

namespace zor::platform {

namespace {
constexpr std::chrono::seconds window{1};
}

RefusalLimiter::RefusalLimiter(Report report, std::function<Clock::time_point()> now)
    : report_(std::move(report)), now_(std::move(now)) {}

bool RefusalLimiter::admit(uid_t uid) {
    EndedList ended;
    bool admitted = false;
    {
        const MutexLock lock(mutex_);
        const Clock::time_point now = now_();
        collectEnded(now, ended);
        Slot& slot = slotOf(uid, now, ended);
        slot.lastSeen = now;
        admitted = slot.written < linesPerSecondMax;
        if (admitted)
            ++slot.written;
        else
            ++slot.leftOut;
    }
    say(ended);
    return admitted;
}

void RefusalLimiter::reportAll() {
    EndedList ended;
    {
        const MutexLock lock(mutex_);
        for (Slot& slot : slots_)
            take(slot, ended);
    }
    say(ended);
}

RefusalLimiter::Slot& RefusalLimiter::slotOf(uid_t uid, Clock::time_point now, EndedList& ended) {
    Slot* oldest = &slots_.front();
    for (Slot& slot : slots_) {
        if (slot.used && slot.uid == uid)
            return slot;
        if (oldest->used && (!slot.used || slot.lastSeen < oldest->lastSeen))
            oldest = &slot;
    }
    take(*oldest, ended);
    *oldest = {.used = true, .uid = uid, .begun = now, .lastSeen = now, .written = 0, .leftOut = 0};
    return *oldest;
}

void RefusalLimiter::collectEnded(Clock::time_point now, EndedList& ended) {
    for (Slot& slot : slots_) {
        if (!slot.used || now - slot.begun < window)
            continue;
        take(slot, ended);
        slot.begun = now;
        slot.written = 0;
    }
}

void RefusalLimiter::take(Slot& slot, EndedList& ended) {
    if (slot.leftOut == 0)
        return;
    ended.items[ended.count++] = {.uid = slot.uid, .leftOut = slot.leftOut};
    slot.leftOut = 0;
}

void RefusalLimiter::say(const EndedList& ended) const {
    for (std::size_t i = 0; i < ended.count; ++i)
        report_(ended.items[i].uid, ended.items[i].leftOut);
}

} // namespace zor::platform
