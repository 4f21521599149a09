// SPDX-License-Identifier: Apache-2.0
// Lookups per second over many connections, each with one request under way, against the echo with a thread for each
// processor; and whether each connection gets its share.
#include "Benchmarks.h"
#include "Echo.h"

#include <algorithm>
#include <numeric>
#include <sys/epoll.h>
#include <thread>

namespace zor::bench {

namespace {

constexpr int fewConnections = 16;

/// Connections to one server, driven by as many threads as there are processors.
class Crowd {
public:
    Crowd(std::vector<Client> clients, const Frame& request, const Frame& reply)
        : clients_(std::move(clients)), counts_(clients_.size()), request_(request), reply_(reply) {}

    /// Answers per second in all; what each connection got is in shares() then.
    double run(double seconds, unsigned threadCount) {
        std::ranges::fill(counts_, 0);
        const auto begin = Clock::now();
        const auto end = begin + std::chrono::duration_cast<Clock::duration>(std::chrono::duration<double>(seconds));
        std::vector<std::thread> threads;
        std::exception_ptr failure;
        for (unsigned i = 0; i < threadCount; ++i)
            threads.emplace_back([this, i, threadCount, end, &failure] {
                try {
                    drive(i, threadCount, end);
                } catch (...) {
                    failure = std::current_exception();
                }
            });
        for (std::thread& thread : threads)
            thread.join();
        if (failure)
            std::rethrow_exception(failure);
        return static_cast<double>(std::accumulate(counts_.begin(), counts_.end(), 0L)) / seconds;
    }

    /// The smallest count of answers by the mean one.
    [[nodiscard]] double slowestByMean() const {
        const double mean = static_cast<double>(std::accumulate(counts_.begin(), counts_.end(), 0L)) /
                            static_cast<double>(counts_.size());
        return static_cast<double>(std::ranges::min(counts_)) / mean;
    }

private:
    void drive(unsigned first, unsigned step, Clock::time_point end) {
        const platform::FileDescriptor epoll(::epoll_create1(EPOLL_CLOEXEC));
        std::size_t underWay = 0;
        for (std::size_t i = first; i < clients_.size(); i += step) {
            epoll_event event = {.events = EPOLLIN, .data = {.u64 = i}};
            ::epoll_ctl(epoll.get(), EPOLL_CTL_ADD, clients_[i].descriptor(), &event);
            clients_[i].send(request_);
            ++underWay;
        }
        epoll_event events[64];
        while (underWay > 0) {
            const int count = ::epoll_wait(epoll.get(), events, std::size(events), 10'000);
            if (count == 0)
                throw Failure("a connection got no answer for ten seconds");
            const bool over = Clock::now() >= end;
            for (int i = 0; i < count; ++i) {
                Client& client = clients_[events[i].data.u64];
                if (!std::ranges::equal(client.receive(), reply_))
                    throw Failure("two replies to one request differ");
                if (over) {
                    --underWay;
                    continue;
                }
                ++counts_[events[i].data.u64];
                client.send(request_);
            }
        }
    }

    std::vector<Client> clients_;
    std::vector<long> counts_;
    const Frame& request_;
    const Frame& reply_;
};

template <typename Server>
std::vector<Client> connections(const Server& server, int count) {
    std::vector<Client> clients;
    for (int i = 0; i < count; ++i)
        clients.push_back(server.connect());
    return clients;
}

/// Blocks of one server: its rates, and the processor time that each answer took it.
struct Blocks {
    std::vector<double> perSecond{};
    std::vector<double> shares{};
    std::vector<double> microsecondsEach{};

    template <typename Server>
    void add(Crowd& crowd, const Server& server, double seconds, unsigned threads) {
        const double before = server.processorSeconds();
        perSecond.push_back(crowd.run(seconds, threads));
        microsecondsEach.push_back((server.processorSeconds() - before) / (perSecond.back() * seconds) * 1e6);
        shares.push_back(crowd.slowestByMean());
    }
};

std::vector<Figure> figuresOf(int count, const Blocks& measured, const Blocks& floor) {
    const Pairs pairs{.measured = measured.perSecond, .floor = floor.perSecond};
    const double each = median(measured.microsecondsEach);
    const double floorEach = median(floor.microsecondsEach);
    const double share = median(measured.shares);
    const double worst = std::ranges::min(measured.shares);
    std::vector<Figure> figures = {
        {.name = text("throughput.%d", count),
         .what = text("lookups per second, %d connections", count),
         .measured = text("%.0f /s", pairs.measuredMedian()),
         .floor = text("%.0f /s", pairs.floorMedian()),
         .value = pairs.ratio(),
         .unit = "x",
         .sense = Sense::atLeast,
         .goal = 0.55,
         .remark = text("processor time of each %.1f us, of the floor %.1f us", each, floorEach),
         .numbers = {{"perSecond", pairs.measuredMedian()},
                     {"floorPerSecond", pairs.floorMedian()},
                     {"processorMicroseconds", each},
                     {"floorProcessorMicroseconds", floorEach}}},
        {.name = text("throughput.%d.slowest", count),
         .what = text("slowest of %d connections, by the mean one", count),
         .measured = text("%.2f", share),
         .floor = "",
         .value = share,
         .unit = "x",
         .sense = Sense::atLeast,
         .goal = 0.5,
         .remark = text("median of %zu blocks; in the worst one %.2f", measured.shares.size(), worst),
         .numbers = {{"worstBlock", worst}}}};
    if (count == fewConnections)
        figures.push_back({.name = "throughput.processor",
                           .what = text("processor time of a lookup, %d connections", count),
                           .measured = text("%.1f us", each),
                           .floor = text("%.1f us", floorEach),
                           .value = each,
                           .unit = "us",
                           .goal = 6});
    return figures;
}

} // namespace

std::vector<Figure> measureThroughput(const Settings& settings) {
    const int blocks = settings.rounds(41, 11);
    const double seconds = 0.1;
    const unsigned threads = std::max(1U, std::thread::hardware_concurrency());
    const Place place(*settings.scratch, "throughput", {.bytes = std::uint64_t{256} << 20, .inodes = 16384});
    prepareRoot(settings, place.path());
    const Daemon daemon(settings, place.path(), {});
    Client client = daemon.connect();
    const std::string identifier = "com.example.application.lookup";
    mustSucceed(client.exchange(containerRequest(identifier, ContainerClass::dataApplication, Create::yes)), false);
    const Frame request = containerRequest(identifier, ContainerClass::dataApplication, Create::no);
    const auto first = client.exchange(request);
    mustSucceed(first, true);
    const Frame reply(first.begin(), first.end());
    const Echo echo(place.path(), request.size(), reply, {.threads = threads});

    std::vector<Figure> figures;
    for (const int count : {fewConnections, 64}) {
        Crowd crowd(connections(daemon, count), request, reply);
        Crowd floorCrowd(connections(echo, count), request, reply);
        Blocks measured;
        Blocks floor;
        (void)crowd.run(seconds, threads);
        (void)floorCrowd.run(seconds, threads);
        for (int block = 0; block < blocks; ++block) {
            measured.add(crowd, daemon, seconds, threads);
            floor.add(floorCrowd, echo, seconds, threads);
        }
        for (Figure& figure : figuresOf(count, measured, floor))
            figures.push_back(std::move(figure));
    }
    return figures;
}

} // namespace zor::bench
