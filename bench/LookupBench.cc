// SPDX-License-Identifier: Apache-2.0
// The round trip of one lookup against that of the same bytes through the echo. Client and server share one processor:
// on several, where the kernel happens to wake the other side decides more than the work does.
#include "Benchmarks.h"
#include "Echo.h"

namespace zor::bench {

std::vector<Figure> measureLookup(const Settings& settings) {
    const int blocks = settings.rounds(31, 11);
    const int requests = settings.rounds(4000, 2000);
    const Place place(*settings.scratch, "lookup", {.bytes = std::uint64_t{256} << 20, .inodes = 16384});
    prepareRoot(settings, place.path());
    const int processor = measuringProcessor();
    const Daemon daemon(settings, place.path(), {.processor = processor});
    Client client = daemon.connect();
    const std::string identifier = "com.example.application.lookup";
    mustSucceed(client.exchange(containerRequest(identifier, ContainerClass::dataApplication, Create::yes)), false);
    const Frame request = containerRequest(identifier, ContainerClass::dataApplication, Create::no);
    const auto first = client.exchange(request);
    mustSucceed(first, true);
    const Frame reply(first.begin(), first.end());

    const Echo echo(place.path(), request.size(), reply, {.processor = processor});
    Client floorClient = echo.connect();
    const Pinned pinned(processor);
    Pairs halves;
    std::vector<double> all;
    std::vector<double> floorAll;
    for (int block = -1; block < blocks; ++block) {
        const auto measured = roundTrips(client, request, reply, requests);
        const auto floor = roundTrips(floorClient, request, reply, requests);
        if (block < 0) // warms up
            continue;
        halves.measured.push_back(median(measured));
        halves.floor.push_back(median(floor));
        all.insert(all.end(), measured.begin(), measured.end());
        floorAll.insert(floorAll.end(), floor.begin(), floor.end());
    }
    const double p99 = percentile(all, 0.99);
    const double floorP99 = percentile(floorAll, 0.99);
    return {{.name = "lookup.p50",
             .what = "lookup round trip, one processor, p50",
             .measured = text("%.2f us", halves.measuredMedian()),
             .floor = text("%.2f us", halves.floorMedian()),
             .value = halves.ratio(),
             .unit = "x",
             .goal = 2.0,
             .remark = text("p99 %.2f us, of the floor %.2f us; request %zu bytes, reply %zu", p99, floorP99,
                            request.size(), reply.size()),
             .numbers = {{"p50us", halves.measuredMedian()},
                         {"p99us", p99},
                         {"floorP50us", halves.floorMedian()},
                         {"floorP99us", floorP99}}}};
}

} // namespace zor::bench
