// SPDX-License-Identifier: Apache-2.0
// A process without descriptors: what it could not look at it does not take for absent.
#include "platform/PeerProcess.h"
#include "platform/linux/EpollRunLoop.h"
#include "platform/linux/FileDeviceLockState.h"
#include "platform/linux/LinuxPeerIdentity.h"
#include "platform/linux/Names.h"
#include "platform/linux/SeqpacketUpcallPort.h"
#include "store/FewDescriptors.h"
#include "support/RecordingLog.h"

#include <atomic>

namespace zor::platform {
namespace {

using zor::test::FewDescriptors;

/// A registry with one program, and whoever runs it.
struct Registered {
    Registered() {
        copyProgram("/bin/sh", test.path("agent"));
        test.replace(path("a.plist"), entryFor("old"));
    }
    [[nodiscard]] static std::string path(const std::string& name) {
        return std::string(names::identityDirectory) + "/" + name;
    }
    [[nodiscard]] std::string entryFor(const std::string& identifier, const std::string& more = "") const {
        return "<plist version=\"1.0\"><dict><key>Executable</key><string>" + test.path("agent") +
               "</string><key>Identifier</key><string>" + identifier + "</string>" + more + "</dict></plist>";
    }
    TestRoot test;
    support::RecordingLog log{5};
    IdentityRegistry registry{test.root(), log, ::geteuid()};
    LinuxPeerIdentity identity{registry, ::geteuid()};
};

std::string who(Peer& peer) {
    const Identity identity = peer.identify(Peer::Explain::no);
    return identity.grant ? identity.grant->identifier.value_or("") : "-";
}

// Goal: a registry that cannot be looked at holds what it held, and is looked at again. Method: a file changes while
// there is no descriptor, or one, which the directory takes.
TEST(WantOfDescriptors, TheRegistryHoldsWhatItHeld) {
    for (const rlim_t left : {0U, 1U}) {
        Registered world;
        const PeerServer server;
        const PeerProcess process(server, world.test.path("agent"));
        const auto peer = world.identity.peerOfSocket(process.socket());
        ASSERT_TRUE(peer);
        EXPECT_EQ(who(*peer), "old");
        world.test.replace(Registered::path("next"), world.entryFor("new"));
        {
            const FewDescriptors few(left);
            ASSERT_EQ(::rename(world.test.path(Registered::path("next")).c_str(),
                               world.test.path(Registered::path("a.plist")).c_str()),
                      0);
            EXPECT_EQ(who(*peer), "old") << left;
            ::usleep(1'100'000); // after a second everything is looked at, notice or not
            EXPECT_EQ(who(*peer), "old") << left;
        }
        EXPECT_TRUE(eventually([&] { return who(*peer) == "new"; })) << left;
    }
}

// Goal: a peer that cannot be pinned is refused, for it would be nobody as long as it is connected; one of which an
// entry's condition cannot be looked up is granted nothing, not what a later entry grants. Method: a process is looked
// at, and the kernel's agent accepted, with too few descriptors.
TEST(WantOfDescriptors, APeerIsRefusedAndNotMistaken) {
    Registered world;
    const PeerServer server;
    const PeerProcess process(server, world.test.path("agent"));
    for (const rlim_t left : {0U, 1U}) {
        const FewDescriptors few(left);
        EXPECT_FALSE(world.identity.peerOfSocket(process.socket()));
        EXPECT_EQ(errno, EMFILE);
    }
    EXPECT_EQ(who(*world.identity.peerOfSocket(process.socket())), "old");
    world.test.replace(Registered::path("a-before.plist"),
                       world.entryFor("first", "<key>Unit</key><string>none.service</string>"));
    const auto peer = world.identity.peerOfSocket(process.socket());
    EXPECT_EQ(who(*world.identity.peerOfSocket(process.socket())), "old");
    {
        const FewDescriptors none(0);
        EXPECT_EQ(who(*peer), "-");
    }
    EXPECT_EQ(who(*peer), "old");

    EpollRunLoop loop;
    SeqpacketUpcallPort port(world.test.root(), world.identity, {});
    ASSERT_EQ(port.checkIn(), 0);
    ASSERT_TRUE(port.serve(loop, [](const UpcallPacket&) { return std::vector<std::uint8_t>(); }));
    const FileDescriptor agent(::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0));
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    const std::string path = world.test.path(std::string(names::runtimeDirectory) + "/" + names::upcallSocket);
    std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
    ASSERT_EQ(::connect(agent.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
    {
        const FewDescriptors few(1);
        loop.post([&] { loop.stop(); });
        loop.run();
    }
    char byte = 0;
    EXPECT_EQ(::recv(agent.get(), &byte, 1, MSG_DONTWAIT), 0);
}

// Goal: an unlock that is told while its file cannot be opened is not missed. Method: the file changes without a
// descriptor left, and never again.
TEST(WantOfDescriptors, AnUnlockIsSeenAfterwards) {
    const TestRoot test;
    const std::string directory = std::string(names::runtimeDirectory) + "/";
    FileDeviceLockState state(test.root());
    EpollRunLoop loop;
    std::atomic<int> seen{DeviceLockState::locked};
    test.write(directory + "next", "0");
    test.write(directory + names::lockState, "1");
    ASSERT_EQ(state.registerForChanges(loop, [&] { seen = state.currentState(); }), 0);
    std::thread runner([&] { loop.run(); });
    {
        const FewDescriptors none(0);
        EXPECT_EQ(::rename(test.path(directory + "next").c_str(), test.path(directory + names::lockState).c_str()), 0);
        EXPECT_TRUE(eventually([&] { return seen == FileDeviceLockState::unknown; }));
    }
    EXPECT_TRUE(eventually([&] { return seen == DeviceLockState::unlocked; }));
    loop.stop();
    runner.join();
}

} // namespace
} // namespace zor::platform
