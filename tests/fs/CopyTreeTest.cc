// SPDX-License-Identifier: Apache-2.0
// Goal: a copy has everything that the original has and is meant to be copied, takes nothing from outside the tree, and
// is never called a success when it is not whole. Method: a table over the kinds of items, compared between and within
// two file systems; an owner who swaps the destination.
#include "fs/Trees.h"

#include "fs/TreeWorld.h"

#include <algorithm>
#include <linux/posix_acl.h>
#include <linux/posix_acl_xattr.h>
#include <sys/xattr.h>

namespace zor::fs::test {
namespace {

constexpr const char* accessAcl = "system.posix_acl_access";
constexpr const char* defaultAcl = "system.posix_acl_default";

std::string attribute(const std::string& path, const char* name) {
    std::string value(65536, '\0');
    const ssize_t length = ::lgetxattr(path.c_str(), name, value.data(), value.size());
    value.resize(length < 0 ? 0 : static_cast<std::size_t>(length));
    return value;
}

/// rw for the owner, r for user 1234, nothing for the rest.
std::string aclFor1234() {
    struct {
        posix_acl_xattr_header header{.a_version = POSIX_ACL_XATTR_VERSION};
        posix_acl_xattr_entry entries[5] = {{ACL_USER_OBJ, 6, ~0U},
                                            {ACL_USER, 4, 1234},
                                            {ACL_GROUP_OBJ, 0, ~0U},
                                            {ACL_MASK, 4, ~0U},
                                            {ACL_OTHER, 0, ~0U}};
    } acl;
    return {reinterpret_cast<const char*>(&acl), sizeof acl};
}

bool setAttribute(const std::string& path, const char* name, const std::string& value) {
    return ::lsetxattr(path.c_str(), name, value.data(), value.size(), 0) == 0;
}

/// Times of an item and of all it may hold are made the same in both trees by whoever made them.
void setOldTimes(const std::string& path) {
    const timespec times[2] = {{1'000'000'000, 123'456'789}, {900'000'000, 987'654'321}};
    EXPECT_EQ(::utimensat(AT_FDCWD, path.c_str(), times, AT_SYMLINK_NOFOLLOW), 0) << path;
}

bool hasOldTimes(const std::string& path) {
    const struct stat status = statusOf(AT_FDCWD, path);
    return status.st_atim.tv_sec == 1'000'000'000 && status.st_mtim.tv_sec == 900'000'000 &&
           status.st_atim.tv_nsec == 123'456'789 && status.st_mtim.tv_nsec == 987'654'321;
}

using Make = std::function<bool(const std::string& path)>;
using Attributes = std::map<std::string, std::string>;

bool setAttributes(const std::string& path, const Attributes& attributes) {
    return std::ranges::all_of(attributes,
                               [&](const auto& one) { return setAttribute(path, one.first.c_str(), one.second); });
}

Make file(mode_t mode, const Attributes& attributes = {}) {
    return [=](const std::string& path) {
        makeFile(AT_FDCWD, path, "content of " + path.substr(path.rfind('/')), mode);
        return setAttributes(path, attributes);
    };
}

Make directoryOf(const std::vector<std::string>& files, mode_t mode = 0755, const Attributes& attributes = {}) {
    return [=](const std::string& path) {
        makeDirectory(AT_FDCWD, path);
        for (const std::string& name : files)
            makeFile(AT_FDCWD, path + "/" + name);
        return ::chmod(path.c_str(), mode) == 0 && setAttributes(path, attributes);
    };
}

Make link(const std::string& target) {
    return [=](const std::string& path) { return ::symlink(target.c_str(), path.c_str()) == 0; };
}

Make owned(const Make& make) {
    return [=](const std::string& path) { return make(path) && ::lchown(path.c_str(), 501, 502) == 0; };
}

Make sparse(off_t length, const std::vector<off_t>& dataAt) {
    return [=](const std::string& path) {
        const FileDescriptor fd(::open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0644));
        for (const off_t at : dataAt)
            EXPECT_EQ(::pwrite(fd.get(), "data", 4, at), 4);
        return ::ftruncate(fd.get(), length) == 0;
    };
}

void checkSparse(const std::string& from, const std::string& to) {
    constexpr blkcnt_t slackBlocks = 64;
    EXPECT_EQ(statusOf(AT_FDCWD, from).st_size, statusOf(AT_FDCWD, to).st_size);
    EXPECT_LE(statusOf(AT_FDCWD, to).st_blocks, statusOf(AT_FDCWD, from).st_blocks + slackBlocks);
}

struct FidelityCase {
    const char* name;
    /// Makes the item, a file, directory or other, at the path; false when the file system or the user cannot.
    Make make;
    /// Judges the copy beyond what is compared for every case: kind, mode (with the bits below), owner, times,
    /// attributes, access lists, content.
    std::function<void(const std::string& from, const std::string& to)> check = nullptr;
    mode_t modeBitsDropped = 0;
};

const std::vector<FidelityCase>& fidelityCases() {
    constexpr off_t megabyte = 1024 * 1024;
    // Revision 2, effective, one capability.
    static const std::string capability = {1, 0, 0, 2, 0, 0x20, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0};
    static const std::vector<FidelityCase> cases = {
        {"mode 0000", [](const auto& path) { return ::geteuid() == 0 && file(0000)(path); }},
        {"set-user-ID", file(04755), nullptr, 06000},
        {"set-group-ID", file(02755), nullptr, 06000},
        {"directory with sticky and set-group-ID", directoryOf({"file"}, 03770)},
        {"another owner", owned(file(0640))},
        {"link of another owner", owned(link("no where"))},
        {"longest link", link(std::string(4095, 'x'))},
        {"FIFO", [](const auto& path) { return ::mkfifo(path.c_str(), 0620) == 0; }},
        {"attributes of a file",
         file(0444, {{"user.some", "value"}, {"user.empty", ""}, {"user.long", std::string(2000, 'v')}})},
        {"protection class", file(0644, {{"trusted.zorvane.protection", "2"}})},
        {"file capabilities", file(0755, {{"security.capability", capability}}),
         [](const auto&, const auto& to) { EXPECT_EQ(attribute(to, "security.capability"), ""); }},
        {"access list of a file", file(0644, {{accessAcl, aclFor1234()}})},
        {"default access list of a directory", directoryOf({"without"}, 0755, {{defaultAcl, aclFor1234()}}),
         [](const auto&, const auto& to) { EXPECT_EQ(attribute(to + "/without", accessAcl), ""); }},
        {"holes in front, between and behind",
         sparse(64 * megabyte, {8 * megabyte, 20 * megabyte + 4096, 20 * megabyte + 12'288}), checkSparse},
        {"a hole and a last byte", sparse(3 * megabyte + 4, {3 * megabyte}), checkSparse},
        {"larger than every buffer",
         [](const auto& path) {
             support::writeFile(path, std::string(1'500'000, 'x') + path);
             return true;
         }},
        {"names without order or form",
         directoryOf({"\xff\xfe\n\t'\"", std::string(255, 'n'), ".links-0000000000000000", "..."})},
        {"hard links in several directories",
         [](const auto& path) {
             directoryOf({"one"})(path);
             makeDirectory(AT_FDCWD, path + "/sub");
             for (const char* other : {"/two", "/sub/three", "-outside"})
                 std::filesystem::create_hard_link(path + "/one", path + other);
             return true;
         },
         [](const auto& from, const auto& to) {
             EXPECT_EQ(statusOf(AT_FDCWD, to + "/one").st_nlink, 3U);
             EXPECT_EQ(statusOf(AT_FDCWD, from + "/one").st_nlink, 4U);
         }},
        {"socket in a tree",
         [](const auto& path) {
             return directoryOf({"file"})(path) && ::mknod((path + "/socket").c_str(), S_IFSOCK | 0600, 0) == 0;
         },
         [](const auto&, const auto& to) {
             EXPECT_TRUE(exists(AT_FDCWD, to + "/file"));
             EXPECT_FALSE(exists(AT_FDCWD, to + "/socket"));
         }},
    };
    return cases;
}

class CopyFidelity : public testing::TestWithParam<std::pair<const char*, const char*>> {};
INSTANTIATE_TEST_SUITE_P(FileSystems, CopyFidelity,
                         testing::Values(std::pair{"/dev/shm", "/dev/shm"}, std::pair{"/dev/shm", "/tmp"},
                                         std::pair{"/tmp", "/dev/shm"}, std::pair{"/tmp", "/tmp"}));

TEST_P(CopyFidelity, KeepsWhatIsMeantToBeKept) {
    const TemporaryDirectory source(GetParam().first);
    const TemporaryDirectory destination(GetParam().second);
    const FileDescriptor from = openDirectory(source.path());
    const FileDescriptor to = openDirectory(destination.path());
    // A list that every new item would take over, were it not taken away again.
    setAttribute(destination.path(), defaultAcl, aclFor1234());
    platform::LinuxDisk disk;
    const support::ProcessResources before;
    for (const FidelityCase& row : fidelityCases()) {
        SCOPED_TRACE(row.name);
        const std::string name = std::string(".") + row.name;
        const std::string original = source.path() + "/" + row.name;
        const std::string copy = destination.path() + "/" + name;
        if (!row.make(original)) {
            std::printf("skipped: %s\n", row.name);
            continue;
        }
        setOldTimes(original);
        ASSERT_FALSE(copyTree(disk, from.get(), row.name, to.get(), name.c_str()));
        const struct stat a = statusOf(AT_FDCWD, original);
        const struct stat b = statusOf(AT_FDCWD, copy);
        EXPECT_EQ(a.st_mode & ~row.modeBitsDropped, b.st_mode);
        EXPECT_EQ(a.st_uid, b.st_uid);
        EXPECT_EQ(a.st_gid, b.st_gid);
        EXPECT_TRUE(hasOldTimes(copy));
        // Lists of FIFOs are not looked after.
        EXPECT_TRUE(S_ISFIFO(a.st_mode) || attribute(original, accessAcl) == attribute(copy, accessAcl));
        EXPECT_EQ(attribute(original, defaultAcl), attribute(copy, defaultAcl));
        if (!S_ISDIR(a.st_mode)) {
            const support::Inode first = support::readInode(AT_FDCWD, original.c_str());
            const support::Inode copied = support::readInode(AT_FDCWD, copy.c_str());
            EXPECT_EQ(first.content, copied.content);
            EXPECT_EQ(first.attributes, copied.attributes);
        } else if (std::string(row.name) != "socket in a tree") {
            EXPECT_EQ(support::readTree(original).describe(), support::readTree(copy).describe());
        }
        if (row.check)
            row.check(original, copy);
        // An item that exists is never replaced or added to.
        EXPECT_EQ(copyTree(disk, from.get(), row.name, to.get(), name.c_str()).number(), EEXIST);
    }
    EXPECT_EQ(before.leakedSince(), "");
}

// An item that cannot be copied faithfully fails the copy, in a tree as on its own.
TEST(CopyTree, RefusesWhatItCannotCopy) {
    World world;
    makeDirectory(world.fd(), "tree");
    EXPECT_EQ(copyTree(world.disk, world.fd(), "missing", world.fd(), ".copy").number(), ENOENT);
    ASSERT_EQ(::mknodat(world.fd(), "socket", S_IFSOCK | 0600, 0), 0);
    EXPECT_EQ(copyTree(world.disk, world.fd(), "socket", world.fd(), ".copy").number(), EOPNOTSUPP);
    if (::mknodat(world.fd(), "tree/device", S_IFCHR | 0600, 0x0103) != 0)
        GTEST_SKIP() << "device nodes are not permitted";
    EXPECT_EQ(copyTree(world.disk, world.fd(), "tree", world.fd(), ".copy").number(), EPERM);
    EXPECT_FALSE(exists(world.fd(), ".copy/device"));
    EXPECT_EQ(copyTree(world.disk, world.fd(), "tree/device", world.fd(), ".copy2").number(), EPERM);
}

// An item that somebody puts in the place of a new link is not given away.
TEST(CopyTree, GivesAwayOnlyTheLinkItMade) {
    World world;
    makeItems(world.fd(), {"tree/", "tree/l -> x", "victim"});
    if (::fchownat(world.fd(), "tree/l", 501, 501, AT_SYMLINK_NOFOLLOW) != 0)
        GTEST_SKIP() << "needs root";
    support::ExchangingDisk disk(world.disk, support::DiskCall::makeSymbolicLink, world.path() + "/victim");
    EXPECT_EQ(copyTree(disk, world.fd(), "tree", world.fd(), ".copy").number(), ESTALE);
    EXPECT_EQ(statusOf(world.fd(), ".copy/l").st_uid, ::geteuid());
}

// A file of another owner below a directory that others can read is never readable in the half-made copy.
TEST(CopyTree, IsClosedToOthersUntilItIsWhole) {
    World world;
    makeItems(world.fd(), {"tree/", "tree/sub/", "tree/1", "tree/2", "tree/sub/1", "tree/sub/2"});
    support::FaultDisk disk(world.disk);
    std::size_t looks = 0;
    disk.before = [&](const support::DiskCallInfo&) {
        if (!exists(world.fd(), ".copy/sub/1"))
            return;
        const bool isWhole =
            exists(world.fd(), ".copy/sub/2") && exists(world.fd(), ".copy/1") && exists(world.fd(), ".copy/2");
        EXPECT_TRUE(isWhole || (statusOf(world.fd(), ".copy").st_mode & 077) == 0);
        ++looks;
    };
    EXPECT_FALSE(copyTree(disk, world.fd(), "tree", world.fd(), ".copy"));
    EXPECT_GT(looks, 0U);
}

// A destination that changes places with another directory as soon as it is made: that one is not filled and not
// changed.
TEST(CopyTree, FillsOnlyTheDirectoryItMade) {
    World world;
    makeDirectory(world.fd(), "tree", 0777);
    makeFile(world.fd(), "tree/f");
    makeDirectory(world.fd(), "victim", 0700);
    makeFile(world.fd(), "victim/keep");
    std::size_t refused = 0;
    const auto copyAside = [&] {
        std::atomic<bool> stopped{false};
        std::thread swapper([&] {
            while (!stopped && ::renameat2(world.fd(), ".copy", world.fd(), "victim", RENAME_EXCHANGE) != 0) {
            }
        });
        refused += copyTree(world.disk, world.fd(), "tree", world.fd(), ".copy") == ESTALE ? 1 : 0;
        stopped = true;
        swapper.join();
        if (exists(world.fd(), ".copy/keep")) {
            EXPECT_EQ(::renameat2(world.fd(), ".copy", world.fd(), "victim", RENAME_EXCHANGE), 0);
        }
        EXPECT_TRUE(exists(world.fd(), "victim/keep"));
        EXPECT_FALSE(exists(world.fd(), "victim/f"));
        EXPECT_EQ(statusOf(world.fd(), "victim").st_mode & 0777, 0700U);
        EXPECT_FALSE(removeTree(world.disk, world.fd(), ".copy"));
    };
    repeatForRace(copyAside, [&] { return refused == 20; });
}

} // namespace
} // namespace zor::fs::test
