// SPDX-License-Identifier: Apache-2.0
#include "upcall/UpcallServer.h"

#include "upcall/UpcallWorld.h"

#include <sys/wait.h>
#include <tuple>

namespace zor::test {
namespace {

using namespace upcall;
using support::LogLine;

constexpr const char* routine = "server_get_process_containers";
constexpr std::uint32_t homeless = 503;
const std::string dataContainers = std::string(mobileContainers) + "/Data/Application";

const ByteVector good = Items().string(upcall::CM_KERN_REQUEST_CONTAINER_ID, "com.example").number(3, mobile).packet();

ByteVector with(ByteVector packet, std::size_t offset, std::uint32_t number) {
    std::memcpy(packet.data() + offset, &number, sizeof number);
    return packet;
}

ByteVector first(const ByteVector& packet, std::size_t size) {
    return {packet.begin(), packet.begin() + static_cast<std::ptrdiff_t>(size)};
}

/// A request of the client's whose buffer is this.
ByteVector around(const std::string& hex) {
    return encodeRequest(fromHex(hex));
}

// Goal: every packet that is no request gets the one code and the lines that it should, and makes nothing. Method: a
// table of packets, sent by the kernel's agent through a socket.
TEST(UpcallServer, AnswersEveryFaultyPacket) {
    const std::string unpack = "failed: to unpack string for CM_KERN_REQUEST_";
    const std::string noEnd = "failed: to find the end of the request. error: 34";
    const std::string id = "02 00 00 00 02 00 00 00 61 00 00 00 00 00 00 00 ";
    const std::string end = "00 00 00 00 00 00 00 00";
    ByteVector longer = good;
    longer.push_back(0);
    struct Row {
        const char* name;
        ByteVector packet;
        std::int32_t code;
        std::string line; // of level 3
    };
    const Row rows[] = {
        {"another message", with(good, 4, 322'514'901), -303, ""},
        {"its own reply", with(good, 4, 322'515'000), -303, ""},
        {"an id alone", first(good, 8), -304, ""},
        {"a cut header", first(good, 23), -304, ""},
        {"another size", with(good, 0, 51), -304, ""},
        {"no descriptor", with(good, 8, 0), -304, ""},
        {"not out of line", with(good, 12, 0), -300, ""},
        {"a larger size", with(good, 16, 41), -300, ""},
        {"a larger count", with(good, 20, 41), -300, ""},
        {"more bytes", longer, -300, ""},
        {"fewer bytes", first(good, good.size() - 1), -300, ""},
        {"a header alone", first(good, 24), -300, ""},
        {"an empty buffer", around(""), 9, "sb_packbuff_init() of request data fails"},
        {"no end", around(id), 5, unpack + "CODE_SIGNATURE_ID. error: 34"},
        {"a number for the code signature", Items().number(0, 1).packet(), 5, unpack + "CODE_SIGNATURE_ID. error: 22"},
        {"an unknown item for the application", around("07 00 02 00 02 00 00 00" + end), 5,
         unpack + "APPLICATION_ID. error: 22"},
        {"a string for the persona", Items().string(3, "501").packet(), 5,
         "failed: to unpack uint32 for CM_KERN_REQUEST_PERSONA_ID. error: 22"},
        {"no NUL in the system container", around("02 00 06 00 01 00 00 00 61 00 00 00 00 00 00 00" + end), 5,
         unpack + "SYSTEM_CONTAINER_ID. error: 22"},
        {"a system group beyond the end", around("02 00 07 00 ff ff ff ff 61 00 00 00 00 00 00 00" + end), 5,
         unpack + "SYSTEM_GROUP_CONTAINER_ID. error: 34"},
        {"a container type", Items().string(0, "com.example").number(3, mobile).number(5, 2).packet(), 4,
         "CM_KERN_REQUEST_CONTAINER_TYPE is not currently supported!"},
        {"the first unknown item", Items().string(0, "com.example").number(3, mobile).string(8, "a").packet(), 4,
         "unexpected value: 8"},
    };
    ServedUpcall upcall;
    for (const Row& row : rows) {
        SCOPED_TRACE(row.name);
        const UpcallReply reply = replyIn(upcall.exchange(row.packet));
        std::uint32_t messageId = 0;
        std::memcpy(&messageId, row.packet.data() + 4, sizeof messageId);
        EXPECT_EQ(reply.messageId, messageId + 100);
        EXPECT_EQ(reply.returnCode, row.code);
        EXPECT_FALSE(reply.bufferBytes);
        std::vector<LogLine> expected;
        if (!row.line.empty())
            expected = {{logLevelError, routine, row.line}};
        EXPECT_EQ(upcall.world.log.take(), expected);
    }
    // One that is too short to have an id gets no answer; the next one does.
    const platform::FileDescriptor socket = upcall.connect();
    sendPacket(socket.get(), first(good, 7));
    sendPacket(socket.get(), with(good, 4, 1));
    EXPECT_EQ(replyIn(receivePacket(socket.get())).messageId, 101U);
    EXPECT_TRUE(upcall.world.names(dataContainers).empty());
}

// Goal: nobody but the kernel's agent is answered: not an unregistered program, and not another process on the agent's
// own connection. Method: real senders; only a sender that is not known at all has to be made up.
TEST(UpcallServer, AnswersTheKernelAlone) {
    ServedUpcall unknown(Agent::unknown);
    EXPECT_EQ(replyIn(unknown.exchange(good)).returnCode, 5);
    EXPECT_EQ(replyIn(unknown.exchange(with(good, 4, 1))).returnCode, -303);
    EXPECT_TRUE(unknown.world.names(dataContainers).empty());

    ServedUpcall upcall;
    const platform::FileDescriptor socket = upcall.connect();
    const pid_t child = ::fork();
    if (child == 0) {
        (void)!::send(socket.get(), good.data(), good.size(), MSG_NOSIGNAL);
        ::_exit(0);
    }
    EXPECT_EQ(replyIn(receivePacket(socket.get())).returnCode, 5);
    ::waitpid(child, nullptr, 0);
    EXPECT_TRUE(upcall.world.names(dataContainers).empty());
    sendPacket(socket.get(), good);
    EXPECT_EQ(replyIn(receivePacket(socket.get())).returnCode, 0);

    World world;
    UpcallServer server(world.services().upcallNeeds(), world.linux().roles().upcallPort);
    EXPECT_EQ(replyIn(server.answer({.bytes = good, .senderPid = {}, .senderUserId = {}})).returnCode, -309);
    const ByteVector another = with(good, 12, 0);
    EXPECT_EQ(replyIn(server.answer({.bytes = another, .senderPid = {}, .senderUserId = {}})).returnCode, -300);
    EXPECT_EQ(replyIn(server.answer({.bytes = good, .senderPid = 1, .senderUserId = 0})).returnCode, 5);
    EXPECT_TRUE(world.names(dataContainers).empty());
}

// Goal: a request gets the paths of what it names, in the one order, made where they were missing, and of nothing else.
// Method: a table of requests; each path is looked at on the disk, each class counted.
TEST(UpcallServer, TellsTheContainersOfAProcess) {
    Items everything;
    everything.string(7, "sg.b").string(4, "group.b").string(6, "com.example.system").string(0, "com.example.all");
    everything.string(4, "group.a").string(7, "sg.a").string(4, "group.b").number(3, mobile).string(2, "x");
    struct Row {
        Items items;
        std::string types;
        std::string home; // below the root
        std::string dataIdentifier;
    };
    const std::string root = "private/var/root";
    const std::string mobiles = "private/var/mobile";
    const Row rows[] = {
        {Items(), "100 0", root, ""},
        // The container counts before the code signature, later items before earlier ones.
        {Items().string(1, "com.example.c").string(0, "com.example.s").number(3, mobile), "100 1 2 0", mobiles,
         "com.example.c"},
        {Items().number(3, mobile).string(1, "com.example.1").string(1, "com.example.2").number(3, second), "100 1 2 0",
         "private/var/second", "com.example.2"},
        {Items().string(2, "com.example.application").number(3, mobile), "100 0", mobiles, ""},
        {Items().string(6, "com.example.system"), "100 101 0", root, ""},
        {everything, "100 1 2 3 4 3 4 101 102 103 102 103 0", mobiles, "com.example.all"},
        // A user without containers, and one without a home.
        {Items().number(3, 33), "0", "", ""},
        {Items().number(3, homeless).string(7, "sg.a"), "102 103 0", "", ""},
    };
    ServedUpcall upcall;
    World& world = upcall.world;
    const auto pathOf = [&](std::uint32_t user, const std::string& identifier, ContainerClass containerClass) {
        return world.daemonsClient().createOrLookupContainerForUser(user, &identifier, containerClass, {}).value().path;
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.types + " " + row.dataIdentifier);
        const UpcallReply reply = upcall.ask(row.items);
        EXPECT_EQ(reply.messageId, 322'515'000U);
        EXPECT_EQ(reply.returnCode, 0);
        EXPECT_EQ(reply.types(), row.types);
        EXPECT_EQ(reply.text(0), "1");
        EXPECT_EQ(reply.text(100), row.home.empty() ? "" : world.path(row.home));
        if (row.dataIdentifier.empty())
            continue;
        const std::uint32_t user = reply.text(100).ends_with("second") ? second : mobile;
        EXPECT_EQ(reply.text(1), pathOf(user, row.dataIdentifier, application));
        EXPECT_EQ(reply.text(2), reply.text(1) + "/tmp");
        EXPECT_EQ(itemAt(reply.text(2)), directoryOf(user));
    }
    const UpcallReply all = upcall.ask(everything);
    using Groups = std::vector<std::pair<std::string, std::string>>;
    EXPECT_EQ(all.groups(3), (Groups{{"group.a", pathOf(mobile, "group.a", ContainerClass::sharedAppGroup)},
                                     {"group.b", pathOf(mobile, "group.b", ContainerClass::sharedAppGroup)}}));
    EXPECT_EQ(all.groups(102), (Groups{{"sg.a", pathOf(499, "sg.a", ContainerClass::sharedSystemGroup)},
                                       {"sg.b", pathOf(499, "sg.b", ContainerClass::sharedSystemGroup)}}));
    EXPECT_EQ(world.names(dataContainers).size(), 2U);
    EXPECT_EQ(world.names("private/var/containers/Data/System").size(), 1U);
}

// Goal: when one container cannot be had, the others are made and no path is told. Method: each kind in turn with an
// identifier that is none, between two good groups.
TEST(UpcallServer, TellsAllOrNothing) {
    constexpr std::string_view cut("group.a\0b", 9);
    const std::tuple<std::uint16_t, std::string_view, std::uint32_t, std::string> rows[] = {
        {1, "\xff", mobile, "createOrLookupContainerForUser: Failed with error: 11"},
        {6, cut, mobile, "createOrLookupContainerForUser:(system container) Failed with error: 11"},
        {4, cut, mobile, "createOrLookupGroupContainersForUser: Failed with error: 11"},
        {7, "\xc3", mobile, "createOrLookupContainerForUser:(system group container) Failed with error: 11"},
        {1, "com.example", 0, "createOrLookupContainerForUser: Failed with error: 11"}, // it owns none
    };
    using Told = std::vector<std::pair<unsigned, std::string>>;
    ServedUpcall upcall;
    World& world = upcall.world;
    std::size_t made = 0;
    for (const auto& [type, identifier, persona, line] : rows) {
        SCOPED_TRACE(line);
        Items items;
        items.number(3, persona).string(7, "sg." + std::to_string(made++)).string(type, identifier);
        EXPECT_EQ(upcall.ask(items.string(7, "sg." + std::to_string(made++))).items, (Told{{0, "0"}}));
        EXPECT_EQ(world.log.take(logLevelError, routine), std::vector<std::string>{line});
        EXPECT_EQ(world.names("private/var/containers/Shared/SystemGroup").size(), made);
    }
    EXPECT_TRUE(world.names(dataContainers).empty());
    // The disk refuses the second of two groups.
    world.disk().arm({.point = 2, .error = ENOSPC, .filter = [](const support::DiskCallInfo& call) {
                          return call.call == support::DiskCall::rename && call.subject.find("/") == std::string::npos;
                      }});
    const Items groups = Items().number(3, mobile).string(4, "group.1").string(4, "group.2");
    EXPECT_EQ(upcall.ask(groups).items, (Told{{0, "0"}}));
    EXPECT_TRUE(world.disk().met());
    world.disk().disarm();
    EXPECT_EQ(upcall.ask(groups).types(), "100 3 4 3 4 0");
}

// Goal: the largest replies come whole through the real port, and one that is too large for it as an empty buffer,
// without a stop of the daemon. Method: groups below a long path, one packet of them after the other, until it happens.
TEST(UpcallServer, SendsLargeRepliesThroughItsPort) {
    const support::TemporaryDirectory parent("/dev/shm");
    std::string deep = parent.path();
    ASSERT_EQ(::chmod(deep.c_str(), 0755), 0);
    for (int i = 0; i < 10; ++i)
        ASSERT_EQ(::mkdir((deep += "/" + std::string(250, 'd')).c_str(), 0755), 0);
    ServedUpcall upcall(Agent::registered, {.parent = deep});
    std::size_t largest = 0;
    std::size_t bytes = 1;
    for (int groups = 32; groups <= 1024 && bytes != 0; groups *= 2) {
        Items items;
        items.number(3, mobile);
        for (int i = 0; i < groups; ++i)
            items.string(4, "g" + std::to_string(i));
        const UpcallReply reply = upcall.ask(items);
        ASSERT_EQ(reply.returnCode, 0);
        bytes = reply.bufferBytes.value();
        largest = std::max(largest, bytes);
        EXPECT_EQ(reply.groups(3).size(), bytes == 0 ? 0U : static_cast<std::size_t>(groups));
    }
    EXPECT_EQ(bytes, 0U);
    EXPECT_GT(largest, upcall.world.linux().roles().upcallPort.replyBytesMax() / 4);
    EXPECT_EQ(upcall.ask(Items().number(3, mobile).string(4, "g1")).types(), "100 3 4 0");
}

// Goal: while a lookup takes long, what waits is bounded by the socket and costs the daemon nothing; then all of it is
// answered. Method: the lock that every lookup takes is held, and packets are sent until the socket takes no more.
TEST(UpcallServer, ASlowLookupBoundsWhatWaits) {
    ServedUpcall upcall;
    const ByteVector packet = Items().string(0, "com.example").number(3, mobile).packet();
    const platform::FileDescriptor socket = upcall.connect();
    int sent = 0;
    {
        const AllIdentifiersLock slow(upcall.world.services().locks(), LockMode::writing);
        constexpr int packetsMax = 100'000;
        int error = 0;
        for (; error == 0 && sent < packetsMax; sent += error == 0 ? 1 : 0)
            error = ::send(socket.get(), packet.data(), packet.size(), MSG_DONTWAIT) < 0 ? errno : 0;
        EXPECT_EQ(error, EAGAIN);
        EXPECT_GT(sent, 1);
        EXPECT_LT(sent, packetsMax / 10);
    }
    for (int i = 0; i < sent; ++i)
        ASSERT_EQ(replyIn(receivePacket(socket.get())).types(), "100 1 2 0") << i;
}

ProcessContainers goldenContainers() {
    const std::string data = "/private/var/mobile/Containers/Data/Application/9985179A";
    return {.homeDirectory = "/private/var/mobile",
            .dataContainer = data,
            .temporaryDirectory = data + "/tmp",
            .appGroups = {{{"group.a", "/private/var/mobile/Containers/Shared/AppGroup/0B"}}},
            .systemContainer = std::nullopt,
            .systemGroups = {{{"sg", "/private/var/containers/Shared/SystemGroup/7F"}}}};
}

// Goal: both sides of the upcall write, and read, exactly the bytes of the golden packets. Method: each golden file
// made by the side that sends it, and read by the side that gets it.
TEST(UpcallMessage, IsTheGoldenOne) {
    const ByteVector request = golden("request.hex");
    Items items;
    items.string(CM_KERN_REQUEST_CONTAINER_ID, "com.example.app").number(CM_KERN_REQUEST_PERSONA_ID, 501);
    items.string(CM_KERN_REQUEST_APP_GROUP_ID, "group.a").string(CM_KERN_REQUEST_SYSTEM_GROUP_CONTAINER_ID, "sg");
    EXPECT_EQ(toHex(items.packet()), toHex(request));
    const auto buffer = decodeRequest(request);
    ASSERT_TRUE(buffer);
    EXPECT_EQ(toHex(*buffer), toHex(items.buffer()));

    support::RecordingLog lines(logLevelNotice);
    const Log log(lines);
    const PackbuffPointer packbuff(sb_packbuff_new(4096));
    packProcessContainersReply(log, *packbuff, goldenContainers(), true);
    const std::span packed(sb_packbuff_get_bytes(packbuff.get()), sb_packbuff_get_size(packbuff.get()));
    const ByteVector reply = golden("reply.hex");
    EXPECT_EQ(toHex(encodeReply(processContainersMessageId, packed)), toHex(reply));
    const auto read = decodeReply(reply);
    ASSERT_TRUE(read);
    EXPECT_EQ(read->returnCode, ReturnCode::success);
    EXPECT_EQ(toHex(read->buffer), toHex(packed));

    const ByteVector refusal = golden("refusal.hex");
    EXPECT_EQ(toHex(encodeErrorReply(processContainersMessageId, ReturnCode::refused)), toHex(refusal));
    const auto refused = decodeReply(refusal);
    ASSERT_TRUE(refused);
    EXPECT_EQ(refused->returnCode, ReturnCode::refused);
    EXPECT_TRUE(refused->buffer.empty());
}

} // namespace
} // namespace zor::test
