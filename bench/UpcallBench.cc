// SPDX-License-Identifier: Apache-2.0
// The round trip of one upcall for a process whose containers are there, against an echo of the same packets that looks
// whether the containers exist; and what a thousand upcalls a second do to a client's lookups beside them.
#include "Benchmarks.h"
#include "RoundTripPairs.h"
#include "ipc/Protocol.h"
#include "os/SystemRoot.h"
#include "platform/Service.h"
#include "plist/Codec.h"
#include "upcall/packbuff/Packbuff.h"
#include "upcall/packbuff/UpcallMessage.h"

#include <algorithm>
#include <atomic>
#include <cstring>
#include <fcntl.h>
#include <fstream>
#include <sys/epoll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <thread>
#include <unistd.h>

namespace zor::bench {

using platform::FileDescriptor;

namespace {

constexpr const char* echoName = "upcall-echo";
constexpr std::size_t packetBytesMax = 65'536;
constexpr int answerSecondsMax = 10;

/// Before the entry that every root of a run has: the first that matches counts.
void registerAsAgent(const Settings& settings, const std::string& root) {
    const plist::Dictionary entry{
        {"Executable", settings.ownProgram},
        {"Entitlements", plist::Dictionary{{std::string(platform::entitlementKeys::allowed), true}}},
        {"Identifier", "com.veltra.zorvane-bench"},
        {"KernelAgent", true}};
    const auto bytes = plist::writeBinary(entry);
    std::ofstream file(root + "/" + platform::names::identityDirectory + "/agent" + platform::names::identityFileSuffix,
                       std::ios::binary);
    if (bytes)
        file.write(reinterpret_cast<const char*>(bytes->data()), static_cast<std::streamsize>(bytes->size()));
    file.close();
    if (!bytes || !file)
        throw Failure("no registry entry for the agent");
}

sockaddr_un addressIn(int directory, std::string_view name) {
    const std::string path = "/proc/self/fd/" + std::to_string(directory) + "/" + std::string(name);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::memcpy(address.sun_path, path.c_str(), std::min(path.size() + 1, sizeof address.sun_path));
    return address;
}

FileDescriptor openDirectory(const std::string& path) {
    return FileDescriptor(::open(path.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
}

/// One connection, one packet at a time.
class Agent {
public:
    Agent(const std::string& directory, std::string_view name)
        : socket_(::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0)), buffer_(packetBytesMax) {
        const FileDescriptor opened = openDirectory(directory);
        const sockaddr_un address = addressIn(opened.get(), name);
        const timeval patience{.tv_sec = answerSecondsMax, .tv_usec = 0};
        if (::connect(socket_.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0 ||
            ::setsockopt(socket_.get(), SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof patience) != 0)
            failWithErrno("connect to " + std::string(name));
    }

    std::span<const std::uint8_t> exchange(const Frame& packet) {
        if (::send(socket_.get(), packet.data(), packet.size(), MSG_NOSIGNAL) != static_cast<ssize_t>(packet.size()))
            failWithErrno("send of a packet");
        const ssize_t received = ::recv(socket_.get(), buffer_.data(), buffer_.size(), 0);
        if (received <= 0)
            failWithErrno("no answer to a packet");
        return std::span(buffer_).first(static_cast<std::size_t>(received));
    }

private:
    FileDescriptor socket_;
    Frame buffer_;
};

/// The work of every server of such packets: it waits, receives one with its sender's credentials, looks whether each
/// of the paths is there, sends the reply.
class PacketEcho {
public:
    PacketEcho(const std::string& directory, Frame reply, std::vector<std::string> paths, int processor)
        : listening_(::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0)) {
        const FileDescriptor opened = openDirectory(directory);
        const sockaddr_un address = addressIn(opened.get(), echoName);
        const int on = 1;
        if (::bind(listening_.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0 ||
            ::listen(listening_.get(), 1) != 0 ||
            ::setsockopt(listening_.get(), SOL_SOCKET, SO_PASSCRED, &on, sizeof on) != 0)
            failWithErrno("packet echo");
        process_ =
            std::make_unique<ChildProcess>([this, reply = std::move(reply), paths = std::move(paths), processor] {
                pinThisThread(processor);
                serve(reply, paths);
            });
    }

private:
    void serve(const Frame& reply, const std::vector<std::string>& paths) const {
        const int socket = ::accept4(listening_.get(), nullptr, nullptr, SOCK_CLOEXEC);
        const int epoll = ::epoll_create1(EPOLL_CLOEXEC);
        epoll_event event = {.events = EPOLLIN, .data = {.fd = socket}};
        ::epoll_ctl(epoll, EPOLL_CTL_ADD, socket, &event);
        Frame buffer(packetBytesMax);
        for (;;) {
            if (::epoll_wait(epoll, &event, 1, -1) != 1)
                continue;
            alignas(cmsghdr) char control[CMSG_SPACE(sizeof(ucred))];
            iovec part{.iov_base = buffer.data(), .iov_len = buffer.size()};
            msghdr message{};
            message.msg_iov = &part;
            message.msg_iovlen = 1;
            message.msg_control = control;
            message.msg_controllen = sizeof control;
            if (::recvmsg(socket, &message, MSG_DONTWAIT) <= 0)
                return;
            struct stat status{};
            for (const std::string& path : paths)
                if (::lstat(path.c_str(), &status) != 0)
                    return;
            if (::send(socket, reply.data(), reply.size(), MSG_DONTWAIT | MSG_NOSIGNAL) < 0)
                return;
        }
    }

    FileDescriptor listening_;
    std::unique_ptr<ChildProcess> process_;
};

/// A process with one data and two group containers.
Frame processRequest() {
    const PackbuffPointer packbuff(sb_packbuff_new(256));
    const auto add = [&](std::uint16_t valueType, std::string_view text) {
        (void)sb_packbuff_pack_string(packbuff.get(), valueType, text.data(), static_cast<std::uint32_t>(text.size()));
    };
    add(upcall::CM_KERN_REQUEST_CODE_SIGNATURE_ID, "com.example.application.process");
    (void)sb_packbuff_pack_uint32(packbuff.get(), upcall::CM_KERN_REQUEST_PERSONA_ID, userId);
    add(upcall::CM_KERN_REQUEST_APP_GROUP_ID, "group.com.example.one");
    add(upcall::CM_KERN_REQUEST_APP_GROUP_ID, "group.com.example.two");
    return upcall::encodeRequest({sb_packbuff_get_bytes(packbuff.get()), sb_packbuff_get_size(packbuff.get())});
}

/// The containers that a reply names; a failure unless it says that these are all.
std::vector<std::string> containersIn(std::span<const std::uint8_t> packet, std::size_t expected) {
    const auto reply = upcall::decodeReply(packet);
    Frame buffer;
    if (reply)
        buffer.assign(reply->buffer.begin(), reply->buffer.end());
    const PackbuffPointer reader(sb_packbuff_init_with_buffer(buffer.data(), buffer.size(), true, packbuffDeallocNone));
    std::vector<std::string> paths;
    std::uint16_t valueType = 0;
    while (reader && sb_packbuff_get_item_value_type(reader.get(), &valueType) != 0 &&
           valueType != upcall::CM_KERN_REPLY_STATUS) {
        const char* const text = sb_packbuff_unpack_string(reader.get(), nullptr, nullptr);
        if (text && (valueType == upcall::CM_KERN_REPLY_DATA_CONTAINER_PATH ||
                     valueType == upcall::CM_KERN_REPLY_APP_GROUP_PATH))
            paths.emplace_back(text);
    }
    if (!reader || sb_packbuff_unpack_uint32(reader.get(), nullptr) != 1 || paths.size() != expected)
        throw Failure("an upcall is not answered as it should be");
    return paths;
}

template <typename Exchange>
std::vector<double> roundTrips(Exchange exchange, const Frame& reply, int count) {
    std::vector<double> microseconds;
    microseconds.reserve(static_cast<std::size_t>(count));
    for (int i = 0; i < count; ++i) {
        const auto begin = Clock::now();
        const std::span<const std::uint8_t> received = exchange();
        microseconds.push_back(secondsSince(begin) * 1e6);
        if (!std::ranges::equal(received, reply))
            throw Failure("two replies to one request differ");
    }
    return microseconds;
}

Figure measureRoundTrip(const Settings& settings) {
    const int blocks = settings.rounds(31, 11);
    const int requests = settings.rounds(4000, 1000);
    const Place place(*settings.scratch, "upcall", {.bytes = std::uint64_t{256} << 20, .inodes = 16384});
    prepareRoot(settings, place.path());
    registerAsAgent(settings, place.path());
    const int processor = measuringProcessor();
    const Daemon daemon(settings, place.path(), {.processor = processor});
    Agent agent(daemon.socketDirectory(), ipc::upcallServiceName);
    const Frame request = processRequest();
    const auto first = agent.exchange(request);
    const std::vector<std::string> paths = containersIn(first, 3);
    const Frame reply(first.begin(), first.end());
    const PacketEcho echo(place.path(), reply, paths, processor);
    Agent floorAgent(place.path(), echoName);
    const Pinned pinned(processor);
    return roundTripsInTurns(
               blocks, [&] { return roundTrips([&] { return agent.exchange(request); }, reply, requests); },
               [&] { return roundTrips([&] { return floorAgent.exchange(request); }, reply, requests); })
        .figure("upcall.p50", "upcall round trip, one data and two group containers, p50", 2.5, request, reply);
}

/// Upcalls at a steady rate on a thread of its own, while it is told to.
class Stream {
public:
    Stream(const std::string& directory, const Frame& request, double perSecond)
        : agent_(directory, ipc::upcallServiceName), request_(request),
          interval_(std::chrono::duration_cast<Clock::duration>(std::chrono::duration<double>(1 / perSecond))),
          thread_([this] { run(); }) {}
    ~Stream() {
        ends_ = true;
        thread_.join();
    }
    Stream(const Stream&) = delete;
    Stream& operator=(const Stream&) = delete;

    void set(bool flows) { flows_ = flows; }
    [[nodiscard]] long answered() const { return answered_; }
    [[nodiscard]] bool failed() const { return failed_; }

private:
    void run() {
        auto next = Clock::now();
        while (!ends_) {
            std::this_thread::sleep_until(next);
            next = std::max(next + interval_, Clock::now() - 10 * interval_);
            if (!flows_)
                continue;
            try {
                (void)agent_.exchange(request_);
                ++answered_;
            } catch (const Failure&) {
                failed_ = true;
                return;
            }
        }
    }

    Agent agent_;
    const Frame& request_;
    const Clock::duration interval_;
    std::atomic<bool> flows_{false};
    std::atomic<bool> ends_{false};
    std::atomic<bool> failed_{false};
    std::atomic<long> answered_{0};
    std::thread thread_;
};

Figure measureLookupsBeside(const Settings& settings) {
    constexpr double wantedPerSecond = 1000;
    const int blocks = settings.rounds(41, 11);
    const double seconds = 0.2;
    const Place place(*settings.scratch, "upcalls", {.bytes = std::uint64_t{256} << 20, .inodes = 16384});
    prepareRoot(settings, place.path());
    registerAsAgent(settings, place.path());
    const Daemon daemon(settings, place.path(), {});
    Client client = daemon.connect();
    const std::string identifier = "com.example.application.lookup";
    mustSucceed(client.exchange(containerRequest(identifier, ContainerClass::dataApplication, Create::yes)), false);
    const Frame lookup = containerRequest(identifier, ContainerClass::dataApplication, Create::no);
    const auto first = client.exchange(lookup);
    mustSucceed(first, true);
    const Frame reply(first.begin(), first.end());
    const Frame request = processRequest();
    Stream stream(daemon.socketDirectory(), request, wantedPerSecond);
    const auto block = [&](bool flows, std::vector<double>& p50s, std::vector<double>& p99s) {
        stream.set(flows);
        const auto begin = Clock::now();
        std::vector<double> times;
        while (secondsSince(begin) < seconds) {
            const auto some = roundTrips([&] { return client.exchange(lookup); }, reply, 20);
            times.insert(times.end(), some.begin(), some.end());
        }
        p50s.push_back(percentile(times, 0.5));
        p99s.push_back(percentile(times, 0.99));
    };
    Pairs p99;
    Pairs p50;
    long answered = 0;
    double flowed = 0;
    for (int i = -1; i < blocks; ++i) {
        if (i == 0) { // what came before made the containers
            p50 = {};
            p99 = {};
        }
        const long before = stream.answered();
        const auto begin = Clock::now();
        block(true, p50.measured, p99.measured);
        flowed += i < 0 ? 0 : secondsSince(begin);
        answered += i < 0 ? 0 : stream.answered() - before;
        block(false, p50.floor, p99.floor);
    }
    if (stream.failed())
        throw Failure("an upcall was not answered");
    const double perSecond = static_cast<double>(answered) / flowed;
    return {.name = "upcall.beside",
            .what = "lookup beside 1,000 upcalls a second, p50",
            .measured = text("%.2f us", p50.measuredMedian()),
            .floor = text("%.2f us", p50.floorMedian()),
            .value = p50.ratio(),
            .unit = "x",
            .goal = 1.5,
            .remark = text("p99 %.2f us, without them %.2f us; %.0f upcalls a second were answered",
                           p99.measuredMedian(), p99.floorMedian(), perSecond),
            .numbers = {{"p50us", p50.measuredMedian()},
                        {"p99us", p99.measuredMedian()},
                        {"aloneP50us", p50.floorMedian()},
                        {"aloneP99us", p99.floorMedian()},
                        {"upcallsPerSecond", perSecond}}};
}

} // namespace

std::vector<Figure> measureUpcall(const Settings& settings) {
    std::vector<Figure> figures;
    figures.push_back(measureRoundTrip(settings));
    figures.push_back(measureLookupsBeside(settings));
    return figures;
}

} // namespace zor::bench
