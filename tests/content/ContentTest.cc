// SPDX-License-Identifier: Apache-2.0
#include "content/Content.h"
#include "archives/ArchiveMaker.h"
#include "content/ContainerDirectory.h"
#include "content/Decoder.h"
#include "content/ItemRules.h"
#include "content/Powerless.h"
#include "content/Unpacker.h"
#include "os/LinuxDisk.h"
#include "support/FaultDisk.h"
#include "support/Files.h"
#include "support/HangingFileSystem.h"
#include "support/LongRun.h"
#include "support/PowerCut.h"
#include "support/ProcessResources.h"

#include <atomic>
#include <gtest/gtest.h>
#include <sys/ioctl.h>
#include <sys/prctl.h>
#include <sys/ptrace.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <sys/sysmacros.h>
#include <sys/uio.h>
#include <sys/wait.h>
#include <sys/xattr.h>

namespace zorvanectl::content::test {
namespace {

using zor::platform::FileDescriptor;
using namespace zor::support;
using namespace zor::test;
constexpr const char* metadata = ".com.veltra.zorvane.metadata.plist";
constexpr uid_t ownerId = 501;

volatile std::sig_atomic_t noSignal = 0;

std::string repeated(const std::string& text, int count) {
    std::string whole;
    for (int i = 0; i < count; ++i)
        whole += text;
    return whole;
}

/// A container as it was just made, and something beside it that nobody may touch.
class World {
public:
    explicit World(const std::string& parent = "/dev/shm") : directory_(parent) {
        for (const char* name : {"/outside", "/container", "/container/Documents", "/source"})
            ::mkdir(path(name).c_str(), 0755);
        writeFile(path("/outside/file"), "SECRET");
        writeFile(path("/container/") + metadata, "whose it is");
        for (const char* name : {"/container", "/container/Documents"})
            EXPECT_TRUE(::geteuid() != 0 || ::chown(path(name).c_str(), ownerId, ownerId) == 0);
        ::chmod(directory_.path().c_str(), 0755);
        outside_ = outside();
        empty_ = content();
    }

    [[nodiscard]] std::string path(const std::string& below) const { return directory_.path() + below; }
    [[nodiscard]] bool isDamaged() const { return outside() != outside_; }
    /// Nothing of what was refused shows in the container, and nothing outside it changed.
    void expectRefused(const Outcome<Progress>& outcome, const std::string& why) const {
        ASSERT_FALSE(outcome);
        EXPECT_NE(outcome.error().what.find(why), std::string::npos) << outcome.error().what;
        EXPECT_FALSE(isDamaged());
        EXPECT_EQ(content(), empty_);
    }

