// SPDX-License-Identifier: Apache-2.0
// Content that is refused and content that comes in: archives and directories, a disk that fails, the power that goes.
#include "content/ContentWorld.h"
#include "content/ItemRules.h"
#include "content/Unpacker.h"
#include "support/FaultDisk.h"
#include "support/PowerCut.h"
#include "support/ProcessResources.h"

#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <sys/xattr.h>

namespace zorvanectl::content::test {
namespace {

std::string repeated(const std::string& text, int count) {
    std::string whole;
    for (int i = 0; i < count; ++i)
        whole += text;
    return whole;
}

// Goal: no archive makes root write outside the container, give powers, or leave half of itself in sight. Method: a
// table of archives, each refused with its reason; the tree around the container stays as it was.
TEST(Content, HostileArchives) {
    using Archive = std::vector<Made>;
    const std::string name255(255, 'n');
    const std::string meta = metadata;
    const struct {
        const char* why;
        std::vector<Archive> archives;
        std::vector<Form> forms = {Form::tar};
    } rows[] = {
        {"absolute", {{file("/outside/file")}}},
        {"leads up", {{file("../outside/file")}}, {Form::tar, Form::zip, Form::cpio, Form::sevenZip}},
        {"leads up", {{file("a/../../outside/file")}, {directory("a/..")}}},
        {"metadata",
         {{file(meta)}, {file("./" + meta)}, {file(meta + "/x")}, {directory("a"), symbolicLink(meta, "a")}}},
        {"set-user-ID", {{file("a", "x", 04755)}}, {Form::tar, Form::zip}},
        {"set-group-ID", {{file("a", "x", 02755)}}},
        {"a device", {{{.name = "a", .mode = S_IFCHR | 0666}}, {{.name = "a", .mode = S_IFBLK | 0666}}}},
        {"a FIFO", {{{.name = "a", .mode = S_IFIFO | 0666}}}},
        {"a socket", {{{.name = "a", .mode = S_IFSOCK | 0666}}}, {Form::cpio}},
        {"absolute path", {{symbolicLink("a", "/outside")}}, {Form::tar, Form::zip}},
        {"leads out", {{symbolicLink("a", "../outside")}, {directory("a"), symbolicLink("a/b", "../../outside")}}},
        {"leads out", {{hardLink("a", "/outside/file")}, {hardLink("a", "../outside/file")}}},
        // The first link leads nowhere but here, so ".." behind it would lead out.
        {"behind a name", {{symbolicLink("here", "."), symbolicLink("out", "here/../outside")}}},
        {"no directory", {{directory("d"), symbolicLink("l", "d"), file("l/f")}, {file("f"), file("f/g")}}},
        {"comes twice", {{symbolicLink("l", "."), directory("l")}, {symbolicLink("l", "f"), file("l")}}},
        {"comes twice", {{file("f"), file("f", "y")}, {file("f"), file("./f", "y")}}},
        {"comes twice", {{file("f"), directory("f")}, {directory("f"), file("f")}}},
        {"no file earlier", {{hardLink("a", "b"), file("b")}, {symbolicLink("l", "f"), hardLink("a", "l")}}},
        {"no file earlier", {{directory("d"), hardLink("a", "d")}, {hardLink("a", meta)}}},
        {"more than 255", {{file(name255 + "n")}}},
        {"more than 4095", {{file(repeated("dir/", 1100) + "f")}}},
        {"only be a directory", {{file(".")}, {hardLink("./", "f")}}},
    };
    for (const auto& row : rows)
        for (const Form form : row.forms)
            for (const Archive& archive : row.archives) {
                SCOPED_TRACE(archive.back().name + " -> " + archive.back().target + ": " + row.why);
                World world;
                world.expectRefused(world.putArchive(makeArchive(form, archive)), row.why);
            }
}

// Goal: what is no archive, is cut or is damaged is refused, wherever that is. Method: such bytes, and a good archive
// cut after every block and at odd places.
TEST(Content, BrokenArchives) {
    std::string noise;
    for (unsigned i = 0; i < 20'000; ++i)
        noise += static_cast<char>((i * i * 7919) >> 5);
    const std::vector<Made> entries = {directory("a"), file("a/f", std::string(3000, 'f')), file("g", noise)};
    std::vector<std::pair<std::string, std::string>> rows = {{"nothing", ""},
                                                             {"text", "Just some text.\n"},
                                                             // A list of files that a reader would fetch.
                                                             {"mtree", "#mtree\na type=file contents=/etc/passwd\n"}};
    for (const Form form :
         {Form::tar, Form::tarGzip, Form::tarXz, Form::tarZstd, Form::zip, Form::cpio, Form::sevenZip}) {
        const std::string whole = makeArchive(form, entries);
        const std::string name = "form " + std::to_string(form.format + form.filter);
        const auto cutAt = [&](std::size_t at) {
            rows.emplace_back(name + " cut at " + std::to_string(at), whole.substr(0, at));
        };
        // A tar's end is its last two blocks; of those one may be missing.
        for (std::size_t cut = 512; form == Form::tar && cut + 1024 < whole.size(); cut += 512)
            cutAt(cut);
        for (std::size_t cut = 16; cut + 16 < whole.size(); cut += whole.size() / 9)
            cutAt(cut);
        std::string damaged = whole;
        damaged[damaged.size() / 2] ^= 0x55;
        // The others have no sums of data, or none when they are made this way.
        if (form != Form::tar && form != Form::cpio && form != Form::tarZstd)
            rows.emplace_back(name + " damaged", damaged);
    }
    const ProcessResources before;
    for (const auto& [what, bytes] : rows) {
        SCOPED_TRACE(what);
        World world;
        world.expectRefused(world.putArchive(bytes), "");
    }
    const std::string member = makeArchive(Form::tarGzip, entries);
    World world; // as two that were put one behind the other, and padded
    EXPECT_TRUE(world.putArchive(member + std::string("\x1f\x8b\x08\0\0\0\0\0\0\3\3\0\0\0\0\0\0\0\0\0\0\0", 22)));
    EXPECT_EQ(before.leakedSince(), "");
}

// Goal: what is good comes in whole, whatever it is packed in, with the container's owner. Method: one tree in every
// form that can hold it, with names that people would not choose.
TEST(Content, GoodArchives) {
    std::string large;
    for (int i = 0; i < 3'000'000; ++i)
        large += static_cast<char>(i * 31 >> 3);
    const std::string longName = repeated(std::string(120, 'l') + "/", 3) + "f";
    for (const Form form :
         {Form::tar, Form::gnuTar, Form::tarGzip, Form::tarBzip2, Form::tarCompress, Form::tarLz4, Form::tarLzip,
          Form::tarLzma, Form::tarXz, Form::tarZstd, Form::zip, Form::cpio, Form::sevenZip}) {
        SCOPED_TRACE(form.format + form.filter);
        const bool isTar = form != Form::zip && form != Form::cpio && form != Form::sevenZip;
        std::vector<Made> entries = {directory("."), directory("./a", 0500), file("./a/f", "text", 0444),
                                     // Twice.
                                     directory("./a", 0500), file("implied/b/run", "#!", 0755),
                                     symbolicLink("implied/up", "../a/f"), file("large", large), file("empty", ""),
                                     symbolicLink("Library", "a"), file("Documents/n\n\x01", "x")};
        std::map<std::string, std::string> contents = {
            {"a/f", "text"},       {"large", large},           {"implied/up", "text"},   {"empty", ""},
            {"Library/f", "text"}, {"Documents/n\n\x01", "x"}, {metadata, "whose it is"}};
        if (isTar) {
            for (Made& more : std::vector{hardLink("./again", "./a/f"), file("\xff\xfe", "no text"),
                                          symbolicLink("longLink", longName), file(longName, "long")})
                entries.push_back(more);
            contents.merge(
                std::map<std::string, std::string>{{"again", "text"}, {"\xff\xfe", "no text"}, {"longLink", "long"}});
        }
        if (form == Form::tar) {
            entries.push_back({.name = "sparse", .data = "end", .hole = 40'000'000});
            contents["sparse"] = std::string(40'000'000, '\0') + "end";
        }
        World world;
        const auto outcome = world.putArchive(makeArchive(form, entries));
        ASSERT_TRUE(outcome) << outcome.error().what;
        EXPECT_FALSE(world.isDamaged());
        for (const auto& [name, content] : contents) {
            EXPECT_TRUE(readFile(world.path("/container/") + name) == content) << name;
        }
        EXPECT_EQ(world.statusOf("a").st_mode & 07777, 0700U) << "its owner may use each of the directories";
        const struct stat file = world.statusOf("a/f");
        EXPECT_EQ(file.st_mode & 07777, 0444U);
        EXPECT_EQ(file.st_mtime, 1'000'000'000);
        EXPECT_EQ(file.st_nlink, isTar ? 2U : 1U);
        if (form == Form::tar) {
            EXPECT_LT(world.statusOf("sparse").st_blocks * 512, 1'000'000) << "a hole stays one";
        }
        for (const auto& [id, inode] : readTree(world.path("/container"), {metadata}).inodes)
            EXPECT_EQ(inode.uid, ::geteuid() == 0 ? ownerId : ::geteuid());
    }
}

// Goal: a directory as the source is judged like an archive. Method: one wrong item in it, deep enough to be met late.
TEST(Content, HostileDirectories) {
    const auto makeSecret = [](const std::string& path, mode_t mode) { writeFile(path, "SECRET", mode); };
    const auto giveAway = [](const std::string& path) { (void)!::chown(path.c_str(), ownerId, ownerId); };
    struct Row {
        const char* why;
        std::function<void(const std::string& folder)> make;
        bool rootOnly = false;
    };
    const Row rows[] = {
        {"set-user-ID", [&](const std::string& folder) { makeSecret(folder + "/x", 04755); }},
        {"a FIFO", [](const std::string& folder) { ::mkfifo((folder + "/x").c_str(), 0600); }},
        {"leads out", [](const std::string& folder) { (void)!::symlink("../../../x", (folder + "/x").c_str()); }},
        {"metadata", [&](const std::string& folder) { makeSecret(folder + "/../../" + metadata, 0644); }},
        {"a device", [](const std::string& folder) { ::mknod((folder + "/x").c_str(), S_IFCHR | 0666, makedev(1, 3)); },
         true},
        {"another file system", [](const std::string& folder) { ::mount("none", folder.c_str(), "tmpfs", 0, ""); },
         true},
        // Root's items in directories of somebody who may have moved them there.
        {"closed to user 501",
         [&](const std::string& folder) {
             makeSecret(folder + "/x", 0640);
             giveAway(folder);
         },
         true},
        {"closed to user 501",
         [&](const std::string& folder) {
             ::chmod(folder.c_str(), 0700);
             giveAway(folder + "/../..");
         },
         true},
        {"closed to user 501",
         [&](const std::string& folder) {
             makeSecret(folder + "/x", 0644);
             // For user 501 alone, nothing.
             constexpr char list[] = "\2\0\0\0\1\0\6\0\xff\xff\xff\xff\2\0\0\0\xf5\1\0\0\4\0\4\0\xff\xff\xff\xff"
                                     "\20\0\4\0\xff\xff\xff\xff \0\4\0\xff\xff\xff\xff";
             EXPECT_EQ(::setxattr((folder + "/x").c_str(), "system.posix_acl_access", list, sizeof list - 1, 0), 0);
             giveAway(folder + "/..");
         },
         true}};
    for (const auto& row : rows) {
        SCOPED_TRACE(row.why);
        if (row.rootOnly && ::geteuid() != 0)
            continue;
        World world;
        const std::string folder = world.path("/source/a/b");
        std::filesystem::create_directories(folder);
        row.make(folder);
        world.expectRefused(world.put("/source"), row.why);
        ::umount2(folder.c_str(), MNT_DETACH);
    }
    World world;
    world.expectRefused(world.put(""), "holds the container itself");
}

// Goal: a directory comes in as it is, but as the container's. Method: what may be in one, compared item by item.
TEST(Content, GoodDirectories) {
    World world;
    const std::string root = world.path("/source");
    for (const char* folder : {"/a/b", "/Documents"})
        std::filesystem::create_directories(root + folder);
    writeFile(root + "/a/b/f", std::string(100'000, 'f'));
    writeFile(root + "/Documents/\n", "x");
    ASSERT_EQ(::link((root + "/a/b/f").c_str(), (root + "/again").c_str()), 0);
    ASSERT_EQ(::symlink("../Documents", (root + "/a/l").c_str()), 0);
    ASSERT_EQ(::truncate((root + "/a/b/f").c_str(), 50'000'000), 0);
    const auto outcome = world.put("/source");
    ASSERT_TRUE(outcome) << outcome.error().what;
    EXPECT_EQ(outcome->items, 7U);
    EXPECT_FALSE(world.isDamaged());
    const auto describe = [](const std::string& path) {
        auto tree = readTree(path, {metadata});
        for (auto& [id, inode] : tree.inodes)
            inode.uid = inode.gid = 0;
        return tree.describe();
    };
    EXPECT_EQ(describe(world.path("/container")), describe(root));
    const struct stat again = world.statusOf("again");
    EXPECT_LT(again.st_blocks * 512, 1'000'000) << "a hole stays one";
    EXPECT_EQ(again.st_uid, ::geteuid() == 0 ? ownerId : ::geteuid());
}

// Goal: a small archive cannot fill the disk, nor make items without end. Method: a file that unpacks to more than a
// small file system may lose; a count beyond the limit.
TEST(Content, Bombs) {
    const FileDescriptor here = openDirectory("/");
    Course course(here.get(), noSignal, {});
    std::uint64_t items = 0;
    for (; items <= itemsMax && course.addItem(); ++items) {
    }
    EXPECT_EQ(items, itemsMax);
    if (::geteuid() != 0)
        GTEST_SKIP() << "only root can make a small file system";
    const TemporaryDirectory directory;
    if (::mount("none", directory.path().c_str(), "tmpfs", 0, "size=64m") != 0)
        GTEST_SKIP() << "mounts are not permitted here";
    {
        World world(directory.path());
        const std::string bomb = makeArchive(Form::tarZstd, {file("zeros", std::string(80'000'000, '\0'))});
        ASSERT_LT(bomb.size(), 100'000U);
        world.expectRefused(world.putArchive(bomb), "too little space");
    }
    ::umount2(directory.path().c_str(), MNT_DETACH);
}

// Goal: no failure of the disk is taken for success, and what is said to have come in is durable whatever the power
// does then. Method: each call that changes the disk fails, for an archive and a directory; then the power goes at the
// end, under both models of a disk.
TEST(Content, EveryCallFailsAndThePowerGoes) {
    const std::string archive =
        makeArchive(Form::tar, {directory("d"), file("d/f", std::string(300'000, 'f')), hardLink("again", "d/f"),
                                symbolicLink("l", "d"), file("Documents/g"), file("empty", "")});
    const auto prepare = [&](World& world, bool asArchive) {
        writeFile(world.path("/archive"), archive);
        ::mkdir(world.path("/source/Documents").c_str(), 0755);
        writeFile(world.path("/source/Documents/f"), std::string(300'000, 'f'));
        EXPECT_EQ(::symlink("Documents", world.path("/source/l").c_str()), 0);
        EXPECT_EQ(::link(world.path("/source/Documents/f").c_str(), world.path("/source/again").c_str()), 0);
        return asArchive ? "/archive" : "/source";
    };
    for (const bool asArchive : {true, false}) {
        zor::platform::LinuxDisk real(zor::platform::Syncs::off);
        struct Run {
            std::unique_ptr<World> world;
            FaultDisk& disk;
            std::string source;
            bool done = false;
        };
        const auto report = forEachFaultPoint(
            real, {.error = ENOSPC, .span = FaultSpan::once},
            [&](FaultDisk& disk) {
                Run run{.world = std::make_unique<World>(), .disk = disk, .source = {}};
                run.source = prepare(*run.world, asArchive);
                return run;
            },
            [](Run& run) { run.done = run.world->put(run.source, &run.disk).has_value(); },
            [](const Run& run, const FaultOutcome& outcome) -> std::string {
                if (run.world->isDamaged())
                    return "something outside changed";
                return run.done == !outcome.met ? "" : "a failure passed for success";
            });
        EXPECT_EQ(report.complaint, "");
        EXPECT_GT(report.examined, 20U);

        World world;
        const std::string source = prepare(world, asArchive);
        RecordingDisk recording(real, world.path("/container"));
        recording.start();
        ASSERT_TRUE(world.put(source, &recording));
        EXPECT_EQ(recording.complaint(), "");
        const auto log = recording.log();
        const std::string whole = readTree(world.path("/container")).describe();
        for (const auto model : {DiskModel::orderedJournal, DiskModel::unordered})
            for (const auto& state : PowerCut(log, {.model = model}).statesAfter(log.operations.size()))
                EXPECT_EQ(state.tree.describe(), whole) << state.description;
    }
}

} // namespace
} // namespace zorvanectl::content::test
