// SPDX-License-Identifier: Apache-2.0
#include "fs/TreeWorld.h"

#include <sched.h>
#include <sys/mount.h>
#include <sys/wait.h>

namespace zor::fs::test {

using support::checked;

namespace {

std::string upwards(std::size_t levels) {
    std::string path;
    while (levels-- > 0)
        path += "../";
    return path;
}

/// `enter` says whether it could.
bool inChild(const std::function<bool()>& enter, const std::function<void()>& body) {
    enum { passed, failed, notPermitted };
    std::fflush(nullptr);
    const pid_t child = checked(::fork(), "fork");
    if (child == 0) {
        if (!enter())
            ::_exit(notPermitted);
        try {
            body();
        } catch (const std::exception& error) {
            ADD_FAILURE() << error.what();
        }
        std::fflush(nullptr);
        ::_exit(testing::Test::HasFailure() ? failed : passed);
    }
    int status = 0;
    checked(::waitpid(child, &status, 0), "waitpid");
    EXPECT_TRUE(WIFEXITED(status)) << "ended by signal " << WTERMSIG(status);
    EXPECT_NE(WEXITSTATUS(status), failed) << "see above";
    return !WIFEXITED(status) || WEXITSTATUS(status) != notPermitted;
}

} // namespace

bool inMountNamespace(const std::function<void()>& body) {
    const auto enter = [] {
        return ::unshare(CLONE_NEWNS) == 0 && ::mount("none", "/", nullptr, MS_REC | MS_PRIVATE, nullptr) == 0;
    };
    return inChild(enter, body);
}

World::World() : root_(openDirectory(directory_.path())) {
    makeItems(fd(), {"outside/", "outside/sub/", "outside/e/", "outside/parking/", "outside/parking/keep/"});
    checked(::fchmodat(fd(), "outside/sub", 0700, 0) | ::fchmodat(fd(), "outside/parking", 0777, 0), "chmod");
    for (const char* file : {"file", "e/f", "parking/keep/f", "parking/f"})
        makeFile(fd(), std::string("outside/") + file, secret, 0600);
    makeFile(fd(), "outside/sub/f", secret, 0640);
    makeFile(fd(), "outside/large", secret);
    const FileDescriptor large(::openat(fd(), "outside/large", O_RDWR | O_CLOEXEC));
    checked(::fallocate(large.get(), FALLOC_FL_KEEP_SIZE, 0, outsideBytes), "fallocate");
    if (::geteuid() == 0)
        checked(::fchownat(fd(), "outside/sub/f", 1234, 1234, AT_SYMLINK_NOFOLLOW), "chown");
    before_ = outside();
}

void World::makeTree() {
    makeDirectory(fd(), "tree");
    for (std::size_t depth = 1; depth <= chainDepth; ++depth) {
        const std::string directory = "tree/" + chainPath(depth);
        makeDirectory(fd(), directory);
        const FileDescriptor made = openDirectory(fd(), directory);
        makeItems(made.get(), {"f", "g", "l -> " + upwards(depth + 1) + "outside", "e/", "e/f", "fifo|"});
    }
    makeDirectory(fd(), "tree/wide");
    const FileDescriptor wide = openDirectory(fd(), "tree/wide");
    for (std::size_t i = 0; i < wideCount; ++i) {
        const std::string number = std::to_string(i);
        makeItems(wide.get(), {"e" + number + "/", "e" + number + "/f", "l" + number + " -> " + upwards(2) + "outside",
                               "f" + number, "p" + number + "|"});
    }
}

bool World::confined(const std::function<void()>& body) {
    const auto enter = [this] {
        confined_ = ::chroot(path().c_str()) == 0 && ::chdir("/") == 0;
        return confined_;
    };
    return inChild(enter, body);
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