    /// The status of an item in the container.
    [[nodiscard]] struct stat statusOf(const std::string& name) const {
        struct stat status{};
        EXPECT_EQ(::lstat(path("/container/" + name).c_str(), &status), 0) << name;
        return status;
    }
    /// A source that begins with "//" is one outside this world.
    Outcome<Progress> put(const std::string& source, zor::platform::Disk* disk = nullptr) {
        zor::platform::LinuxDisk real(zor::platform::Syncs::off);
        auto opened = Source::open(source.starts_with("//") ? source : path(source));
        if (!opened)
            return std::unexpected(opened.error());
        return putContent(disk ? *disk : real, openDirectory(path("/container")).get(), *opened, {}, noSignal);
    }
    Outcome<Progress> putArchive(const std::string& bytes) {
        writeFile(path("/archive"), bytes);
        return put("/archive");
    }

private:
    /// Everything but the container and the source.
    [[nodiscard]] std::string outside() const {
        return readTree(directory_.path(), {"container", "source", "archive"}).describe();
    }
    /// The content that shows in the container: ".install-" is closed to its owner.
    [[nodiscard]] std::string content() const {
        std::string shown;
        std::istringstream lines(readTree(path("/container"), {metadata}).describe());
        for (std::string line; std::getline(lines, line);)
            if (line.find(".install-") == line.npos)
                shown += line + "\n";
        return shown;
    }
    TemporaryDirectory directory_;
    std::string outside_;
    std::string empty_;
};

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

// Goal: whatever a decoder that was taken over sends, the writer stays in its directory and ends. Method: records that
// no decoder of ours sends, through a pipe.
TEST(Content, NonsenseRecords) {
    const auto bytes = [](const Record& record, const std::string& after = "") {
        return std::string(reinterpret_cast<const char*>(&record), sizeof record) + after;
    };
    const auto data = [&](const std::string& content, std::int64_t offset = 0) {
        const auto length = static_cast<std::uint32_t>(content.size());
        return bytes({.kind = RecordKind::data, .first = length, .offset = offset}, content);
    };
    const auto entry = [&](const std::string& name, const std::string& target, Record record) {
        record.kind = RecordKind::entry;
        record.first = static_cast<std::uint32_t>(name.size());
        record.second = static_cast<std::uint32_t>(target.size());
        return bytes(record, name + target);
    };
    const std::string withNul("f\0g", 3);
    const std::string end = bytes({.kind = RecordKind::end});
    const std::string file = entry("f", "", {.flags = recordHasSize, .mode = S_IFREG | 0644, .offset = 4});
    const std::vector<std::pair<std::string, const char*>> rows = {
        {"", "too early"},
        {file, "too early"},
        {bytes({.kind = RecordKind{77}}), "nonsense"},
        {bytes({.kind = RecordKind::entry, .first = 0xFFFF'FFFF}), "nonsense"},
        {bytes({.kind = RecordKind::entry, .first = 200'000, .second = 200'000}), "nonsense"},
        {bytes({.kind = RecordKind::data, .first = 1, .second = 1}), "nonsense"},
        {data("x"), "data of no file"},
        {entry("d", "", {.mode = S_IFDIR | 0755}) + data("x"), "data of no file"},
        {file + data("x", -1), "out of order"},
        {file + data("x", INT64_MAX), "out of order"},
        {file + data("x", 1) + data("x"), "out of order"},
        {file + data("12345") + end, "longer than it says"},
        {entry("f", "", {.flags = recordHasSize, .mode = S_IFREG | 0644, .offset = -5}) + end, "longer than it says"},
        {entry(withNul, "", {.mode = S_IFREG | 0644}), "NUL"},
        {entry("l", withNul, {.mode = S_IFLNK | 0777}), "NUL"},
        {entry("l", "", {.mode = S_IFLNK | 0777}), "without a target"},
        {entry("", "", {.mode = S_IFREG}), "no name"},
        {bytes({.kind = RecordKind::failure, .first = 4}, "\x1b[2J"), "\\x1b"},
    };
    for (const auto& [sent, why] : rows) {
        SCOPED_TRACE(why);
        World world;
        int ends[2];
        ASSERT_EQ(::pipe2(ends, O_CLOEXEC), 0);
        const FileDescriptor reading(ends[0]);
        ASSERT_EQ(::write(ends[1], sent.data(), sent.size()), static_cast<ssize_t>(sent.size()));
        ::close(ends[1]);
        const FileDescriptor directory = openDirectory(world.path("/source"));
        zor::platform::LinuxDisk disk(zor::platform::Syncs::off);
        Course course(directory.get(), noSignal, {});
        const auto outcome = Unpacker(disk, directory.get(), {}, course).unpack(reading.get());
        ASSERT_FALSE(outcome);
        EXPECT_NE(outcome.error().what.find(why), std::string::npos) << outcome.error().what;
        EXPECT_FALSE(world.isDamaged());
    }
}

// Goal: the process that decodes has the archive, the pipe, and nothing of its caller's. Method: one that waits for its
// reader, as /proc shows it.
TEST(Content, ADecoderHoldsNothing) {
    World world;
    writeFile(world.path("/archive"), makeArchive(Form::tar, {file("f", std::string(4'000'000, 'f'))}));
    const FileDescriptor archive(::open(world.path("/archive").c_str(), O_RDONLY | O_CLOEXEC));
    const auto decoder = Decoder::start(archive.get());
    ASSERT_TRUE(decoder);
    char record = 0;
    ASSERT_EQ(::read(decoder->records(), &record, 1), 1); // it is ready then
    std::string pid;
    std::getline(std::ifstream("/proc/thread-self/children") >> std::ws, pid, ' ');
    const std::string process = "/proc/" + pid;
    std::set<std::string> descriptors;
    for (const auto& entry : std::filesystem::directory_iterator(process + "/fd"))
        descriptors.insert(entry.path().filename());
    EXPECT_EQ(descriptors, (std::set<std::string>{"3", "4"}));
    EXPECT_EQ(std::to_string(::getsid(std::stoi(pid))), pid) << "its caller's session, and terminal";
    const std::string status = readFile(process + "/status");
    std::vector<std::string> lines = {"NoNewPrivs:\t1\n", "Seccomp:\t2\n"};
    if (::geteuid() == 0)
        lines.insert(lines.end(), {"Uid:\t65534\t65534\t65534\t65534\n", "CapPrm:\t0000000000000000\n"});
    for (const std::string& line : lines)
        EXPECT_NE(status.find(line), std::string::npos) << line;
}

/// A step that is not to succeed.
struct Attempt {
    const char* what;
    std::function<long(pid_t parent)> call;
};

/// In a process with a terminal of its own, as an ordinary user where it can be one: starts a powerless one that makes
/// each attempt. The number of the first that succeeded, from 1; 0 when none did.
int firstThatSucceeds(const std::vector<Attempt>& attempts, const char* terminal) {
    if (::setsid() < 0 || (::geteuid() == 0 && (::setgid(ownerId) != 0 || ::setuid(ownerId) != 0)))
        return 101;
    const int opened = ::open(terminal, O_RDWR);
    if (opened < 0 || ::dup2(opened, 0) != 0 || ::prctl(PR_SET_DUMPABLE, 1) != 0)
        return 102;
    const pid_t self = ::getpid();
    const pid_t powerless = ::fork();
    if (powerless == 0) {
        if (!becomePowerless(self))
            ::_exit(103);
        for (std::size_t i = 0; i < attempts.size(); ++i)
            if (attempts[i].call(self) >= 0)
                ::_exit(static_cast<int>(i) + 1);
        ::_exit(0);
    }
    int status = 0;
    ::waitpid(powerless, &status, 0);
    return WIFEXITED(status) ? WEXITSTATUS(status) : 104;
}

// Goal: a decoder that was taken over has no hold on anything, also where its user could do more. Method: a process
// that gave up its powers, with a terminal and a parent of the same user, tries what could help it.
TEST(Content, ADecoderThatWasTakenOver) {
    const TemporaryDirectory directory;
    ::chmod(directory.path().c_str(), 0777);
    const std::string own = directory.path() + "/own";
    writeFile(own, "x");
    (void)!::chown(own.c_str(), ownerId, ownerId);
    const FileDescriptor master(::posix_openpt(O_RDWR | O_NOCTTY | O_CLOEXEC));
    char terminal[64];
    ASSERT_EQ(::grantpt(master.get()), 0);
    ASSERT_EQ(::unlockpt(master.get()), 0);
    ASSERT_EQ(::ptsname_r(master.get(), terminal, sizeof terminal), 0);
    ::chmod(terminal, 0666);
    char byte = 'x';
    iovec part{.iov_base = &byte, .iov_len = 1};
    const char* const words[] = {"false", nullptr};
    const std::vector<Attempt> attempts = {
        {"types into the terminal", [&](pid_t) { return ::syscall(SYS_ioctl, 0, TIOCSTI, &byte); }},
        {"opens", [&](pid_t) { return ::syscall(SYS_openat, AT_FDCWD, own.c_str(), O_RDONLY); }},
        {"removes", [&](pid_t) { return ::syscall(SYS_unlinkat, AT_FDCWD, own.c_str(), 0); }},
        {"truncates", [&](pid_t) { return ::syscall(SYS_truncate, own.c_str(), 0); }},
        {"connects", [](pid_t) { return ::syscall(SYS_socket, AF_UNIX, SOCK_STREAM, 0); }},
        {"signals its parent", [](pid_t parent) { return ::syscall(SYS_kill, parent, 0); }},
        {"signals everybody", [](pid_t) { return ::syscall(SYS_kill, -1, 0); }},
        {"writes into its parent",
         [&](pid_t parent) { return ::syscall(SYS_process_vm_writev, parent, &part, 1, &part, 1, 0); }},
        {"traces its parent", [](pid_t parent) { return ::syscall(SYS_ptrace, PTRACE_SEIZE, parent, 0, 0); }},
        {"forks", [](pid_t) { return ::syscall(SYS_clone, SIGCHLD, 0, 0, 0, 0); }},
        {"executes", [&](pid_t) { return ::syscall(SYS_execve, "/bin/false", words, words + 1); }},
    };
    const pid_t user = ::fork();
    if (user == 0)
        ::_exit(firstThatSucceeds(attempts, terminal));
    int status = 0;
    ASSERT_EQ(::waitpid(user, &status, 0), user);
    ASSERT_TRUE(WIFEXITED(status));
    const auto number = static_cast<std::size_t>(WEXITSTATUS(status));
    EXPECT_EQ(number, 0U) << (number <= attempts.size() ? attempts[number - 1].what : "the test is not set up");
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

/// Puts a directory that somebody else filled where the new content's was just made.
class SwappingDisk final : public InterceptedDisk {
public:
    using InterceptedDisk::InterceptedDisk;

protected:
    zor::Errno intercept(const DiskCallInfo& info, const Make& make) override {
        const zor::Errno made = make();
        if (info.call == DiskCall::makeDirectory && info.subject.starts_with(".install-")) {
            EXPECT_EQ(::renameat2(info.fd, "closed", info.fd, info.subject.c_str(), RENAME_EXCHANGE), 0);
        }
        return made;
    }
};

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
    SwappingDisk disk(real);
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
