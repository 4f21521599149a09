// SPDX-License-Identifier: Apache-2.0
// A device of a test's own: a temporary root with the accounts and homes that the daemon expects, the Linux platform
// over it with some roles in the test's hand, and one daemon's services, which may be ended and begun anew on the same
// disk.
//
// Everything a client is shown or a log line says is the real thing. In the test's hand: the disk may fail (`disk`),
// the log keeps its lines, the build may be internal, the device may be locked, the boot is a flag. One thread makes,
// restarts and ends a world. The crash tests put a world on a root and a disk of theirs.
#pragma once

#include "daemon/Composition.h"
#include "daemon/LinuxPlatform.h"
#include "os/LinuxDisk.h"
#include "platform/Errno.h"
#include "store/StorePlaces.h"
#include "support/FaultDisk.h"
#include "support/RecordingLog.h"
#include "support/SettableRoles.h"
#include "support/TestRoot.h"
#include "support/Waiting.h"

#include <array>
#include <future>
#include <memory>

namespace zor::test {

inline constexpr std::uint32_t mobile = 501;
inline constexpr std::uint32_t second = 502;
inline constexpr ContainerClass application = ContainerClass::dataApplication;
inline constexpr bool asTransient = true;
inline constexpr const char* byCaller = "com.veltra.Zorvane.EntitlementsRegisteredByCaller";

inline constexpr const char* cachesPath = "private/var/root/Library/Caches/com.veltra.zorvaned";
inline constexpr const char* libraryPath = "private/var/root/Library/Zorvane";
/// On any device that has been booted: no group identifiers of an older system wait in containers.
inline constexpr const char* groupMarkerPath = "private/var/root/Library/Zorvane/zor_group_id_migration_complete.plist";
inline constexpr const char* sharedPath = "private/var/containers";
inline constexpr const char* mobileContainers = "private/var/mobile/Containers";
inline constexpr const char* mobileCaches = "private/var/mobile/Containers/Library/Caches/com.veltra.zorvaned";
inline const std::string applications = std::string(mobileContainers) + "/Data/Application";
inline const std::string transients = std::string(mobileCaches) + "/Temp/Data/Application";
inline const std::string staging = std::string(cachesPath) + "/Staging";
inline const std::string dead = std::string(cachesPath) + "/Dead";
inline const std::string journals = std::string(libraryPath) + "/Replace";
inline const std::string entitlementFile = std::string(libraryPath) + "/zor_entitlements.plist";

using support::FlagBootMarker;
using support::furnish;
using support::inThreads;
using support::itemAt;

/// Counts what the queue behind it is told.
class CountingQueue final : public platform::WorkQueue {
public:
    bool start() override { return canStart && inner->start(); }
    void async(std::function<void()> job) override { inner->async(std::move(job)); }
    void suspend() override {
        ++suspended;
        inner->suspend();
    }
    void resume() override {
        ++resumed;
        inner->resume();
    }
    platform::WorkQueue* inner = nullptr;
    bool canStart = true;
    std::atomic<int> suspended{0};
    std::atomic<int> resumed{0};
};

/// Runs its jobs at once, on the thread that queues them: the earliest that they can come, and a stop in one reaches
/// the test.
class ImmediateQueue final : public platform::WorkQueue {
public:
    bool start() override { return true; }
    void async(std::function<void()> job) override { job(); }
    void suspend() override {}
    void resume() override {}
};

/// Passes on what it is told until it is to fail.
class FailingSandbox final : public platform::SandboxUserState {
public:
    Errno setMapping(std::uint32_t userId, platform::SandboxItemType type, std::string_view identifier,
                     const std::optional<std::string>& path) override {
        return !path && removeError != 0 ? Errno(removeError) : inner->setMapping(userId, type, identifier, path);
    }
    unsigned removeDanglingMappings(const std::function<bool(std::uint32_t)>& mayConclude,
                                    const std::function<bool(const std::string&)>& isGone) override {
        return inner->removeDanglingMappings(mayConclude, isGone);
    }
    platform::SandboxUserState* inner = nullptr;
    int removeError = 0;
};

/// The text of itemAt for what should lie there. Owners are judged only where the process can give files away.
std::string directoryOf(std::uint32_t owner, mode_t mode = 0755);

/// private/var/mobile as a file system of its own, in a mount namespace of this process.
class MountedHome {
public:
    /// Mounts the home of a furnished root. If a namespace is asked for before a daemon opens the root, the home can be
    /// mounted below that later.
    explicit MountedHome(const std::string& root);
    ~MountedHome();
    MountedHome(const MountedHome&) = delete;
    /// Only root may have the namespace.
    static bool canBe();
    [[nodiscard]] bool mounted() const { return mounted_; }

private:
    const std::string path_;
    const bool mounted_;
};

/// The user whose containers of a class the tests make.
inline std::uint32_t ownerOf(ContainerClass containerClass) {
    return isBundleClass(containerClass) ? 33 : isSystemClass(containerClass) ? 499 : mobile;
}

/// An error of the system's has a negative code.
inline ErrorCode codeOf(const ZORError& error) {
    return error.domain() == ErrorDomain::zor ? error.replyCode() : static_cast<ErrorCode>(-error.code());
}
template <typename T>
ErrorCode codeOf(const Result<T>& result) {
    return result ? ErrorCode::success : codeOf(result.error());
}

class World : public support::TestRoot {
public:
    struct Options {
        std::string parent = "/dev/shm";
        platform::Syncs syncs = platform::Syncs::off;
        int logLevel = logLevelNotice;
        fs::Durability::Probe probe = fs::orderingOfFileSystem;
        /// One that is furnished, and stays, in place of a new one below `parent`.
        std::string root = {};
        /// In place of its own; the sandbox's links are made on it too, and its queues run their jobs at once.
        platform::Disk* disk = nullptr;
        platform::BootMarker* marker = nullptr;
    };
    World() : World(Options()) {}
    explicit World(Options options);
    ~World();

