// SPDX-License-Identifier: Apache-2.0
// A device with a store on it, and daemons that come and go on it: worlds over a disk that the test gives. One thread;
// one daemon at a time on a root.
#pragma once

#include "daemon/Daemon.h"
#include "support/InterceptedDisk.h"
#include "support/StoreJudge.h"
#include "world/World.h"

#include <fstream>
#include <sstream>

namespace zor::support {

/// How a file system on which the store is told to lie keeps order.
inline fs::Ordering journalEverywhere(int) {
    return fs::Ordering::journal;
}
inline fs::Ordering noOrderAnywhere(int) {
    return fs::Ordering::none;
}

/// A request for a container, and what the request got.
struct Request {
    std::string identifier;
    ContainerClass containerClass;
    std::uint32_t userId;
    bool transient = false;
};
struct Acknowledged {
    Request request;
    std::string path;
    std::string uuid;
};
/// Adds a promise. A transient container takes the place of the one before it.
inline void add(std::vector<Acknowledged>& promised, const Acknowledged& promise) {
    std::erase_if(promised, [&](const Acknowledged& earlier) {
        return promise.request.transient && earlier.request.transient &&
               earlier.request.identifier == promise.request.identifier;
    });
    promised.push_back(promise);
}

class StoreDaemon {
public:
    StoreDaemon(const std::string& root, platform::BootMarker& marker, platform::Disk& disk,
                fs::Durability::Probe probe)
        : world({.probe = probe, .root = root, .disk = &disk, .marker = &marker}) {
        world.load(); // reads the entitlement file, as a start does
    }
    /// The setup before the first client; of the boot too where the marker is missing.
    void launch() { Daemon(world.services(), {}).setUp(); }
    /// An error code, or what the client was told.
    struct Answer {
        std::optional<Acknowledged> acknowledged;
        ErrorCode code = ErrorCode::success;
    };
    Answer create(const Request& request) { return ask(request, true); }
    Answer lookUp(const Request& request) { return ask(request, false); }

    [[nodiscard]] ZORClientConnection& client() { return world.daemonsClient(); }
    [[nodiscard]] ZOREntitlementMapping& entitlements() { return world.services().entitlements(); }
    /// Its lines since the last call, for a test that fails.
    [[nodiscard]] std::string log() {
        std::ostringstream text;
        for (const LogLine& line : world.log.take())
            text << "\n    " << line;
        return text.str();
    }

    test::World world;

private:
    Answer ask(const Request& request, bool createIfNecessary) {
        const auto found = client().createOrLookupContainerForUser(
            request.userId, &request.identifier, request.containerClass,
            {.createIfNecessary = createIfNecessary, .transient = request.transient});
        if (!found)
            return {.acknowledged = std::nullopt, .code = found.error().replyCode()};
        return {.acknowledged = Acknowledged{request, found->path, found->uuid.string()}};
    }
};

/// A daemon over a store that is at rest, to be asked what only a client can see.
struct LaterDaemon {
    explicit LaterDaemon(const std::string& root) : daemon(root, marker, disk, journalEverywhere) {
        (void)marker.make();
    }
    test::FlagBootMarker marker;
    platform::LinuxDisk disk{platform::Syncs::off};
    StoreDaemon daemon;
};

/// The file system on which private/var/mobile lies: the root's, or one mounted there.
enum class Home { onRoot, mounted };

/// A disk on whose file systems no two names can be exchanged.
class WithoutExchange final : public InterceptedDisk {
public:
    using InterceptedDisk::InterceptedDisk;
    Errno rename(int fromDirectory, const char* from, int toDirectory, const char* to, unsigned flags) override {
        return flags == RENAME_EXCHANGE ? Errno(EINVAL) : inner().rename(fromDirectory, from, toDirectory, to, flags);
    }

private:
    Errno intercept(const DiskCallInfo&, const Make& make) override { return make(); }
};

/// A device for one run of a fault loop: its root, and what its clients were promised.
struct Device {
    explicit Device(const std::string& parent, Home whereHome = Home::onRoot) : root(parent), home(whereHome) {
        test::furnish(root.path());
        // Each user takes the passes of a boot longer.
        std::ofstream(root.path() + "/etc/passwd") << "mobile:x:501:501::/private/var/mobile:/bin/sh\n";
        if (home == Home::mounted && !mountedHome.emplace(root.path()).mounted())
            throw std::runtime_error("cannot mount a home");
    }
    void start(platform::Disk& onDisk, fs::Durability::Probe theProbe) {
        disk = &onDisk;
        probe = theProbe;
        restart(onDisk);
    }
    /// Another daemon in the place of the one that there is, on that disk.
    void restart(platform::Disk& onDisk) {
        daemon.reset(); // it lives on the disk
        platform::Disk& its = exchanges ? onDisk : withoutExchange.emplace(onDisk);
        daemon = std::make_unique<StoreDaemon>(root.path(), marker, its, probe);
        daemon->launch();
    }
    /// Creates a container and notes it as promised. False when the daemon did not.
    bool create(const Request& request) {
        const auto answer = daemon->create(request);
        if (answer.acknowledged)
            add(promised, *answer.acknowledged);
        return answer.acknowledged.has_value();
    }
    /// The same without a promise; what is done to it takes it away or changes its place. Throws when it cannot.
    Acknowledged mustCreate(const Request& request) const {
        const auto answer = daemon->create(request);
        if (!answer.acknowledged)
            throw std::runtime_error("cannot create " + request.identifier + daemon->log());
        return *answer.acknowledged;
    }
    /// Promises a path that was answered. A container that the daemon does not find there is promised too, and missed.
    void promise(const Request& request, const std::string& path) {
        const auto found = daemon->lookUp(request);
        add(promised, {request, path, found.acknowledged ? found.acknowledged->uuid : ""});
    }
    [[nodiscard]] ZORClientConnection& client() const { return daemon->client(); }

    TemporaryDirectory root;
    const Home home;
    std::optional<test::MountedHome> mountedHome;
    test::FlagBootMarker marker;
    std::vector<Acknowledged> promised;
    /// A change that promises no container was acknowledged.
    bool acted = false;
    /// Before it starts: whether its file systems exchange names.
    bool exchanges = true;
    std::optional<WithoutExchange> withoutExchange;
    /// The disk that the daemon runs on.
    platform::Disk* disk = nullptr;
    fs::Durability::Probe probe = journalEverywhere;
    std::unique_ptr<StoreDaemon> daemon;
};

/// Judges the tree as it lies, launches a new daemon over it with the real disk, and judges what it makes of it:
/// nothing half made under a final name, nothing promised lost, staging and death row empty, and each request either
/// served by what is there or answered as not found, then created; at the end `zorvanectl check` would find nothing. A
/// complaint or nothing.
enum class Leftovers { none, ofErrors };
std::string judgeAfterRestart(const std::string& root, platform::BootMarker& marker, fs::Durability::Probe probe,
                              const std::vector<Acknowledged>& promised, const std::vector<Request>& requests,
                              Leftovers leftovers = Leftovers::none);

} // namespace zor::support
