// SPDX-License-Identifier: Apache-2.0
// Any bytes as the entitlement file of a daemon: it starts, answers every question about every key, processes changes
// of them, and takes a change whose result the next daemon reads. Runs over one root in memory that lives as long as
// the fuzzer.
#include "daemon/Composition.h"
#include "daemon/LinuxPlatform.h"
#include "fs/Durability.h"
#include "fs/Trees.h"
#include "store/StorePlaces.h"

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <fcntl.h>
#include <memory>
#include <optional>
#include <source_location>
#include <string>
#include <sys/stat.h>
#include <unistd.h>

namespace {

using namespace zor;

void require(bool holds, std::source_location where = std::source_location::current()) {
    if (holds)
        return;
    std::fprintf(stderr, "line %u does not hold\n", where.line());
    std::abort();
}

class Silence final : public platform::PlatformLog {
public:
    bool open(std::string_view, int) override { return true; }
    [[nodiscard]] bool isOpen() const override { return true; }
    [[nodiscard]] int level() const override { return logLevelDebug; }
    void enableDiskLogging(const std::string&, unsigned, std::size_t) override {}
    void write(int, std::string_view, std::string_view) override {}
    void writeToSystemLog(int, std::string_view) override {}
};

class Device {
public:
    Device() : path_(makeRoot()), platform_(openPlatform(path_)) {
        library_ = path_ + "/private/var/root/Library/Zorvane";
        file_ = FileURL::file(library_ + "/" + names::entitlementFile);
        Composition(roles()).configuration().libraryDirectory();
    }
    ~Device() {
        const platform::FileDescriptor parent(::open("/dev/shm", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
        (void)fs::removeTree(platform_->roles().disk, parent.get(), path_.c_str() + path_.rfind('/') + 1);
    }
    Device(const Device&) = delete;
    Device& operator=(const Device&) = delete;

    void put(Composition& composition, std::span<const std::uint8_t> bytes) {
        const auto parent = composition.defaultManager().resolver().openParent(file_);
        require(parent &&
                !fs::replaceFileDurably(platform_->roles().disk, parent->directory.get(), parent->name, 0644, bytes));
        ::unlink((library_ + "/" + names::unreadableEntitlementFile).c_str());
    }
    [[nodiscard]] std::optional<plist::Dictionary> read(Composition& composition) {
        auto dictionary = readDictionaryAtURL(file_, std::size_t{1} << 26, composition.defaultManager());
        return dictionary ? std::optional(std::move(*dictionary)) : std::nullopt;
    }
    /// The platform's, with a log that keeps nothing.
    [[nodiscard]] platform::Platform roles() {
        const platform::Platform real = platform_->roles();
        return {.root = real.root,
                .disk = real.disk,
                .log = sink_,
                .internalBuild = real.internalBuild,
                .systemVersion = real.systemVersion,
                .passwords = real.passwords,
                .lockState = real.lockState,
                .protection = real.protection,
                .sandbox = real.sandbox,
                .assertions = real.assertions,
                .crash = real.crash,
                .bootMarker = real.bootMarker,
                .transactions = real.transactions,
                .deathRowQueue = real.deathRowQueue,
                .lockStateQueue = real.lockStateQueue,
                .runLoop = real.runLoop,
                .peers = real.peers,
                .listener = real.listener,
                .upcallPort = real.upcallPort};
    }

private:
    static std::string makeRoot() {
        char path[] = "/dev/shm/zorvane-fuzz.XXXXXX";
        require(::mkdtemp(path) != nullptr);
        std::string root = path;
        for (const char* directory :
             {"/private", "/private/var", "/private/var/root", "/private/var/brevad", "/etc", "/tmp"})
            require(::mkdir((root + directory).c_str(), 0755) == 0);
        const platform::FileDescriptor passwords(
            ::open((root + "/etc/passwd").c_str(), O_CREAT | O_WRONLY | O_CLOEXEC, 0644));
        require(passwords.valid());
        return root;
    }
    static std::unique_ptr<platform::LinuxPlatform> openPlatform(const std::string& root) {
        auto opened = platform::LinuxPlatform::open({.rootDirectory = root, .syncs = platform::Syncs::off});
        require(opened.has_value() && (*opened)->roles().deathRowQueue.start());
        return std::move(*opened);
    }

    Silence sink_;
    const std::string path_;
    std::unique_ptr<platform::LinuxPlatform> platform_;
    std::string library_;
    FileURL file_;
};

void ask(ZOREntitlementMapping& mapping, const std::string& key) {
    require(mapping.entitlementsExistForIdentifier(key));
    (void)mapping.identifierHasCallerRegisteredEntitlements(key);
    (void)mapping.identifierHasSystemContainer(key);
    if (const auto groups = mapping.appGroupIdentifiersForIdentifier(key))
        require(std::ranges::adjacent_find(*groups) == groups->end());
    if (const auto groups = mapping.systemGroupIdentifiersForIdentifier(key))
        for (const std::string& group : *groups)
            require(group.starts_with("systemgroup."));
}

/// Registers another group for a key and drops everything again.
void change(Composition& composition, const std::string& key) {
    EntitlementChange& change = composition.store().entitlementChange;
    const bool reserved = key == entitlementMapKeys::childPluginBundleIds ||
                          key == entitlementMapKeys::registeredByCaller || key == entitlementMapKeys::placeholder;
    const plist::Dictionary entitlements{{std::string(entitlementKeys::applicationGroups), plist::Array{"h"}}};
    const ErrorCode expected = reserved ? ErrorCode::invalidObject : ErrorCode::success;
    require(change.processEntitlements(&entitlements, &key, nullptr) == expected);
    require(change.processEntitlements(nullptr, &key, nullptr) == expected);
    require(reserved || !composition.entitlements().entitlementsExistForIdentifier(key));
}

void run(Device& device, std::span<const std::uint8_t> bytes) {
    Composition composition(device.roles());
    device.put(composition, bytes);
    const auto content = device.read(composition);
    ZOREntitlementMapping& mapping = composition.entitlements();
    require(mapping.lostFile().has_value() == !content.has_value());
    require(mapping.entryCount() == (content ? content->size() : 0));
    const plist::Dictionary value{{std::string(entitlementKeys::applicationGroups), "g"}};
    require(mapping._setEntitlementDictionaryValues({value}, {"added.by.the.fuzzer"}).has_value());
    int changes = 2;
    for (const auto& [key, entry] : content.value_or(plist::Dictionary()))
        ask(mapping, key);
    for (const auto& [key, entry] : content.value_or(plist::Dictionary()))
        if (key != "added.by.the.fuzzer" && --changes >= 0)
            change(composition, key);
    Composition next(device.roles());
    require(next.entitlements().entryCount() == mapping.entryCount());
    require(next.entitlements().appGroupIdentifiersForIdentifier("added.by.the.fuzzer") ==
            std::vector<std::string>{"g"});
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* bytes, std::size_t size) {
    static Device device;
    run(device, {bytes, size});
    return 0;
}
