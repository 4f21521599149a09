// SPDX-License-Identifier: Apache-2.0
// A real daemon under random load of everything it does, in random trouble, for as long as wanted. Everything that it
// acknowledged is there afterwards, nothing is half made, nothing grows.
//
// The seed is printed first; the same one makes the same choices in each client, though not the same meetings of them.
#include "soak/HostileOwner.h"
#include "soak/Surroundings.h"
#include "support/Allocations.h"
#include "support/LongRun.h"

#include <CLI/CLI.hpp>
#include <sys/mount.h>
#include <unistd.h>

namespace zor::soak {
namespace {

using Clock = std::chrono::steady_clock;

constexpr std::size_t diskBytes = std::size_t{96} << 20;
constexpr unsigned clientCount = 4;
constexpr std::size_t grownKiBMax = 16384;
constexpr std::size_t grownDescriptorsMax = 16;

struct Options {
    double seconds = support::isLongRun() ? 60 : 15;
    Count kills = 0;
    Count seed = static_cast<Count>(Clock::now().time_since_epoch().count()) % 1'000'000;
    bool verbose = false;
};

/// A small file system that can be filled, where this process may mount one.
class SmallDisk {
public:
    SmallDisk()
        : directory_("/dev/shm"), mounted_(::mount("soak", directory_.path().c_str(), "tmpfs", 0,
                                                   ("mode=0755,size=" + std::to_string(diskBytes)).c_str()) == 0) {}
    ~SmallDisk() {
        // Mounts below the disk go with it.
        if (mounted_)
            ::umount2(directory_.path().c_str(), MNT_DETACH);
    }
    [[nodiscard]] bool isMounted() const { return mounted_; }
    [[nodiscard]] const std::string& path() const { return directory_.path(); }

private:
    support::TemporaryDirectory directory_;
    const bool mounted_;
};

void say(const Session& session, const Surroundings& surroundings, double seconds) {
    Count operations = 0;
    for (const auto& [name, count] : session.record().counts)
        operations += count;
    const auto size = surroundings.size();
    std::printf("%6.0f s: %llu operations, %llu kills, %llu boots, %s\n", seconds, operations, surroundings.kills(),
                surroundings.boots(), size.text().c_str());
    std::fflush(stdout);
}

/// Trouble until the time or the number of kills is reached.
void trouble(Session& session, Surroundings& surroundings, const Options& options) {
    const auto begin = Clock::now();
    auto said = begin;
    const auto seconds = [&](Clock::time_point from) {
        return std::chrono::duration<double>(Clock::now() - from).count();
    };
    while (!session.stopped &&
           (options.kills > 0 ? surroundings.kills() < options.kills : seconds(begin) < options.seconds * 0.75)) {
        surroundings.happen(options.kills > 0 ? 200 : 400);
        if (seconds(said) > 5) {
            said = Clock::now();
            say(session, surroundings, seconds(begin));
        }
    }
    surroundings.settle();
}

/// The same load without trouble: what the daemon takes stays what it was.
void calm(Session& session, const Surroundings& surroundings, double seconds) {
    const auto wait = [&](double time) {
        for (const auto end = Clock::now() + std::chrono::duration<double>(time);
             Clock::now() < end && !session.stopped;)
            sleepMilliseconds(50);
    };
    wait(seconds / 3);
    const auto before = surroundings.size();
    wait(seconds * 2 / 3);
    const auto after = surroundings.size();
    // A sanitizer keeps what was freed, up to a quarter of a gigabyte.
    if ((support::allocationsCanFail() && after.residentKiB > before.residentKiB + grownKiBMax) ||
        after.descriptors > before.descriptors + grownDescriptorsMax)
        session.found("the daemon grew from " + before.text() + " to " + after.text());
}

int report(const Session& session, const Surroundings& surroundings, double seconds, const std::string& log) {
    say(session, surroundings, seconds);
    const auto record = session.record();
    for (const auto& [name, count] : record.counts)
        std::printf("  %8llu  %s\n", count, name.c_str());
    if (record.findings.empty()) {
        std::puts("nothing was found");
        return 0;
    }
    for (const std::string& operation : record.lastOperations)
        std::printf("  last: %s\n", operation.c_str());
    std::printf("%s\n", log.substr(log.size() > 4000 ? log.size() - 4000 : 0).c_str());
    for (const std::string& finding : record.findings)
        std::printf("FOUND: %s\n", finding.c_str());
    return 1;
}

int soak(const Options& options) {
    std::printf("seed %llu\n", options.seed);
    const SmallDisk disk;
    if (!disk.isMounted())
        std::puts("skipped: a full disk, and clients of several users; only root may mount and become others");
    if (::access("/dev/fuse", R_OK | W_OK) != 0 || !disk.isMounted())
        std::puts("skipped: mounts that hang; there is no /dev/fuse for this process");
    whole::DaemonProcess daemon(whole::DaemonProcess::Syncs::off, disk.path());
    Session session(daemon, options.verbose);
    Surroundings surroundings(session, options.seed, disk.isMounted());
    // Every other seed has the first user's home on a file system of its own.
    const std::string home = disk.isMounted() && options.seed % 2 == 1 ? daemon.path("private/var/mobile") : "";
    if (!home.empty() && ::mount("soak-home", home.c_str(), "tmpfs", 0, "mode=0755,uid=501,gid=501,size=64m") == 0)
        std::puts("the first user's home is a file system of its own");
    daemon.start();
    HostileOwner hostile(session, options.seed);
    const auto begin = Clock::now();

    std::vector<std::thread> threads;
    for (unsigned i = 0; i < clientCount; ++i)
        threads.emplace_back([&, i] { live(session, i, i % 2 == 0 ? 0 : whole::mobile, options.seed); });
    threads.emplace_back([&] { hostile.ask(); });
    threads.emplace_back([&] { hostile.swap(); });
    trouble(session, surroundings, options);
    calm(session, surroundings, options.seconds / 4);
    session.stopped = true;
    for (std::thread& thread : threads)
        thread.join();
    surroundings.check();
    // Clients and daemons that ended in the middle of things have left nothing behind.
    for (const char* counter : {"LockedIdentifiers", "BufferedInputBytes", "BufferedOutputBytes"})
        if (daemon.counter(counter) != 0)
            session.found(std::string(counter) + " is " + std::to_string(daemon.counter(counter)));
    if (const std::string changed = hostile.changedOutside(); !changed.empty())
        session.found("what lies outside was changed: " + changed);
    return report(session, surroundings, std::chrono::duration<double>(Clock::now() - begin).count(), daemon.log());
}

} // namespace
} // namespace zor::soak

int main(int argumentCount, char** arguments) {
    zor::soak::Options options;
    CLI::App app("Runs a real daemon under random load and in random trouble, and holds it to what it acknowledged.");
    app.add_option("--seconds", options.seconds, "How long")->capture_default_str();
    app.add_option("--kills", options.kills, "Until the daemon was killed this often, instead");
    app.add_option("--seed", options.seed, "Of the choices")->capture_default_str();
    app.add_flag("--verbose", options.verbose, "Print each operation");
    CLI11_PARSE(app, argumentCount, arguments);
    return zor::soak::soak(options);
}
