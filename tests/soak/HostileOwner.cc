// SPDX-License-Identifier: Apache-2.0
#include "soak/HostileOwner.h"

#include "os/FileDescriptor.h"
#include "support/FileTree.h"
#include "support/Frames.h"

#include <array>
#include <fcntl.h>
#include <filesystem>
#include <stdexcept>
#include <unistd.h>

namespace zor::soak {

namespace {

namespace files = std::filesystem;

using whole::dataApplication;

/// Whose directories get wanted names.
constexpr std::array<uid_t, 2> owners = {0, 501};
/// So many of the victims, the first ones, lead to containers; the daemon moves the others about itself.
constexpr std::size_t placesOnTheWay = 3;

/// The places where the second user's containers lie and those that lead there, at every depth.
std::vector<std::string> victimsBelow(const std::string& home) {
    std::vector<std::string> victims = {home + "Containers", home + "Containers/Data",
                                        home + "Containers/Data/Application"};
    std::error_code error;
    for (files::recursive_directory_iterator at(home + "Containers", error), end; !error && at != end;
         at.increment(error)) {
        victims.push_back(at->path());
        if (at.depth() >= 4 || at->is_symlink(error))
            at.disable_recursion_pending();
    }
    return victims;
}

} // namespace

HostileOwner::HostileOwner(Session& session, std::uint64_t seed)
    : session_(session), asking_(seed, 1000), swapping_(seed, 1001), outside_(session.root() + "/outside") {
    files::create_directories(outside_ + "/Data/Application/tmp");
    whole::writeFile(outside_ + "/file", "untouched");
    whole::writeFile(outside_ + "/Data/Application/" + whole::metadataFile, "untouched");
    for (const uid_t owner : owners) {
        const std::string closed = closedOf(owner);
        files::create_directories(closed + "/Data/sub");
        whole::writeFile(closed + "/secret", "untouched");
        if (::chmod(closed.c_str(), 0700) != 0 || (::geteuid() == 0 && ::chown(closed.c_str(), owner, owner) != 0))
            throw std::runtime_error("cannot close " + closed);
    }
    before_ = support::readTree(outside_).describe();
}

std::string HostileOwner::changedOutside() const {
    const std::string now = support::readTree(outside_).describe();
    return now == before_ ? "" : before_ + "\nbecame\n" + now;
}

zorvane::Result<void> HostileOwner::askOnce(zorvane::Client& client) {
    const std::string identifier = "org.hostile." + std::to_string(asking_.upTo(4));
    const auto made = client.createOrLookup({.containerClass = dataApplication,
                                             .user = hostileUser,
                                             .identifier = identifier,
                                             .create = true,
                                             .transient = asking_.oneIn(3)});
    session_.did("hostile", "hostile request", identifier);
    if (!made)
        return std::unexpected(made.error());
    const zorvane::Client::Address address{dataApplication, hostileUser, identifier, made->uuid};
    const std::function<zorvane::Result<void>()> requests[] = {
        [&] { return client.wipe(dataApplication, hostileUser, identifier); },
        [&] { return client.recreateDefaultStructure(address); },
        [&] { return client.regenerateDirectoryUUID(address); },
        [&] {
            const auto size = client.diskUsage(address);
            return size ? zorvane::Result<void>() : std::unexpected(size.error());
        },
        [&] { return client.stageForDelete({address}); },
        [&] { return client.setInfoValue(address, "k", zorvane::Value{std::string("v")}); },
        [&] { return client.setDataProtection({dataApplication, hostileUser, identifier, asking_.oneIn(2) ? 1 : 3}); },
    };
    return requests[asking_.upTo(std::size(requests))]();
}

void HostileOwner::askByHalves() {
    const platform::FileDescriptor socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    const unsigned char frame[] = {75, 0, 0, 0, 1, 0, 0, 0, 1, 0, 0, 0, 0, 0, 0, 0, 'b', 'p', 'l', 'i', 's', 't'};
    if (support::connectTo(socket.get(), session_.daemon().path("run/zorvane/com.veltra.zorvaned")))
        (void)!::send(socket.get(), frame, asking_.upTo(sizeof frame), MSG_NOSIGNAL);
}

void HostileOwner::ask() {
    std::optional<zorvane::Client> client;
    while (!session_.stopped) {
        if (asking_.oneIn(8))
            askByHalves();
        if (!client) {
            session_.connect(client);
            continue;
        }
        const auto last = askOnce(*client);
        if (last)
            continue;
        if (last.error().kind == zorvane::Error::Kind::timedOut)
            session_.found("the hostile owner gets no answer: " + last.error().message);
        if (last.error().kind != zorvane::Error::Kind::daemon)
            client.reset();
    }
}

std::string HostileOwner::closedOf(uid_t owner) const {
    return outside_ + "/closed-" + std::to_string(owner);
}

void HostileOwner::nameAnothersSo(const std::string& victim) {
    std::error_code error;
    const std::string closed = closedOf(owners[swapping_.upTo(owners.size())]);
    if (::geteuid() != 0 || files::canonical(victim, error) != victim ||
        ::renameat2(AT_FDCWD, closed.c_str(), AT_FDCWD, victim.c_str(), RENAME_EXCHANGE) != 0)
        return;
    std::this_thread::sleep_for(std::chrono::microseconds(swapping_.upTo(3000)));
    if (::renameat2(AT_FDCWD, closed.c_str(), AT_FDCWD, victim.c_str(), RENAME_EXCHANGE) != 0)
        session_.found("another's directory is gone from " + victim);
}

void HostileOwner::swapOnce(const std::string& victim) {
    std::error_code error;
    // Not through a link that it put there itself: this thread may change what lies outside.
    if (files::canonical(victim, error) != victim)
        return;
    const std::string aside = victim + ".aside";
    const auto trick = swapping_.upTo(5);
    if (trick == 3) // a second name of what lies outside
        if (files::canonical(victim + "/tmp", error) == victim + "/tmp")
            files::create_hard_link(outside_ + "/file", victim + "/tmp/" + std::to_string(swapping_.upTo(9)), error);
    if (trick == 4)
        files::remove_all(victim, error);
    if (trick > 2)
        return;
    // Gone for a moment, or a link or a pipe in its place.
    files::rename(victim, aside, error);
    if (error && trick < 2)
        return;
    if (trick == 0)
        files::create_symlink(outside_ + "/Data/Application", victim, error);
    else if (trick == 1)
        ::mkfifo(victim.c_str(), 0666);
    std::this_thread::sleep_for(std::chrono::microseconds(swapping_.upTo(3000)));
    // An item that the daemon has made there meanwhile goes, or stays under another name.
    if (!files::is_directory(files::symlink_status(victim, error)))
        files::remove(victim, error);
    files::rename(aside, victim, error);
}

void HostileOwner::swap() {
    while (!session_.stopped) {
        session_.hostileTree.lock();
        const auto victims = victimsBelow(session_.root() + "/" + hostileHome);
        session_.hostileTree.unlock();
        {
            const std::lock_guard alone(session_.hostileTree);
            for (unsigned i = 0; i < 8 && !session_.stopped; ++i)
                swapOnce(victims[swapping_.upTo(victims.size())]);
            nameAnothersSo(victims[swapping_.upTo(placesOnTheWay)]);
        }
        sleepMilliseconds(1);
    }
}

} // namespace zor::soak
