// SPDX-License-Identifier: Apache-2.0
// Making a container against the bare system calls that make the same tree, on one fresh file system: without syncs,
// with them, and by several clients at once.
#include "Benchmarks.h"
#include "TreeFloor.h"

#include <algorithm>
#include <mutex>
#include <thread>

namespace zor::bench {

namespace {

constexpr Place::Size placeSize{.bytes = std::uint64_t{2} << 30, .inodes = 131072};
constexpr int clientsAtOnce = 8;
constexpr int syncsMax = 3;

/// Makes containers with names that were not there before, and times each.
class Creator {
public:
    Creator(const Daemon& daemon, std::string prefix) : client_(daemon.connect()), prefix_(std::move(prefix)) {}

    double create() {
        const Frame request =
            containerRequest(prefix_ + std::to_string(next_++), ContainerClass::dataApplication, Create::yes);
        const auto begin = Clock::now();
        const auto reply = client_.exchange(request);
        const double microseconds = secondsSince(begin) * 1e6;
        mustSucceed(reply, false);
        return microseconds;
    }

private:
    Client client_;
    const std::string prefix_;
    int next_ = 0;
};

Pairs compare(Creator& creator, TreeFloor& floor, int blocks, int perBlock) {
    Pairs pairs;
    for (int block = -1; block < blocks; ++block) {
        std::vector<double> measured;
        std::vector<double> floors;
        for (int i = 0; i < perBlock; ++i)
            measured.push_back(creator.create());
        for (int i = 0; i < perBlock; ++i)
            floors.push_back(floor.create());
        if (block < 0)
            continue;
        pairs.measured.push_back(median(measured));
        pairs.floor.push_back(median(floors));
    }
    return pairs;
}

Figure ofPairs(const Pairs& pairs, const char* name, const char* what, double goal) {
    return {.name = name,
            .what = what,
            .measured = text("%.0f us", pairs.measuredMedian()),
            .floor = text("%.0f us", pairs.floorMedian()),
            .value = pairs.ratio(),
            .unit = "x",
            .goal = goal,
            .numbers = {{"p50us", pairs.measuredMedian()}, {"floorP50us", pairs.floorMedian()}}};
}

/// Containers per second made by so many clients at once.
double rate(const Daemon& daemon, int clients, double seconds, int round) {
    std::atomic<long> made{0};
    std::exception_ptr failure;
    std::mutex failureMutex;
    std::vector<std::unique_ptr<Creator>> creators;
    for (int i = 0; i < clients; ++i)
        creators.push_back(std::make_unique<Creator>(daemon, text("com.example.rate.%d.%d.%d.", clients, round, i)));
    std::vector<std::thread> threads;
    const auto begin = Clock::now();
    for (const auto& creator : creators)
        threads.emplace_back([&, one = creator.get()] {
            try {
                while (secondsSince(begin) < seconds) {
                    one->create();
                    ++made;
                }
            } catch (...) {
                const std::lock_guard lock(failureMutex);
                failure = std::current_exception();
            }
        });
    for (std::thread& thread : threads)
        thread.join();
    const double took = secondsSince(begin);
    if (failure)
        std::rethrow_exception(failure);
    return static_cast<double>(made) / took;
}

Figure measureWithoutSyncs(const Settings& settings) {
    const Place place(*settings.scratch, "create", placeSize);
    prepareRoot(settings, place.path());
    const int processor = measuringProcessor();
    const Daemon daemon(settings, place.path(), {.syncs = Daemon::Syncs::off, .processor = processor});
    const Pinned pinned(processor);
    Creator creator(daemon, "com.example.create.");
    TreeFloor floor(place.path(), TreeFloor::Syncs::off);
    const Pairs pairs = compare(creator, floor, settings.rounds(25, 9), settings.rounds(50, 30));
    Figure figure = ofPairs(pairs, "create.noSyncs", "create, no syncs, p50", 1.4);
    figure.remark = "on " + place.description() + "; one processor";
    return figure;
}

Figure measureClientsAtOnce(const Settings& settings, const Daemon& daemon) {
    Pairs pairs;
    for (int round = 0; round < settings.rounds(5, 3); ++round) {
        const double seconds = settings.quick ? 0.5 : 1.0;
        pairs.floor.push_back(rate(daemon, 1, seconds, round));
        pairs.measured.push_back(rate(daemon, clientsAtOnce, seconds, round));
    }
    return {.name = "create.clients",
            .what = text("create, durable, %d clients by one", clientsAtOnce),
            .measured = text("%.0f /s", pairs.measuredMedian()),
            .floor = text("%.0f /s", pairs.floorMedian()),
            .value = pairs.ratio(),
            .unit = "x",
            .sense = Sense::atLeast,
            .goal = 2.0,
            .numbers = {{"perSecond", pairs.measuredMedian()}, {"onePerSecond", pairs.floorMedian()}}};
}

Figure countSyncs(const Settings& settings) {
    constexpr int containers = 20;
    Figure figure = {.name = "create.syncs",
                     .what = "create, durable, syncs for each container",
                     .measured = "",
                     .floor = "",
                     .unit = "",
                     .goal = syncsMax};
    const Place place(*settings.scratch, "syncs", {.bytes = std::uint64_t{256} << 20, .inodes = 16384});
    prepareRoot(settings, place.path());
    SyncCounter counter;
    const Daemon daemon(settings, place.path(), {.syncs = Daemon::Syncs::on, .syncCounter = &counter});
    if (!counter.works()) {
        figure.remark = "this kernel does not tell of another process's calls";
        return figure;
    }
    Creator creator(daemon, "com.example.syncs.");
    creator.create(); // the first one also looks at the class directory
    const long before = counter.count();
    for (int i = 0; i < containers; ++i)
        creator.create();
    figure.value = static_cast<double>(counter.count() - before) / containers;
    figure.measured = text("%.2f", *figure.value);
    figure.remark = "calls of fsync, fdatasync, syncfs, sync_file_range, sync and msync on " + place.description();
    return figure;
}

} // namespace

std::vector<Figure> measureCreate(const Settings& settings) {
    std::vector<Figure> figures = {measureWithoutSyncs(settings)};
    const Place place(*settings.scratch, "durable", placeSize);
    prepareRoot(settings, place.path());
    const Daemon daemon(settings, place.path(), {.syncs = Daemon::Syncs::on});
    {
        Creator creator(daemon, "com.example.durable.");
        TreeFloor floor(place.path(), TreeFloor::Syncs::on);
        const Pairs pairs = compare(creator, floor, settings.rounds(15, 7), settings.rounds(20, 10));
        figures.push_back(ofPairs(pairs, "create.durable", "create, durable, p50", 1.25));
        figures.back().remark = "floor with 3 fsyncs; on " + place.description();
    }
    figures.push_back(countSyncs(settings));
    figures.push_back(measureClientsAtOnce(settings, daemon));
    return figures;
}

} // namespace zor::bench
