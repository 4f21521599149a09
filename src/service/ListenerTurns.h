// SPDX-License-Identifier: Apache-2.0
// The order of turns: what is ready to be served and has to wait, in one line for each user, and the lines in a ring.
//
// The kernel's list of ready descriptors goes by connection: a user with a thousand of them gets a thousand turns while
// another gets one. So the list is the source of news alone. A worker that looks there takes everything that is ready.
// When that is one task, and none waits here, it is run at once: no lock, no hand-off and no call more than the look
// itself. Else nothing is run in the order in which it came: all tasks go into the lines of their users, and the next
// one is taken from the line at the front of the ring, which then goes to its end. While a task waits, each worker
// looks for news, without waiting, before it takes one: the user who has just come is at most one turn of the others
// away from its own. Owners of the root have a ring of their own that is looked at first.
//
// A turn is one frame while somebody else's line waits. It may be longer where nobody's does, for the next frame of the
// same connection is at hand; but no longer than it may take to find out that somebody has come.
//
// Weighed against it: one epoll for each user, inside of one for all, tells the kernel the same, but makes every
// message pay a second look. Putting a connection back when its user had a turn lately needs clocks, and a guess at
// who else waits. A thread that deals out the work is a hand-off for every message.
//
// A line may not have more tasks under way than its share of the threads. Handlers that wait (for a disk, or for a
// server behind a home) would else fill the pool up with one user's, and turns would never come. A line that is at its
// share stands aside until one of its tasks has ended.
//
// Invariants: a task waits at most once. A line is in a ring exactly when tasks wait in it and it does not stand aside.
// Everything is guarded by the pool's mutex but what says that it is not. Tasks and lines outlive their waiting.
#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>

namespace zor::platform {

struct ListenerScratch;
class ListenerTask;

/// One user's line. Lives as long as the listener.
class ListenerLine {
public:
    ListenerLine(bool isOwners, unsigned tasksAtOnceMax) : isOwners_(isOwners), tasksAtOnceMax_(tasksAtOnceMax) {}
    ListenerLine(const ListenerLine&) = delete;
    ListenerLine& operator=(const ListenerLine&) = delete;

    // Any thread, without the mutex.
    /// False, and nothing has begun, when the line has its share of tasks under way.
    [[nodiscard]] bool begin() {
        unsigned seen = underWay_;
        while (seen < tasksAtOnceMax_) {
            if (underWay_.compare_exchange_weak(seen, seen + 1))
                return true;
        }
        return false;
    }
    /// True: the line stands aside, and has to be called back.
    [[nodiscard]] bool end() {
        --underWay_;
        return standsAside_;
    }

private:
    friend class ListenerTurns;

    const bool isOwners_;
    const unsigned tasksAtOnceMax_;
    std::atomic<unsigned> underWay_{0};
    std::atomic<bool> standsAside_{false};
    std::atomic<bool> inRing_{false};
    ListenerTask* first_ = nullptr;
    ListenerTask* last_ = nullptr;
    std::size_t waiting_ = 0;
    ListenerLine* next_ = nullptr;
};

class ListenerTask {
public:
    explicit ListenerTask(ListenerLine* line = nullptr) : line_(line) {}
    virtual ~ListenerTask() = default;
    /// The epoll events that came, or 0 after a requeue. The kernel tells no event twice: the task looks until there is
    /// nothing more. It throws nothing: the thread serves others too.
    virtual void run(ListenerScratch& scratch, std::uint32_t events) = 0;

    /// Before the task is added to a pool. An event that is out of date may still find it in the line of before.
    void standIn(ListenerLine& line) { line_ = &line; }
    [[nodiscard]] ListenerLine& line() const { return *line_; }

private:
    friend class ListenerTurns;

    std::atomic<ListenerLine*> line_;
    ListenerTask* next_ = nullptr;
    std::uint32_t events_ = 0;
    bool waits_ = false;
    bool isRequeued_ = false;
};

class ListenerTurns {
public:
    struct Turn {
        ListenerTask* task = nullptr;
        std::uint32_t events = 0;
        /// In which it has begun.
        ListenerLine* line = nullptr;
    };

    void add(ListenerTask& task, std::uint32_t events);
    /// A task that goes on later. It gets the events 0, whatever else comes for it meanwhile.
    void requeue(ListenerTask& task);
    /// The next one, begun in its line; no task when all that wait stand aside.
    [[nodiscard]] Turn take();
    /// After an end of the line that said so.
    void callBack(ListenerLine& line);

    // Any thread, without the mutex.
    /// Tasks that can be taken.
    [[nodiscard]] unsigned count() const { return count_; }
    /// Whether somebody else's line waits. It may be out of date.
    [[nodiscard]] bool othersWait(const ListenerLine& line) const { return linesInRings_ > (line.inRing_ ? 1U : 0U); }

private:
    struct Ring {
        ListenerLine* first = nullptr;
        ListenerLine* last = nullptr;
    };
    void append(ListenerTask& task);
    void join(ListenerLine& line);
    ListenerLine* leaveFirst(Ring& ring);
    [[nodiscard]] Turn takeFrom(Ring& ring);

    Ring owners_;
    Ring others_;
    std::atomic<unsigned> count_{0};
    std::atomic<unsigned> linesInRings_{0};
};

} // namespace zor::platform
