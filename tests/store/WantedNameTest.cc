// SPDX-License-Identifier: Apache-2.0
// The fate of another's directory that is renamed to a name which the daemon wants: whoever may write the directory
// above can do that, also where he may not look inside.
#include "world/World.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

namespace zor::test {
namespace {

struct Row {
    std::string what;
    std::uint32_t owner;
    /// Below the root; "APP" and "GROUP" stand for two containers.
    std::string wanted;
    std::function<ErrorCode(World&)> request;
    ErrorCode code = ErrorCode::success;
};

std::function<ErrorCode(World&)> creating(bool transient) {
    return [transient](World& world) { return codeOf(world.create("com.example.new", application, transient)); };
}

std::function<ErrorCode(World&)> repairing(const char* identifier, ContainerClass containerClass) {
    return [=](World& world) {
        const auto found = world.find(identifier, containerClass);
        return codeOf(world.daemonsClient().recreateDefaultStructureForUser(addressOf(*found)));
    };
}

ErrorCode renaming(World& world) {
    return codeOf(world.daemonsClient().regenerateDirectoryUUIDForUser(addressOf(*world.find("app"))));
}

ErrorCode measuring(World& world) {
    const auto measured = world.daemonsClient().diskUsageForUserId(addressOf(*world.find("app")));
    EXPECT_EQ(measured.bytes, 0U);
    return measured.error;
}

ErrorCode replacing(World& world) {
    const auto old = world.find("app");
    const auto fresh = world.make("app", application, asTransient);
    return codeOf(world.replace(&*old, fresh));
}

ErrorCode booting(World& world) {
    world.reboot();
    return ErrorCode::success;
}

/// A replace that had stopped after its first move.
ErrorCode recovering(World& world) {
    const std::string name = UUID::random().string();
    const std::string old = applications + "/" + UUID::random().string();
    world.makeDirectories(staging + "/" + name);
    world.putJournal(name, {old, transients + "/" + name, staging + "/" + name, old});
    const auto recovered = world.daemonsClient()._recoverFromReplaceOperationsWithError();
    EXPECT_TRUE(world.exists(staging + "/" + name));
    return codeOf(recovered);
}

/// Exchanges the class directory with the other one when the container is about to move in.
ErrorCode exchanging(World& world) {
    const std::string aside = world.path("private/var/mobile/aside");
    const std::string wanted = world.path(applications);
    world.move(wanted, aside);
    bool done = false;
    world.disk().arm({.filter = [&](const support::DiskCallInfo& call) {
        if (call.call == support::DiskCall::rename && call.subject.find(" -> ") == 36 && !done)
            done = ::renameat2(AT_FDCWD, wanted.c_str(), AT_FDCWD, aside.c_str(), RENAME_EXCHANGE) == 0;
        return false;
    }});
    const ErrorCode code = creating(false)(world);
    world.disk().disarm();
    EXPECT_TRUE(done);
    return code;
}

// Goal: it stays its owner's, as closed as it was, and nothing comes into it or goes. Method: each wanted name, each
// kind of owner, and the requests and launches that want it.
TEST(WantedName, GivesNothingAway) {
    if (::geteuid() != 0)
        GTEST_SKIP() << "skipped: needs root for directories of several users";
    constexpr ContainerClass group = ContainerClass::sharedSystemGroup;
    const ErrorCode notMoved = ErrorCode::moveToLiveFailed;
    const ErrorCode notMade = ErrorCode::subdirectoryFailed;
    const std::string temp = std::string(mobileCaches) + "/Temp";
    const Row rows[] = {
        {"base", 0, mobileContainers, creating(false), notMoved},
        {"base at boot", 0, mobileContainers, booting},
        {"on the way", second, std::string(mobileContainers) + "/Data", creating(false), notMoved},
        {"on the way, of root's", 0, std::string(mobileContainers) + "/Data", creating(false), notMoved},
        {"class", second, applications, creating(false), notMoved},
        {"class of root's", 0, applications, creating(false), notMoved},
        {"class at boot", second, applications, booting},
        {"class meanwhile", second, applications, exchanging},
        {"class of what comes back", second, applications, recovering, ErrorCode::journalUnusable},
        {"transient base", 0, temp, creating(true), notMoved},
        {"transient class", second, transients, creating(true), notMoved},
        {"container", second, "APP", repairing("app", application), notMade},
        {"container's name", 0, "APP", renaming, ErrorCode::directoryNotRenamed},
        {"container's size", second, "APP", measuring},
        {"container that is replaced", 0, "APP", replacing, ErrorCode::oldNotMovedToStaging},
        {"subdirectory", 0, "APP/Documents", repairing("app", application), notMade},
        {"subdirectory's", second, "APP/Library/Caches", repairing("app", application), notMade},
        {"group's", second, "GROUP/Library/Caches", repairing("systemgroup.x", group), notMade},
        {"group's of root's", 0, "GROUP/Library/Caches", repairing("systemgroup.x", group)},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.what);
        World world;
        std::string wanted = row.wanted;
        const auto place = [&](const std::string& word, const FoundContainer& container) {
            if (wanted.starts_with(word))
                wanted.replace(0, word.size(), world.relative(container.path));
        };
        place("APP", world.make("app"));
        place("GROUP", world.make("systemgroup.x", group));
        world.make("app", application, asTransient);
        world.move(wanted, "private/var/mobile/other");
        world.makeDirectories(wanted, row.owner, 0700);
        world.write(wanted + "/sub/secret", "s", 0600);
        world.write(wanted + "/Data/file", "s", 0600);
        world.write(wanted + "/" + names::metadataFile, "", 0600);
        const std::string before = support::readTree(world.path(wanted)).describe();
        EXPECT_EQ(row.request(world), row.code);
        EXPECT_EQ(world.item(wanted), directoryOf(row.owner, 0700));
        EXPECT_EQ(support::readTree(world.path(wanted)).describe(), before);
    }
}

} // namespace
} // namespace zor::test
