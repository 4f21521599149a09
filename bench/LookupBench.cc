// SPDX-License-Identifier: Apache-2.0
// The round trip of one lookup against that of the same bytes through the echo. Client and server share one processor:
// on several, where the kernel happens to wake the other side decides more than the work does.
#include "Benchmarks.h"
#include "Echo.h"
#include "RoundTripPairs.h"

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
    return {roundTripsInTurns(
                blocks, [&] { return roundTrips(client, request, reply, requests); },
                [&] { return roundTrips(floorClient, request, reply, requests); })
                .figure("lookup.p50", "lookup round trip, one processor, p50", 1.65, request, reply)};
}

} // namespace zor::bench
