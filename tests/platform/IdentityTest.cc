// SPDX-License-Identifier: Apache-2.0
// Peers are real processes that run copies of real programs; the registry is files in a root of the test's own.
#include "os/EpollRunLoop.h"
#include "platform/PeerProcess.h"
#include "support/ProcessResources.h"

#include <algorithm>
#include <atomic>
#include <functional>

namespace zor::platform {
namespace {

// A peer is what the registry says of its program, and stops being that: by executing another one, registered or not,
// by exiting.
TEST(PeerIdentity, EndsWithTheProgramAndTheProcess) {
    PeerWorld world;
    world.registerAs("a.plist", "agent", "agent", "<key>Entitlements</key><dict><key>k</key><true/></dict>");
    world.registerAs("b.plist", "sleeper", "sleeper");
    PeerProcess process(world.server, world.program("agent"));
    const auto peer = world.peerOf(process);
    EXPECT_EQ(peer->pid(), process.pid());
    EXPECT_EQ(peer->kernelUserId(), ::geteuid());
    const Identity first = peer->identify(Peer::Explain::no);
    ASSERT_TRUE(first.grant && first.grant->entitlements);
    EXPECT_EQ(first.grant->identifier, "agent");
    EXPECT_TRUE(first.grant->entitlements->isTrue("k"));
    EXPECT_EQ(first.explanation, "");
    EXPECT_EQ(peer->identify(Peer::Explain::no).grant, first.grant) << "an unchanged peer gets the same object";
    EXPECT_EQ(peer->identify(Peer::Explain::yes).explanation, "a.plist: matches");
    process.execute(world.program("sleeper"));
    EXPECT_EQ(who(*peer), "-");
    EXPECT_EQ(peer->identify(Peer::Explain::yes).explanation,
              "the process has executed another program since it connected");
    PeerProcess ends(world.server, world.program("agent"));
    const auto ending = world.peerOf(ends);
    EXPECT_EQ(who(*ending), "agent");
    ends.kill();
    EXPECT_TRUE(eventually([&] { return who(*ending) == "-"; })) << "one that has ended, though not yet waited for";
    ends.end();
    EXPECT_EQ(who(*ending), "-");
    EXPECT_EQ(ending->identify(Peer::Explain::yes).explanation, "the process has ended");
    const PeerProcess stranger(world.server, world.program("other"));
    const auto unknown = world.peerOf(stranger);
    EXPECT_EQ(who(*unknown), "-");
    EXPECT_EQ(unknown->identify(Peer::Explain::yes).explanation, "no entry names " + world.program("other"));
}

// Whoever connects and is gone before its peer is asked for is nobody, and its pid is not looked up again.
TEST(PeerIdentity, IsNobodyWhoWasGoneBeforeTheAccept) {
    PeerWorld world;
    world.registerAs("a.plist", "agent", "agent");
    PeerProcess process(world.server, world.program("agent"));
    process.end();
    const auto peer = world.peerOf(process);
    ASSERT_TRUE(peer);
    EXPECT_EQ(who(*peer), "-");
    int pair[2] = {};
    ASSERT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair), 0);
    EXPECT_TRUE(world.identity.peerOfSocket(pair[0]));
    ::close(pair[0]);
    ::close(pair[1]);
    EXPECT_FALSE(world.identity.peerOfSocket(-1));
}

// Files are looked at in the order of their names, the first that matches counts, and fences hold: for a peer that is a
// user (501 when the test is root) and one that owns the root.
TEST(PeerIdentity, TakesTheFirstEntryThatMatches) {
    const uid_t userUid = ::geteuid() == 0 ? 501 : ::geteuid();
    const std::string powers =
        "<key>Entitlements</key><dict><key>com.veltra.private.Zorvane.allowed</key><true/></dict>";
    const std::string label = "<key>SecurityLabel</key><string>no label of any system</string>";
    const std::string unit = "<key>Unit</key><string>no-such-unit-anywhere.service</string>";
    const std::string uids = "<key>UserIDs</key><array><integer>" + std::to_string(userUid) + "</integer></array>";
    for (const PeerIs kind : {PeerIs::user, PeerIs::owner}) {
        const bool owns = kind == PeerIs::owner;
        PeerWorld world(kind, userUid);
        world.registerAs("00-other.plist", "other", "wrong program");
        world.registerAs("10-label.plist", "agent", "wrong label", label);
        world.registerAs("20-unit.plist", "agent", "wrong unit", unit);
        world.registerAs("30-powers.plist", "agent", "owner", powers);
        world.registerAs("40-uids.plist", "agent", "user", uids);
        world.registerAs("50-any.plist", "agent", "too late");
        const PeerProcess process(world.server, world.program("agent"), {.uid = userUid});
        const auto peer = world.peerOf(process);
        EXPECT_EQ(who(*peer), owns ? "owner" : "user");
        EXPECT_EQ(peer->identify(Peer::Explain::no).effectiveUserId, owns ? 0U : userUid);
        EXPECT_EQ(peer->kernelUserId(), userUid);
        EXPECT_EQ(world.identity.ownsRoot(userUid), owns);
        EXPECT_TRUE(world.identity.ownsRoot(0));
    }
}

