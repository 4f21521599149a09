// SPDX-License-Identifier: Apache-2.0
// Any bytes as the entitlement file of a daemon: it starts, answers every question about every key, and takes a change
// whose result the next daemon reads. Runs over one root in memory that lives as long as the fuzzer.
#include "entitlements/ZOREntitlementMapping.h"
#include "fs/AtomicFile.h"
#include "fs/DictionaryFile.h"
#include "fs/RecursiveRemove.h"
#include "platform/linux/FileDeviceLockState.h"
#include "platform/linux/LinuxDisk.h"
#include "platform/linux/LinuxPasswordDatabase.h"
#include "platform/linux/SystemRoot.h"
#include "platform/linux/XattrProtectionClass.h"
#include "store/Names.h"

#include <algorithm>
#include <cstdlib>
#include <fcntl.h>
#include <optional>
#include <string>
#include <sys/stat.h>
#include <unistd.h>

namespace {

using namespace zor;

void require(bool holds) {
    if (!holds)
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
    Device() : root_(makeRoot()) {
        require(root_.makeRuntimeDirectory(disk_) == 0);
        library_ = root_.path("/private/var/root/Library/Zorvane");
        file_ = FileURL::file(library_ + "/" + names::entitlementFile);
        configuration_.libraryDirectory();
    }
    ~Device() {
        const platform::FileDescriptor parent(::open("/dev/shm", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
        const std::string& path = root_.canonicalPath();
        (void)fs::removeTree(disk_, parent.get(), path.c_str() + path.rfind('/') + 1);
    }
    Device(const Device&) = delete;
    Device& operator=(const Device&) = delete;

    void put(std::span<const std::uint8_t> bytes) {
        const auto parent = fileManager_.resolver().openParent(file_);
        require(parent && fs::replaceFileDurably(disk_, parent->directory.get(), parent->name, 0644, bytes) == 0);
        ::unlink((library_ + "/" + names::unreadableEntitlementFile).c_str());
    }
    [[nodiscard]] std::optional<plist::Dictionary> read() {
        auto dictionary = readDictionaryAtURL(file_, std::size_t{1} << 26, fileManager_);
        return dictionary ? std::optional(std::move(*dictionary)) : std::nullopt;
    }

    Silence sink;
    Log log{sink};

private:
    static platform::SystemRoot makeRoot() {
        char path[] = "/dev/shm/zorvane-fuzz.XXXXXX";
        require(::mkdtemp(path) != nullptr);
        const std::string root = path;
        for (const char* directory : {"/private", "/private/var", "/private/var/root"})
            require(::mkdir((root + directory).c_str(), 0755) == 0);
        auto opened = platform::SystemRoot::open(root);
        require(opened.has_value());
        return std::move(*opened);
    }

    platform::LinuxDisk disk_{platform::Syncs::off};
    platform::SystemRoot root_;
    platform::FileDeviceLockState lockState_{root_};
    platform::XattrProtectionClass protection_{root_, disk_, lockState_};
    platform::LinuxPasswordDatabase passwords_{root_};
    ZORFileManager fileManager_{log, root_, disk_, protection_};
    ZORGlobalConfiguration configuration_{log, fileManager_, passwords_};
    std::string library_;
    FileURL file_;

    friend void run(Device&, std::span<const std::uint8_t>);
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

void run(Device& device, std::span<const std::uint8_t> bytes) {
    device.put(bytes);
    const auto content = device.read();
    ZOREntitlementMapping mapping(device.log, device.fileManager_, device.configuration_);
    require(mapping.lostFile().has_value() == !content.has_value());
    require(mapping.entryCount() == (content ? content->size() : 0));
    if (content)
        for (const auto& [key, value] : *content)
            ask(mapping, key);
    const plist::Dictionary value{{"com.veltra.security.application-groups", "g"}};
    require(mapping._setEntitlementDictionaryValues({value}, {"added.by.the.fuzzer"}).has_value());
    ZOREntitlementMapping next(device.log, device.fileManager_, device.configuration_);
    require(next.entryCount() == mapping.entryCount());
    require(next.appGroupIdentifiersForIdentifier("added.by.the.fuzzer") == std::vector<std::string>{"g"});
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* bytes, std::size_t size) {
    static Device device;
    run(device, {bytes, size});
    return 0;
}
