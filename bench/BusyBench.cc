// SPDX-License-Identifier: Apache-2.0
// How long lookups take while death row removes a container with very many files and another client has a large
// container measured again and again, against lookups alone in the same daemon, before and after.
#include "Benchmarks.h"
#include "ContentTree.h"
#include "Writers.h"

#include <algorithm>
#include <atomic>

namespace zor::bench {

namespace {

constexpr ContainerClass containerClass = ContainerClass::dataApplication;
/// Lookups leave a removal, which has a lower priority, little of two processors: it is not waited for.
constexpr double secondsMax = 15;

} // namespace

std::vector<Figure> measureBusy(const Settings& settings) {
    const int removed = settings.rounds(300'000, 50'000);
    const int measured = settings.rounds(50'000, 10'000);
    const int alone = settings.rounds(50'000, 20'000);
    const Place place(*settings.scratch, "busy",
                      {.bytes = std::uint64_t{4} << 30, .inodes = 16384 + 12 * static_cast<unsigned>(removed) / 10});
    prepareRoot(settings, place.path());
    const Daemon daemon(settings, place.path(), {.syncs = Daemon::Syncs::on});
    const auto make = [&](const std::string& identifier) {
        Client client = daemon.connect();
        return makeContainer(client, identifier, containerClass);
    };
    const Container going = make("com.example.going");
    const Container large = make("com.example.large");
    const ContentTree goingTree(going.path + "/Documents/content", {.files = removed});
    const ContentTree largeTree(large.path + "/Documents/content", {.files = measured});
    writeOut(place.path());

    const std::string identifier = "com.example.looked.up";
    (void)make(identifier);
    Client client = daemon.connect();
    const Frame lookup = containerRequest(identifier, containerClass, Create::no);
    const auto first = client.exchange(lookup);
    mustSucceed(first, true);
    const Frame found(first.begin(), first.end());
    const std::vector<double> before = roundTrips(client, lookup, found, alone);
    std::vector<double> busy;
    std::atomic<bool> over{false};
    double took = 0;
    int usages = 0;
    const auto begin = Clock::now();
    {
        Client deleting = daemon.connect();
        Client measuring = daemon.connect();
        (void)succeed(deleting, containerFrame(ipc::Command::deleteContainer, "com.example.going", containerClass));
        OtherClient removal([&] {
            (void)succeed(deleting,
                          requestFrame({{std::string(ipc::keys::command),
                                         static_cast<std::uint64_t>(ipc::Command::deleteContainersOnDeathRow)}}));
        });
        OtherClient usage([&] {
            const Frame request = containerFrame(ipc::Command::getDiskUsage, "com.example.large", containerClass,
                                                 {{std::string(ipc::keys::uuid), large.uuid}});
            for (; !over && !removal.ended(); ++usages)
                (void)succeed(measuring, request);
        });
        while (!removal.ended() && secondsSince(begin) < secondsMax)
            for (const double microseconds : roundTrips(client, lookup, found, 100))
                busy.push_back(microseconds);
        took = secondsSince(begin);
        over = true;
        usage.wait();
        removal.wait();
    }
    const std::vector<double> after = roundTrips(client, lookup, found, alone);
    // The machine's other work may spoil one of them, and must not make the goal an easy one.
    const double p99 = percentile(busy, 0.99);
    const double floorP99 = std::min(percentile(before, 0.99), percentile(after, 0.99));
    return {{.name = "busy.lookup",
             .what = text("lookups while %d files are removed and a tree is measured, p99", removed),
             .measured = text("%.0f us", p99),
             .floor = text("%.0f us", floorP99),
             .value = p99 / floorP99,
             .unit = "x",
             .goal = 2.0,
             .remark = text("p50 %.0f us, alone %.0f us; for %.1f s, in which %d files were measured %d times",
                            median(busy), std::min(median(before), median(after)), took, measured, usages),
             .numbers = {{"p99us", p99}, {"floorP99us", floorP99}, {"seconds", took}}}};
}

} // namespace zor::bench
