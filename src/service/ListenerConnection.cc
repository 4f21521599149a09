// SPDX-License-Identifier: Apache-2.0
#include "service/ListenerConnection.h"

#include "base/Log.h"
#include "ipc/Frame.h"
#include "plist/Codec.h"

#include <chrono>
#include <exception>
#include <string>
#include <sys/epoll.h>
#include <sys/socket.h>
#include <utility>

namespace zor::platform {

namespace {

std::string lineOf(ListenerIncident incident, std::int64_t about, std::uint64_t requestId) {
    const auto number = static_cast<long long>(about);
    const auto request = static_cast<unsigned long long>(requestId);
    switch (incident) {
    case ListenerIncident::tooManyConnections:
        return formatted("Connection refused, too many connections: uid %lld", number);
    case ListenerIncident::outOfDescriptors:
        return formatted("Connection refused, out of descriptors or memory: errno %lld", number);
    case ListenerIncident::unknownPeer:
        return formatted("Connection refused, the kernel does not tell the peer: errno %lld", number);
    case ListenerIncident::foreignSender:
        return formatted("Connection ended, bytes came from a process that did not connect: pid %lld", number);
    case ListenerIncident::brokenFrame:
        return formatted("Connection ended, it sent something that is no request: pid %lld", number);
    case ListenerIncident::tooMuchInput:
        return formatted("Connection ended, too many bytes of unfinished requests: uid %lld", number);
    case ListenerIncident::tooMuchOutput:
        return formatted("Connection ended, too many bytes of unread replies: uid %lld, request %llu", number, request);
    case ListenerIncident::unwritableReply:
        return formatted("A reply could not be written: uid %lld, request %llu", number, request);
    case ListenerIncident::unservable:
        return formatted("Connection ended, its request could not be served: pid %lld", number);
    }
    return {};
}

std::int64_t secondsNow() {
    const auto now = std::chrono::steady_clock::now().time_since_epoch();
    return std::chrono::duration_cast<std::chrono::seconds>(now).count();
}

} // namespace

void ListenerIncidents::happened(ListenerIncident incident, std::int64_t about, std::uint64_t request) noexcept {
    const auto index = static_cast<std::size_t>(incident);
    Kind& kind = kinds_[index];
    const std::uint64_t count = ++kind.count;
    std::int64_t from = kind.tellFromSeconds;
    const std::int64_t now = secondsNow();
    if (!report_ || now < from || !kind.tellFromSeconds.compare_exchange_strong(from, now + lineEvery_.count()))
        return;
    const std::uint64_t told = kind.countTold.exchange(count);
    try {
        std::string line = lineOf(incident, about, request);
        if (count > told + 1)
            line += formatted(" (and %llu more before)", static_cast<unsigned long long>(count - told - 1));
        report_(line);
    } catch (const std::exception&) {
        return; // the next line of this kind is due in a while
    }
}

std::uint64_t ListenerIncidents::count(ListenerIncident incident) const {
    return kinds_[static_cast<std::size_t>(incident)].count;
}

namespace {

/// A reply is written into a buffer that its thread keeps, unless it has become larger than most replies ever are.
constexpr std::size_t replyBufferBytesKept = std::size_t{256} * 1024;
/// A peer that asks again as soon as it has its answer is served so often before others are looked for. It bounds one
/// that sends byte by byte, too.
constexpr unsigned receivesPerTurn = 4;

} // namespace

/// The fields below the connection are guarded by the connection's mutex.
class ListenerConnection::Channel final : public ReplyChannel {
public:
    explicit Channel(std::shared_ptr<ListenerConnection> owner) : connection(std::move(owner)) {}

