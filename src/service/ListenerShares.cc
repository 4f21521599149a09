// SPDX-License-Identifier: Apache-2.0
#include "service/ListenerShares.h"

#include "platform/Errno.h"

#include <algorithm>
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

namespace {

/// The socket, the directory of the process in /proc, and its address space.
constexpr std::size_t descriptorsPerConnection = 3;
/// Not for connections: a quarter, which is more than the threads that run at once take for their walks (some thirty
/// each; eighty for a change of class, which few may ask for), and at least what an idle daemon and all upcall
/// connections take, unless that is more than half.
constexpr std::size_t shareOfOwn = 4;
constexpr std::size_t ownLeast = 256;

} // namespace

ListenerLimits ListenerLimits::forDescriptors(std::size_t descriptorsMax) {
    ListenerLimits limits;
    const std::size_t own = std::max(descriptorsMax / shareOfOwn, std::min(ownLeast, descriptorsMax / 2));
    const std::size_t connections = (descriptorsMax - own) / descriptorsPerConnection;
    if (connections >= limits.connectionsMax)
        return limits;
    limits.connectionsMax = connections;
    limits.connectionsMaxPerUser = connections / 4;
    limits.connectionsKeptForOwners = std::min(limits.connectionsKeptForOwners, connections / 4);
    return limits;
}

ListenerLimits ListenerLimits::forUsers(const ipc::UserNumbers& owners) const {
    ListenerLimits limits = *this;
    limits.users = owners;
    if (owners.mobileUsers() > users.mobileUsers())
        limits.threadsMax += threadsMaxPerUser * (owners.mobileUsers() - users.mobileUsers());
    return limits;
}

ListenerCharges::~ListenerCharges() {
    const MutexLock lock(mutex_);
    ZOR_ASSERT(totals_.connections == 0);
    ZOR_ASSERT(totals_.inputBytes == 0);
    ZOR_ASSERT(totals_.outputBytes == 0);
    ZOR_ASSERT(ofOthers_.connections == 0 && ofOthers_.inputBytes == 0 && ofOthers_.outputBytes == 0);
}

ListenerCharges::Account* ListenerCharges::openConnection(uid_t uid, bool ownsRoot) {
    const MutexLock lock(mutex_);
    if (totals_.connections >= limits_.connectionsMax)
        return nullptr;
    if (!ownsRoot && ofOthers_.connections + limits_.connectionsKeptForOwners >= limits_.connectionsMax)
        return nullptr;
    const unsigned threadsMax = ownsRoot ? limits_.threadsMax : std::min(limits_.threadsMaxPerUser, limits_.threadsMax);
    Account& account =
        accounts_.try_emplace(ownsRoot ? uid : limits_.users.counted(uid), ownsRoot, threadsMax).first->second;
    if (!ownsRoot && account.connections >= limits_.connectionsMaxPerUser)
        return nullptr;
    if (!ownsRoot)
        ++ofOthers_.connections;
    ++account.connections;
    ++totals_.connections;
    return &account;
}

void ListenerCharges::closeConnection(Account& account) {
    const MutexLock lock(mutex_);
    ZOR_ASSERT(account.connections > 0);
    ZOR_ASSERT(totals_.connections >= account.connections);
    if (!account.ownsRoot)
        --ofOthers_.connections;
    --totals_.connections;
    if (--account.connections > 0)
        return;
    ZOR_ASSERT(account.inputBytes == 0);
    ZOR_ASSERT(account.outputBytes == 0);
}

bool ListenerCharges::changeInput(Account& account, std::size_t before, std::size_t after) {
    const MutexLock lock(mutex_);
    ZOR_ASSERT(account.inputBytes >= before);
    const std::size_t ofUser = account.inputBytes - before + after;
    const std::size_t ofOthers = account.ownsRoot ? ofOthers_.inputBytes : ofOthers_.inputBytes - before + after;
    const std::size_t inAll = totals_.inputBytes - before + after;
    const bool tooMuchOfOthers =
        ofUser > limits_.inputBytesMaxPerUser || ofOthers + limits_.inputBytesKeptForOwners > limits_.inputBytesMax;
    if (after > before && (inAll > limits_.inputBytesMax || (!account.ownsRoot && tooMuchOfOthers)))
        return false;
    account.inputBytes = ofUser;
    ofOthers_.inputBytes = ofOthers;
    totals_.inputBytes = inAll;
    return true;
}

bool ListenerCharges::changeOutput(Account& account, std::size_t before, std::size_t after) {
    const MutexLock lock(mutex_);
    ZOR_ASSERT(account.outputBytes >= before);
    const std::size_t ofUser = account.outputBytes - before + after;
    const std::size_t ofOthers = account.ownsRoot ? ofOthers_.outputBytes : ofOthers_.outputBytes - before + after;
    const bool tooMuchOfOthers = ofUser > limits_.outputBytesMaxPerUser || ofOthers > limits_.outputBytesMaxOfOthers;
    if (after > before && !account.ownsRoot && tooMuchOfOthers)
        return false;
    account.outputBytes = ofUser;
    ofOthers_.outputBytes = ofOthers;
    totals_.outputBytes = totals_.outputBytes - before + after;
    return true;
}

ListenerCharges::Totals ListenerCharges::totals() const {
    const MutexLock lock(mutex_);
    return totals_;
}

} // namespace zor::platform