// Entries of one identifier keep their own powers, and each tells what they grant together, also when another changes.
TEST(IdentityRegistry, UnitesTheEntriesOfAnIdentifier) {
    PeerWorld world;
    const auto entitled = [](const std::string& body) { return "<key>Entitlements</key><dict>" + body + "</dict>"; };
    const auto groups = [](const std::string& name) {
        return "<key>groups</key><array><string>" + name + "</string><string>both</string></array>";
    };
    world.registerAs("a.plist", "sleeper", "app", entitled(groups("a") + "<key>power</key><true/>"));
    world.registerAs("b.plist", "agent", "app", entitled(groups("b") + "<key>one</key><string>x</string>"));
    const PeerProcess process(world.server, world.program("agent"));
    const auto peer = world.peerOf(process);
    const auto together = [&] { return peer->identify(Peer::Explain::no).grant->identifierEntitlements; };
    EXPECT_EQ(together(),
              (plist::Dictionary{{"groups", plist::Array{"a", "both", "b"}}, {"one", "x"}, {"power", true}}));
    EXPECT_FALSE(peer->identify(Peer::Explain::no).grant->entitlements->isTrue("power"));
    world.registerAs("a.plist", "sleeper", "app", entitled("<key>groups</key><string>c</string>"));
    world.registry.takeNotices();
    EXPECT_EQ(together(), (plist::Dictionary{{"groups", plist::Array{"c", "b", "both"}}, {"one", "x"}}));
    const auto grant = peer->identify(Peer::Explain::no).grant;
    world.registerAs("c.plist", "other", "unrelated");
    world.registry.takeNotices();
    EXPECT_EQ(peer->identify(Peer::Explain::no).grant, grant);
    world.registerAs("a.plist", "sleeper", "else");
    world.registry.takeNotices();
    EXPECT_EQ(together(), std::nullopt);
}

// What could have been put there by others, or could hold up the reader, is ignored and said once.
TEST(IdentityRegistry, IgnoresWhatMayBeForged) {
    PeerWorld world;
    const auto placeFor = [&](const std::string& file) { return world.test.path(PeerWorld::pathOf(file)); };
    const auto write = [&](const std::string& file, const std::string& text, mode_t mode = 0644) {
        world.test.write(PeerWorld::pathOf(file), text, mode);
        return placeFor(file);
    };
    world.registerAs("good.plist", "agent", "good");
    write("a-world.plist", world.named("agent", "world-writable"), 0646);
    write("a-group.plist", world.named("agent", "group-writable"), 0664);
    world.test.write("elsewhere.plist", world.named("agent", "linked"));
    ASSERT_EQ(::symlink(world.test.path("elsewhere.plist").c_str(), placeFor("a-link.plist").c_str()), 0);
    ASSERT_EQ(::mkfifo(placeFor("a-fifo.plist").c_str(), 0644), 0);
    ASSERT_EQ(::mkdir(placeFor("a-directory.plist").c_str(), 0755), 0);
    write("a-damaged.plist", "<plist><dict>");
    write("a-large.plist", world.entry("agent") + std::string(RegistryDirectory::fileBytesMax, ' '));
    write(".hidden.plist", world.named("agent", "hidden"));
    write("README", "no registry file");
    std::size_t ignored = 7;
    if (::geteuid() == 0) {
        ASSERT_EQ(::chown(write("a-owner.plist", world.named("agent", "foreign")).c_str(), 501, 0), 0);
        ++ignored;
    } else {
        std::puts("a file of another owner was skipped: not root");
    }
    const PeerProcess process(world.server, world.program("agent"));
    const auto peer = world.peerOf(process);
    EXPECT_EQ(who(*peer), "good");
    EXPECT_EQ(world.registry.snapshot()->entries.size(), 1U);
    const auto lines = world.log.take();
    EXPECT_EQ(lines.size(), ignored);
    for (const support::LogLine& line : lines)
        EXPECT_TRUE(line.message.starts_with("a-")) << line;
    write("zz.plist", world.entry("other"));
    world.registry.takeNotices();
    EXPECT_EQ(who(*peer), "good");
    EXPECT_EQ(world.registry.snapshot()->entries.size(), 2U);
    EXPECT_TRUE(world.log.take().empty()) << "what was said is not said again";
    // Files of which none is too large, and all together are.
    for (int i = 100; i <= 164; ++i)
        std::filesystem::resize_file(write("zzz" + std::to_string(i) + ".plist", ""), RegistryDirectory::fileBytesMax);
    world.registry.takeNotices();
    EXPECT_EQ(who(*peer), "good");
    EXPECT_TRUE(std::ranges::any_of(world.log.take(), [](const support::LogLine& line) {
        return line.message.ends_with(" is ignored: all files together are too large");
    }));
    // The directory itself.
    ASSERT_EQ(::chmod(world.test.path(names::identityDirectory).c_str(), 0777), 0);
    world.registry.takeNotices();
    EXPECT_EQ(who(*peer), "-");
    EXPECT_EQ(world.log.take().size(), 1U);
}

