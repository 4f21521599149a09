// SPDX-License-Identifier: Apache-2.0
// Peers are real processes that run copies of real programs; the registry is files in a root of the test's own.
#include "platform/PeerProcess.h"
#include "platform/linux/EpollRunLoop.h"
#include "platform/linux/LinuxPeerIdentity.h"
#include "platform/linux/Names.h"
#include "support/ProcessResources.h"

#include <algorithm>
#include <atomic>
#include <functional>

namespace zor::platform {
namespace {

class KeptLog final : public PlatformLog {
public:
    bool open(std::string_view, int) override { return true; }
    [[nodiscard]] bool isOpen() const override { return true; }
    [[nodiscard]] int level() const override { return 7; }
    void enableDiskLogging(const std::string&, unsigned, std::size_t) override {}
    void writeToSystemLog(int, std::string_view) override {}
    void write(int, std::string_view, std::string_view message) override {
        const MutexLock lock(mutex_);
        lines_.emplace_back(message);
    }
    [[nodiscard]] std::vector<std::string> take() {
        const MutexLock lock(mutex_);
        return std::exchange(lines_, {});
    }

private:
    Mutex mutex_;
    std::vector<std::string> lines_ ZOR_GUARDED_BY(mutex_);
};

/// Whom a peer's own uid counts as: the owner of the root, or some user.
enum class PeerIs { owner, user };

struct World {
    explicit World(PeerIs peers = PeerIs::user, uid_t peerUid = ::geteuid())
        // A peer counts as the owner when its uid is the daemon's. uid 0 always does.
        : identity(registry, peers == PeerIs::owner ? peerUid : peerUid + 1000) {
        copyProgram("/bin/sh", test.path("agent"));
        copyProgram("/bin/sh", test.path("other"));
        copyProgram("/bin/sleep", test.path("sleeper"));
    }
    void registerFile(const std::string& name, const std::string& program, const std::string& more = "") const {
        test.replace(std::string(names::identityDirectory) + "/" + name, entry(program, more));
    }
    [[nodiscard]] std::string entry(const std::string& program, const std::string& more = "") const {
        return "<plist version=\"1.0\"><dict><key>Executable</key><string>" + test.path(program) + "</string>" + more +
               "</dict></plist>";
    }
    [[nodiscard]] std::string filePath(const std::string& name) const {
        return test.path(std::string(names::identityDirectory) + "/" + name);
    }

    TestRoot test;
    KeptLog log;
    IdentityRegistry registry{test.root(), log, ::geteuid()};
    LinuxPeerIdentity identity;
    PeerServer server;
};

std::string identifier(const std::string& value) {
    return "<key>Identifier</key><string>" + value + "</string>";
}

/// What the peer is now: its identifier, "" for a grant without one, "-" for no grant.
std::string who(Peer& peer) {
    const Identity identity = peer.identify(Peer::Explain::no);
    return !identity.grant ? "-" : identity.grant->identifier.value_or("");
}

TEST(PeerIdentity, GrantsWhatTheRegistrySays) {
    World world;
    world.registerFile("a.plist", "agent",
                       identifier("com.veltra.agent") + "<key>Entitlements</key><dict><key>k</key><true/></dict>");
    const PeerProcess process(world.server, world.test.path("agent"));
    const auto peer = world.identity.peerOfSocket(process.socket());
    ASSERT_TRUE(peer);
    EXPECT_EQ(peer->pid(), process.pid());
    EXPECT_EQ(peer->kernelUserId(), ::geteuid());
    const Identity first = peer->identify(Peer::Explain::no);
    ASSERT_TRUE(first.grant);
    EXPECT_EQ(first.grant->identifier, "com.veltra.agent");
    ASSERT_TRUE(first.grant->entitlements);
    EXPECT_TRUE(first.grant->entitlements->isTrue("k"));
    EXPECT_EQ(first.explanation, "");
    EXPECT_EQ(peer->identify(Peer::Explain::no).grant, first.grant) << "an unchanged peer gets the same object";
    EXPECT_EQ(peer->identify(Peer::Explain::yes).explanation, "a.plist: matches");
    const PeerProcess stranger(world.server, world.test.path("other"));
    const auto unknown = world.identity.peerOfSocket(stranger.socket());
    EXPECT_EQ(who(*unknown), "-");
    EXPECT_EQ(unknown->identify(Peer::Explain::yes).explanation, "no entry names " + world.test.path("other"));
}

// Goal: a peer stops being what it was: by executing another program, by exiting, also when its socket lives on.
TEST(PeerIdentity, EndsWithTheProgramAndTheProcess) {
    World world;
    world.registerFile("a.plist", "agent", identifier("agent"));
    world.registerFile("b.plist", "sleeper", identifier("sleeper"));
    PeerProcess process(world.server, world.test.path("agent"));
    const auto peer = world.identity.peerOfSocket(process.socket());
    EXPECT_EQ(who(*peer), "agent");
    process.execute(world.test.path("sleeper"));
    EXPECT_EQ(who(*peer), "sleeper");
    process.kill();
    EXPECT_TRUE(eventually([&] { return who(*peer) == "-"; })) << "a process that has ended, though not yet waited for";
    process.end();
    EXPECT_EQ(who(*peer), "-");
    EXPECT_EQ(peer->identify(Peer::Explain::yes).explanation, "the process has ended");
}

// Goal: whoever connects and is gone before the accept is nobody, and its pid is not looked up again.
TEST(PeerIdentity, IsNobodyWhoWasGoneBeforeTheAccept) {
    World world;
    world.registerFile("a.plist", "agent", identifier("agent"));
    auto process = std::make_unique<PeerProcess>(world.server, world.test.path("agent"));
    const FileDescriptor kept(::fcntl(process->socket(), F_DUPFD_CLOEXEC, 0));
    process.reset();
    const auto peer = world.identity.peerOfSocket(kept.get());
    ASSERT_TRUE(peer);
    EXPECT_EQ(who(*peer), "-");
    int pair[2] = {};
    ASSERT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair), 0);
    EXPECT_TRUE(world.identity.peerOfSocket(pair[0]));
    ::close(pair[0]);
    ::close(pair[1]);
    EXPECT_FALSE(world.identity.peerOfSocket(-1));
}

