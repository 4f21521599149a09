// SPDX-License-Identifier: Apache-2.0
// The file manager over a temporary root, with a disk that may fail, a log that keeps its lines, and a settable lock
// state: directories, what it takes for existing, protection classes, files that are replaced whole, listing, moving,
// and ownership of trees.
#include "device/DataProtection.h"
#include "fs/Durability.h"
#include "fs/Names.h"
#include "fs/ZORFileManager.h"
#include "support/FaultDisk.h"
#include "support/Files.h"
#include "support/RecordingLog.h"
#include "support/SettableRoles.h"
#include "support/TestRoot.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/sysmacros.h>

namespace zor::fs::test {
namespace {

using support::DiskCall;
using support::LogLine;

class FileManager : public testing::Test, protected support::TestRoot {
protected:
    [[nodiscard]] ZORFileManager& manager() { return manager_; }
    [[nodiscard]] FileURL url(const std::string& name) const { return FileURL::directory(path(name)); }
    void makeItems(const std::vector<std::string>& items) const {
        support::makeItems(support::openDirectory(path()).get(), items);
    }
    /// The next call of this kind, or each from then on, fails.
    void fail(support::FaultSpan span, DiskCall call, int error) {
        disk.arm({.error = error, .span = span, .filter = [=](const auto& info) { return info.call == call; }});
    }
    static void expectPosix(const Result<void>& result, int number, const std::string& description) {
        ASSERT_FALSE(result);
        EXPECT_TRUE(result.error().isPosix(number)) << result.error().text();
        EXPECT_EQ(result.error().description(), description);
    }

