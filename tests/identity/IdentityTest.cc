// SPDX-License-Identifier: Apache-2.0
// Peers are real processes that run copies of real programs; the registry is files in a root of the test's own.
#include "identity/LinuxPeer.h"
#include "identity/PeerProcess.h"
#include "identity/RegistryFiles.h"
#include "identity/Users.h"
#include "os/RunLoop.h"
#include "service/SeqpacketUpcallPort.h"
#include "support/Files.h"
#include "support/Frames.h"

#include <fstream>

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
    // A new peer finds what was registered just before it came, also through a link.
    std::filesystem::create_symlink("agent", world.program("link"));
    world.registerAs("a.plist", "link", "agent");
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

// A peer that connects and is gone before it is asked for is nobody, and its pid is not looked up again.
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
    for (const bool owns : {false, true}) {
        PeerWorld world(owns ? userUid : userUid + 1000);
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

// A file that others could have put there, or that could hold up the reader, is ignored and said once.
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
    support::makeItems(
        support::openDirectory(placeFor("")).get(),
        {"a-link.plist -> " + world.test.path("elsewhere.plist"), "a-fifo.plist|", "a-directory.plist/"});
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
    RunLoop loop;
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
        {"another program of the name", [&] { world.copyProgram("/bin/sh", "agent"); }, "-"},
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

// Goal: a program that came with the directory above its own, of which no notice tells, is known at once. Method: that
// directory is exchanged, less than a second after the registry has looked.
TEST(IdentityRegistry, KnowsAProgramThatCameWithADirectory) {
    PeerWorld world;
    for (const std::string above : {"above", "next"}) {
        std::filesystem::create_directories(world.test.path(above + "/bin"));
        world.copyProgram("/bin/sh", above + "/bin/agent");
    }
    world.registerAs("a.plist", "above/bin/agent", "agent");
    world.registry.takeNotices();
    std::filesystem::rename(world.test.path("above"), world.test.path("old"));
    std::filesystem::rename(world.test.path("next"), world.test.path("above"));
    ::usleep(30'000); // a look that was a moment ago is not repeated
    const PeerProcess process(world.server, world.program("above/bin/agent"));
    EXPECT_EQ(who(*world.peerOf(process)), "agent");
}

// Goal: a file that is being copied into the registry is not called wrong before it is whole, nor a wrong one right.
// Method: one written in two halves, with a look after each; then one that stays half.
TEST(IdentityRegistry, SaysNothingOfAFileThatIsBeingWritten) {
    PeerWorld world;
    world.registerAs("0.plist", "agent", "first");
    world.registry.takeNotices();
    const auto written = [&](const char* name, bool isWhole) {
        const std::string text = world.named("agent", "copied");
        std::ofstream file(world.test.path(PeerWorld::pathOf(name)));
        file << text.substr(0, text.size() / 2) << std::flush;
        world.registry.takeNotices();
        const std::size_t said = world.log.take().size();
        file << (isWhole ? text.substr(text.size() / 2) : "");
        file.close();
        world.registry.takeNotices();
        return std::pair(said, world.log.take().size());
    };
    EXPECT_EQ(written("a.plist", true), std::pair(std::size_t{0}, std::size_t{0}));
    EXPECT_EQ(written("b.plist", false), std::pair(std::size_t{0}, std::size_t{1}));
}

// Goal: a registry that cannot be looked at holds what it held, and is looked at again. Method: a file changes while
// there is no descriptor, or one, which the directory takes.
TEST(WantOfDescriptors, TheRegistryHoldsWhatItHeld) {
    for (const rlim_t left : {0U, 1U}) {
        PeerWorld world;
        world.registerAs("a.plist", "agent", "old");
        const PeerProcess process(world.server, world.program("agent"));
        const auto peer = world.peerOf(process);
        ASSERT_TRUE(peer);
        EXPECT_EQ(who(*peer), "old");
        world.registerAs("next", "agent", "new");
        {
            const support::FewDescriptors few(left);
            ASSERT_EQ(::rename(world.test.path(PeerWorld::pathOf("next")).c_str(),
                               world.test.path(PeerWorld::pathOf("a.plist")).c_str()),
                      0);
            EXPECT_EQ(who(*peer), "old") << left;
            if (left == 0)
                ::usleep(1'100'000); // after a second everything is looked at, notice or not
            EXPECT_EQ(who(*peer), "old") << left;
        }
        EXPECT_TRUE(eventually([&] { return who(*peer) == "new"; })) << left;
    }
}

// Goal: a registry that got no notices of changes when it was made asks for them again. Method: one made without a
// descriptor; a change after its first look is found at once by who asks for notices alone.
TEST(WantOfDescriptors, TheRegistryAsksForNoticesAgain) {
    PeerWorld world;
    std::optional<IdentityRegistry> registry;
    {
        const support::FewDescriptors few(0);
        registry.emplace(world.test.root(), world.log, ::geteuid());
    }
    ::usleep(30'000); // a look that was a moment ago is not repeated
    registry->takeNotices();
    EXPECT_TRUE(registry->snapshot()->entries.empty());
    world.registerAs("a.plist", "agent", "agent");
    registry->takeNotices();
    EXPECT_EQ(registry->snapshot()->entries.size(), 1U);
}

// Goal: a peer that cannot be pinned is refused, for it would be nobody as long as it is connected; one of which an
// entry's condition cannot be looked up is granted nothing, not what a later entry grants. Method: a process is looked
// at, and the kernel's agent accepted, with too few descriptors.
TEST(WantOfDescriptors, APeerIsRefusedAndNotMistaken) {
    PeerWorld world;
    world.registerAs("a.plist", "agent", "old");
    const PeerProcess process(world.server, world.program("agent"));
    for (const rlim_t left : {0U, 1U}) {
        const support::FewDescriptors few(left);
        EXPECT_FALSE(world.peerOf(process));
        EXPECT_EQ(errno, EMFILE);
    }
    EXPECT_EQ(who(*world.peerOf(process)), "old");
    world.registerAs("a-before.plist", "agent", "first", "<key>Unit</key><string>none.service</string>");
    const auto peer = world.peerOf(process);
    EXPECT_EQ(who(*world.peerOf(process)), "old");
    {
        const support::FewDescriptors none(0);
        EXPECT_EQ(who(*peer), "-");
    }
    EXPECT_EQ(who(*peer), "old");

    RunLoop loop;
    SeqpacketUpcallPort port(world.test.root(), world.identity, {});
    ASSERT_FALSE(port.checkIn());
    ASSERT_TRUE(port.serve(loop, [](const UpcallPacket&) { return std::vector<std::uint8_t>(); }));
    const FileDescriptor agent(::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0));
    ASSERT_TRUE(support::connectTo(agent.get(),
                                   world.test.path(std::string(names::runtimeDirectory) + "/" + names::upcallSocket)));
    {
        const support::FewDescriptors few(1);
        loop.post([&] { loop.stop(); });
        loop.run();
    }
    char byte = 0;
    EXPECT_EQ(::recv(agent.get(), &byte, 1, MSG_DONTWAIT), 0);
}

std::string file(const std::string& body) {
    return "<plist version=\"1.0\"><dict>" + body + "</dict></plist>";
}

std::expected<RegistryEntry, std::string> parse(const std::string& text) {
    return parseIdentityFile({reinterpret_cast<const std::uint8_t*>(text.data()), text.size()});
}

const std::string executable = "<key>Executable</key><string>/usr/bin/agent</string>";

// A file that is not wholly understood grants nothing.
TEST(IdentityFile, RefusesWhatItDoesNotUnderstand) {
    ASSERT_TRUE(parse(file(executable + "<key>Identifier</key><string>" + std::string(1024, 'i') + "</string>")));
    std::vector<std::string> wrong = {"", "not a property list", "<plist version=\"1.0\"><array/></plist>",
                                      "<plist version=\"1.0\"><string>/usr/bin/agent</string></plist>", file("")};
    for (const char* value :
         {"<string>agent</string>", "<string></string>", "<integer>1</integer>", "<array><string>/a</string></array>"})
        wrong.push_back(file(std::string("<key>Executable</key>") + value));
    const std::pair<const char*, std::vector<std::string>> values[] = {
        {"Identifier", {"<string></string>", "<true/>", "<string>" + std::string(1025, 'i') + "</string>"}},
        {"UserIDs", {"<integer>501</integer>", "<array><string>501</string></array>"}},
        {"UserIDs", {"<array><integer>-1</integer></array>", "<array><integer>4294967295</integer></array>"}},
        {"Unit", {"<array/>", "<string></string>"}},
        {"SecurityLabel", {"<true/>"}},
        {"Entitlements", {"<array/>"}},
        {"KernelAgent", {"<integer>1</integer>"}},
        {"OnlyOwnIdentifier", {"<string>true</string>"}},
        {"PassedSockets", {"<string>true</string>"}},
        // A fence with a typing mistake must not be a fence that is not there.
        {"UserIds", {"<array><integer>501</integer></array>"}},
        {"Executable ", {"<string>/b</string>"}}};
    for (const auto& [key, texts] : values)
        for (const std::string& text : texts)
            wrong.push_back(file(executable + "<key>" + key + "</key>" + text));
    for (const std::string& text : wrong) {
        const auto entry = parse(text);
        EXPECT_TRUE(!entry && !entry.error().empty()) << text;
    }
}

// Power needs a uid that was named, or the owner's.
TEST(IdentityFile, FencesPowers) {
    const std::string prefix = "com.veltra.private.Zorvane.";
    const auto entitled = [&](const std::string& key, const std::string& value) {
        return "<key>Entitlements</key><dict><key>" + key + "</key>" + value + "</dict>";
    };
    struct Case {
        std::string body;
        bool admitsOwner;
        bool admits501;
    };
    const std::string named = "<key>UserIDs</key><array><integer>501</integer></array>";
    const std::vector<Case> cases = {
        {"", true, true},
        {"<key>Identifier</key><string>com.veltra.app</string>", true, true},
        {entitled(prefix + "allowed", "<true/>"), true, false},
        {entitled(prefix + "allowed", "<false/>"), true, true},
        {entitled(prefix + "allowed", "<integer>1</integer>"), true, true},
        {entitled(prefix + "otherIdLookup", "<true/>"), true, false},
        {entitled(prefix + "wipeContainer", "<array/>"), true, false},
        {entitled(prefix + "wipeContainer", "<true/>"), true, true},
        {entitled("com.veltra.security.application-groups", "<array/>"), true, true},
        {"<key>KernelAgent</key><true/>", true, false},
        {"<key>KernelAgent</key><false/>", true, true},
        {entitled(prefix + "allowed", "<true/>") + named, false, true},
        {named, false, true},
        {"<key>UserIDs</key><array/>", false, false},
    };
    for (const Case& row : cases) {
        const auto entry = parse(file(executable + row.body));
        ASSERT_TRUE(entry) << row.body << entry.error();
        EXPECT_EQ(entry->admitsUser(0), row.admitsOwner) << row.body;
        EXPECT_EQ(entry->admitsUser(501), row.admits501) << row.body;
    }
}

// Only a unit of the system manager counts, not one that a user can bring about.
TEST(CgroupUnit, IsTheSystemManagersUnit) {
    const std::vector<std::pair<std::string, std::string>> cases = {
        {"0::/system.slice/installer.service\n", "installer.service"},
        {"0::/system.slice/system-x.slice/x@1.service/inner/deeper\n", "x@1.service"},
        {"0::/user.slice/user-501.slice/user@501.service/app.slice/installer.service\n", "user@501.service"},
        {"0::/\n", ""},
        {"0::/../system.slice/installer.service\n", ".."},
        {"0::/system.slice/_cpu.service\n", "cpu.service"},
        {"12:cpu:/system.slice/a.service\n1:name=systemd:/system.slice/b.service\n0::/\n", "b.service"},
        {"1:cpu,name=other:/system.slice/installer.service\n", ""},
        {"", ""},
        {"0::/system.slice", ""},
    };
    for (const auto& [text, unit] : cases)
        EXPECT_EQ(systemUnitInCgroups(text), unit) << text;
}

TEST(PasswordDatabase, ReadsTheRootsOwnFile) {
    const TestRoot test;
    const LinuxPasswordDatabase database(test.root());
    EXPECT_FALSE(database.entryForUserId(0)) << "the system's own database must not be asked";
    test.write(names::passwordFile, "root:x:0:0:root:/private/var/root:/bin/sh\n"
                                    "# a comment\nbroken line\nmobile:x:501:501::/private/var/mobile:/bin/sh\n"
                                    "homeless:x:502:502:::/bin/sh\nrelative:x:503:503::home:/bin/sh\n"
                                    "other:x:501:501::/elsewhere:/bin/sh\n");
    ASSERT_TRUE(database.entryForUserId(501));
    EXPECT_EQ(database.entryForUserId(501)->name, "mobile");
    EXPECT_EQ(database.entryForUserId(501)->homeDirectory, test.path("private/var/mobile"));
    EXPECT_EQ(database.entryForName("other")->homeDirectory, test.path("elsewhere"));
    for (const char* name : {"homeless", "relative", "absent", ""})
        EXPECT_FALSE(database.entryForName(name)) << name;
    // A content that has been kept does not outlive its file, even when all but the time of change stays as it was.
    const std::string file = test.path(names::passwordFile);
    const timespec longAgo[2] = {{.tv_sec = 1, .tv_nsec = 1}, {.tv_sec = 1, .tv_nsec = 1}};
    for (const char* home : {"a", "b", "c"}) {
        test.write(names::passwordFile, std::string("mobile:x:501:501::/") + home + ":/bin/sh\n");
        ASSERT_EQ(::utimensat(AT_FDCWD, file.c_str(), longAgo, 0), 0);
        EXPECT_EQ(database.entryForUserId(501)->homeDirectory, test.path(home)) << "just written";
        ::usleep(30'000);
        EXPECT_EQ(database.entryForUserId(501)->homeDirectory, test.path(home));
    }
    // On the device itself the whole database of the system counts.
    EXPECT_TRUE(LinuxPasswordDatabase(SystemRoot::open("/").value()).entryForUserId(0));
}

} // namespace
} // namespace zor::platform