// Every way of changing the registry or an executable reaches a live connection through the loop.
TEST(IdentityRegistry, FollowsChanges) {
    PeerWorld world;
    EpollRunLoop loop;
    ASSERT_TRUE(world.registry.follow(loop));
    std::thread runner([&] { loop.run(); });
    const PeerProcess process(world.server, world.program("agent"));
    const auto peer = world.peerOf(process);
    EXPECT_EQ(who(*peer), "-") << "there is no registry yet";
    const auto rename = [&](const std::string& from, const std::string& to) {
        std::filesystem::rename(world.test.path(from), world.test.path(to));
    };
    const std::string file = PeerWorld::pathOf("a.plist");
    struct Step {
        const char* what;
        std::function<void()> change;
        std::string expected;
    };
    const Step steps[] = {
        {"the first file", [&] { world.registerAs("a.plist", "agent", "made"); }, "made"},
        {"another by rename", [&] { world.registerAs("a.plist", "agent", "replaced"); }, "replaced"},
        {"in place", [&] { world.test.write(file, world.named("agent", "rewritten")); }, "rewritten"},
        {"a bad mode", [&] { ::chmod(world.test.path(file).c_str(), 0666); }, "-"},
        {"a good mode", [&] { ::chmod(world.test.path(file).c_str(), 0644); }, "rewritten"},
        {"the program goes", [&] { rename("agent", "agent.old"); }, "-"},
        {"another program of the name", [&] { copyProgram("/bin/sh", world.program("agent")); }, "-"},
        {"the program comes back", [&] { rename("agent.old", "agent"); }, "rewritten"},
        {"the directory goes", [&] { rename("etc/zorvane", "etc/old"); }, "-"},
        {"another directory", [&] { world.registerAs("b.plist", "agent", "again"); }, "again"},
        {"no file", [&] { std::filesystem::remove(world.test.path(PeerWorld::pathOf("b.plist"))); }, "-"},
    };
    for (const Step& step : steps) {
        const std::uint64_t before = world.registry.generation();
        step.change();
        EXPECT_TRUE(eventually([&] { return world.registry.generation() != before && who(*peer) == step.expected; }))
            << step.what;
    }
    loop.stop();
    runner.join();
    world.registry.unfollow(loop);
}

// A new peer finds what was registered just before it came, also through a link, and nothing is leaked.
TEST(IdentityRegistry, KnowsWhatWasRegisteredJustNow) {
    PeerWorld world;
    world.test.makeDirectories("versions/1");
    for (int i = 0; i < 5; ++i) {
        const std::string name = "program" + std::to_string(i);
        copyProgram("/bin/sh", world.program("versions/1/" + name));
        ASSERT_EQ(::symlink(("versions/1/" + name).c_str(), world.program(name).c_str()), 0);
        const PeerProcess process(world.server, world.program("versions/1/" + name));
        world.registerAs(name + ".plist", name, name);
        EXPECT_EQ(who(*world.peerOf(process)), name);
        const support::ProcessResources before;
        for (const std::string& next : {name + "a", name + "b", name + "c", name + "d"}) {
            world.registerAs(name + ".plist", name, next);
            EXPECT_EQ(who(*world.peerOf(process)), next);
        }
        EXPECT_EQ(before.leakedSince(), "");
    }
}

// Many threads ask while files change: each grant is one that was written, and everybody sees the last.
TEST(IdentityRegistry, ServesThreadsWhileItChanges) {
    PeerWorld world;
    world.registerAs("a.plist", "agent", "even");
    const PeerProcess process(world.server, world.program("agent"));
    std::atomic<bool> stop{false};
    std::atomic<int> wrong{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < 3; ++t)
        threads.emplace_back([&] {
            const auto peer = world.peerOf(process);
            while (!stop) {
                const std::string now = who(*peer);
                wrong += now == "even" || now == "odd" || now == "last" ? 0 : 1;
            }
            wrong += eventually([&] { return who(*peer) == "last"; }) ? 0 : 1;
        });
    for (int i = 0; i < 60; ++i) {
        world.registerAs("a.plist", "agent", i % 2 == 0 ? "even" : "odd");
        world.registry.takeNotices();
    }
    stop = true;
    world.registerAs("a.plist", "agent", "last");
    for (std::thread& thread : threads)
        thread.join();
    EXPECT_EQ(wrong, 0);
}

} // namespace
} // namespace zor::platform