    support::RecordingLog lines{logLevelNotice};
    Log log{lines};
    support::SettableLockState lockState;
    support::FaultDisk disk{TestRoot::disk()};
    platform::XattrProtectionClass protection{disk, lockState};

private:
    ZORFileManager manager_{log, root(), disk, protection};
};

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
        support::ExchangingDisk exchanging(disk, DiskCall::makeDirectory, path("other"));
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
    EXPECT_FALSE(manager().createDirectoryAtURL(url("x/y"), Intermediates::no, {}));
    EXPECT_FALSE(exists("x"));
    EXPECT_TRUE(item("outside").starts_with("directory 0700"));
    EXPECT_TRUE(names("outside").empty());
    const FileURL elsewhere = FileURL::directory(path() + "-elsewhere"); // begins as the root does
    EXPECT_FALSE(manager().createDirectoryAtURL(elsewhere, Intermediates::yes, {}));
    EXPECT_FALSE(std::filesystem::exists(elsewhere.path()));
}

// Goal: a directory is made with its class, the class changes exactly when the predicate says so and the device allows
// it, and never through a link. Method: each of these, and a file system without classes.
TEST_F(FileManager, SetsProtectionClasses) {
    for (const int given : {4, 0}) {
        ASSERT_TRUE(manager().createDirectoryAtURL(url("d"), Intermediates::no, {.protectionClass = given}));
        EXPECT_EQ(manager().dataProtectionClassOfItemAtURL(url("d")).value(), given);
    }
    makeItems({"f", "link -> f", "fifo|"});
    const auto classOfF = [&] { return manager().dataProtectionClassOfItemAtURL(url("f")).value(); };
    for (const bool answer : {false, true}) {
        EXPECT_TRUE(manager().setDataProtectionClassOfItemAtURL(
            url("f"), 2, [&](int current) { return answer && current == 3; })); // that of a file without one
        EXPECT_EQ(classOfF(), answer ? 2 : 3);
    }
    const std::string failed = "Failed to setclass(4) on file " + path("f");
    lockState.state = 1;
    EXPECT_TRUE(manager().setDataProtectionClassOfItemAtURL(url("f"), 4, [](int) { return false; }));
    expectPosix(manager().setDataProtectionClassOfItemAtURL(url("f"), 4), EPERM, failed + ": Operation not permitted");
    lockState.state = 0;
    fail(support::FaultSpan::once, DiskCall::setAttribute, EPERM); // the kernel's own: the file, not the lock
    expectPosix(manager().setDataProtectionClassOfItemAtURL(url("f"), 4), EACCES, failed + ": Permission denied");
    EXPECT_FALSE(manager().setDataProtectionClassOfItemAtURL(url("link"), 1));
    EXPECT_FALSE(manager().dataProtectionClassOfItemAtURL(url("link")));
    (void)manager().dataProtectionClassOfItemAtURL(url("fifo")); // must come back
    EXPECT_EQ(classOfF(), 2);
    // A file system without classes is said once, and a directory is made all the same.
    fail(support::FaultSpan::fromThenOn, DiskCall::setAttribute, EOPNOTSUPP);
    for (const char* name : {"e", "g"})
        EXPECT_TRUE(manager().createDirectoryAtURL(url(name), Intermediates::no, {.protectionClass = 4}));
    EXPECT_EQ(lines.take(5, "setClassAtCreation").size(), 1U);
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
    write("text", "hello");
    write("array", "<plist version=\"1.0\"><array/></plist>");
    std::map<std::string, int> rows = {{"groupWritable", EPERM}, {"othersWritable", EPERM}, {"linked", EPERM},
                                       {"symbolic", ELOOP},      {"fifo", EPERM},           {"directory", EPERM},
                                       {"large", EFBIG},         {"text", EINVAL},          {"array", EINVAL},
                                       {"missing", ENOENT},      {"good/below", ENOTDIR}};
    if (::geteuid() == 0) {
        write("foreign", bytes);
        ASSERT_EQ(::chown(path("foreign").c_str(), 501, 501), 0);
        ASSERT_EQ(::mknod(path("device").c_str(), S_IFCHR | 0644, makedev(1, 5)), 0); // /dev/zero
        rows["foreign"] = rows["device"] = EPERM;
    }
    for (const auto& [name, number] : rows) {
        const auto read = readDictionaryAtURL(FileURL::file(path(name)), bytesMax, manager());
        EXPECT_TRUE(!read && read.error().isPosix(number)) << name;
    }
    write("xml", "<plist version=\"1.0\"><dict><key>a</key><string>b</string></dict></plist>");
    for (const char* name : {"good", "xml"})
        EXPECT_EQ(readDictionaryAtURL(FileURL::file(path(name)), bytesMax, manager()).value(), good);
}

// Goal: what a stop left of a write goes with the next one, whatever the owner puts there stops none, and no other name
// is touched; the mode is not the mask's to change. Method: a write over each, judged by the names that are left.
TEST_F(FileManager, AFileIsReplacedWhateverLiesInTheWay) {
    const std::pair<const char*, std::vector<std::string>> rows[] = {
        {"d/f2", {"f", "f2"}},
        {"d/.f.new-000000", {"f"}}, // a stopped write
        {"d/.f.new-000000 -> /etc/passwd", {"f"}},
        {"d/.f.new-000000/", {".f.new-000000", "f"}},
        {"d/.f.new-abcdef", {".f.new-abcdef", "f"}},
    };
    const std::vector<std::uint8_t> bytes = {'n', 'e', 'w'};
    for (const auto& [before, left] : rows) {
        SCOPED_TRACE(before);
        makeItems({"d/", "d/f", before});
        const platform::FileDescriptor directory(::open(path("d").c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
        const mode_t mask = ::umask(077);
        EXPECT_FALSE(replaceFileDurably(disk, directory.get(), "f", 0644, bytes));
        ::umask(mask);
        EXPECT_EQ(read("d/f"), "new");
        EXPECT_TRUE(item("d/f").starts_with("file 0644"));
        EXPECT_EQ(names("d"), left);
        ASSERT_TRUE(manager().removeItemAtURL(url("d")));
    }
}

// Goal: everything of the former owner's but metadata files gets the owner and 0755 or 0644; what has a name outside or
// is another's keeps its own. Method: one item of each kind, before and after.
TEST_F(FileManager, StandardisesOwnership) {
    if (::geteuid() != 0)
        GTEST_SKIP() << "skipped: needs root to give files away";
    const std::string metadata = std::string("tree/sub/") + zor::names::metadataFile;
    makeDirectories("tree", {}, 0700);
    makeDirectories("tree/sub", {}, 01777);
    const std::pair<std::string, mode_t> files[] = {{"tree/plain", 0600},   {"tree/program", 0410},
                                                    {"tree/setuid", 04711}, {metadata, 0640},
                                                    {"shared", 0600},       {"tree/twice", 04711}};
    for (const auto& [name, mode] : files)
        write(name, "x", mode);
    makeItems({"tree/link -> ../outside"});
    ASSERT_EQ(::link(path("shared").c_str(), path("tree/shared").c_str()), 0);
    ASSERT_EQ(::link(path("tree/twice").c_str(), path("tree/sub/twice").c_str()), 0);
    for (int other = 0; other < 102; ++other) {
        write("tree/other" + std::to_string(other), "x", 0600);
        ASSERT_EQ(::chown(path("tree/other" + std::to_string(other)).c_str(), 502, 502), 0);
    }
    // In a directory that cannot be given away, names may be moved and counted twice.
    fail(support::FaultSpan::once, DiskCall::changeOwner, EROFS);
    ASSERT_TRUE(manager().standardizeOwnershipAtURL(url("tree"), 501, 502, 0));
    EXPECT_TRUE(item("tree/twice").starts_with("file 4711"));
    lines.take();
    ASSERT_TRUE(manager().standardizeOwnershipAtURL(url("tree"), 501, 502, 0));
    ASSERT_TRUE(manager().standardizeOwnershipAtURL(url("tree/shared"), 501, 502, 0));
    const std::pair<std::string, const char*> rows[] = {
        {"tree", "directory 0755 501:502"},   {"tree/sub", "directory 0755 501:502"},
        {"tree/plain", "file 0644 501:502"},  {"tree/program", "file 0755 501:502"},
        {"tree/setuid", "file 0755 501:502"}, {"tree/twice", "file 0755 501:502"},
        {"tree/link", "other 0777 501:502"},  {metadata, "file 0640 0:0"},
        {"shared", "file 0600 0:0"},          {"tree/other0", "file 0600 502:502"}};
    for (const auto& [name, after] : rows)
        EXPECT_EQ(item(name), after) << name;
    const auto said = lines.take(); // each of the others, up to a limit, and their number
    ASSERT_EQ(said.size(), 101U);
    EXPECT_EQ(said.back().message, "2 more items below " + path("tree") + " keep their owner and mode");
    fail(support::FaultSpan::fromThenOn, DiskCall::changeOwner, EROFS);
    EXPECT_TRUE(manager().standardizeOwnershipAtURL(url("tree/plain"), 33, 33, 501));
    EXPECT_TRUE(hasLine(lines.take(), 3, "standardizeOwnershipAtURL",
                        "Could not chown " + path("tree/plain") + ": Read-only file system"));
    expectPosix(manager().standardizeOwnershipAtURL(url("no"), 501, 501, 0), ENOENT,
                "Could not stat " + path("no") + ": No such file or directory");
}

} // namespace
} // namespace zor::fs::test
