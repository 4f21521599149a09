// SPDX-License-Identifier: Apache-2.0
#include "service/ListenerTurns.h"

#include "base/Assert.h"

#include <utility>

namespace zor::platform {

void ListenerTurns::add(ListenerTask& task, std::uint32_t events) {
    if (task.waits_) {
        // One that was requeued is held by its line, and looks until there is nothing more when its turn comes.
        if (!task.isRequeued_)
            task.events_ |= events;
        return;
    }
    task.events_ = events;
    append(task);
}

void ListenerTurns::requeue(ListenerTask& task) {
    task.isRequeued_ = true;
    task.events_ = 0;
    if (!task.waits_)
        append(task);
}

void ListenerTurns::append(ListenerTask& task) {
    ListenerLine& line = task.line();
    ZOR_ASSERT(!task.waits_);
    task.waits_ = true;
    task.next_ = nullptr;
    (line.last_ ? line.last_->next_ : line.first_) = &task;
    line.last_ = &task;
    ++line.waiting_;
    if (line.standsAside_)
        return;
    ++count_;
    if (!line.inRing_)
        join(line);
}

void ListenerTurns::join(ListenerLine& line) {
    ZOR_ASSERT(!line.inRing_ && line.waiting_ > 0);
    Ring& ring = line.isOwners_ ? owners_ : others_;
    line.next_ = nullptr;
    (ring.last ? ring.last->next_ : ring.first) = &line;
    ring.last = &line;
    line.inRing_ = true;
    ++linesInRings_;
}

ListenerLine* ListenerTurns::leaveFirst(Ring& ring) {
    ListenerLine* const line = ring.first;
    ZOR_ASSERT(line && line->inRing_ && linesInRings_ > 0);
    ring.first = std::exchange(line->next_, nullptr);
    if (!ring.first)
        ring.last = nullptr;
    line->inRing_ = false;
    --linesInRings_;
    return line;
}

ListenerTurns::Turn ListenerTurns::take() {
    const Turn turn = takeFrom(owners_);
    return turn.task ? turn : takeFrom(others_);
}

ListenerTurns::Turn ListenerTurns::takeFrom(Ring& ring) {
    while (ring.first) {
        ListenerLine& line = *leaveFirst(ring);
        bool begun = line.begin();
        if (!begun) {
            line.standsAside_ = true;
            // The task that made it too many may have ended before it could see that the line stands aside.
            begun = line.begin();
            if (!begun) {
                count_ -= static_cast<unsigned>(line.waiting_);
                continue;
            }
            line.standsAside_ = false;
        }
        ZOR_ASSERT(line.first_ && line.waiting_ > 0 && count_ > 0);
        ListenerTask* const task = std::exchange(line.first_, line.first_->next_);
        if (!line.first_)
            line.last_ = nullptr;
        --line.waiting_;
        --count_;
        if (line.waiting_ > 0)
            join(line);
        task->waits_ = false;
        task->isRequeued_ = false;
        return {.task = task, .events = task->events_, .line = &line};
    }
    return {};
}

void ListenerTurns::callBack(ListenerLine& line) {
    if (!line.standsAside_.exchange(false))
        return;
    count_ += static_cast<unsigned>(line.waiting_);
    if (line.waiting_ > 0)
        join(line);
}

} // namespace zor::platform
