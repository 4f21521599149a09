// SPDX-License-Identifier: Apache-2.0
// The first lookup in a class, which reads all of its containers, against a loop that reads the same files and forgets
// them: from memory, from the disk, and what a record costs the daemon in memory. The containers are written by this
// program.
#include "Benchmarks.h"
#include "ClassTree.h"

#include <memory>

namespace zor::bench {

namespace {

constexpr ContainerClass large = ContainerClass::dataApplication;
constexpr ContainerClass small = ContainerClass::dataKolvexPlugin;
constexpr ContainerClass other = ContainerClass::dataVPNPlugin; // empty: warms up all else

/// The floor may take so long to read the large class from the disk.
constexpr double coldSecondsMax = 75;

struct FirstLookup {
    double seconds = 0;
    double grownKiB = 0;
};

enum class Caches { warm, cold };

/// A daemon that has read nothing yet is asked for one container of the class.
FirstLookup firstLookup(const Settings& settings, const Place& place, ContainerClass containerClass, Caches caches) {
    const Daemon daemon(settings, place.path(), {});
    Client client = daemon.connect();
    (void)client.exchange(containerRequest("com.example.none", other, Create::no));
    const Frame request = containerRequest(ClassTree::identifier(0), containerClass, Create::no);
    if (caches == Caches::cold && !dropCaches(place.path()))
        throw Failure("the caches cannot be dropped");
    const double before = daemon.residentKiB();
    const auto begin = Clock::now();
    const auto reply = client.exchange(request);
    const double seconds = secondsSince(begin);
    mustSucceed(reply, true);
    return {.seconds = seconds, .grownKiB = daemon.residentKiB() - before};
}

struct Warm {
    Pairs seconds;                    // of the large class
    std::vector<double> smallSeconds; // measured next to them
    std::vector<double> grownKiB;
    std::vector<double> growth; // per entry, large by small
};

Warm measureWarm(const Settings& settings, const Place& place, const ClassTree& tree, const ClassTree& smallTree) {
    Warm warm;
    (void)tree.readAll();
    (void)smallTree.readAll();
    for (int round = 0; round < settings.rounds(7, 3); ++round) {
        const FirstLookup lookup = firstLookup(settings, place, large, Caches::warm);
        const FirstLookup smallLookup = firstLookup(settings, place, small, Caches::warm);
        warm.seconds.measured.push_back(lookup.seconds);
        warm.seconds.floor.push_back(tree.readAll());
        warm.smallSeconds.push_back(smallLookup.seconds);
        warm.grownKiB.push_back(lookup.grownKiB);
        warm.growth.push_back(lookup.seconds / tree.count() / (smallLookup.seconds / smallTree.count()));
    }
    return warm;
}

/// On a slow disk the small class has to do: a run is to end within minutes.
Figure coldFigure(const Settings& settings, const Place& place, const ClassTree& largeTree,
                  const ClassTree& smallTree) {
    Figure figure = {.name = "class.cold",
                     .what = text("first lookup in a class of %d, from the disk", largeTree.count()),
                     .measured = "",
                     .floor = "",
                     .unit = "x",
                     .goal = 0.35};
    if (!dropCaches(place.path())) {
        figure.remark = "only root may drop the kernel's caches";
        return figure;
    }
    const double expected = smallTree.readAll() / smallTree.count() * largeTree.count();
    const bool isSlow = expected > coldSecondsMax;
    const ClassTree& tree = isSlow ? smallTree : largeTree;
    Pairs pairs;
    for (int round = 0; round < (isSlow ? 3 : 1); ++round) {
        pairs.measured.push_back(firstLookup(settings, place, isSlow ? small : large, Caches::cold).seconds);
        dropCaches(place.path());
        pairs.floor.push_back(tree.readAll());
    }
    figure.what = text("first lookup in a class of %d, from the disk", tree.count());
    figure.measured = text("%.2f s", pairs.measuredMedian());
    figure.floor = text("%.2f s", pairs.floorMedian());
    figure.value = pairs.ratio();
    figure.numbers = {
        {"seconds", pairs.measuredMedian()}, {"floorSeconds", pairs.floorMedian()}, {"containers", tree.count()}};
    return figure;
}

/// The reply to a list of the whole class, against a look at each metadata file and making the same reply out of
/// identifiers and UUIDs that are at hand.
Figure listFigure(const Settings& settings, const Place& place, const ClassTree& tree) {
    const int count = tree.count();
    const Daemon daemon(settings, place.path(), {});
    Client client = daemon.connect();
    const Frame request =
        requestFrame({{std::string(ipc::keys::command), static_cast<std::uint64_t>(ipc::Command::listContainers)},
                      {std::string(ipc::keys::containerClass), static_cast<std::uint64_t>(large)},
                      {std::string(ipc::keys::userId), std::uint64_t{userId}}});
    const plist::Dictionary listed = succeed(client, request);
    const plist::Array* const identifiers = listed.array(ipc::keys::replyIdsArray);
    const plist::Array* const uuids = listed.array(ipc::keys::replyUUIDsArray);
    if (!identifiers || !uuids || identifiers->size() != static_cast<std::size_t>(count))
        throw Failure("a list is not of the whole class");
    Pairs pairs;
    for (int round = -1; round < settings.rounds(9, 5); ++round) {
        const auto begin = Clock::now();
        client.send(request);
        const std::size_t bytes = client.receive().size();
        const double seconds = secondsSince(begin);
        const double looks = tree.lookAtAll();
        const auto beginFloor = Clock::now();
        plist::Array ids;
        plist::Array numbers;
        ids.reserve(identifiers->size());
        numbers.reserve(uuids->size());
        for (std::size_t i = 0; i < identifiers->size(); ++i) {
            ids.emplace_back(*(*identifiers)[i].asString());
            numbers.push_back((*uuids)[i]);
        }
        const Frame reply = requestFrame({{std::string(ipc::keys::replyError), std::uint64_t{0}},
                                          {std::string(ipc::keys::replyIdsArray), std::move(ids)},
                                          {std::string(ipc::keys::replyUUIDsArray), std::move(numbers)}});
        if (reply.size() != bytes)
            throw Failure("the floor of a list is another reply");
        if (round < 0)
            continue;
        pairs.measured.push_back(seconds);
        pairs.floor.push_back(looks + secondsSince(beginFloor));
    }
    return {.name = "class.list",
            .what = text("list of %d containers", count),
            .measured = text("%.0f ms", pairs.measuredMedian() * 1e3),
            .floor = text("%.0f ms", pairs.floorMedian() * 1e3),
            .value = pairs.ratio(),
            .unit = "x",
            .goal = 1.3,
            .remark = "the floor looks at each metadata file and makes the same reply from what is at hand",
            .numbers = {{"seconds", pairs.measuredMedian()}, {"floorSeconds", pairs.floorMedian()}}};
}

} // namespace

std::vector<Figure> measureClass(const Settings& settings) {
    const int count = settings.rounds(100'000, 20'000);
    const Place place(*settings.scratch, "class", {.bytes = std::uint64_t{3} << 30, .inodes = 300'000});
    prepareRoot(settings, place.path());
    const ClassTree tree(makeClassDirectory(place.path(), large), large, count);
    const ClassTree smallTree(makeClassDirectory(place.path(), small), small, count / 10);
    firstLookup(settings, place, small, Caches::warm); // its launch is the first after the boot and looks at everything
    const Warm warm = measureWarm(settings, place, tree, smallTree);
    const double measured = warm.seconds.measuredMedian();
    const double perRecord = median(warm.grownKiB) * 1024 / count;
    return {
        {.name = "class.warm",
         .what = text("first lookup in a class of %d, warm", count),
         .measured = text("%.0f ms", measured * 1e3),
         .floor = text("%.0f ms", warm.seconds.floorMedian() * 1e3),
         .value = warm.seconds.ratio(),
         .unit = "x",
         .goal = 2.0,
         .remark = text("%.2f us for each container, of the floor %.2f; on ", measured * 1e6 / count,
                        warm.seconds.floorMedian() * 1e6 / count) +
                   place.description(),
         .numbers = {{"seconds", measured}, {"floorSeconds", warm.seconds.floorMedian()}}},
        {.name = "class.linear",
         .what = text("each container, of %d by of %d", count, smallTree.count()),
         .measured = text("%.2f us", measured * 1e6 / count),
         .floor = text("%.2f us", median(warm.smallSeconds) * 1e6 / smallTree.count()),
         .value = median(warm.growth),
         .unit = "x",
         .goal = 1.2,
         .numbers = {{"secondsOfSmall", median(warm.smallSeconds)}}},
        coldFigure(settings, place, tree, smallTree),
        listFigure(settings, place, tree),
        {.name = "class.memory",
         .what = text("memory of each of %d records", count),
         .measured = text("%.1f MiB", median(warm.grownKiB) / 1024),
         .floor = text("%zu bytes", ClassTree::recordDataBytes),
         .value = perRecord,
         .unit = "bytes",
         .goal = 240,
         .remark = "growth of the resident memory by the first lookup; the floor is what is known of each container",
         .numbers = {{"bytes", perRecord}}}};
}

} // namespace zor::bench
