// SPDX-License-Identifier: Apache-2.0
#include "upcall/packbuff/Packbuff.h"
#include "zorvane-run/ToldContainers.h"

#include <algorithm>
#include <gtest/gtest.h>

namespace zorvanerun {
namespace {

using namespace zor;
using namespace zor::upcall;

using Buffer = std::vector<std::uint8_t>;

/// A reply, item by item. The text is bytes of any kind: what is sent as a string need not be one.
using Items = std::vector<std::pair<std::uint16_t, std::variant<std::string, std::uint32_t>>>;

Buffer packed(const Items& items) {
    const PackbuffPointer packbuff(sb_packbuff_new(4096));
    for (const auto& [type, value] : items)
        if (const auto* const text = std::get_if<std::string>(&value))
            sb_packbuff_pack_string(packbuff.get(), type, text->c_str(), static_cast<std::uint32_t>(text->size()));
        else
            sb_packbuff_pack_uint32(packbuff.get(), type, std::get<std::uint32_t>(value));
    const std::uint8_t* const bytes = sb_packbuff_get_bytes(packbuff.get());
    return {bytes, bytes + sb_packbuff_get_size(packbuff.get())};
}

struct Paths {
    std::string home = "/r/private/var/mobile";
    std::string data = "/r/private/var/mobile/Containers/Data/Application/A";
    std::string temporary = "/r/private/var/mobile/Containers/Data/Application/A/tmp";
    std::string group = "group.a";
    std::string groupPath = "/r/private/var/mobile/Containers/Shared/AppGroup/B";
    std::string system = "/r/private/var/containers/Data/System/C";
    std::string systemGroup = "systemgroup.a";
    std::string systemGroupPath = "/r/private/var/containers/Shared/SystemGroup/D";
    std::uint32_t status = 1;