    /// Ends the daemon's services and makes new ones, as a launch after a stop does. The disk stays.
    void restart();
    [[nodiscard]] Composition& services() { return *composition_; }
    [[nodiscard]] ZORClientConnection& daemonsClient() { return *composition_->sharedClientConnection(); }
    /// Reads what the services are made from, as they do when they are first asked for.
    void load() { (void)composition_->store(); }
    /// A client of one message.
    [[nodiscard]] std::shared_ptr<ZORClientConnection> client(ZORClientConnection::Client client) {
        return std::make_shared<ZORClientConnection>(composition_->store(), std::move(client));
    }
    [[nodiscard]] platform::LinuxPlatform& linux() { return *platform_; }
    /// The work of a boot before the daemon serves; a launch without a boot does the second half.
    void boot() {
        daemonsClient().rebootContainerManagerSetup();
        launch();
    }
    void launch() {
        daemonsClient().containerManagerSetup();
        drainDeathRow();
    }
    void reboot() {
        restart();
        boot();
    }
    void relaunch() {
        restart();
        launch();
    }
    /// Waits until everything queued for death row has run.
    void drainDeathRow() {
        std::promise<void> reached;
        deathRowQueue().async([&] { reached.set_value(); });
        reached.get_future().wait();
    }
    /// The code of one deletion pass.
    ErrorCode pass() {
        std::promise<ErrorCode> code;
        daemonsClient().deleteContainersOnDeathRowWithCompletion([&](ErrorCode c) { code.set_value(c); });
        const ErrorCode result = code.get_future().get();
        drainDeathRow();
        return result;
    }

    // Containers, by the daemon's own client; of mobile where the class does not say whose they are.
    Result<FoundContainer> create(const std::string& identifier, ContainerClass containerClass = application,
                                  bool transient = false, std::optional<std::uint32_t> userId = {}) {
        return daemonsClient().createOrLookupContainerForUser(userId.value_or(ownerOf(containerClass)), &identifier,
                                                              containerClass,
                                                              {.createIfNecessary = true, .transient = transient});
    }
    Result<FoundContainer> find(const std::string& identifier, ContainerClass containerClass = application,
                                bool transient = false) {
        return daemonsClient().createOrLookupContainerForUser(ownerOf(containerClass), &identifier, containerClass,
                                                              {.transient = transient});
    }
    FoundContainer make(const std::string& identifier, ContainerClass containerClass = application,
                        bool transient = false, std::optional<std::uint32_t> userId = {}) {
        return create(identifier, containerClass, transient, userId).value();
    }

    /// The code that answers a registration; without entitlements it ends one.
    ErrorCode entitle(const std::string& identifier, const std::optional<plist::Dictionary>& entitlements,
                      const plist::Dictionary& options = {}) {
        return composition_->store().entitlementChange.processEntitlements(entitlements ? &*entitlements : nullptr,
                                                                           &identifier, &options);
    }
    /// The code that answers the deletion of one container.
    ErrorCode stage(const FoundContainer& container) {
        const ZORMetadata& record = *container.record;
        return codeOf(daemonsClient().stageForDeleteContainersWithUsers(
            ZORClientConnection::DeletionBatch::of(record.uid(), container.uuid, record.identifier(),
                                                   record.containerClass()),
            UseLocking::yes));
    }

