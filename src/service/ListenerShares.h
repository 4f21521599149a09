// SPDX-License-Identifier: Apache-2.0
// How much of the daemon each user may take up through connections, and in which order users are served.
#pragma once

#include "base/Mutex.h"
#include "ipc/Frame.h"
#include "ipc/UserNumbers.h"

#include <atomic>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <map>
#include <sys/types.h>

namespace zor::platform {

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
// The pool's mutex guards everything but the members that say otherwise. Tasks and lines outlive their waiting.

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

// How much of the daemon clients may take up through their connections, and the accounts that count it: for each user
// and in all.
//
// Users that the system does not know count as one (UserNumbers.h). So there are so few accounts that they stay for the
// listener's life. Every charge is given back by the object that took it; at the end everything is zero again, and the
// destructor stops the process if it is not. Tests make the limits smaller, and so does a process that may have few
// descriptors; nothing else changes them. Any thread.

struct ListenerLimits {
    /// All users that the system does not know count as one.
    static constexpr unsigned strangers = 1;

    /// The limits of a process that may have so many descriptors open: no crowd of connections takes those that the
    /// daemon's work, the upcall and the status need, nor what is kept for the owners.
    [[nodiscard]] static ListenerLimits forDescriptors(std::size_t descriptorsMax);
    /// These limits where others own containers: more users have more threads, each of them its share.
    [[nodiscard]] ListenerLimits forUsers(const ipc::UserNumbers& owners) const;

    /// The users that have a share of their own; all others have one together.
    ipc::UserNumbers users;

    /// Connections in all, and of any one user that does not own the root.
    std::size_t connectionsMax = 4096;
    std::size_t connectionsMaxPerUser = 1024;
    /// The part of connectionsMax that is kept for the owners of the root: all users together cannot lock them out.
    std::size_t connectionsKeptForOwners = 64;

    /// Bytes of requests that have not arrived whole, in all and of any one user that does not own the root.
    std::size_t inputBytesMax = std::size_t{256} << 20;
    std::size_t inputBytesMaxPerUser = std::size_t{64} << 20;
    /// The part of inputBytesMax that is kept for the owners of the root.
    std::size_t inputBytesKeptForOwners = std::size_t{64} << 20;

    /// A connection with this much reply unread is not read from: a peer that never reads cannot make the daemon work.
    std::size_t outputBytesPaused = std::size_t{1} << 20;
    /// With more unread than this a connection is dropped.
    std::size_t outputBytesMax = std::size_t{64} << 20;
    /// Unread replies of all connections of any one user that does not own the root.
    std::size_t outputBytesMaxPerUser = std::size_t{256} << 20;
    /// The same of all users that do not own the root together.
    std::size_t outputBytesMaxOfOthers = std::size_t{1} << 30;

    /// Requests of one connection that are served in a row while nobody else waits, and for how long: another client is
    /// not seen before the end. The first one may take any time.
    unsigned framesPerTurn = 16;
    std::chrono::microseconds turnMax{1000};

    /// Between two lines of the log about one kind of incident: who provokes them all, over and over, writes as much as
    /// one refused user does.
    std::chrono::seconds incidentLineEvery{10};

    /// Threads that run handlers at once; 0 means one for each processor, and no fewer than 2.
    unsigned threadsRunning = 0;
    /// Requests of any one user that does not own the root under way at once: a user whose requests all wait for ever
    /// leaves threads to the others.
    unsigned threadsMaxPerUser = 16;
    /// Threads in all, those included that wait inside a handler: each user's share, and one more for the owners of the
    /// root and the system's own users, so that all other users together leave them that.
    unsigned threadsMax = threadsMaxPerUser * (users.mobileUsers() + strangers) + threadsMaxPerUser;
    /// A thread that is not needed ends after this time.
    std::chrono::milliseconds threadIdle{5000};
    /// How long a handler may wait unannounced before another thread takes its place.
    std::chrono::milliseconds tick{10};
};

/// The bytes that one receive can take: most requests fit several times over.
inline constexpr std::size_t listenerScratchBytes = 32 * 1024;
/// Input up to this size is put together in the scratch buffer; beyond it the connection's own buffer takes the rest.
inline constexpr std::size_t listenerSmallInputBytes = 4 * 1024;

static_assert(listenerSmallInputBytes + ipc::frameHeaderBytes < listenerScratchBytes);
// Requests that wait for their turn are kept too. They never fill a share, or fairness would drop connections.
static_assert(ListenerLimits{}.connectionsMaxPerUser * listenerScratchBytes < ListenerLimits{}.inputBytesMaxPerUser);
static_assert(ListenerLimits{}.connectionsMax * listenerScratchBytes + ListenerLimits{}.inputBytesKeptForOwners <
              ListenerLimits{}.inputBytesMax);
static_assert(ListenerLimits{}.outputBytesPaused < ListenerLimits{}.outputBytesMax);

class ListenerCharges {
public:
    explicit ListenerCharges(const ListenerLimits& limits) : limits_(limits) {}
    ~ListenerCharges();
    ListenerCharges(const ListenerCharges&) = delete;
    ListenerCharges& operator=(const ListenerCharges&) = delete;

    /// One user's share. Lives as long as this object.
    struct Account {
        Account(bool isOwners, unsigned threadsMax) : ownsRoot(isOwners), line(isOwners, threadsMax) {}

        const bool ownsRoot;
        /// Not guarded by the mutex of the charges.
        ListenerLine line;
        std::size_t connections = 0;
        std::size_t inputBytes = 0;
        std::size_t outputBytes = 0;
    };

    /// Takes a connection. nullptr when the user, or the listener, has as many as it may.
    [[nodiscard]] Account* openConnection(uid_t uid, bool ownsRoot) ZOR_EXCLUDES(mutex_);
    void closeConnection(Account& account) ZOR_EXCLUDES(mutex_);

    /// Changes a charge from `before` to `after` bytes. False, and nothing changes, when that is too much; less is
    /// never too much.
    [[nodiscard]] bool changeInput(Account& account, std::size_t before, std::size_t after) ZOR_EXCLUDES(mutex_);
    [[nodiscard]] bool changeOutput(Account& account, std::size_t before, std::size_t after) ZOR_EXCLUDES(mutex_);

    struct Totals {
        std::size_t connections = 0;
        std::size_t inputBytes = 0;
        std::size_t outputBytes = 0;
    };
    [[nodiscard]] Totals totals() const ZOR_EXCLUDES(mutex_);

private:
    const ListenerLimits limits_;
    mutable Mutex mutex_;
    /// By UserNumbers::counted, but for owners of the root.
    std::map<uid_t, Account> accounts_ ZOR_GUARDED_BY(mutex_);
    Totals totals_ ZOR_GUARDED_BY(mutex_);
    /// The part of it that belongs to users who do not own the root.
    Totals ofOthers_ ZOR_GUARDED_BY(mutex_);
};

} // namespace zor::platform
