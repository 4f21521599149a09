// SPDX-License-Identifier: Apache-2.0
// A device with a store on it, and daemons that come and go on it: real roles and operations over a disk that the test
// gives.
//
// The death-row queue runs its jobs at once, on the thread that queues them: the earliest that a pass can come, and a
// stop in a pass reaches the test. One thread; one daemon at a time on a root.
#pragma once

#include "daemon/Composition.h"
#include "daemon/LinuxPlatform.h"
#include "os/LinuxDisk.h"
#include "support/RecordingLog.h"
#include "support/StoreJudge.h"

#include <memory>
#include <optional>

namespace zor::support {

/// What a boot keeps in memory.
class MemoryBootMarker final : public platform::BootMarker {
public:
    explicit MemoryBootMarker(bool present = false) : present_(present) {}
    [[nodiscard]] State look() const override { return {.present = present_, .foreign = false}; }
    int make() override {
        present_ = true;
        return 0;
    }
    void forget() override { present_ = false; }
    [[nodiscard]] std::string name() const override { return "memory"; }

private:
    bool present_;
};

class ImmediateQueue final : public platform::WorkQueue {
public:
    bool start() override { return true; }
    void async(std::function<void()> job) override { job(); }
    void suspend() override {}
    void resume() override {}
};

/// A tree with what the daemon expects to find: the password file, homes, and the system's directories.
void furnishRoot(const std::string& root);

/// How a file system on which the store is told to lie keeps order.
fs::Ordering journalEverywhere(int fd);
fs::Ordering noOrderAnywhere(int fd);

/// What asks for a container, and what it got.
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
void add(std::vector<Acknowledged>& promised, const Acknowledged& promise);

class StoreDaemon {
public:
    StoreDaemon(const std::string& root, platform::BootMarker& marker, platform::Disk& disk,
                fs::Durability::Probe probe);
    ~StoreDaemon();

    /// The setup before the first client; of the boot too where the marker is missing.
    void launch();
    /// An error code, or what the client was told.
    struct Answer {
        std::optional<Acknowledged> acknowledged;
        ErrorCode code = ErrorCode::success;
    };
    Answer create(const Request& request) { return ask(request, true); }
    Answer lookUp(const Request& request) { return ask(request, false); }

    [[nodiscard]] Composition& composition() { return *composition_; }
    [[nodiscard]] ZORClientConnection& client() { return *composition_->sharedClientConnection(); }
    [[nodiscard]] ZOREntitlementMapping& entitlements() { return composition_->entitlements(); }
    /// Its latest lines since the last call, for a test that fails.
    [[nodiscard]] std::string log();

private:
    Answer ask(const Request& request, bool createIfNecessary);

    const std::string root_;
    RecordingLog log_{logLevelNotice};
    ImmediateQueue queue_;
    std::unique_ptr<platform::LinuxPlatform> platform_;
    platform::XattrProtectionClass protection_;
    platform::LinkSandboxUserState sandbox_;
    std::unique_ptr<Composition> composition_;
};

/// A daemon over a store that is at rest, to be asked what only a client can see.
struct LaterDaemon {
    explicit LaterDaemon(const std::string& root) : daemon(root, marker, disk, journalEverywhere) {}
    MemoryBootMarker marker{true};
    platform::LinuxDisk disk{platform::Syncs::off};
    StoreDaemon daemon;
};

/// Where private/var/mobile lies: on the root's file system, or on one mounted there (in a mount namespace of this
/// process, which only root may have).
enum class Home { onRoot, mounted };
bool homesCanBeMounted();

/// A device for one run of a fault loop: its root, and what its clients were promised.
struct Device {
    explicit Device(const std::string& parent, Home home = Home::onRoot);
    ~Device();
    void start(platform::Disk& onDisk, fs::Durability::Probe probe);
    /// Creates a container and notes it as promised. False when the daemon did not.
    bool create(const Request& request);
    /// The same without a promise; what is done to it takes it away or changes its place. Throws when it cannot.
    Acknowledged mustCreate(const Request& request) const;
    /// Promises a path that was answered. What the daemon does not find there is promised too, and missed.
    void promise(const Request& request, const std::string& path);
    [[nodiscard]] ZORClientConnection& client() const { return daemon->client(); }

    TemporaryDirectory root;
    const Home home;
    MemoryBootMarker marker;
    std::vector<Acknowledged> promised;
    /// A change that promises no container was acknowledged.
    bool acted = false;
    /// What the daemon runs on.
    platform::Disk* disk = nullptr;
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