    void send(const plist::Dictionary& reply) override {
        thread_local plist::Data frame;
        try {
            frame.resize(ipc::frameHeaderBytes);
            if (plist::appendBinary(reply, frame) && frame.size() - ipc::frameHeaderBytes <= ipc::replyPayloadBytesMax)
                connection->transmit(*this, frame);
            else
                connection->unwritable(*this);
        } catch (const std::exception&) {
            // Here, because the thread may be a queue's, which has nobody to tell.
            connection->unwritable(*this);
        }
        if (frame.capacity() > replyBufferBytesKept)
            plist::Data().swap(frame);
    }

    const std::shared_ptr<ListenerConnection> connection;
    std::uint64_t life = 0;
    std::uint64_t id = 0;
    bool sent = true;
};

void ListenerConnection::open(PeerSocket socket, std::unique_ptr<Peer> peer, ListenerCharges::Account& account) {
    bool added = false;
    {
        // Under the mutex to the end: an event that belongs to an earlier life may come at any moment.
        const MutexLock lock(mutex_);
        input_.open(core_.charges, account, socket.get(), peer->pid());
        output_.open(core_.charges, account, core_.limits.outputBytesMax);
        account_ = &account;
        uid_ = peer->kernelUserId();
        standIn(account.line);
        peer_ = std::move(peer);
        descriptor_ = socket.get();
        socket_ = std::move(socket);
        over_ = false;
        open_ = true;
        ++life_;
        lookAgain_ = false;
        awaited_ = eventsWanted();
        added = core_.pool.add(descriptor_, *this, awaited_);
        held_ = !added;
    }
    if (!added)
        close();
}

void ListenerConnection::endAfterStop() {
    {
        const MutexLock lock(mutex_);
        if (!open_)
            return;
        held_ = true;
        over_ = true;
    }
    close();
}

void ListenerConnection::run(ListenerScratch& scratch, std::uint32_t events) {
    {
        const MutexLock lock(mutex_);
        if (!open_)
            return; // out of date
        if (events != 0 && held_) {
            lookAgain_ = true;
            return;
        }
        held_ = true;
    }
    Outcome outcome = Outcome::wait;
    Turn turn{.onlyArrival = events == EPOLLIN};
    do {
        try {
            outcome = keepRest(serve(scratch, turn));
            turn.onlyArrival = false;
            if (outcome == Outcome::requeue)
                return core_.pool.requeue(*this);
        } catch (const std::exception&) {
            // One request less is better than no daemon. Its peer learns at once that there will be no reply.
            outcome = endWithIncident(ListenerIncident::unservable, peer_->pid());
        }
    } while (outcome == Outcome::wait && !letGo());
    if (outcome == Outcome::end)
        close();
}

bool ListenerConnection::lookAtRoom() {
    // Before the looks: what comes after them sets the mark again.
    const bool hasHappened = lookAgain_ && lookAgain_.exchange(false);
    if (output_.pendingBytes() == 0)
        return hasHappened;
    const MutexLock lock(mutex_);
    if (output_.flush(descriptor_) == ListenerOutput::Result::broken)
        dropLocked();
    return hasHappened;
}

ListenerConnection::Outcome ListenerConnection::serve(ListenerScratch& scratch, Turn& turn) {
    for (bool isLast = false;;) {
        turn.onlyArrival = !lookAtRoom() && turn.onlyArrival;
        if (const std::optional<Outcome> outcome = serveArrived(scratch, turn))
            return *outcome;
        if (isLast && turn.onlyArrival)
            return Outcome::wait;
        if (output_.pendingBytes() >= core_.limits.outputBytesPaused)
            return Outcome::wait;
        if (turn.receives++ >= receivesPerTurn)
            return Outcome::requeue;
        switch (input_.receive(descriptor_, scratch)) {
        case ListenerInput::Received::bytes:
            isLast = false;
            break;
        case ListenerInput::Received::lastBytes:
            isLast = true;
            break;
        case ListenerInput::Received::nothing:
            return Outcome::wait;
        case ListenerInput::Received::ended:
            return Outcome::end;
        case ListenerInput::Received::foreign:
            return endWithOther(ListenerIncident::foreignSender);
        case ListenerInput::Received::tooMuch:
            return endWithIncident(ListenerIncident::tooMuchInput, static_cast<std::int64_t>(peer_->kernelUserId()));
        }
    }
}

bool ListenerConnection::isOver(Turn& turn) const {
    if (turn.frames == 0)
        return false;
    if (turn.frames >= core_.limits.framesPerTurn || core_.pool.othersWait(line()))
        return true;
    const auto now = std::chrono::steady_clock::now();
    if (turn.frames == 1)
        turn.firstServed = now;
    return now - turn.firstServed >= core_.limits.turnMax;
}

std::optional<ListenerConnection::Outcome> ListenerConnection::serveArrived(ListenerScratch& scratch, Turn& turn) {
    for (;;) {
        if (over_)
            return Outcome::end;
        const std::span<const std::uint8_t> pending = input_.pending();
        if (pending.size() < ipc::frameHeaderBytes)
            return std::nullopt;
        const ipc::FrameHeader header = ipc::decodeFrameHeader(pending.first<ipc::frameHeaderBytes>());
        if (!header.isValidRequest())
            return endWithOther(ListenerIncident::brokenFrame);
        if (pending.size() - ipc::frameHeaderBytes < header.payloadBytes)
            return std::nullopt;
        if (output_.pendingBytes() >= core_.limits.outputBytesPaused)
            return Outcome::wait;
        if (isOver(turn))
            return Outcome::requeue;
        ++turn.frames;
        if (!serveFrame(header, pending.subspan(ipc::frameHeaderBytes, header.payloadBytes)))
            return endWithOther(ListenerIncident::brokenFrame);
        input_.consume(ipc::frameHeaderBytes + header.payloadBytes);
        scratch.messages.store(scratch.messages.load(std::memory_order_relaxed) + 1, std::memory_order_relaxed);
    }
}

bool ListenerConnection::serveFrame(const ipc::FrameHeader& header, std::span<const std::uint8_t> payload) {
    auto value = plist::readBinary(payload);
    plist::Dictionary* request = value ? value->asMutableDictionary() : nullptr;
    if (!request)
        return false;
    ServiceEvent event = {
        .kind = ServiceEvent::Kind::message, .request = std::move(*request), .reply = nullptr, .requestId = header.id};
    if (header.expectsReply())
        event.reply = channelFor(header.id);
    core_.handler(*this, event);
    return true;
}

ListenerConnection::Outcome ListenerConnection::endWithOther(ListenerIncident incident) {
    core_.incidents.happened(incident, peer_->pid());
    ServiceEvent event = {.kind = ServiceEvent::Kind::other, .request = {}, .reply = nullptr};
    core_.handler(*this, event);
    return Outcome::end;
}

ListenerConnection::Outcome ListenerConnection::endWithIncident(ListenerIncident incident, std::int64_t about) {
    core_.incidents.happened(incident, about);
    return Outcome::end;
}

std::shared_ptr<ListenerConnection::Channel> ListenerConnection::channelFor(std::uint64_t id) {
    // Counted once, it is ours alone. Another thread that had it may have dropped it just now, after a send under the
    // mutex.
    if (!channel_ || channel_.use_count() != 1)
        channel_ = std::make_shared<Channel>(shared_from_this());
    const MutexLock lock(mutex_);
    channel_->life = life_;
    channel_->id = id;
    channel_->sent = false;
    return channel_;
}

std::uint32_t ListenerConnection::eventsWanted() const {
    const std::size_t pending = output_.pendingBytes();
    if (pending == 0)
        return EPOLLIN | EPOLLRDHUP | EPOLLET;
    return pending < core_.limits.outputBytesPaused ? std::uint32_t{EPOLLIN | EPOLLRDHUP | EPOLLOUT | EPOLLET}
                                                    : std::uint32_t{EPOLLOUT | EPOLLET};
}

ListenerConnection::Outcome ListenerConnection::keepRest(Outcome outcome) {
    if (outcome != Outcome::end && !input_.keep())
        return endWithIncident(ListenerIncident::tooMuchInput, static_cast<std::int64_t>(peer_->kernelUserId()));
    return outcome;
}

bool ListenerConnection::letGo() {
    const MutexLock lock(mutex_);
    if (over_ || lookAgain_ || !await())
        return false;
    held_ = false;
    return true;
}

bool ListenerConnection::await() {
    const std::uint32_t wanted = eventsWanted();
    if (wanted == awaited_)
        return true;
    // The kernel tells anew what is there already.
    if (!core_.pool.change(descriptor_, *this, wanted)) {
        over_ = true;
        return false;
    }
    awaited_ = wanted;
    return true;
}

void ListenerConnection::close() {
    {
        const MutexLock lock(mutex_);
        over_ = true;
    }
    ServiceEvent event = {.kind = ServiceEvent::Kind::invalid, .request = {}, .reply = nullptr};
    core_.handler(*this, event);

    input_.close();
    channel_.reset();
    peer_.reset();
    PeerSocket socket;
    ListenerCharges::Account* account = nullptr;
    {
        const MutexLock lock(mutex_);
        output_.close();
        core_.pool.remove(descriptor_);
        open_ = false;
        held_ = false;
        socket = std::move(socket_);
        descriptor_ = -1;
        account = std::exchange(account_, nullptr);
    }
    // A moment at most, but nobody should have to wait for the mutex meanwhile.
    socket.reset();
    core_.charges.closeConnection(*account);
    core_.recycle(*this);
}

void ListenerConnection::cancel() {
    const MutexLock lock(mutex_);
    over_ = true;
}

void ListenerConnection::transmit(Channel& channel, plist::Data& frame) {
    const MutexLock lock(mutex_);
    if (channel.sent || channel.life != life_ || !open_ || over_)
        return;
    const ipc::FrameHeader header = {.payloadBytes = static_cast<std::uint32_t>(frame.size() - ipc::frameHeaderBytes),
                                     .flags = ipc::frameIsReply,
                                     .id = channel.id};
    ipc::encodeFrameHeader(header, std::span(frame).first<ipc::frameHeaderBytes>());
    const ListenerOutput::Result result = output_.write(socket_.get(), frame);
    channel.sent = true;
    switch (result) {
    case ListenerOutput::Result::done:
        return;
    case ListenerOutput::Result::kept:
        if (!held_ && !await())
            dropLocked();
        return;
    case ListenerOutput::Result::tooMuch:
        core_.incidents.happened(ListenerIncident::tooMuchOutput, static_cast<std::int64_t>(uid_), channel.id);
        return dropLocked();
    case ListenerOutput::Result::broken:
        return dropLocked();
    }
}

void ListenerConnection::unwritable(Channel& channel) {
    const MutexLock lock(mutex_);
    if (channel.sent || channel.life != life_ || !open_ || over_)
        return;
    channel.sent = true;
    core_.incidents.happened(ListenerIncident::unwritableReply, static_cast<std::int64_t>(uid_), channel.id);
    // A peer that waits for this reply has to learn that it does not come.
    dropLocked();
}

void ListenerConnection::dropLocked() {
    over_ = true;
    output_.discard();
    ::shutdown(socket_.get(), SHUT_RDWR);
}

std::shared_ptr<ListenerConnection> ListenerCore::unusedConnection() {
    const MutexLock lock(mutex);
    if (unused.empty()) {
        // So that its end needs no memory.
        unused.reserve(connections.size() + 1);
        return connections.emplace_back(std::make_shared<ListenerConnection>(*this));
    }
    ListenerConnection* connection = unused.back();
    unused.pop_back();
    return connection->shared_from_this();
}

void ListenerCore::recycle(ListenerConnection& connection) {
    const MutexLock lock(mutex);
    unused.push_back(&connection);
}

} // namespace zor::platform
