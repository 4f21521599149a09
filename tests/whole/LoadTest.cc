// SPDX-License-Identifier: Apache-2.0
// Many clients at once, some of which die, and an owner of the trees who moves things about.
#include "process/DaemonProcess.h"
#include "support/LongRun.h"

#include <atomic>
#include <csignal>
#include <fcntl.h>
#include <filesystem>
#include <fstream>
#include <gtest/gtest.h>
#include <random>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>

namespace zor::whole {

namespace {

using Clock = std::chrono::steady_clock;

Clock::time_point endOfRace() {
    return Clock::now() + std::chrono::duration_cast<Clock::duration>(std::chrono::seconds(support::raceSeconds()));
}

/// One client's life: random commands on few identifiers, so that clients meet. Counts answers that must not be.
void live(const DaemonProcess& daemon, unsigned seed, Clock::time_point end, std::atomic<int>& wrong,
          std::atomic<long>& answered) {
    std::mt19937 random(seed);
    const auto upTo = [&](int count) { return std::uniform_int_distribution(0, count - 1)(random); };
    while (Clock::now() < end) {
        auto client = daemon.client();
        for (int i = upTo(40); i >= 0; --i) {
            const std::string identifier = "org.example.shared" + std::to_string(upTo(12));
            const bool transient = upTo(4) == 0;
            const int command = upTo(20);
            if (command == 0) {
                wrong += !client.emptyDeathRow().has_value();
            } else if (command < 4) {
                wrong += !client.list(dataApplication, mobile, transient).has_value();
            } else {
                const auto made = client.createOrLookup(dataContainer(identifier, transient));
                wrong += !made || made->identifier != identifier;
            }
            ++answered;
        }
    }
}

/// A client that ends in the middle of things, over and over: half a frame, or a request whose answer nobody reads.
void dieOften(const DaemonProcess& daemon, unsigned seed, Clock::time_point end) {
    std::mt19937 random(seed);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    const std::string path = daemon.path("run/zorvane/com.veltra.zorvaned");
    path.copy(address.sun_path, sizeof address.sun_path - 1);
    const unsigned char frame[] = {75, 0, 0, 0, 1, 0, 0, 0, 1, 0, 0, 0, 0, 0, 0, 0, 'b', 'p', 'l', 'i', 's', 't'};
    while (Clock::now() < end) {
        const int socket = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
        if (::connect(socket, reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0)
            (void)!::send(socket, frame, std::uniform_int_distribution<std::size_t>(0, sizeof frame)(random),
                          MSG_NOSIGNAL);
        ::close(socket);
    }
}

} // namespace

// Goal: the commands stay right and nothing leaks under many clients of which some die at any moment. Method: threads
// with connections of their own, then the daemon's own counters and descriptors as before.
TEST(Load, ManyClientsAndRandomDeaths) {
    DaemonProcess daemon;
    daemon.start();
    {
        auto warm = daemon.client();
        ASSERT_TRUE(warm.list(dataApplication, 501, false));
        ASSERT_TRUE(warm.list(dataApplication, 501, true));
        ASSERT_TRUE(warm.emptyDeathRow());
    }
    const std::size_t descriptorsBefore = daemon.descriptors();
    std::atomic<int> wrong{0};
    std::atomic<long> answered{0};
    const auto end = endOfRace();
    std::vector<std::thread> threads;
    for (unsigned i = 0; i < 8; ++i)
        threads.emplace_back([&, i] { live(daemon, 100 + i, end, wrong, answered); });
    for (unsigned i = 0; i < 2; ++i)
        threads.emplace_back([&, i] { dieOften(daemon, 200 + i, end); });
    for (std::thread& thread : threads)
        thread.join();
    EXPECT_EQ(wrong, 0);
    EXPECT_GT(answered, 50);
    ASSERT_TRUE(daemon.client().emptyDeathRow());
    for (int tries = 0; tries < 500 && daemon.descriptors() > descriptorsBefore; ++tries)
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    EXPECT_LE(daemon.descriptors(), descriptorsBefore);
    EXPECT_EQ(daemon.counter("BufferedInputBytes"), 0);
    EXPECT_EQ(daemon.counter("BufferedOutputBytes"), 0);
    EXPECT_EQ(daemon.counter("LockedIdentifiers"), 0);
    const auto listed = daemon.client().list(dataApplication, 501, false);
    ASSERT_TRUE(listed);
    EXPECT_LE(listed->size(), 12u);
    EXPECT_EQ(daemon.terminate(), 0);
}

namespace {

/// Until `end`: moves `place` aside, puts a link, a FIFO, a directory or a file there, and the thing back.
void swapUntil(Clock::time_point end, const std::string& place, const std::string& target) {
    const std::string aside = place + "-aside";
    for (int i = 0; Clock::now() < end; ++i) {
        if (::rename(place.c_str(), aside.c_str()) != 0)
            continue;
        if (i % 4 == 0)
            (void)!::symlink(target.c_str(), place.c_str());
        else if (i % 4 == 1)
            ::mkfifo(place.c_str(), 0666);
        else if (i % 4 == 2)
            ::mkdir(place.c_str(), 0777);
        else
            std::ofstream(place) << "x";
        std::this_thread::sleep_for(std::chrono::microseconds(200));
        if (::unlink(place.c_str()) != 0)
            ::rmdir(place.c_str());
        ::rename(aside.c_str(), place.c_str());
    }
}

} // namespace

// Goal: an owner who swaps the class directory, its parent, a container, its metadata file or a subdirectory for other
// things, at any moment, gets errors; nothing outside is touched and no thread hangs. Method: a race of creations and
// lookups, a tree outside that stays the same.
TEST(HostileOwner, SwapsWhatTheDaemonWorksOn) {
    if (::geteuid() != 0)
        GTEST_SKIP() << "needs root: a daemon that is not root owns everything itself";
    for (int what = 0; what < 5; ++what) {
        DaemonProcess daemon;
        daemon.start();
        const std::string outside = daemon.path("outside");
        writeFile(outside + "/inside/file", "untouched");
        writeFile(outside + "/" + metadataFile, "not a container");
        const std::string before = support::readTree(outside).describe();
        const std::string base = daemon.path("private/var/mobile/Containers/Data");
        const std::string container = daemon.client().createOrLookup(dataContainer("victim")).value().path;
        const std::string places[] = {base + "/Application", base, container, container + "/" + metadataFile,
                                      container + "/Library"};
        SCOPED_TRACE(places[what]);
        const auto end = endOfRace();
        std::thread owner([&] { swapUntil(end, places[what], outside); });
        std::atomic<long> answers{0};
        std::vector<std::thread> clients;
        for (int thread = 0; thread < 3; ++thread)
            clients.emplace_back([&, thread] {
                auto client = daemon.client();
                for (int i = 0; Clock::now() < end; ++i) {
                    const std::string fresh = "c" + std::to_string(thread) + "." + std::to_string(i);
                    auto lookup = dataContainer(i % 3 == 0 ? fresh : "victim", i % 7 == 0);
                    lookup.create = i % 3 == 0;
                    const auto answer = client.createOrLookup(lookup);
                    if (!answer && answer.error().kind != zorvane::Error::Kind::daemon) {
                        ADD_FAILURE() << answer.error().message;
                        return;
                    }
                    ++answers;
                }
            });
        owner.join();
        for (std::thread& client : clients)
            client.join();
        EXPECT_GT(answers, 20);
        ASSERT_TRUE(daemon.client().emptyDeathRow());
        EXPECT_EQ(support::readTree(outside).describe(), before);
        EXPECT_EQ(daemon.terminate(), 0);
    }
}

} // namespace zor::whole
