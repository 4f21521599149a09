// SPDX-License-Identifier: Apache-2.0
#include "service/ServiceListener.h"

#include "platform/Errno.h"
#include "service/ListenerConnection.h"

#include <cerrno>
#include <chrono>
#include <new>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <unistd.h>
#include <utility>

namespace zor::platform {

namespace {

/// Connections taken in a row before others have their turn.
constexpr unsigned acceptsPerTurn = 16;
/// How long nobody is accepted when there is not one descriptor left.
constexpr std::chrono::milliseconds acceptPause{100};

} // namespace

/// The listening socket as a task of the pool. One thread at a time.
class ServiceListener::Acceptance final : public ListenerTask {
public:
    Acceptance(int socket, PeerIdentity& identity, ListenerCore& core)
        : ListenerTask(&line_), socket_(socket), identity_(identity), core_(core) {}

    void run(ListenerScratch&, std::uint32_t) override {
        for (unsigned i = 0; i < acceptsPerTurn; ++i) {
            ListenerAcceptor::Accepted accepted = acceptor_.accept(socket_);
            switch (accepted.outcome) {
            case ListenerAcceptor::Outcome::accepted:
                admit(std::move(accepted.socket));
                break;
            case ListenerAcceptor::Outcome::refused:
                core_.incidents.happened(ListenerIncident::outOfDescriptors, EMFILE);
                break;
            case ListenerAcceptor::Outcome::exhausted:
                core_.incidents.happened(ListenerIncident::outOfDescriptors, EMFILE);
                core_.pool.callLater(acceptPause, [this] { arm(); });
                return;
            case ListenerAcceptor::Outcome::none:
                return arm();
            }
        }
        arm();
    }

private:
    void arm() { [[maybe_unused]] const bool armed = core_.pool.change(socket_, *this, EPOLLIN | EPOLLET); }

    void admit(PeerSocket socket) {
        // A peer that connected before the listening socket came to the daemon has not taken it over. All that such a
        // one has sent would come with descriptors in the place of credentials.
        if (const Errno error = enableSenderCredentials(socket.get()))
            return core_.incidents.happened(ListenerIncident::unknownPeer, error.number());
        ucred credentials = {};
        socklen_t length = sizeof credentials;
        if (::getsockopt(socket.get(), SOL_SOCKET, SO_PEERCRED, &credentials, &length) != 0)
            return core_.incidents.happened(ListenerIncident::unknownPeer, errno);
        // The charge comes before anything that costs more.
        ListenerCharges::Account* account = nullptr;
        std::unique_ptr<Peer> peer;
        std::shared_ptr<ListenerConnection> connection;
        Errno error;
        try {
            account = core_.charges.openConnection(credentials.uid, identity_.ownsRoot(credentials.uid));
            if (!account)
                return core_.incidents.happened(ListenerIncident::tooManyConnections, credentials.uid);
            peer = identity_.peerOfSocket(socket.get());
            if (peer)
                connection = core_.unusedConnection();
            else
                error = Errno::last();
        } catch (const std::bad_alloc&) {
            error = Errno(ENOMEM); // refused like one for which there is no descriptor
        }
        if (connection) {
            ++core_.accepted;
            return connection->open(std::move(socket), std::move(peer), *account);
        }
        core_.incidents.happened(
            isOwnShortage(error) ? ListenerIncident::outOfDescriptors : ListenerIncident::unknownPeer, error.number());
        if (account)
            core_.charges.closeConnection(*account);
    }

    /// Taking turns with the users, whoever connects over and over.
    ListenerLine line_{false, 1};
    const int socket_;
    PeerIdentity& identity_;
    ListenerCore& core_;
    ListenerAcceptor acceptor_;
};

/// Shows that the pool serves: a question that a worker takes, in the turn of the owners of the root.
class ServiceListener::Probe final : public ListenerTask {
public:
    explicit Probe(ListenerPool& pool) : ListenerTask(&line_), pool_(pool) {}

