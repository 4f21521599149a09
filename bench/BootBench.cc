// SPDX-License-Identifier: Apache-2.0
// The first launch after a boot with many containers, until it serves clients, against one pass that asks of each
// container's metadata file whether it is there. Everything is in memory.
#include "Benchmarks.h"
#include "ClassTree.h"

#include <algorithm>
#include <map>

namespace zor::bench {

namespace {

constexpr ContainerClass containerClass = ContainerClass::dataApplication;
/// Passes that take less of a container's time are not worth a line.
constexpr double microsecondsEachShown = 0.01;

/// A root with so many containers.
struct Device {
    Device(const Settings& settings, const std::string& name, int count)
        : place(*settings.scratch, name,
                {.bytes = std::uint64_t{256 + 12 * static_cast<unsigned>(count) / 1000} << 20,
                 .inodes = 16384 + 2 * static_cast<unsigned>(count)}) {
        prepareRoot(settings, place.path());
        tree = std::make_unique<ClassTree>(makeClassDirectory(place.path(), containerClass), containerClass, count);
    }

    const Place place;
    std::unique_ptr<ClassTree> tree;
};

/// Boots of one device.
struct Boots {
    Pairs seconds;                                     // to the service, and of the floor
    std::map<std::string, std::vector<double>> passes; // microseconds

    void run(const Settings& settings, const Device& device) {
        const Daemon daemon(settings, device.place.path(), {.forgetBoot = true});
        seconds.measured.push_back(daemon.readySeconds());
        seconds.floor.push_back(device.tree->lookAtAll());
        const plist::Dictionary counters = daemon.counters();
        const plist::Array* setup = counters.array("LastSetup");
        if (!setup || setup->size() < 2)
            throw Failure("the status does not tell what the setup did");
        for (const plist::Value& pass : *setup) {
            const plist::Dictionary& told = *pass.asDictionary();
            passes[*told.string("Pass")].push_back(static_cast<double>(*told.unsignedInteger("Microseconds")));
        }
    }
};

std::string passesOf(const Boots& boots, int count, Figure& figure) {
    std::string shown;
    for (const auto& [name, microseconds] : boots.passes) {
        const double each = median(microseconds) / count;
        figure.numbers["microsecondsEach: " + name] = each;
        if (each >= microsecondsEachShown)
            shown += text("; %s %.2f us", name.c_str(), each);
    }
    return shown;
}

} // namespace

std::vector<Figure> measureBoot(const Settings& settings) {
    const int count = settings.rounds(100'000, 20'000);
    const Device large(settings, "boot", count);
    const Device small(settings, "boot-small", count / 10);
    double veryFirst = 0;
    writeOut(large.place.path());
    writeOut(small.place.path());
    for (const Device* device : {&small, &large}) // what the very first launch does, no later one does again
        veryFirst = Daemon(settings, device->place.path(), {}).readySeconds();
    Boots boots;
    Boots smallBoots;
    std::vector<double> growth;
    for (int round = 0; round < 5; ++round) {
        boots.run(settings, large);
        smallBoots.run(settings, small);
        growth.push_back(boots.seconds.measured.back() / count /
                         (smallBoots.seconds.measured.back() / small.tree->count()));
    }
    const double measured = boots.seconds.measuredMedian();
    const double smallMeasured = smallBoots.seconds.measuredMedian();
    Figure first{.name = "boot.first",
                 .what = text("first launch of a boot, %d containers, warm", count),
                 .measured = text("%.0f ms", measured * 1e3),
                 .floor = text("%.0f ms", boots.seconds.floorMedian() * 1e3),
                 .value = boots.seconds.ratio(),
                 .unit = "x",
                 .goal = 1.5,
                 .numbers = {{"seconds", measured},
                             {"floorSeconds", boots.seconds.floorMedian()},
                             {"veryFirstSeconds", veryFirst}}};
    first.remark = text("the very first launch, which reads all metadata once, %.0f ms; passes for each container",
                        veryFirst * 1e3) +
                   passesOf(boots, count, first);
    return {first,
            {.name = "boot.linear",
             .what = text("each container, of %d by of %d", count, small.tree->count()),
             .measured = text("%.2f us", measured * 1e6 / count),
             .floor = text("%.2f us", smallMeasured * 1e6 / small.tree->count()),
             .value = median(growth),
             .unit = "x",
             .goal = 1.2,
             .numbers = {{"secondsOfSmall", smallMeasured}}}};
}

} // namespace zor::bench
