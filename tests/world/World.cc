// SPDX-License-Identifier: Apache-2.0
#include "world/World.h"

#include "plist/Codec.h"

#include <sched.h>
#include <stdexcept>
#include <sys/mount.h>
#include <unistd.h>

namespace zor::test {

namespace {

bool canGiveAway() {
    return ::geteuid() == 0;
}

platform::Platform withRoles(const platform::Platform& real, World& world, platform::BootMarker& marker,
                             platform::WorkQueue& deathRowQueue) {
    return {.root = real.root,
            .users = real.users,
            .disk = world.disk(),
            .log = world.log,
            .internalBuild = world.internalBuild,
            .systemVersion = real.systemVersion,
            .passwords = real.passwords,
            .lockState = world.lockState,
            .protection = world.protection(),
            .sandbox = world.sandbox,
            .assertions = real.assertions,
            .crash = real.crash,
            .bootMarker = marker,
            .transactions = real.transactions,
            .deathRowQueue = deathRowQueue,
            .lockStateQueue = world.lockStateQueue,
            .runLoop = real.runLoop,
            .peers = real.peers,
            .listener = real.listener,
            .upcallPort = real.upcallPort};
}

void require(bool done, const std::string& what) {
    if (!done)
        throw std::runtime_error("the test's world: " + what + ": " + std::to_string(errno));
}

} // namespace

std::string directoryOf(std::uint32_t owner, mode_t mode) {
    char text[96];
    std::snprintf(text, sizeof text, "directory %04o %u:%u", static_cast<unsigned>(mode),
                  canGiveAway() ? owner : ::geteuid(), canGiveAway() ? owner : ::getegid());
    return text;
}

bool MountedHome::canBe() {
    static const bool can =
        ::unshare(CLONE_NEWNS) == 0 && ::mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) == 0;
    return can;
}

MountedHome::MountedHome(const std::string& root)
    : path_(root + "/private/var/mobile"),
      mounted_(canBe() && ::mount("home", path_.c_str(), "tmpfs", 0, "mode=0755,uid=501,gid=501") == 0) {}

MountedHome::~MountedHome() {
    if (mounted_)
        ::umount2(path_.c_str(), MNT_DETACH);
}

World::World(Options options)
    : TestRoot(options.parent, options.root), log(options.logLevel), options_(std::move(options)),
      realDisk_(options_.syncs), faults_(options_.disk ? *options_.disk : realDisk_) {
    if (options_.root.empty())
        furnish(path());
    start();
}

World::~World() {
    platform_->finish();
}

void World::start() {
    auto opened = platform::LinuxPlatform::open({.rootDirectory = path(), .syncs = options_.syncs});
    require(opened.has_value(), "no platform");
    platform_ = std::move(*opened);
    const platform::Platform roles = platform_->roles();
    lockStateQueue.inner = options_.disk ? &immediately_ : &roles.lockStateQueue;
    require(lockStateQueue.start() && deathRowQueue().start(), "no thread");
    if (options_.disk)
        links_ = std::make_unique<platform::LinkSandboxUserState>(platform_->root(), *options_.disk);
    sandbox.inner = links_ ? links_.get() : &roles.sandbox;
    protection_ = std::make_unique<platform::XattrProtectionClass>(faults_, lockState);
    composition_ = std::make_unique<Composition>(
        withRoles(roles, *this, options_.marker ? *options_.marker : bootMarker, deathRowQueue()), options_.probe);
}

void World::restart() {
    platform_->finish();
    composition_.reset();
    protection_.reset();
    platform_.reset();
    start();
}

void World::putContainer(std::string_view relative, const plist::Dictionary& metadata) const {
    makeDirectories(relative);
    write(std::string(relative) + "/" + names::metadataFile, binary(metadata));
    const plist::Value* const user = metadata.find("ZORMetadataPersona");
    const uid_t owner = user ? static_cast<uid_t>(user->asUnsigned().value_or(0)) : 0;
    if (owner > 500 && ::geteuid() == 0)
        require(::chown(path(relative).c_str(), owner, owner) == 0, "chown");
}

void World::putJournal(const std::string& name, const std::array<std::string, 5>& places) const {
    const std::array keys = {"ZORReplaceOperationOldURL", "ZORReplaceOperationNewURL", "ZORReplaceOperationStagingURL",
                             "ZORReplaceOperationDestURL", "ZORReplaceOperationAsideURL"};
    plist::Dictionary content;
    for (std::size_t i = 0; i < keys.size(); ++i)
        if (!places[i].empty())
            content.set(keys[i], at(places[i]));
    write(journals + "/" + name + ".plist", binary(content));
}

Result<void> World::replace(const FoundContainer* old, const FoundContainer& fresh,
                            ZORClientConnection::PreserveOldUUID preserve) {
    ZORClientConnection::ReplaceRequest request{.newUuid = fresh.uuid,
                                                .userIdNew = fresh.record->uid(),
                                                .identifierNew = fresh.record->identifier(),
                                                .classNew = fresh.record->containerClass(),
                                                .preserveOldUuid = preserve};
    if (old) {
        request.oldUuid = old->uuid;
        request.userIdOld = old->record->uid();
        request.identifierOld = old->record->identifier();
        request.classOld = old->record->containerClass();
    }
    return daemonsClient().replaceContainer(request, StartDeletionThread::no);
}

std::string binary(const plist::Value& value) {
    const auto bytes = plist::writeBinary(value);
    require(bytes.has_value(), "value that cannot be written");
    return {bytes->begin(), bytes->end()};
}

} // namespace zor::test
