// SPDX-License-Identifier: Apache-2.0
// The cost of keeping entitlements up to date: registering what is registered already, and admitting a peer whose
// registration is its own. Both against a lookup in the same daemon, on one processor.
#include "Benchmarks.h"
#include "RoundTripPairs.h"
#include "Writers.h"

#include "ipc/Protocol.h"
#include "platform/Service.h"
#include "store/StorePlaces.h"
#include "store/ZOREntitlementMapping.h"

#include <sys/stat.h>

namespace zor::bench {

namespace {

namespace keys = ipc::keys;

/// The reply to a request that is to succeed.
Frame firstReply(Client& client, const Frame& request) {
    const auto reply = client.exchange(request);
    if (replyOf(reply).unsignedInteger(keys::replyError) != ipc::replySuccess)
        throw Failure("a registration failed");
    return {reply.begin(), reply.end()};
}

ino_t entitlementFile(const std::string& root) {
    struct stat status{};
    const std::string path = root + "/private/var/root/Library/Zorvane/" + names::entitlementFile;
    if (::stat(path.c_str(), &status) != 0)
        failWithErrno(path);
    return status.st_ino; // each save makes a new one
}

Figure figureOf(const Pairs& pairs, const char* name, const char* what, double goal, std::string remark) {
    return {.name = name,
            .what = what,
            .measured = text("%.2f us", pairs.measuredMedian()),
            .floor = text("%.2f us", pairs.floorMedian()),
            .value = pairs.ratio(),
            .unit = "x",
            .goal = goal,
            .remark = std::move(remark),
            .numbers = {{"p50us", pairs.measuredMedian()}, {"floorP50us", pairs.floorMedian()}}};
}

} // namespace

std::vector<Figure> measureRegistration(const Settings& settings) {
    const int blocks = settings.rounds(31, 11);
    const int requests = settings.rounds(2000, 1000);
    const Place place(*settings.scratch, "registration", {.bytes = std::uint64_t{256} << 20, .inodes = 16384});
    prepareRoot(settings, place.path());
    const int processor = measuringProcessor();
    const Daemon daemon(settings, place.path(), {.processor = processor});
    Client client = daemon.connect();
    const std::string identifier = "com.example.application.registered";
    mustSucceed(client.exchange(containerRequest(identifier, ContainerClass::dataApplication, Create::yes)), false);
    const Frame lookup = containerRequest(identifier, ContainerClass::dataApplication, Create::no);
    const Frame found = firstReply(client, lookup);
    const plist::Dictionary groups{
        {std::string(entitlementKeys::applicationGroups),
         plist::Array{"group.com.example.one", "group.com.example.two"}},
        {std::string(entitlementKeys::systemGroups), plist::Array{"systemgroup.com.example.three"}},
    };
    const Frame unchanged = registration(identifier, groups, {});
    const Frame accepted = firstReply(client, unchanged);
    const plist::Dictionary own{{std::string(platform::entitlementKeys::allowed), true}};
    const Frame byInstaller = registration(benchIdentifier, own, {});
    const Frame byCaller =
        registration(benchIdentifier, own, {{std::string(entitlementMapKeys::registeredByCaller), true}});

    const Pinned pinned(processor);
    const ino_t fileBefore = entitlementFile(place.path());
    const auto lookUp = [&] { return roundTrips(client, lookup, found, requests); };
    const Pairs registering =
        roundTripsInTurns(blocks, [&] { return roundTrips(client, unchanged, accepted, requests); }, lookUp).blocks;
    if (entitlementFile(place.path()) != fileBefore)
        throw Failure("registering what is registered wrote the entitlement file");
    const auto lookUpAfter = [&](const Frame& registered) {
        (void)firstReply(client, registered);
        return lookUp();
    };
    const Pairs admission = roundTripsInTurns(
                                blocks, [&] { return lookUpAfter(byCaller); }, [&] { return lookUpAfter(byInstaller); })
                                .blocks;
    return {figureOf(registering, "registration.unchanged", "registering unchanged entitlements, against a lookup", 1.3,
                     "the entitlement file is not written"),
            figureOf(admission, "registration.admission",
                     "lookup by a peer registered by itself, against one registered by an installer", 1.2, "")};
}

} // namespace zor::bench