    // The disk below the root; paths are relative to it, or begin with it.
    void move(const std::string& from, const std::string& to) const { std::filesystem::rename(at(from), at(to)); }
    void link(const std::string& target, const std::string& place) const {
        std::filesystem::create_symlink(target, at(place));
    }
    [[nodiscard]] FileURL url(std::string_view relative) const { return FileURL::directory(path(relative)); }
    [[nodiscard]] std::string relative(const std::string& absolute) const { return absolute.substr(path().size() + 1); }
    /// The names under death row's unique directories, sorted.
    [[nodiscard]] std::vector<std::string> deathRow() const {
        std::vector<std::string> found;
        for (const std::string& unique : names(dead))
            for (std::string& name : names(dead + "/" + unique))
                found.push_back(std::move(name));
        std::ranges::sort(found);
        return found;
    }

    /// The new one takes the old one's place; nullptr: that of none.
    Result<void> replace(const FoundContainer* old, const FoundContainer& fresh,
                         ZORClientConnection::PreserveOldUUID preserve = ZORClientConnection::PreserveOldUUID::no);

    /// A container as an earlier launch left it: `relative` is its directory, made with its parents.
    void putContainer(std::string_view relative, const plist::Dictionary& metadata) const;

    /// A journal as a launch may find it: old, new, staging and destination, perhaps aside; empty ones are left out.
    void putJournal(const std::string& name, const std::array<std::string, 5>& places) const;

    support::RecordingLog log;
    support::SettableBuild internalBuild;
    FlagBootMarker bootMarker;
    support::SettableLockState lockState;
    CountingQueue lockStateQueue;
    FailingSandbox sandbox;
    support::FaultDisk& disk() { return faults_; }
    /// The disk refuses calls of one kind until it is disarmed.
    void refuse(support::DiskCall call, int error, support::FaultSpan span = support::FaultSpan::once) {
        faults_.arm({.error = error, .span = span, .filter = [call](const support::DiskCallInfo& info) {
                         return info.call == call;
                     }});
    }
    /// The level-3 messages of a function since the last look at the log, without their source lines.
    std::vector<std::string> complaints(std::string_view function) {
        std::vector<std::string> messages = log.take(3, function);
        std::ranges::transform(messages, messages.begin(), support::withoutSourceLine);
        return messages;
    }
    /// Classes under the lock state in the test's hand.
    platform::XattrProtectionClass& protection() { return *protection_; }

private:
    [[nodiscard]] std::string at(const std::string& place) const {
        return place.starts_with('/') ? place : path(place);
    }
    void start();
    [[nodiscard]] platform::WorkQueue& deathRowQueue() {
        return options_.disk ? immediately_ : platform_->roles().deathRowQueue;
    }

    const Options options_;
    platform::LinuxDisk realDisk_;
    support::FaultDisk faults_;
    ImmediateQueue immediately_;
    std::unique_ptr<platform::LinuxPlatform> platform_;
    std::unique_ptr<platform::LinkSandboxUserState> links_;
    std::unique_ptr<platform::XattrProtectionClass> protection_;
    std::unique_ptr<Composition> composition_;
};

/// The content of a metadata file.
inline plist::Dictionary metadataOf(std::uint64_t containerClass, std::uint32_t userId, const std::string& identifier,
                                    const std::string& uuid = "00000000-0000-4000-8000-000000000001") {
    return {{"ZORMetadataContentClass", containerClass},
            {"ZORMetadataPersona", userId},
            {"ZORMetadataIdentifier", identifier},
            {"ZORMetadataUUID", uuid}};
}
std::string binary(const plist::Value& value);
inline ZORClientConnection::ContainerAddress addressOf(const FoundContainer& container) {
    const ZORMetadata& record = *container.record;
    return {record.uid(), container.uuid, record.identifier(), record.containerClass()};
}
inline std::string nameOf(const std::string& path) {
    return path.substr(path.rfind('/') + 1);
}
inline std::string parentOf(const std::string& path) {
    return path.substr(0, path.rfind('/'));
}
inline bool isThere(const std::string& path) {
    return itemAt(path) != "missing";
}

/// The code and the description: "11 Can't act on". Empty for a success.
template <typename T>
std::string complaintOf(const Result<T>& result) {
    return result ? ""
                  : std::to_string(static_cast<std::int64_t>(codeOf(result))) + " " +
                        result.error().description().value_or("(null)");
}

} // namespace zor::test
