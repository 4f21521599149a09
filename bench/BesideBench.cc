// SPDX-License-Identifier: Apache-2.0
// How long lookups take beside clients that change the store and wait for its disk, against lookups alone in the same
// daemon, before and after.
#include "Benchmarks.h"
#include "Writers.h"

#include "store/ZOREntitlementMapping.h"

#include <algorithm>
#include <functional>
#include <memory>

namespace zor::bench {

namespace {

constexpr ContainerClass containerClass = ContainerClass::dataApplication;
constexpr int creators = 4;
constexpr double microsecondsOfMillisecond = 1000;

/// Does the same again and again until it is told to end; `round` is another number each time.
using Change = std::function<void(Client& client, int round)>;

/// Some clients at once, each with a change of its own.
class Changes {
public:
    Changes(const Daemon& daemon, const std::vector<Change>& changes) {
        for (const Change& change : changes)
            clients_.push_back(std::make_unique<OtherClient>([this, &daemon, change] {
                Client client = daemon.connect();
                for (int round = 0; !over_; ++round, ++done_)
                    change(client, round);
            }));
    }
    ~Changes() { over_ = true; }
    Changes(const Changes&) = delete;
    Changes& operator=(const Changes&) = delete;

    /// How many changes were made.
    int end() {
        over_ = true;
        for (const auto& client : clients_)
            client->wait();
        return done_;
    }

private:
    std::atomic<bool> over_{false};
    std::atomic<int> done_{0};
    std::vector<std::unique_ptr<OtherClient>> clients_;
};

std::vector<Change> creating() {
    std::vector<Change> changes;
    for (int i = 0; i < creators; ++i)
        changes.emplace_back([i](Client& client, int round) {
            (void)makeContainer(client, text("com.example.made.%d.%d", i, round), containerClass);
        });
    return changes;
}

/// Each registration has a group of its own, whose container is made.
std::vector<Change> registering() {
    return {[](Client& client, int round) {
        (void)succeed(client, registration(text("com.example.registered.%d", round),
                                           {{std::string(entitlementKeys::applicationGroups),
                                             plist::Array{text("group.com.example.%d", round)}}}));
    }};
}

/// Containers that take another's place, that are emptied, and that leave the store.
std::vector<Change> replacingWipingDeleting(const Daemon& daemon) {
    const auto replacer = std::make_shared<Replacer>(daemon, "com.example.replaced");
    return {[replacer](Client&, int) { (void)replacer->replace(); },
            [](Client& client, int round) {
                const std::string wiped = "com.example.wiped";
                if (round == 0)
                    (void)makeContainer(client, wiped, containerClass);
                (void)succeed(client, containerFrame(ipc::Command::wipeDataContainerContent, wiped, containerClass));
            },
            [](Client& client, int round) {
                const std::string deleted = text("com.example.deleted.%d", round);
                (void)makeContainer(client, deleted, containerClass);
                (void)succeed(client, containerFrame(ipc::Command::deleteContainer, deleted, containerClass));
            }};
}

/// The times of lookups, alone and beside changes, in microseconds.
struct Beside {
    std::vector<double> busy;
    std::vector<double> before;
    std::vector<double> after;
    int changes = 0;
    double seconds = 0;

    [[nodiscard]] double p99() const { return percentile(busy, 0.99); }
    /// The machine's other work may spoil one of them, and must not make the goal an easy one.
    [[nodiscard]] double aloneP99() const { return std::min(percentile(before, 0.99), percentile(after, 0.99)); }
    [[nodiscard]] std::string remark() const {
        return text("p50 %.0f us, alone %.0f us; %d changes in %.1f s", median(busy),
                    std::min(median(before), median(after)), changes, seconds);
    }
};

Figure inMicroseconds(const char* name, std::string what, double value, double alone, double goal, std::string remark) {
    return {.name = name,
            .what = std::move(what),
            .measured = text("%.0f us", value),
            .floor = text("%.0f us", alone),
            .value = value / microsecondsOfMillisecond,
            .unit = "ms",
            .goal = goal,
            .remark = std::move(remark),
            .numbers = {{"us", value}, {"aloneUs", alone}}};
}

Figure againstAlone(const char* name, const char* what, const Beside& beside) {
    return {.name = name,
            .what = what,
            .measured = text("%.0f us", beside.p99()),
            .floor = text("%.0f us", beside.aloneP99()),
            .value = beside.p99() / beside.aloneP99(),
            .unit = "x",
            .goal = 2.0,
            .remark = beside.remark(),
            .numbers = {{"p99us", beside.p99()}, {"floorP99us", beside.aloneP99()}}};
}

} // namespace

std::vector<Figure> measureBeside(const Settings& settings) {
    const int alone = settings.rounds(50'000, 20'000);
    const double seconds = settings.quick ? 1 : 4;
    const Place place(*settings.scratch, "beside", {.bytes = std::uint64_t{2} << 30, .inodes = 262'144});
    prepareRoot(settings, place.path());
    const Daemon daemon(settings, place.path(), {.syncs = Daemon::Syncs::on});
    const std::string identifier = "com.example.looked.up";
    Client client = daemon.connect();
    (void)makeContainer(client, identifier, containerClass);
    const Frame lookup = containerRequest(identifier, containerClass, Create::no);
    const auto first = client.exchange(lookup);
    mustSucceed(first, true);
    const Frame found(first.begin(), first.end());
    const auto beside = [&](const std::vector<Change>& wanted) {
        Beside times;
        times.before = roundTrips(client, lookup, found, alone);
        Changes changes(daemon, wanted);
        const auto begin = Clock::now();
        while (secondsSince(begin) < seconds)
            for (const double microseconds : roundTrips(client, lookup, found, 100))
                times.busy.push_back(microseconds);
        times.seconds = secondsSince(begin);
        times.changes = changes.end();
        times.after = roundTrips(client, lookup, found, alone);
        return times;
    };
    const Beside made = beside(creating());
    const double aloneP50 = std::min(median(made.before), median(made.after));
    return {inMicroseconds("beside.creators.p50", text("lookup beside %d durable creators, p50", creators),
                           median(made.busy), aloneP50, 0.3, made.remark()),
            inMicroseconds("beside.creators.p99", text("lookup beside %d durable creators, p99", creators), made.p99(),
                           made.aloneP99(), 6, ""),
            againstAlone("beside.registrations", "lookup beside registrations with a new group each, p99",
                         beside(registering())),
            againstAlone("beside.replaces", "lookup beside replaces, wipes and deletions, p99",
                         beside(replacingWipingDeleting(daemon)))};
}

} // namespace zor::bench
