// SPDX-License-Identifier: Apache-2.0
#include "fs/TreeWorld.h"

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <random>
#include <sys/stat.h>
#include <sys/wait.h>
#include <system_error>
#include <unistd.h>

namespace zor::fs::test {

using platform::FileDescriptor;

namespace {

void check(int result, const std::string& what) {
    if (result < 0)
        throw std::system_error(errno, std::generic_category(), what);
}

std::string upwards(std::size_t levels) {
    std::string path;
    while (levels-- > 0)
        path += "../";
    return path;
}

} // namespace

bool isLongRun() {
    const char* const value = std::getenv("ZORVANE_TEST_LONG");
    return value != nullptr && std::string(value) == "1";
}

std::chrono::seconds raceTime() {
    return std::chrono::seconds(isLongRun() ? 30 : 2);
}

std::size_t openDescriptorCount() {
    // Not from /proc, which a confined test does not have.
    constexpr int descriptorsMax = 1024;
    std::size_t count = 0;
    for (int fd = 0; fd < descriptorsMax; ++fd)
        count += ::fcntl(fd, F_GETFD) >= 0 ? 1 : 0;
    return count;
}

FileDescriptor openDirectory(int parent, const std::string& path) {
    FileDescriptor fd(::openat(parent, path.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    check(fd.get(), "open " + path);
    return fd;
}

void makeDirectory(int parent, const std::string& path, mode_t mode) {
    check(::mkdirat(parent, path.c_str(), 0755), "mkdir " + path);
    check(::fchmodat(parent, path.c_str(), mode, 0), "chmod " + path);
}

void makeFile(int parent, const std::string& path, const std::string& content, mode_t mode) {
    const FileDescriptor fd(::openat(parent, path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0600));
    check(fd.get(), "create " + path);
    check(static_cast<int>(::write(fd.get(), content.data(), content.size())), "write " + path);
    check(::fchmod(fd.get(), mode), "chmod " + path);
}

void makeLink(int parent, const std::string& path, const std::string& target) {
    check(::symlinkat(target.c_str(), parent, path.c_str()), "symlink " + path);
}

void makeFifo(int parent, const std::string& path) {
    check(::mkfifoat(parent, path.c_str(), 0644), "mkfifo " + path);
}

bool exists(int parent, const std::string& path) {
    struct stat status{};
    return ::fstatat(parent, path.c_str(), &status, AT_SYMLINK_NOFOLLOW) == 0;
}

void makeChain(int parent, std::size_t depth) {
    FileDescriptor current;
    for (std::size_t level = 0; level < depth; ++level) {
        const int above = level == 0 ? parent : current.get();
        check(::mkdirat(above, "d", 0755), "mkdir");
        FileDescriptor next = openDirectory(above, "d");
        check(::mknodat(next.get(), "f", S_IFREG | 0644, 0), "mknod");
        current = std::move(next);
    }
}

std::string chainPath(std::size_t depth) {
    std::string path;
    for (std::size_t level = 0; level < depth; ++level)
        path += (level == 0 ? "a" : "/a") + std::to_string(level);
    return path;
}

World::World(const std::string& parent) : directory_(parent), root_(openDirectory(AT_FDCWD, directory_.path())) {
    makeDirectory(fd(), "outside");
    makeFile(fd(), "outside/file", secret, 0600);
    makeDirectory(fd(), "outside/sub", 0700);
    makeFile(fd(), "outside/sub/f", secret, 0640);
    makeDirectory(fd(), "outside/e");
    makeFile(fd(), "outside/e/f", secret, 0600);
    makeDirectory(fd(), "outside/parking", 0777);
    makeDirectory(fd(), "outside/parking/keep");
    makeFile(fd(), "outside/parking/keep/f", secret);
    makeFile(fd(), "outside/parking/f", secret);
    makeFile(fd(), "outside/large", secret);
    const FileDescriptor large(::openat(fd(), "outside/large", O_RDWR | O_CLOEXEC));
    check(::fallocate(large.get(), FALLOC_FL_KEEP_SIZE, 0, outsideBytes), "fallocate");
    if (::geteuid() == 0)
        check(::fchownat(fd(), "outside/sub/f", 1234, 1234, AT_SYMLINK_NOFOLLOW), "chown");
    before_ = outside();
}

void World::makeTree() {
    makeDirectory(fd(), "tree");
    for (std::size_t depth = 1; depth <= chainDepth; ++depth) {
        const std::string directory = "tree/" + chainPath(depth);
        makeDirectory(fd(), directory);
        makeFile(fd(), directory + "/f");
        makeFile(fd(), directory + "/g");
        makeLink(fd(), directory + "/l", upwards(depth + 1) + "outside");
        makeDirectory(fd(), directory + "/e");
        makeFile(fd(), directory + "/e/f");
        makeFifo(fd(), directory + "/fifo");
    }
    makeDirectory(fd(), "tree/wide");
    for (std::size_t i = 0; i < wideCount; ++i) {
        const std::string number = std::to_string(i);
        makeDirectory(fd(), "tree/wide/e" + number);
        makeFile(fd(), "tree/wide/e" + number + "/f");
        makeLink(fd(), "tree/wide/l" + number, upwards(2) + "outside");
        makeFile(fd(), "tree/wide/f" + number);
        makeFifo(fd(), "tree/wide/p" + number);
    }
}

bool World::confined(const std::function<void()>& body) {
    constexpr int passed = 0;
    constexpr int failed = 1;
    constexpr int notPermitted = 2;
    std::fflush(nullptr);
    const pid_t child = ::fork();
    check(child, "fork");
    if (child == 0) {
        if (::chroot(path().c_str()) != 0 || ::chdir("/") != 0)
            ::_exit(notPermitted);
        confined_ = true;
        try {
            body();
        } catch (const std::exception& error) {
            ADD_FAILURE() << error.what();
        }
        std::fflush(nullptr);
        ::_exit(testing::Test::HasFailure() ? failed : passed);
    }
    int status = 0;
    check(::waitpid(child, &status, 0), "waitpid");
    EXPECT_TRUE(WIFEXITED(status)) << "ended by signal " << WTERMSIG(status);
    EXPECT_NE(WEXITSTATUS(status), failed) << "see above";
    return !WIFEXITED(status) || WEXITSTATUS(status) != notPermitted;
}

std::string World::outside() const {
    return support::readTree(path() + "/outside", {"parking/moved"}).describe();
}

std::string World::damage() const {
    const std::string now = outside();
    return now == before_ ? "" : "outside was\n" + before_ + "and is\n" + now;
}

Vandal::Vandal(const World& world) : world_(world), thread_([this] { run(); }) {
    while (!begun_)
        std::this_thread::yield();
}

Vandal::~Vandal() {
    stopped_ = true;
    thread_.join();
}

void Vandal::run() {
    std::mt19937 random(static_cast<unsigned>(::getpid()));
    while (!stopped_) {
        for (int exchanges = 0; exchanges < 100 && !stopped_; ++exchanges)
            exchange(random());
        begun_ = true;
        replaceFile(random());
        moveOutAndBack(random());
    }
}

/// A directory of the chain stands in outside/parking for a moment, with a link to there in its place.
void Vandal::moveOutAndBack(unsigned random) {
    const std::size_t depth = 1 + random % World::chainDepth;
    const std::string path = "tree/" + chainPath(depth);
    if (::renameat(world_.fd(), path.c_str(), world_.fd(), "outside/parking/moved") != 0)
        return;
    const std::string target = upwards(depth) + "outside" + (random & 0x1000 ? "" : "/parking/moved");
    [[maybe_unused]] int ignored = ::symlinkat(target.c_str(), world_.fd(), path.c_str());
    ::usleep((random >> 16) % 1000);
    ::unlinkat(world_.fd(), path.c_str(), 0);
    if (::renameat(world_.fd(), "outside/parking/moved", world_.fd(), path.c_str()) != 0)
        ::renameat(world_.fd(), "outside/parking/moved", world_.fd(), "tree/returned");
}

/// A directory and a link to outside, or a file and a FIFO, change places.
void Vandal::exchange(unsigned random) {
    const std::string number = std::to_string(random / 2 % World::wideCount);
    const std::string from = (random % 2 == 0 ? "tree/wide/e" : "tree/wide/f") + number;
    const std::string to = (random % 2 == 0 ? "tree/wide/l" : "tree/wide/p") + number;
    ::renameat2(world_.fd(), from.c_str(), world_.fd(), to.c_str(), RENAME_EXCHANGE);
}

void Vandal::replaceFile(unsigned random) {
    const std::size_t depth = 1 + random % World::chainDepth;
    const std::string path = "tree/" + chainPath(depth) + "/f";
    ::unlinkat(world_.fd(), path.c_str(), 0);
    [[maybe_unused]] int ignored = 0;
    if ((random & 0x1000) != 0)
        ignored = ::symlinkat((upwards(depth + 1) + "outside/file").c_str(), world_.fd(), path.c_str());
    else if ((random & 0x2000) != 0)
        ignored = ::mkfifoat(world_.fd(), path.c_str(), 0600);
    else
        ignored = ::mkdirat(world_.fd(), path.c_str(), 0700);
}

} // namespace zor::fs::test
