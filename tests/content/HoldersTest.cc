// SPDX-License-Identifier: Apache-2.0
// Others who hold what an installation goes by: the path of a source, the place of the container, the container itself.
#include "content/ContainerDirectory.h"
#include "content/ContentWorld.h"
#include "support/HangingFileSystem.h"
#include "support/InterceptedDisk.h"
#include "support/LongRun.h"

#include <atomic>
#include <csignal>
#include <sys/wait.h>

namespace zorvanectl::content::test {
namespace {

// Goal: root is not led to what is closed to those who had a hand in the path of an operand. Method: a table of paths
// in directories of root's and of others, each with the reason, or none where it may be installed.
TEST(Content, OperandsThatOthersHold) {
    if (::geteuid() != 0)
        GTEST_SKIP() << "needs root: directories of several users";
    World world;
    const auto give = [](const std::string& path, uid_t owner) { ASSERT_EQ(::lchown(path.c_str(), owner, owner), 0); };
    const auto link = [&](const std::string& target, const std::string& path, uid_t owner) {
        ASSERT_EQ(::symlink(target.c_str(), path.c_str()), 0);
        give(path, owner);
    };
    const std::string his = world.path("/his");
    const std::string roots = world.path("/roots");
    const std::string archive = makeArchive(Form::tar, {file("f")});
    for (const std::string& folder : {his, roots, roots + "/folder", his + "/folder"})
        std::filesystem::create_directory(folder);
    const std::tuple<std::string, uid_t, mode_t> archives[] = {
        {roots + "/closed", 0, 0600}, {roots + "/another's", 502, 0644}, {his + "/own", ownerId, 0600},
        {his + "/closed", 0, 0640},   {his + "/open", 0, 0644},          {his + "/another's", 502, 0644},
    };
    for (const auto& [path, owner, mode] : archives) {
        writeFile(path, archive, mode);
        give(path, owner);
    }
    ::chmod((his + "/folder").c_str(), 0700); // root's, renamed by whom the directory belongs to
    link("/" + roots.substr(1) + "/closed", his + "/link", ownerId);
    link("../roots", his + "/way", ownerId);
    link("../roots/closed", his + "/rootsLink", 0);
    link("../his", roots + "/rootsLink", 0);
    link("rootsLoop", roots + "/rootsLoop", 0);
    give(his, ownerId);
    for (const auto& [folder, mode] : {std::pair("/everybodys", 0777), std::pair("/sticky", 01777)}) {
        writeFile(world.path(folder) + "/closed", archive, 0600);
        ::chmod(world.path(folder).c_str(), static_cast<mode_t>(mode));
    }
    std::filesystem::create_hard_link(roots + "/closed", world.path("/sticky/linked"));
    const std::pair<const char*, const char*> rows[] = {
        {"/roots/closed", ""},
        {"/roots//./../roots/closed", ""},
        {"/roots/folder/", ""},
        {"/roots/another's", "belongs to user 502, and the directory"},
        {"/roots/rootsLink/own", ""},
        {"/roots/rootsLoop", "Too many levels"},
        {"/his/own", ""},
        {"/his/open", ""},
        {"/his/own/", "Not a directory"},
        {"/his/closed", "closed to user 501"},
        {"/his/folder", "closed to user 501"},
        {"/his/another's", "belongs to user 502, and the directory"},
        {"/his/link", "link is a symbolic link of user 501"},
        {"/his/way/closed", "way is a symbolic link of user 501"},
        {"/his/way/", "way is a symbolic link of user 501"},
        {"/his/rootsLink", "closed to user 501"}, // root's link, but at a place of his choice
        {"/everybodys/closed", "where everybody may write"},
        {"/sticky/closed", ""},
        {"/sticky/linked", "where everybody may write"},
        {"/his/absent", "No such file"},
    };
    for (const auto& [path, why] : rows) {
        const auto outcome = Source::open(world.path(path));
        const std::string said = outcome ? "" : outcome.error().what;
        EXPECT_TRUE(*why == '\0' ? said.empty() : said.find(why) != said.npos) << path << ": " << said;
    }
    EXPECT_FALSE(Source::open(""));
    const std::string open = his + "/folder/open";
    writeFile(open, "for all");
    writeFile(his + "/folder/closed", "his own", 0600);
    give(his + "/folder", ownerId);
    give(his + "/folder/closed", ownerId);
    EXPECT_TRUE(world.put("/his/folder"));
    // A file of his that is another one by the time it is opened.
    writeFile(his + "/secret", "SECRET", 0600);
    std::atomic<bool> ends{false};
    std::thread swapping([&] {
        while (!ends)
            ::renameat2(AT_FDCWD, open.c_str(), AT_FDCWD, (his + "/secret").c_str(), RENAME_EXCHANGE);
    });
    for (int round = 0; round < 300; ++round) {
        World target;
        if (!target.put("/" + his + "/folder"))
            continue;
        EXPECT_NE(readFile(target.path("/container/open")), "SECRET");
    }
    ends = true;
    swapping.join();
}

// Goal: nothing is written into what only stands in a new container's place. Method: another user's directory there,
// with no record of the daemon's, with one that its owner made, with a link; file systems that never answer, mounted on
// the way; and the container itself.
TEST(Content, AnotherDirectoryInTheContainersPlace) {
    if (::geteuid() != 0)
        GTEST_SKIP() << "only root can make another user's directory";
    const World world;
    zor::platform::LinuxDisk disk;
    const auto open = [&](const std::string& path) { return openNewContainer(disk, path, MountFence::Kind::home); };
    const std::string place = world.path("/home/Containers");
    const std::string application = place + "/Data/Application";
    std::filesystem::create_directories(application);
    const std::string container = application + "/new";
    ASSERT_EQ(::rename(world.path("/container").c_str(), container.c_str()), 0);
    EXPECT_TRUE(open(container));
    for (const bool forged : {false, true}) {
        const std::string other = application + (forged ? "/forged" : "/other");
        ::mkdir(other.c_str(), 0755);
        if (forged) {
            writeFile(other + "/" + metadata, "whose it is");
            ::chown((other + "/" + metadata).c_str(), ownerId + 1, ownerId + 1);
        }
        ::chown(other.c_str(), ownerId + 1, ownerId + 1);
        EXPECT_FALSE(open(other)) << other;
    }
    ::symlink("new", (application + "/link").c_str());
    EXPECT_FALSE(open(application + "/link"));
    for (const std::string& at : {container, application, place, world.path("/home")}) {
        const HangingFileSystem hanging(at, ownerId);
        if (!hanging.mounted())
            GTEST_SKIP() << "file systems of users (FUSE) cannot be mounted here";
        const auto begin = std::chrono::steady_clock::now();
        const auto opened = open(container);
        EXPECT_LT(std::chrono::steady_clock::now() - begin, 2 * zor::fs::homePatience) << at;
        ASSERT_FALSE(opened) << at;
        EXPECT_NE(opened.error().what.find("unmount"), std::string::npos) << opened.error().what;
    }
}

// Goal: what another program of root's keeps closed in the container does not come out of it. Method: its directory is
// swapped in for the one that the installer makes, before that is opened.
TEST(Content, AnotherDirectoryInTheWayOfTheNewContent) {
    World world;
    ::mkdir(world.path("/container/closed").c_str(), 0700);
    writeFile(world.path("/container/closed/secret"), "SECRET");
    writeFile(world.path("/archive"), makeArchive(Form::tar, {file("f")}));
    zor::platform::LinuxDisk real(zor::platform::Syncs::off);
    ExchangingDisk disk(real, DiskCall::makeDirectory, world.path("/container/closed"), ".install-");
    const auto outcome = world.put("/archive", &disk);
    ASSERT_FALSE(outcome);
    EXPECT_NE(outcome.error().what.find("something else in the place"), std::string::npos) << outcome.error().what;
    EXPECT_FALSE(std::filesystem::exists(world.path("/container/secret")));
}

/// As the container's owner: moves, links and replaces what is in the container until it is killed.
[[noreturn]] void raceAsOwner(const std::string& container) {
    if (::setgid(ownerId) != 0 || ::setuid(ownerId) != 0 || ::chdir(container.c_str()) != 0)
        ::_exit(1);
    for (unsigned round = 0;; ++round) {
        std::vector<std::string> names = {"Documents", "f", "d", "d/g"};
        std::error_code ignored;
        for (const auto& entry : std::filesystem::directory_iterator(".", ignored))
            names.push_back(entry.path().filename());
        for (const std::string& name : names) {
            (void)::rename(name.c_str(), ("moved" + std::to_string(round % 3)).c_str());
            (void)!::symlink(round % 2 == 0 ? "../outside" : "../outside/file", name.c_str());
            if (round % 5 == 0)
                (void)::unlink(name.c_str());
        }
    }
}

// Goal: root writes nothing outside while the container's owner does what he likes with the container. Method: he
// moves everything about and leaves links to outside in its place; afterwards outside is as it was.
TEST(Content, OwnerWhoChangesTheContainerMeanwhile) {
    if (::geteuid() != 0)
        GTEST_SKIP() << "only root can have another owner";
    std::vector<Made> entries = {file("Documents/x"), file("f"), file("d/g")};
    for (int i = 0; i < 80; ++i)
        entries.push_back(file((i % 2 == 0 ? "f" : "d/g") + std::to_string(i) + (i % 2 == 0 ? "" : "/g")));
    const std::string archive = makeArchive(Form::tar, entries);
    const auto end = std::chrono::steady_clock::now() + std::chrono::seconds(raceSeconds());
    int succeeded = 0;
    while (std::chrono::steady_clock::now() < end) {
        World world;
        const pid_t owner = ::fork();
        if (owner == 0)
            raceAsOwner(world.path("/container"));
        for (int i = 0; i < 20; ++i)
            succeeded += world.putArchive(archive) ? 1 : 0;
        ::kill(owner, SIGKILL);
        int status = 0;
        ::waitpid(owner, &status, 0);
        ASSERT_TRUE(WIFSIGNALED(status)) << "the owner did not race";
        ASSERT_FALSE(world.isDamaged());
    }
    EXPECT_GT(succeeded, 0);
}

} // namespace
} // namespace zorvanectl::content::test