    bool start() { return question_.valid() && pool_.add(question_.get(), *this, EPOLLIN | EPOLLET); }
    bool answers() {
        if (asked_.exchange(true))
            return false;
        constexpr std::uint64_t one = 1;
        (void)!::write(question_.get(), &one, sizeof one);
        return true;
    }

    void run(ListenerScratch&, std::uint32_t) override {
        std::uint64_t questions = 0;
        (void)!::read(question_.get(), &questions, sizeof questions);
        asked_ = false; // the next question is an event of its own
    }

private:
    ListenerLine line_{true, 1};
    const FileDescriptor question_{::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)};
    ListenerPool& pool_;
    std::atomic<bool> asked_{false};
};

ServiceListener::ServiceListener(PeerIdentity& identity, ListenerOptions options)
    : identity_(identity), options_(std::move(options)) {}

ServiceListener::~ServiceListener() {
    stop();
}

bool ServiceListener::resume(ServiceHandler handler) {
    const Errno error = begin(std::move(handler));
    if (!error)
        return true;
    // Clients would get in and wait for ever.
    stop();
    errno = error.number();
    return false;
}

Errno ServiceListener::begin(ServiceHandler handler) {
    TRY(takeSocket());
    TRY(enableSenderCredentials(socket_.get()));
    core_ = std::make_unique<ListenerCore>(options_.limits, options_.report);
    core_->handler = std::move(handler);
    acceptance_ = std::make_unique<Acceptance>(socket_.get(), identity_, *core_);
    if (!core_->pool.start())
        return Errno(EAGAIN);
    probe_ = std::make_unique<Probe>(core_->pool);
    return core_->pool.add(socket_.get(), *acceptance_, EPOLLIN | EPOLLONESHOT) && probe_->start() ? Errno()
                                                                                                   : Errno::last();
}

bool ServiceListener::answers() {
    return probe_ && probe_->answers();
}

Errno ServiceListener::takeSocket() {
    if (options_.passed.valid()) {
        socket_ = PeerSocket(std::move(options_.passed));
        return adoptListenerSocket(socket_.get(), SOCK_STREAM);
    }
    socket_ = PeerSocket(TRY(makeListenerSocket(options_.address, SOCK_STREAM, 0666)));
    socketIsOurs_ = true;
    return Errno();
}

void ServiceListener::stop() {
    if (std::exchange(socketIsOurs_, false))
        ::unlinkat(options_.address.directory, options_.address.name.c_str(), 0);
    if (core_) {
        core_->pool.stop();
        std::vector<std::shared_ptr<ListenerConnection>> connections;
        {
            const MutexLock lock(core_->mutex);
            connections = core_->connections;
        }
        for (const auto& connection : connections)
            connection->endAfterStop();
    }
    socket_.reset();
}

ListenerCounters ServiceListener::counters() const {
    if (!core_)
        return {};
    const ListenerCharges::Totals totals = core_->charges.totals();
    const ListenerPool::Counters pool = core_->pool.counters();
    const auto count = [this](ListenerIncident incident) { return core_->incidents.count(incident); };
    return {.connections = totals.connections,
            .connectionsAccepted = core_->accepted,
            .connectionsRefused = count(ListenerIncident::tooManyConnections) +
                                  count(ListenerIncident::outOfDescriptors) + count(ListenerIncident::unknownPeer),
            .messages = pool.messages,
            .brokenFrames = count(ListenerIncident::brokenFrame),
            .foreignSenders = count(ListenerIncident::foreignSender),
            .connectionsDropped = count(ListenerIncident::tooMuchInput) + count(ListenerIncident::tooMuchOutput) +
                                  count(ListenerIncident::unwritableReply) + count(ListenerIncident::unservable),
            .inputBytes = totals.inputBytes,
            .outputBytes = totals.outputBytes,
            .threads = pool.threads,
            .threadsBlocked = pool.threadsBlocked,
            .threadsMost = pool.threadsMost};
}

} // namespace zor::platform
