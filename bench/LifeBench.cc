// SPDX-License-Identifier: Apache-2.0
// The daemon's cost while nobody asks, how soon it answers after its start, and whether many requests and
// connections leave something behind.
#include "Benchmarks.h"

#include <algorithm>
#include <fcntl.h>
#include <unistd.h>

namespace zor::bench {

namespace {

constexpr Place::Size placeSize{.bytes = std::uint64_t{256} << 20, .inodes = 16384};
constexpr int connectionsKept = 64;

const std::string identifier = "com.example.application.life";

/// Milliseconds of a process that loads the program and ends.
double emptyRun(const std::string& program) {
    const auto begin = Clock::now();
    ChildProcess process([&] {
        const int nothing = ::open("/dev/null", O_WRONLY | O_CLOEXEC);
        ::dup2(nothing, STDOUT_FILENO);
        ::execl(program.c_str(), "zorvaned", "--version", static_cast<char*>(nullptr));
    });
    if (process.wait() != 0)
        throw Failure(program + " --version fails");
    return secondsSince(begin) * 1e3;
}

/// Every kind of request that a crowd sends, over each of the connections in turn; so much of it is one round.
class Requests {
public:
    explicit Requests(const Daemon& daemon) {
        for (int i = 0; i < connectionsKept; ++i)
            clients_.push_back(daemon.connect());
    }
    void send(int count) {
        for (int i = 0; i < count; ++i) {
            Client& client = clients_[static_cast<std::size_t>(i) % clients_.size()];
            if (i % 8 == 7)
                (void)client.exchange(absent_);
            else
                mustSucceed(client.exchange(present_), true);
        }
    }

private:
    const Frame present_ = containerRequest(identifier, ContainerClass::dataApplication, Create::no);
    const Frame absent_ = containerRequest("com.example.none", ContainerClass::dataApplication, Create::no);
    std::vector<Client> clients_;
};

void connectOften(const Daemon& daemon, int count) {
    const Frame request = containerRequest(identifier, ContainerClass::dataApplication, Create::no);
    for (int i = 0; i < count; ++i)
        mustSucceed(daemon.connect().exchange(request), true);
}

/// The daemon closes its end a little after the client did.
int descriptorsOnceSettled(const Daemon& daemon, int expected) {
    int count = daemon.descriptorCount();
    for (int tried = 0; count > expected && tried < 200; ++tried) {
        ::usleep(10'000);
        count = daemon.descriptorCount();
    }
    return count;
}

} // namespace

std::vector<Figure> measureStart(const Settings& settings) {
    const Place place(*settings.scratch, "start", placeSize);
    prepareRoot(settings, place.path());
    {
        const Daemon first(settings, place.path(), {}); // leaves the boot marker and one container
        Client client = first.connect();
        mustSucceed(client.exchange(containerRequest(identifier, ContainerClass::dataApplication, Create::yes)), false);
    }
    Pairs milliseconds;
    std::vector<double> residentKiB;
    for (int round = -1; round < settings.rounds(21, 9); ++round) {
        const Daemon daemon(settings, place.path(), {});
        Client client = daemon.connect();
        const auto reply = client.exchange(containerRequest(identifier, ContainerClass::dataApplication, Create::no));
        const double took = secondsSince(daemon.startedAt()) * 1e3;
        mustSucceed(reply, true);
        const double floor = emptyRun(settings.daemonProgram);
        ::usleep(50'000);
        if (round < 0)
            continue;
        milliseconds.measured.push_back(took);
        milliseconds.floor.push_back(floor);
        residentKiB.push_back(daemon.residentKiB());
    }
    const double resident = median(residentKiB) / 1024;
    return {{.name = "idle.memory",
             .what = "resident memory when idle",
             .measured = text("%.2f MiB", resident),
             .floor = "",
             .value = resident,
             .unit = "MiB",
             .goal = 5},
            {.name = "start.firstAnswer",
             .what = "start to first answer, p50",
             .measured = text("%.2f ms", milliseconds.measuredMedian()),
             .floor = text("%.2f ms", milliseconds.floorMedian()),
             .value = milliseconds.measuredMedian(),
             .unit = "ms",
             .goal = 5,
             .remark = "the floor, for comparison, is the program started with --version",
             .numbers = {{"milliseconds", milliseconds.measuredMedian()},
                         {"floorMilliseconds", milliseconds.floorMedian()}}}};
}

std::vector<Figure> measureEndurance(const Settings& settings) {
    const int requests = settings.rounds(200'000, 50'000);
    const int connections = settings.rounds(20'000, 5'000);
    const Place place(*settings.scratch, "endurance", placeSize);
    prepareRoot(settings, place.path());
    const Daemon daemon(settings, place.path(), {});
    mustSucceed(daemon.connect().exchange(containerRequest(identifier, ContainerClass::dataApplication, Create::yes)),
                false);
    {
        Requests(daemon).send(requests / 20);
        connectOften(daemon, connections / 20);
    }
    const int descriptors = descriptorsOnceSettled(daemon, 0);
    const double before = daemon.residentKiB();
    {
        Requests(daemon).send(requests);
        connectOften(daemon, connections);
    }
    const int descriptorsAfter = descriptorsOnceSettled(daemon, descriptors);
    const double grown = (daemon.residentKiB() - before) / 1024;
    return {{.name = "endurance.memory",
             .what = "resident growth by many requests",
             .measured = text("%.2f MiB", grown),
             .floor = "",
             .value = grown,
             .unit = "MiB",
             .goal = 1,
             .remark = text("by %d requests and %d connections, after a twentieth of them", requests, connections)},
            {.name = "endurance.descriptors",
             .what = "descriptors left by them",
             .measured = std::to_string(descriptorsAfter),
             .floor = std::to_string(descriptors),
             .value = descriptorsAfter - descriptors,
             .unit = "",
             .goal = 0}};
}

} // namespace zor::bench