// Goal: files are looked at in the order of their names and the first that matches counts; fences hold. Method: entries
// for one program, judged for a peer that is a user and for one that owns the root.
TEST(PeerIdentity, TakesTheFirstEntryThatMatches) {
    if (::geteuid() == 0)
        std::puts("as root a peer of uid 501 stands for the user");
    const uid_t userUid = ::geteuid() == 0 ? 501 : ::geteuid();
    World user(PeerIs::user, userUid);
    World owner(PeerIs::owner, userUid);
    const std::string powers =
        "<key>Entitlements</key><dict><key>com.veltra.private.Zorvane.allowed</key><true/></dict>";
    const std::string label = "<key>SecurityLabel</key><string>no label of any system</string>";
    const std::string unit = "<key>Unit</key><string>no-such-unit-anywhere.service</string>";
    const std::string uids = "<key>UserIDs</key><array><integer>" + std::to_string(userUid) + "</integer></array>";
    for (World* world : {&user, &owner}) {
        world->registerFile("00-other.plist", "other", identifier("wrong program"));
        world->registerFile("10-label.plist", "agent", identifier("wrong label") + label);
        world->registerFile("20-unit.plist", "agent", identifier("wrong unit") + unit);
        world->registerFile("30-powers.plist", "agent", identifier("owner") + powers);
        world->registerFile("40-uids.plist", "agent", identifier("user") + uids);
        world->registerFile("50-any.plist", "agent", identifier("too late"));
    }
    const PeerProcess userProcess(user.server, user.test.path("agent"), userUid);
    const auto userPeer = user.identity.peerOfSocket(userProcess.socket());
    EXPECT_EQ(who(*userPeer), "user");
    EXPECT_EQ(userPeer->identify(Peer::Explain::no).effectiveUserId, userUid);
    const PeerProcess ownerProcess(owner.server, owner.test.path("agent"), userUid);
    const auto ownerPeer = owner.identity.peerOfSocket(ownerProcess.socket());
    EXPECT_EQ(who(*ownerPeer), "owner");
    EXPECT_EQ(ownerPeer->identify(Peer::Explain::no).effectiveUserId, 0U);
    EXPECT_EQ(ownerPeer->kernelUserId(), userUid);
    EXPECT_TRUE(owner.identity.ownsRoot(userUid) && owner.identity.ownsRoot(0));
    EXPECT_FALSE(user.identity.ownsRoot(userUid) && userUid != 0);
}

