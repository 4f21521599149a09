// SPDX-License-Identifier: Apache-2.0
// The file manager's directories, what it takes for existing, protection classes, and dictionaries in files.
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
    if (!isRoot())
        GTEST_SKIP() << "skipped: needs root to give directories away";
    struct Row {
        const char* before; // mode and owner of an existing one
        DirectoryAttributes attributes;
        const char* after;
        mode_t parentMode = 0755;
        std::uint32_t parentOwner = 0;
    };
    const Row rows[] = {
        {nullptr, {.mode = 0755}, "040755 0:0"},
        {nullptr, {.mode = 0777, .owner = 501}, "040777 501:501"},
        {nullptr, {.mode = 0711, .owner = 33}, "040711 33:33"},
        {nullptr, {.mode = 0711, .owner = 502}, "040711 502:502", 01777, 501},
        {"1777 0", {.mode = 0755}, "040755 0:0"},
        {"0755 501", {.mode = 0755, .owner = 501}, "040755 501:501"},
        {"0700 501", {.mode = 0755, .owner = 501}, "040755 501:501", 0755, 501},
        {"0770 501:7", {.mode = 0755, .owner = 501}, "040755 501:501", 0755, 501},
        // Others can have named them so.
        {"0700 501", {.mode = 0755, .owner = 501}, "040700 501:501", 01777},
        {"0700 501", {.mode = 0755, .owner = 501}, "040700 501:501", 0775, 501},
        {"0700 501", {.mode = 0755, .owner = 501}, "040700 501:501", 0755, 502},
        {"0770 501:7", {.mode = 0755, .owner = 501}, "040750 501:7", 01777},
        {"0700 0", {.mode = 0777}, "040700 0:0", 0777},
        {"0755 33", {.mode = 0711, .otherOwner = 33}, "040755 33:33"},
        // They are another's.
        {"0700 0", {.mode = 0755, .owner = 501}, "EPERM 040700 0:0", 0755, 501},
        {"0700 502", {.mode = 0755, .owner = 501}, "EPERM 040700 502:502", 01777},
        {"0700 502", {.mode = 0777, .protectionClass = 4}, "EPERM 040700 502:502", 0777},
    };
    const mode_t mask = ::umask(077);
    for (const Row& row : rows) {
        SCOPED_TRACE(row.after);
        makeDirectory("a", row.parentMode);
        ASSERT_EQ(::chown(path("a").c_str(), row.parentOwner, row.parentOwner), 0);
        if (row.before) {
            unsigned mode = 0;
            unsigned owner = 0;
            unsigned group = 0;
            if (std::sscanf(row.before, "%o %u:%u", &mode, &owner, &group) == 2)
                group = owner;
            makeDirectory("a/d", mode);
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
    if (!isRoot())
        GTEST_SKIP() << "skipped: needs root to give directories away";
    const struct {
        mode_t mode;
        uid_t owner;
        bool full;
    } rows[] = {{0700, 0, true}, {0755, 0, false}, {0700, 502, false}};
    for (const auto& row : rows) {
        makeDirectory("other", row.mode);
        if (row.full)
            makeFile("other/secret");
        ASSERT_EQ(::chown(path("other").c_str(), row.owner, row.owner), 0);
        const std::string before = item("other");
        ExchangingDisk exchanging(disk, path("other"));
        ZORFileManager manager(log, root(), exchanging, protection());
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

// Goal: the final name exists only when all is set. Method: fail each call of a creation.
TEST_F(FileManager, AFailingDiskNeverLeavesAHalfMadeName) {
    for (const DiskCall call :
         {DiskCall::makeDirectory, DiskCall::rename, DiskCall::changeMode, DiskCall::changeOwner}) {
        failNext(call, EIO);
        EXPECT_FALSE(manager().createDirectoryAtURL(url("d"), Intermediates::no, {.owner = 501}));
        EXPECT_TRUE(disk.met()) << support::nameOf(call);
        EXPECT_EQ(names(""), std::vector<std::string>{"run"});
    }
}

TEST_F(FileManager, IntermediateLevels) {
    ASSERT_TRUE(manager().createDirectoryAtURL(url("a/b/c"), Intermediates::yes, {.mode = 0700}));
    EXPECT_TRUE(item("a/b").starts_with("040755"));
    EXPECT_TRUE(item("a/b/c").starts_with("040700"));
    expectPosix(manager().createDirectoryAtURL(url("x/y"), Intermediates::no, {}), ENOENT,
                "mkdir of " + path("x/y") + " failed: No such file or directory");
    EXPECT_EQ(item("x"), "missing");
}

// Goal: nothing but a directory is taken for one, and what a link points to is not touched. Method: everything that may
// stand in the place or on the way.
TEST_F(FileManager, RefusesWhatStandsInThePlace) {
    makeDirectory("outside", 0700);
    makeItems({"link -> outside", "dangling -> nowhere", "file"});
    struct Row {
        const char* name;
        int number;
        std::string description;
    };
    const Row rows[] = {
        {"link", ELOOP, "mkdir of " + path("link") + " failed: Too many levels of symbolic links"},
        {"dangling", ELOOP, "mkdir of " + path("dangling") + " failed: Too many levels of symbolic links"},
        {"file", ENOTDIR, "mkdir of " + path("file") + " failed: Not a directory"},
        {"link/d", ENOTDIR, "Failed to determine if " + path("link/d") + " exists: Not a directory"},
        {"file/d", ENOTDIR, "Failed to determine if " + path("file/d") + " exists: Not a directory"},
    };
    for (const Row& row : rows)
        expectPosix(manager().createDirectoryAtURL(url(row.name), Intermediates::no, {.mode = 0777}), row.number,
                    row.description);
    EXPECT_TRUE(item("outside").starts_with("040700"));
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
    makeDirectory("row");
    const auto first = manager().createTemporaryDirectoryInDirectoryURL(url("row"));
    const auto other = manager().createTemporaryDirectoryInDirectoryURL(url("row"));
    ASSERT_TRUE(first && other);
    EXPECT_NE(first->path(), other->path());
    EXPECT_TRUE(first->lastPathComponent().starts_with("temp."));
    EXPECT_EQ(first->lastPathComponent().size(), 11U);
    EXPECT_TRUE(item("row/" + std::string(first->lastPathComponent())).starts_with("040700"));
    expectPosix(manager().createTemporaryDirectoryInDirectoryURL(url("nowhere")), ENOENT,
                "Failed to create temp dir at path " + path("nowhere/temp.XXXXXX") + " : No such file or directory");
}

// Goal: an item that cannot be examined neither exists nor does not exist. Method: each kind of item against both
// questions, with the line that is written.
TEST_F(FileManager, Existence) {
    makeItems({"d/", "f", "dangling -> nowhere", "toDirectory -> d"});
    struct Row {
        const char* name;
        bool exists;
        bool doesNotExist;
        const char* said;
    };
    for (const Row& row :
         {Row{"d", true, false, nullptr}, Row{"f", true, false, nullptr}, Row{"dangling", true, false, nullptr},
          Row{"missing", false, true, nullptr}, Row{"missing/below", false, true, nullptr},
          Row{"f/below", false, false, "Not a directory"}, Row{"toDirectory/f", false, false, "Not a directory"}}) {
        EXPECT_EQ(manager().itemExistsAtURL(url(row.name)), row.exists) << row.name;
        EXPECT_EQ(manager().itemDoesNotExistAtURL(url(row.name)), row.doesNotExist) << row.name;
        std::vector<LogLine> expected;
        if (row.said) {
            const std::string message = "Failed to determine if " + path(row.name) + " exists: " + row.said;
            expected = {{3, "itemExistsAtURL", message}, {3, "itemDoesNotExistAtURL", message}};
        }
        EXPECT_EQ(lines.take(), expected) << row.name;
    }
}

// Goal: the class changes exactly when the predicate says so and the device allows it, and never through a link.
// Method: a table over predicate, lock state and item.
TEST_F(FileManager, SetsProtectionClasses) {
    makeItems({"f", "link -> f", "fifo|"});
    std::vector<int> asked;
    const auto says = [&](bool answer) {
        return [&asked, answer](int current) {
            asked.push_back(current);
            return answer;
        };
    };
    EXPECT_EQ(manager().dataProtectionClassOfItemAtURL(url("f")).value(), 3); // what a file without one has
    EXPECT_TRUE(manager().setDataProtectionClassOfItemAtURL(url("f"), 1, says(false)));
    EXPECT_EQ(manager().dataProtectionClassOfItemAtURL(url("f")).value(), 3);
    EXPECT_TRUE(manager().setDataProtectionClassOfItemAtURL(url("f"), 2, says(true)));
    EXPECT_EQ(manager().dataProtectionClassOfItemAtURL(url("f")).value(), 2);
    EXPECT_EQ(asked, (std::vector<int>{3, 3}));
    lockState.state = 1;
    EXPECT_TRUE(manager().setDataProtectionClassOfItemAtURL(url("f"), 4, says(false)));
    expectPosix(manager().setDataProtectionClassOfItemAtURL(url("f"), 4), EPERM,
                "Failed to setclass(4) on file " + path("f") + ": Operation not permitted");
    lockState.state = 0;
    failNext(DiskCall::setAttribute, EPERM); // the kernel's own: the file, not the lock, is in the way
    expectPosix(manager().setDataProtectionClassOfItemAtURL(url("f"), 4), EACCES,
                "Failed to setclass(4) on file " + path("f") + ": Permission denied");
    EXPECT_TRUE(manager().setDataProtectionClassOfItemAtURL(url("f"), 4));
    EXPECT_EQ(manager().dataProtectionClassOfItemAtURL(url("f")).value(), 4);
    expectPosix(manager().setDataProtectionClassOfItemAtURL(url("link"), 1), ELOOP,
                "Failed to open " + path("link") + " : Too many levels of symbolic links");
    EXPECT_FALSE(manager().dataProtectionClassOfItemAtURL(url("link")));
    (void)manager().dataProtectionClassOfItemAtURL(url("fifo")); // must come back
    EXPECT_EQ(manager().dataProtectionClassOfItemAtURL(url("f")).value(), 4);
}

// Goal: what is written reads back, whole, 0644, and a failed write leaves what was there and no rest. Method: fail
// every call in turn.
TEST_F(FileManager, DictionariesAreReplacedWhole) {
    constexpr std::uint32_t options = writeAtomically | writeWithoutProtection;
    EXPECT_EQ(options, 0x10000001U);
    const plist::Dictionary old{{"a", "old"}};
    const plist::Dictionary next{{"a", "new"}, {"b", plist::Array{1, 2}}};
    const FileURL file = FileURL::file(path("f.plist"));
    const mode_t mask = ::umask(077);
    ASSERT_TRUE(writeToURL(old, file, options, bytesMax, manager()));
    ::umask(mask);
    EXPECT_TRUE(item("f.plist").starts_with("100644"));
    EXPECT_TRUE(content("f.plist").starts_with("bplist00"));
    EXPECT_FALSE(writeToURL(next, file, writeAtomically, bytesMax, manager()));
    std::size_t failures = 0;
    for (std::size_t point = 1;; ++point) {
        disk.arm({.point = point});
        const auto written = writeToURL(next, file, options, bytesMax, manager());
        const bool met = disk.met();
        disk.disarm();
        const auto found = readDictionaryAtURL(file, bytesMax, manager());
        ASSERT_TRUE(found) << point;
        EXPECT_TRUE(*found == old || *found == next) << point;
        if (!met) {
            EXPECT_TRUE(written);
            EXPECT_EQ(*found, next);
            break;
        }
        if (!written) {
            ++failures;
            EXPECT_TRUE(written.error().isPosix(EIO));
        }
        ASSERT_TRUE(writeToURL(old, file, options, bytesMax, manager()));
        EXPECT_EQ(names(""), (std::vector<std::string>{"f.plist", "run"})) << point;
    }
    EXPECT_GE(failures, 4U);
}

// Goal: only a file that the daemon can have written is believed. Method: everything that a client can put there, each
// with content that would read well.
TEST_F(FileManager, HostileDictionaryFiles) {
    const plist::Dictionary good{{"a", "b"}};
    const FileURL file = FileURL::file(path("good"));
    ASSERT_TRUE(writeToURL(good, file, writeAtomically | writeWithoutProtection, bytesMax, manager()));
    const std::string bytes = content("good");
    makeFile("groupWritable", bytes, 0664);
    makeFile("othersWritable", bytes, 0646);
    makeFile("linked", bytes);
    ASSERT_EQ(::link(path("linked").c_str(), path("linkedToo").c_str()), 0);
    makeItems({"symbolic -> good", "fifo|", "directory/"});
    makeFile("large", bytes + std::string(bytesMax, ' '));
    makeFile("empty", "");
    makeFile("text", "hello");
    makeFile("array", "<plist version=\"1.0\"><array/></plist>");
    struct Row {
        std::string name;
        int number;
    };
    std::vector<Row> rows = {{"groupWritable", EPERM}, {"othersWritable", EPERM}, {"linked", EPERM},
                             {"symbolic", ELOOP},      {"fifo", EPERM},           {"directory", EPERM},
                             {"large", EFBIG},         {"empty", EINVAL},         {"text", EINVAL},
                             {"array", EINVAL},        {"missing", ENOENT},       {"good/below", ENOTDIR}};
    if (isRoot()) {
        makeFile("foreign", bytes);
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
    makeFile("xml", "<plist version=\"1.0\"><dict><key>a</key><string>b</string></dict></plist>");
    EXPECT_EQ(readDictionaryAtURL(FileURL::file(path("xml")), bytesMax, manager()).value(), good);
}

TEST(DictionaryFile, DotDotComponents) {
    for (const char* path : {"..", "a/..", "../a", "/a/../b", "a//.."})
        EXPECT_TRUE(containsDotDotPathComponents(path)) << path;
    for (const char* path : {"", "a", "...", "a..", "..a", "a/..b/c", "/", "a/.", "a/b"})
        EXPECT_FALSE(containsDotDotPathComponents(path)) << path;
}

} // namespace
} // namespace zor::fs::test
