// SPDX-License-Identifier: Apache-2.0
// The file manager's directories, what it takes for existing, protection classes, and files that are replaced whole.
#include "fs/AtomicFile.h"
#include "fs/DictionaryFile.h"
#include "fs/FileManagerWorld.h"

namespace zor::fs::test {
namespace {

using support::DiskCall;
using support::LogLine;

constexpr std::size_t bytesMax = 4096;

// Goal: a directory, new or not, ends with the mode and owner asked for, whatever the process's mask; but nobody else's
// does for its name, nor is one opened that others could have put there; no temporary name stays. Method: a table over
// what is there before, and who may write the directory above.
TEST_F(FileManager, CreatesWithModeAndOwner) {
    if (::geteuid() != 0)
        GTEST_SKIP() << "skipped: needs root to give directories away";
    struct Row {
        const char* before; // mode and owner of an existing one
        DirectoryAttributes attributes;
        const char* after;
        mode_t parentMode = 0755;
        std::uint32_t parentOwner = 0;
    };
    const Row rows[] = {
        {nullptr, {.mode = 0755}, "directory 0755 0:0"},
        {nullptr, {.mode = 0777, .owner = 501}, "directory 0777 501:501"},
        {nullptr, {.mode = 0711, .owner = 33}, "directory 0711 33:33"},
        {nullptr, {.mode = 0711, .owner = 502}, "directory 0711 502:502", 01777, 501},
        {"1777 0", {.mode = 0755}, "directory 0755 0:0"},
        {"0755 501", {.mode = 0755, .owner = 501}, "directory 0755 501:501"},
        {"0700 501", {.mode = 0755, .owner = 501}, "directory 0755 501:501", 0755, 501},
        {"0770 501:7", {.mode = 0755, .owner = 501}, "directory 0755 501:501", 0755, 501},
        // Others can have named them so.
        {"0700 501", {.mode = 0755, .owner = 501}, "directory 0700 501:501", 01777},
        {"0700 501", {.mode = 0755, .owner = 501}, "directory 0700 501:501", 0775, 501},
        {"0700 501", {.mode = 0755, .owner = 501}, "directory 0700 501:501", 0755, 502},
        {"0770 501:7", {.mode = 0755, .owner = 501}, "directory 0750 501:7", 01777},
        {"0700 0", {.mode = 0777}, "directory 0700 0:0", 0777},
        {"0755 33", {.mode = 0711, .otherOwner = 33}, "directory 0755 33:33"},
        // They are another's.
        {"0700 0", {.mode = 0755, .owner = 501}, "EPERM directory 0700 0:0", 0755, 501},
        {"0700 502", {.mode = 0755, .owner = 501}, "EPERM directory 0700 502:502", 01777},
        {"0700 502", {.mode = 0777, .protectionClass = 4}, "EPERM directory 0700 502:502", 0777},
    };
    const mode_t mask = ::umask(077);
    for (const Row& row : rows) {
        SCOPED_TRACE(row.after);
        makeDirectories("a", {}, row.parentMode);
        ASSERT_EQ(::chown(path("a").c_str(), row.parentOwner, row.parentOwner), 0);
        if (row.before) {
            unsigned mode = 0;
            unsigned owner = 0;
            unsigned group = 0;
            if (std::sscanf(row.before, "%o %u:%u", &mode, &owner, &group) == 2)
                group = owner;
            makeDirectories("a/d", {}, mode);
            ASSERT_EQ(::chown(path("a/d").c_str(), owner, group), 0);
        }
        const auto made = manager().createDirectoryAtURL(url("a/d"), Intermediates::no, row.attributes);
        EXPECT_EQ((made ? "" : made.error().isPosix(EPERM) ? "EPERM " : made.error().text()) + item("a/d"), row.after);
        EXPECT_EQ(names("a"), (std::vector<std::string>{"d"}));
        ::rmdir(path("a/d").c_str());
        ::rmdir(path("a").c_str());
    }
    ::umask(mask);
}

/// Puts another directory in the place of each new one, before anybody can open it.
class ExchangingDisk final : public support::InterceptedDisk {
public:
    ExchangingDisk(Disk& inner, std::string other) : InterceptedDisk(inner), other_(std::move(other)) {}

protected:
    ssize_t intercept(const support::DiskCallInfo& info, const Make& make) override {
        const ssize_t made = make();
        if (info.call == DiskCall::makeDirectory) {
            EXPECT_EQ(::renameat2(AT_FDCWD, other_.c_str(), info.fd, info.subject.c_str(), RENAME_EXCHANGE), 0);
        }
        return made;
    }

private:
    const std::string other_;
};

// Goal: what is put in a new directory's place before it was given away is neither given away nor gets the final name.
// Method: directories of several kinds, exchanged right after the making.
TEST_F(FileManager, GivesNobodyWhatWasExchanged) {
    if (::geteuid() != 0)
        GTEST_SKIP() << "skipped: needs root to give directories away";
    const struct {
        mode_t mode;
        uid_t owner;
        bool full;
    } rows[] = {{0700, 0, true}, {0755, 0, false}, {0700, 502, false}};
    for (const auto& row : rows) {
        makeDirectories("other", {}, row.mode);
        if (row.full)
            write("other/secret", "x");
        ASSERT_EQ(::chown(path("other").c_str(), row.owner, row.owner), 0);
        const std::string before = item("other");
        ExchangingDisk exchanging(disk, path("other"));
        ZORFileManager manager(log, root(), exchanging, protection);
        const auto made = manager.createDirectoryAtURL(url("d"), Intermediates::no, {.mode = 0755, .owner = 501});
        ASSERT_FALSE(made);
        EXPECT_TRUE(made.error().isPosix(EPERM)) << made.error().text();
        EXPECT_EQ(item("d"), "missing");
        const std::string exchanged = names("").front(); // "d." and a suffix
        EXPECT_EQ(item(exchanged), before);
        std::filesystem::remove_all(path(exchanged));
        std::filesystem::remove_all(path("other"));
    }
}

TEST_F(FileManager, IntermediateLevels) {
    ASSERT_TRUE(manager().createDirectoryAtURL(url("a/b/c"), Intermediates::yes, {.mode = 0700}));
    EXPECT_TRUE(item("a/b").starts_with("directory 0755"));
    EXPECT_TRUE(item("a/b/c").starts_with("directory 0700"));
    EXPECT_FALSE(manager().createDirectoryAtURL(url("x/y"), Intermediates::no, {}));
    EXPECT_EQ(item("x"), "missing");
}

// Goal: nothing but a directory is taken for one, and what a link points to is not touched. Method: everything that may
// stand in the place or on the way.
TEST_F(FileManager, RefusesWhatStandsInThePlace) {
    makeDirectories("outside", {}, 0700);
    makeItems({"link -> outside", "dangling -> nowhere", "file"});
    for (const auto& [name, number] :
         {std::pair("link", ELOOP), {"dangling", ELOOP}, {"file", ENOTDIR}, {"link/d", ENOTDIR}, {"file/d", ENOTDIR}}) {
        const auto made = manager().createDirectoryAtURL(url(name), Intermediates::no, {.mode = 0777});
        EXPECT_TRUE(!made && made.error().isPosix(number)) << name;
    }
    EXPECT_TRUE(item("outside").starts_with("directory 0700"));
    EXPECT_TRUE(names("outside").empty());
    const auto outside =
        manager().createDirectoryAtURL(FileURL::directory("/dev/shm/zorvane-elsewhere"), Intermediates::yes, {});
    ASSERT_FALSE(outside);
    EXPECT_NE(::access("/dev/shm/zorvane-elsewhere", F_OK), 0);
}

TEST_F(FileManager, GivesDirectoriesTheirClassAtCreation) {
    const std::pair<DirectoryAttributes, int> rows[] = {
        {{.protectionClass = 4}, 4}, {{.protectionClass = 0}, 0}, {{}, 0}};
    for (const auto& [attributes, expected] : rows) {
        ASSERT_TRUE(manager().createDirectoryAtURL(url("d"), Intermediates::no, attributes));
        EXPECT_EQ(manager().dataProtectionClassOfItemAtURL(url("d")).value(), expected);
    }
    // A file system without classes is said once, and a directory is made all the same.
    fail(support::FaultSpan::fromThenOn, DiskCall::setAttribute, EOPNOTSUPP);
    for (const char* name : {"e", "f"})
        EXPECT_TRUE(manager().createDirectoryAtURL(url(name), Intermediates::no, {.protectionClass = 4}));
    EXPECT_EQ(lines.take(), (std::vector<LogLine>{{5, "setClassAtCreation",
                                                   "The file system keeps no extended attributes; new directories "
                                                   "have no protection class"}}));
}

TEST_F(FileManager, TemporaryDirectories) {
    makeDirectories("row");
    for (std::size_t count = 1; count <= 2; ++count) {
        const auto made = manager().createTemporaryDirectoryInDirectoryURL(url("row"));
        ASSERT_TRUE(made);
        EXPECT_TRUE(item("row/" + std::string(made->lastPathComponent())).starts_with("directory 0700"));
        EXPECT_EQ(names("row").size(), count);
    }
    EXPECT_FALSE(manager().createTemporaryDirectoryInDirectoryURL(url("nowhere")));
}

// Goal: an item that cannot be examined neither exists nor does not exist. Method: each kind of item against both
// questions.
TEST_F(FileManager, Existence) {
    makeItems({"d/", "f", "dangling -> nowhere", "toDirectory -> d"});
    const std::tuple<const char*, bool, bool> rows[] = {
        {"d", true, false},         {"f", true, false},        {"dangling", true, false},      {"missing", false, true},
        {"missing/b", false, true}, {"f/below", false, false}, {"toDirectory/f", false, false}};
    for (const auto& [name, exists, doesNotExist] : rows) {
        EXPECT_EQ(manager().itemExistsAtURL(url(name)), exists) << name;
        EXPECT_EQ(manager().itemDoesNotExistAtURL(url(name)), doesNotExist) << name;
    }
    // Both questions about both of the last say why they have no answer.
    EXPECT_EQ(lines.take().size(), 4U);
}

// Goal: the class changes exactly when the predicate says so and the device allows it, and never through a link.
// Method: a table over predicate, lock state and item.
TEST_F(FileManager, SetsProtectionClasses) {
    makeItems({"f", "link -> f", "fifo|"});
    const auto classOfF = [&] { return manager().dataProtectionClassOfItemAtURL(url("f")).value(); };
    const auto says = [](bool answer) {
        return [answer](int current) { return answer && current == 3; }; // that of a file without one
    };
    EXPECT_TRUE(manager().setDataProtectionClassOfItemAtURL(url("f"), 1, says(false)));
    EXPECT_EQ(classOfF(), 3);
    EXPECT_TRUE(manager().setDataProtectionClassOfItemAtURL(url("f"), 2, says(true)));
    EXPECT_EQ(classOfF(), 2);
    lockState.state = 1;
    EXPECT_TRUE(manager().setDataProtectionClassOfItemAtURL(url("f"), 4, says(false)));
    expectPosix(manager().setDataProtectionClassOfItemAtURL(url("f"), 4), EPERM,
                "Failed to setclass(4) on file " + path("f") + ": Operation not permitted");
    lockState.state = 0;
    failNext(DiskCall::setAttribute, EPERM); // the kernel's own: the file, not the lock, is in the way
    expectPosix(manager().setDataProtectionClassOfItemAtURL(url("f"), 4), EACCES,
                "Failed to setclass(4) on file " + path("f") + ": Permission denied");
    EXPECT_TRUE(manager().setDataProtectionClassOfItemAtURL(url("f"), 4));
    EXPECT_FALSE(manager().setDataProtectionClassOfItemAtURL(url("link"), 1));
    EXPECT_FALSE(manager().dataProtectionClassOfItemAtURL(url("link")));
    (void)manager().dataProtectionClassOfItemAtURL(url("fifo")); // must come back
    EXPECT_EQ(classOfF(), 4);
}

// Goal: only a file that the daemon can have written is believed. Method: everything that a client can put there, each
// with content that would read well.
TEST_F(FileManager, HostileDictionaryFiles) {
    const plist::Dictionary good{{"a", "b"}};
    const FileURL file = FileURL::file(path("good"));
    ASSERT_TRUE(writeToURL(good, file, writeAtomically | writeWithoutProtection, bytesMax, manager()));
    EXPECT_FALSE(writeToURL(good, file, writeAtomically, bytesMax, manager())) << "protection is the caller's";
    const std::string bytes = read("good");
    write("groupWritable", bytes, 0664);
    write("othersWritable", bytes, 0646);
    write("linked", bytes);
    ASSERT_EQ(::link(path("linked").c_str(), path("linkedToo").c_str()), 0);
    makeItems({"symbolic -> good", "fifo|", "directory/"});
    write("large", bytes + std::string(bytesMax, ' '));
    write("empty", "");
    write("text", "hello");
    write("array", "<plist version=\"1.0\"><array/></plist>");
    struct Row {
        std::string name;
        int number;
    };
    std::vector<Row> rows = {{"groupWritable", EPERM}, {"othersWritable", EPERM}, {"linked", EPERM},
                             {"symbolic", ELOOP},      {"fifo", EPERM},           {"directory", EPERM},
                             {"large", EFBIG},         {"empty", EINVAL},         {"text", EINVAL},
                             {"array", EINVAL},        {"missing", ENOENT},       {"good/below", ENOTDIR}};
    if (::geteuid() == 0) {
        write("foreign", bytes);
        ASSERT_EQ(::chown(path("foreign").c_str(), 501, 501), 0);
        rows.push_back({"foreign", EPERM});
        ASSERT_EQ(::mknod(path("device").c_str(), S_IFCHR | 0644, (1 << 8) | 5), 0); // /dev/zero
        rows.push_back({"device", EPERM});
    }
    for (const Row& row : rows) {
        const auto read = readDictionaryAtURL(FileURL::file(path(row.name)), bytesMax, manager());
        ASSERT_FALSE(read) << row.name;
        EXPECT_TRUE(read.error().isPosix(row.number)) << row.name << ": " << read.error().text();
    }
    EXPECT_EQ(readDictionaryAtURL(file, bytesMax, manager()).value(), good);
    write("xml", "<plist version=\"1.0\"><dict><key>a</key><string>b</string></dict></plist>");
    EXPECT_EQ(readDictionaryAtURL(FileURL::file(path("xml")), bytesMax, manager()).value(), good);
}

// Goal: what a stop left of a write goes with the next one, whatever the owner puts there stops none, and no other name
// is touched; the mode is not the mask's to change. Method: a write over each, judged by the names that are left.
TEST_F(FileManager, AFileIsReplacedWhateverLiesInTheWay) {
    const std::string temporary = ".f.new-000000";
    struct Row {
        const char* name;
        std::function<void()> prepare;
        std::vector<std::string> left;
    };
    const Row rows[] = {
        {"nothing", [] {}, {"f"}},
        {"a stopped write", [&] { write("d/" + temporary, "half"); }, {"f"}},
        {"a link", [&] { ASSERT_EQ(::symlink("/etc/passwd", path("d/" + temporary).c_str()), 0); }, {"f"}},
        {"a directory", [&] { makeDirectories("d/" + temporary); }, {temporary, "f"}},
        {"other names", [&] { write("d/.f.new-abcdef", "x"); }, {".f.new-abcdef", "f"}},
    };
    const std::vector<std::uint8_t> bytes = {'n', 'e', 'w'};
    for (const Row& row : rows) {
        SCOPED_TRACE(row.name);
        makeDirectories("d");
        write("d/f", "old");
        row.prepare();
        const platform::FileDescriptor directory(::open(path("d").c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
        const mode_t mask = ::umask(077);
        EXPECT_EQ(replaceFileDurably(disk, directory.get(), "f", 0644, bytes), 0);
        ::umask(mask);
        EXPECT_EQ(read("d/f"), "new");
        EXPECT_TRUE(item("d/f").starts_with("file 0644"));
        EXPECT_EQ(names("d"), row.left);
        ASSERT_TRUE(manager().removeItemAtURL(url("d")));
    }
}

TEST(DictionaryFile, DotDotComponents) {
    for (const char* path : {"..", "a/..", "../a", "/a/../b", "a//.."})
        EXPECT_TRUE(containsDotDotPathComponents(path)) << path;
    for (const char* path : {"", "a", "...", "a..", "..a", "a/..b/c", "/", "a/.", "a/b"})
        EXPECT_FALSE(containsDotDotPathComponents(path)) << path;
}

} // namespace
} // namespace zor::fs::test
