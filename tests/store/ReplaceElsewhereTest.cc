// SPDX-License-Identifier: Apache-2.0
// Replace over several file systems: where the two containers, their home and staging lie apart.
#include "fs/Names.h"
#include "world/World.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/mount.h>
#include <thread>

namespace zor::test {
namespace {

using support::DiskCall;
using support::DiskCallInfo;
using support::FaultSpan;
using Preserve = ZORClientConnection::PreserveOldUUID;

// Goal: with the home on another file system nothing is copied to get out of the way, whatever its owner does
// meanwhile; where two names cannot be exchanged the replace succeeds all the same. Method: an old one with what no
// copy can make; an exchange, and the move after it, that are refused; a pass over the death row before the journal; an
// owner who swaps before the exchange.
TEST(ReplaceAtHome, ChangesPlaces) {
    enum class Row { plain, cannotExchange, passMeanwhile, cannotRename, swapped };
    if (!MountedHome::canBe())
        GTEST_SKIP() << "skipped: only root may mount a home";
    const std::string aside = std::string("private/var/mobile/") + fs::deathRowOuter + "/" + fs::asideInner;
    for (const Row row : {Row::plain, Row::cannotExchange, Row::passMeanwhile, Row::cannotRename, Row::swapped})
        for (const Preserve preserve : {Preserve::no, Preserve::yes}) {
            SCOPED_TRACE(std::to_string(static_cast<int>(row)) + (preserve == Preserve::yes ? " preserving" : ""));
            World world;
            const MountedHome home(world.path());
            ASSERT_TRUE(home.mounted());
            const FoundContainer old = world.make("id");
            const FoundContainer fresh = world.make("id", application, asTransient);
            const FoundContainer decoy = world.make("decoy");
            const auto contentAt = [&](const std::string& path) {
                return world.read(world.relative(path) + "/content");
            };
            world.write(world.relative(old.path) + "/content", "old");
            world.write(world.relative(fresh.path) + "/content", "new");
            ASSERT_TRUE(row == Row::cannotExchange || row == Row::passMeanwhile ||
                        ::mknod((old.path + "/whiteout").c_str(), S_IFCHR, 0) == 0);
            int moves = 0;
            world.disk().arm({.error = EINVAL, .span = FaultSpan::fromThenOn, .filter = [&](const DiskCallInfo& call) {
                                  if (call.subject != nameOf(old.path) + " -> " + nameOf(fresh.path))
                                      return false;
                                  ++moves;
                                  EXPECT_TRUE(row != Row::swapped || moves != 1 ||
                                              ::renameat2(AT_FDCWD, old.path.c_str(), AT_FDCWD, decoy.path.c_str(),
                                                          RENAME_EXCHANGE) == 0);
                                  return ((row == Row::cannotExchange || row == Row::passMeanwhile) && moves == 1) ||
                                         (row == Row::cannotRename && moves == 2);
                              }});
            bool hasPassed = row != Row::passMeanwhile;
            world.disk().before = [&](const DiskCallInfo& call) {
                if (call.call != DiskCall::createFile || !world.exists(aside) || std::exchange(hasPassed, true))
                    return;
                EXPECT_EQ(world.stage(decoy), ErrorCode::success);
                EXPECT_EQ(world.pass(), ErrorCode::success);
                EXPECT_FALSE(world.exists(aside));
            };
            const auto replaced = world.replace(&old, fresh, preserve);
            world.drainDeathRow();
            world.disk().before = nullptr;
            world.disk().disarm();
            EXPECT_TRUE(hasPassed);
            EXPECT_EQ(codeOf(replaced), row == Row::swapped ? ErrorCode::oldNotMovedToStaging : ErrorCode::success);
            if (row == Row::swapped) {
                EXPECT_EQ(contentAt(fresh.path), "new");
                EXPECT_EQ(contentAt(decoy.path), "old");
                EXPECT_EQ(world.find("id", application, asTransient).error().code(), 21);
            }
            for (int launch = 0; row != Row::swapped && launch < 2; ++launch) {
                const auto found = world.find("id");
                ASSERT_TRUE(found);
                EXPECT_EQ(found->uuid, preserve == Preserve::yes ? old.uuid : fresh.uuid);
                EXPECT_EQ(found->path == old.path, preserve == Preserve::yes || row == Row::cannotRename);
                EXPECT_EQ(contentAt(found->path), "new");
                EXPECT_FALSE(isThere(fresh.path));
                world.restart();
            }
            EXPECT_TRUE(world.names(staging).empty() && world.names(journals).empty());
        }
}

// Goal: nobody waits under the lock of all identifiers for the disk, wherever the two lie and whatever their file
// systems can, and the new content is there afterwards. Method: a table of places; at each call that waits, whether it
// is held.
TEST(ReplaceAnywhere, NothingWaitsUnderTheLock) {
    if (!MountedHome::canBe())
        GTEST_SKIP() << "skipped: only root may mount a home";
    constexpr ContainerClass system = ContainerClass::dataSystem;
    struct Row {
        fs::Ordering ordering;
        bool home;
        bool exchanges;
        bool oldIsTransient; // and the new one live
        ContainerClass containerClass;
        bool classIsMounted; // so that the new one lies elsewhere
    };
    const Row rows[] = {{fs::Ordering::journal, false, true, false, application, false},
                        {fs::Ordering::none, false, true, false, application, false},
                        {fs::Ordering::journal, true, true, false, application, false},
                        {fs::Ordering::journal, true, false, false, application, false},
                        {fs::Ordering::none, true, false, false, application, false},
                        {fs::Ordering::none, true, true, true, application, false},
                        {fs::Ordering::none, false, true, false, system, true},
                        {fs::Ordering::journal, false, true, true, system, true}};
    for (const Row& row : rows)
        for (const Preserve preserve : {Preserve::no, Preserve::yes}) {
            SCOPED_TRACE(std::to_string(&row - rows) + (preserve == Preserve::yes ? " preserving" : ""));
            World world({.probe = row.ordering == fs::Ordering::none ? [](int) { return fs::Ordering::none; }
                                                                     : [](int) { return fs::Ordering::journal; }});
            std::optional<MountedHome> home;
            ASSERT_TRUE(!row.home || home.emplace(world.path()).mounted());
            const std::string mount = world.path("private/var/containers/Data/System");
            if (row.classIsMounted) {
                world.makeDirectories("private/var/containers/Data/System");
                ASSERT_EQ(::mount("class", mount.c_str(), "tmpfs", 0, "mode=0755"), 0);
            }
            const FoundContainer old = world.make("id", row.containerClass, row.oldIsTransient);
            const FoundContainer fresh = world.make("id", row.containerClass, !row.oldIsTransient);
            world.write(world.relative(fresh.path) + "/content", "new");
            const ZORLocks& locks = world.services().locks();
            world.disk().before = [&, here = std::this_thread::get_id()](const DiskCallInfo& call) {
                using enum DiskCall;
                const bool waits = call.call == sync || call.call == syncFileSystem || call.call == orderData ||
                                   call.call == write || call.call == createFile || call.call == copyData;
                if (std::this_thread::get_id() != here || !locks.allAreHeldForWriting())
                    return;
                EXPECT_FALSE(waits) << call.describe();
                EXPECT_FALSE(call.call == rename && locks.quietGeneration("id")) << call.describe();
            };
            world.disk().arm({.error = EINVAL, .filter = [&](const DiskCallInfo& call) {
                                  return !row.exchanges &&
                                         call.subject == nameOf(old.path) + " -> " + nameOf(fresh.path);
                              }});
            EXPECT_EQ(complaintOf(world.replace(&old, fresh, preserve)), "");
            world.disk().disarm();
            world.disk().before = nullptr;
            EXPECT_EQ(world.pass(), ErrorCode::success);
            for (int launch = 0; launch < 2; ++launch) {
                const std::string identifier = "id";
                const auto found = world.services().cache().containerForUser(
                    ownerOf(row.containerClass), row.containerClass, &identifier, row.oldIsTransient);
                ASSERT_TRUE(found) << found.error().text();
                EXPECT_EQ((*found)->uuid(), preserve == Preserve::yes ? old.uuid : fresh.uuid);
                EXPECT_EQ(world.read(world.relative((*found)->url().path()) + "/content"), "new");
                EXPECT_FALSE(isThere(fresh.path) && fresh.path != (*found)->url().path());
                world.relaunch();
            }
            EXPECT_TRUE(world.names(staging).empty() && world.names(journals).empty());
            EXPECT_FALSE(world.exists(std::string("private/var/mobile/") + fs::deathRowOuter));
            if (row.classIsMounted)
                ::umount2(mount.c_str(), MNT_DETACH);
        }
}

} // namespace
} // namespace zor::test