// Goal: what could have been put there by others, or could hold up the reader, is ignored and said once. Method: one
// file of each kind beside a good one.
TEST(IdentityRegistry, IgnoresWhatMayBeForged) {
    World world;
    const std::string directory = std::string(names::identityDirectory) + "/";
    world.registerFile("good.plist", "agent", identifier("good"));
    world.test.write(directory + "a-world.plist", world.entry("agent", identifier("world-writable")), 0646);
    world.test.write(directory + "a-group.plist", world.entry("agent", identifier("group-writable")), 0664);
    world.test.write("elsewhere.plist", world.entry("agent", identifier("linked")));
    ASSERT_EQ(::symlink(world.test.path("elsewhere.plist").c_str(), world.filePath("a-link.plist").c_str()), 0);
    ASSERT_EQ(::mkfifo(world.filePath("a-fifo.plist").c_str(), 0644), 0);
    ASSERT_EQ(::mkdir(world.filePath("a-directory.plist").c_str(), 0755), 0);
    world.test.write(directory + "a-damaged.plist", "<plist><dict>");
    world.test.write(directory + "a-large.plist",
                     world.entry("agent") + std::string(RegistryDirectory::fileBytesMax, ' '));
    world.test.write(directory + ".hidden.plist", world.entry("agent", identifier("hidden")));
    world.test.write(directory + "README", "no registry file");
    std::size_t ignored = 7;
    if (::geteuid() == 0) {
        world.test.write(directory + "a-owner.plist", world.entry("agent", identifier("foreign")));
        ASSERT_EQ(::chown(world.filePath("a-owner.plist").c_str(), 501, 0), 0);
        ++ignored;
    } else {
        std::puts("a file of another owner was skipped: not root");
    }
    const PeerProcess process(world.server, world.test.path("agent"));
    const auto peer = world.identity.peerOfSocket(process.socket());
    EXPECT_EQ(who(*peer), "good");
    EXPECT_EQ(world.registry.snapshot()->entries.size(), 1U);
    const auto lines = world.log.take();
    EXPECT_EQ(lines.size(), ignored);
    for (const std::string& line : lines)
        EXPECT_TRUE(line.starts_with("a-")) << line;
    world.registerFile("zz.plist", "other");
    world.registry.takeNotices();
    EXPECT_EQ(who(*peer), "good");
    EXPECT_EQ(world.registry.snapshot()->entries.size(), 2U);
    EXPECT_TRUE(world.log.take().empty()) << "what was said is not said again";
    // Files of which none is too large, and all together are.
    for (int i = 0; i <= 64; ++i) {
        const std::string name = "zzz" + std::to_string(100 + i) + ".plist";
        world.test.write(directory + name, "");
        ASSERT_EQ(::truncate(world.filePath(name).c_str(), RegistryDirectory::fileBytesMax), 0);
    }
    world.registry.takeNotices();
    EXPECT_EQ(who(*peer), "good");
    EXPECT_TRUE(std::ranges::any_of(world.log.take(), [](const std::string& line) {
        return line.ends_with(" is ignored: all files together are too large");
    }));
    // The directory itself.
    ASSERT_EQ(::chmod(world.test.path(names::identityDirectory).c_str(), 0777), 0);
    world.registry.takeNotices();
    EXPECT_EQ(who(*peer), "-");
    EXPECT_EQ(world.log.take().size(), 1U);
}