    [[nodiscard]] Items items() const {
        return {{CM_KERN_REPLY_HOME_DIR_PATH, home},
                {CM_KERN_REPLY_DATA_CONTAINER_PATH, data},
                {CM_KERN_REPLY_TEMP_DIR_PATH, temporary},
                {CM_KERN_REPLY_APP_GROUP_ID, group},
                {CM_KERN_REPLY_APP_GROUP_PATH, groupPath},
                {CM_KERN_REPLY_SYSTEM_CONTAINER_PATH, system},
                {CM_KERN_REPLY_SYSTEM_GROUP_ID, systemGroup},
                {CM_KERN_REPLY_SYSTEM_GROUP_PATH, systemGroupPath},
                {CM_KERN_REPLY_STATUS, status}};
    }
    [[nodiscard]] Buffer buffer() const { return packed(items()); }
};

const WantedContainers wanted{
    .applicationGroups = {"group.a"}, .systemGroups = {"systemgroup.a"}, .systemContainer = true};
constexpr const char* root = "/r";

std::string problemOf(const Buffer& buffer) {
    const auto told = readReply(buffer, wanted, root);
    return told ? "" : told.error();
}

// A launcher that is root mounts nothing but a container in its place, whatever the answer says: one lie for each row.
TEST(Reply, EveryLieIsFound) {
    ASSERT_EQ(problemOf(Paths().buffer()), "");
    const Paths good;
    const std::string applications = good.home + "/Containers/Data/Application";
    struct Row {
        const char* what;
        std::string Paths::* path;
        std::string lie;
        const char* problem;
    };
    const Row rows[] = {
        {"a home outside", &Paths::home, "/private/var/mobile", "home"},
        {"a home beside", &Paths::home, "/rr/private", "home"},
        {"the root as home", &Paths::home, "/r", "home"},
        {"a relative home", &Paths::home, "r/private", "home"},
        {"a way out of home", &Paths::home, "/r/../etc", "home"},
        {"data of the root user", &Paths::data, "/etc", "data container"},
        {"data of another user", &Paths::data, "/r/private/var/second/Containers/Data/Application/A", "data container"},
        {"data of another class", &Paths::data, good.home + "/Containers/Data/VPNPlugin/A", "data container"},
        {"all data", &Paths::data, applications, "data container"},
        {"all data, with a slash", &Paths::data, applications + "/", "data container"},
        {"a way up", &Paths::data, applications + "/..", "data"},
        {"a hidden name", &Paths::data, applications + "/.A", "data"},
        {"a place in a container", &Paths::data, applications + "/A/Documents", "data container"},
        {"a line of its own", &Paths::data, applications + "/A\nB", "data container"},
        {"another's tmp", &Paths::temporary, applications + "/Z/tmp", "temporary"},
        {"another group", &Paths::group, "group.b", "asked for"},
        {"a group's path elsewhere", &Paths::groupPath, good.data, "application group"},
        {"a system container of a user", &Paths::system, good.data, "system container"},
        {"a system group outside", &Paths::systemGroupPath, "/private/var/containers/Shared/SystemGroup/D",
         "system group"},
    };
    for (const Row& row : rows) {
        Paths paths;
        paths.*row.path = row.lie;
        const std::string problem = problemOf(paths.buffer());
        EXPECT_TRUE(problem.contains(row.problem)) << row.what << ": " << problem;
    }
    Paths failed;
    failed.status = 0;
    EXPECT_TRUE(problemOf(failed.buffer()).contains("could not find or make"));
    Paths nested; // a home in a container
    nested.home = nested.system;
    nested.data = nested.home + "/Containers/Data/Application/A";
    nested.temporary = nested.data + "/tmp";
    nested.groupPath = nested.home + "/Containers/Shared/AppGroup/B";
    EXPECT_TRUE(problemOf(nested.buffer()).contains("inside another"));
}

// An answer of a form that a daemon never sends is none.
TEST(Reply, EveryWrongFormIsFound) {
    const Paths good;
    const Items::value_type status{CM_KERN_REPLY_STATUS, 1U};
    const Items::value_type group{CM_KERN_REPLY_APP_GROUP_ID, "group.a"};
    const Items::value_type data{CM_KERN_REPLY_DATA_CONTAINER_PATH, good.data};
    Items twoEnds = good.items();
    twoEnds.push_back(status);
    const std::pair<const char*, Buffer> rows[] = {
        {"nothing", {}},
        {"no item", packed({})},
        {"only a status", packed({status})},
        {"an item behind the status", packed(twoEnds)},
        {"a path twice", packed({data, data, status})},
        {"a group without a path", packed({group, status})},
        {"another kind's path", packed({group, {CM_KERN_REPLY_SYSTEM_GROUP_PATH, good.systemGroupPath}, status})},
        {"a kind that is not known", packed({{77, "x"}, status})},
        {"a NUL in a path", packed({{CM_KERN_REPLY_DATA_CONTAINER_PATH, good.data + '\0' + "/x"}, status})},
        {"a status that is text", packed({{CM_KERN_REPLY_STATUS, "1"}})},
        {"a path that is a number", packed({{CM_KERN_REPLY_DATA_CONTAINER_PATH, 1U}, status})}};
    for (const auto& [what, buffer] : rows)
        EXPECT_NE(problemOf(buffer), "") << what;
}

// Every byte of a good answer in turn takes each of a few values, and every cut: what is still believed is a
// container's place.
TEST(Reply, DamageNeverLeadsAway) {
    const Buffer good = Paths().buffer();
    const auto judge = [](const Buffer& buffer) {
        const auto told = readReply(buffer, wanted, root);
        if (!told)
            return;
        ASSERT_TRUE(told->applicationGroups.contains("group.a") && told->systemContainer);
        for (const std::string& path : {told->data, told->applicationGroups.begin()->second, *told->systemContainer,
                                        told->systemGroups.begin()->second}) {
            EXPECT_TRUE(isPlainPath(path)) << path;
            EXPECT_TRUE(isAtOrBelow(path, "/r")) << path;
            EXPECT_GE(std::ranges::count(path, '/'), 6) << path;
        }
    };
    for (std::size_t at = 0; at < good.size(); ++at) {
        Buffer damaged = good;
        for (const int value : {0, 1, 3, 8, 0x2e, 0x2f, 0x7f, 0xff}) {
            damaged[at] = static_cast<std::uint8_t>(value);
            judge(damaged);
        }
        EXPECT_FALSE(readReply(std::span(good).first(at), wanted, root)) << "cut at " << at;
    }
}

} // namespace
} // namespace zorvanerun