// Goal: every way of changing the registry or an executable reaches a live connection through the loop, long before a
// second has passed. Method: each change, then the peer is asked until it is what it should be.
TEST(IdentityRegistry, FollowsChanges) {
    World world;
    EpollRunLoop loop;
    ASSERT_TRUE(world.registry.follow(loop));
    std::thread runner([&] { loop.run(); });
    const PeerProcess process(world.server, world.test.path("agent"));
    const auto peer = world.identity.peerOfSocket(process.socket());
    EXPECT_EQ(who(*peer), "-") << "there is no registry yet";
    const auto rename = [&](const std::string& from, const std::string& to) {
        EXPECT_EQ(::rename(world.test.path(from).c_str(), world.test.path(to).c_str()), 0);
    };
    const std::string file = std::string(names::identityDirectory) + "/a.plist";
    struct Step {
        const char* what;
        std::function<void()> change;
        std::string expected;
    };
    const std::vector<Step> steps = {
        {"the first file", [&] { world.registerFile("a.plist", "agent", identifier("made")); }, "made"},
        {"another by rename", [&] { world.registerFile("a.plist", "agent", identifier("replaced")); }, "replaced"},
        {"in place", [&] { world.test.write(file, world.entry("agent", identifier("rewritten"))); }, "rewritten"},
        {"a bad mode", [&] { ::chmod(world.test.path(file).c_str(), 0666); }, "-"},
        {"a good mode", [&] { ::chmod(world.test.path(file).c_str(), 0644); }, "rewritten"},
        {"the program goes", [&] { rename("agent", "agent.old"); }, "-"},
        {"another program of the name", [&] { copyProgram("/bin/sh", world.test.path("agent")); }, "-"},
        {"the program comes back", [&] { rename("agent.old", "agent"); }, "rewritten"},
        {"the directory goes", [&] { rename("etc/zorvane", "etc/old"); }, "-"},
        {"another directory", [&] { world.registerFile("b.plist", "agent", identifier("again")); }, "again"},
        {"no file", [&] { ::unlink(world.filePath("b.plist").c_str()); }, "-"},
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

// Goal: the same within about a second when nobody reads the notices, and when there are none (the target of a second
// link).
TEST(IdentityRegistry, LooksOnceASecondByItself) {
    World world;
    ASSERT_EQ(::symlink("middle", world.test.path("first").c_str()), 0);
    world.test.makeDirectories("away");
    ASSERT_EQ(::symlink("away/last", world.test.path("middle").c_str()), 0);
    ASSERT_EQ(::symlink("../agent", world.test.path("away/last").c_str()), 0);
    world.registerFile("a.plist", "first", identifier("agent"));
    const PeerProcess process(world.server, world.test.path("agent"));
    const auto peer = world.identity.peerOfSocket(process.socket());
    EXPECT_EQ(who(*peer), "agent");
    world.registerFile("a.plist", "first", identifier("changed"));
    EXPECT_TRUE(eventually([&] { return who(*peer) == "changed"; }));
    ::unlink(world.test.path("away/last").c_str());
    ASSERT_EQ(::symlink("../other", world.test.path("away/last").c_str()), 0);
    EXPECT_TRUE(eventually([&] { return who(*peer) == "-"; }, std::chrono::seconds(3)));
}

// Goal: a new peer finds what was registered just before it came: nobody has to wait for the registry. Method: register
// and connect at once, again and again, through a link whose target changes.
TEST(IdentityRegistry, KnowsWhatWasRegisteredJustNow) {
    World world;
    world.test.makeDirectories("versions/1");
    for (int i = 0; i < 5; ++i) {
        const std::string name = "program" + std::to_string(i);
        copyProgram("/bin/sh", world.test.path("versions/1/" + name));
        ASSERT_EQ(::symlink(("versions/1/" + name).c_str(), world.test.path(name).c_str()), 0);
        const PeerProcess process(world.server, world.test.path("versions/1/" + name));
        world.registerFile(name + ".plist", name, identifier(name));
        const auto peer = world.identity.peerOfSocket(process.socket());
        EXPECT_EQ(who(*peer), name);
    }
}

// Goal: many threads ask while files change: no torn state, and everybody sees the end. Method: each grant must be one
// of the two that were ever written.
TEST(IdentityRegistry, ServesThreadsWhileItChanges) {
    World world;
    world.registerFile("a.plist", "agent", identifier("even"));
    const PeerProcess process(world.server, world.test.path("agent"));
    std::atomic<bool> stop{false};
    std::atomic<int> wrong{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < 3; ++t)
        threads.emplace_back([&] {
            const auto peer = world.identity.peerOfSocket(process.socket());
            while (!stop) {
                const std::string now = who(*peer);
                wrong += now == "even" || now == "odd" || now == "last" ? 0 : 1;
            }
            if (!eventually([&] { return who(*peer) == "last"; }))
                ++wrong;
        });
    for (int i = 0; i < 60; ++i) {
        world.registerFile("a.plist", "agent", identifier(i % 2 == 0 ? "even" : "odd"));
        world.registry.takeNotices();
    }
    stop = true;
    world.registerFile("a.plist", "agent", identifier("last"));
    for (std::thread& thread : threads)
        thread.join();
    EXPECT_EQ(wrong, 0);
}

// Goal: peers and reloads leak no descriptors and no watches.
TEST(IdentityRegistry, LeaksNothing) {
    World world;
    world.registerFile("a.plist", "agent");
    const PeerProcess process(world.server, world.test.path("agent"));
    (void)who(*world.identity.peerOfSocket(process.socket()));
    const support::ProcessResources before;
    for (int i = 0; i < 50; ++i) {
        world.registerFile("a.plist", "agent", identifier(std::to_string(i)));
        EXPECT_EQ(who(*world.identity.peerOfSocket(process.socket())), std::to_string(i));
    }
    EXPECT_EQ(before.leakedSince(), "");
}

} // namespace
} // namespace zor::platform
