// SPDX-License-Identifier: Apache-2.0
#include "upcall/packbuff/Packbuff.h"
#include "zorvane-run/ToldContainers.h"

#include <algorithm>
#include <functional>
#include <gtest/gtest.h>

namespace zorvanerun {
namespace {

using namespace zor;
using namespace zor::upcall;

using Buffer = std::vector<std::uint8_t>;

/// A reply, item by item.
class Items {
public:
    Items& text(std::uint16_t type, const std::string& value) {
        // As bytes of any kind: what is sent as a string need not be one.
        sb_packbuff_pack_string(packbuff_.get(), type, value.c_str(), static_cast<std::uint32_t>(value.size()));
        return *this;
    }
    Items& number(std::uint16_t type, std::uint32_t value) {
        sb_packbuff_pack_uint32(packbuff_.get(), type, value);
        return *this;
    }
    [[nodiscard]] Buffer buffer() const {
        const std::uint8_t* const bytes = sb_packbuff_get_bytes(packbuff_.get());
        return {bytes, bytes + sb_packbuff_get_size(packbuff_.get())};
    }

private:
    PackbuffPointer packbuff_{sb_packbuff_new(4096)};
};

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
        Items items;
        items.text(CM_KERN_REPLY_HOME_DIR_PATH, home)
            .text(CM_KERN_REPLY_DATA_CONTAINER_PATH, data)
            .text(CM_KERN_REPLY_TEMP_DIR_PATH, temporary)
            .text(CM_KERN_REPLY_APP_GROUP_ID, group)
            .text(CM_KERN_REPLY_APP_GROUP_PATH, groupPath)
            .text(CM_KERN_REPLY_SYSTEM_CONTAINER_PATH, system)
            .text(CM_KERN_REPLY_SYSTEM_GROUP_ID, systemGroup)
            .text(CM_KERN_REPLY_SYSTEM_GROUP_PATH, systemGroupPath)
            .number(CM_KERN_REPLY_STATUS, status);
        return items;
    }
};

const WantedContainers wanted{
    .applicationGroups = {"group.a"}, .systemGroups = {"systemgroup.a"}, .systemContainer = true};
constexpr const char* root = "/r";

std::string problemOf(const Buffer& buffer) {
    const auto told = readReply(buffer, wanted, root);
    return told ? "" : told.error();
}

// Goal: a launcher that is root mounts nothing but a container in its place, whatever the answer says. Method: one lie
// for each row, told in an answer that is otherwise good.
TEST(Reply, EveryLieIsFound) {
    ASSERT_EQ(problemOf(Paths().items().buffer()), "");
    struct Row {
        const char* what;
        std::function<void(Paths&)> lie;
        const char* problem;
    };
    const Row rows[] = {
        {"no success", [](Paths& p) { p.status = 0; }, "could not find or make"},
        {"a home outside", [](Paths& p) { p.home = "/private/var/mobile"; }, "home"},
        {"a home beside", [](Paths& p) { p.home = "/rr/private"; }, "home"},
        {"the root as home", [](Paths& p) { p.home = "/r"; }, "home"},
        {"a relative home", [](Paths& p) { p.home = "r/private"; }, "home"},
        {"a way out of home", [](Paths& p) { p.home = "/r/../etc"; }, "home"},
        {"data of the root user", [](Paths& p) { p.data = "/etc"; }, "data container"},
        {"data of another user", [](Paths& p) { p.data = "/r/private/var/second/Containers/Data/Application/A"; },
         "data container"},
        {"data of another class", [](Paths& p) { p.data = "/r/private/var/mobile/Containers/Data/VPNPlugin/A"; },
         "data container"},
        {"all data", [](Paths& p) { p.data = "/r/private/var/mobile/Containers/Data/Application"; }, "data container"},
        {"all data, with a slash", [](Paths& p) { p.data = "/r/private/var/mobile/Containers/Data/Application/"; },
         "data container"},
        {"a way up", [](Paths& p) { p.data = "/r/private/var/mobile/Containers/Data/Application/.."; }, "data"},
        {"a hidden name", [](Paths& p) { p.data = "/r/private/var/mobile/Containers/Data/Application/.A"; }, "data"},
        {"a place in a container",
         [](Paths& p) { p.data = "/r/private/var/mobile/Containers/Data/Application/A/Documents"; }, "data container"},
        {"a line of its own", [](Paths& p) { p.data = "/r/private/var/mobile/Containers/Data/Application/A\nB"; },
         "data container"},
        {"another's tmp", [](Paths& p) { p.temporary = "/r/private/var/mobile/Containers/Data/Application/Z/tmp"; },
         "temporary"},
        {"another group", [](Paths& p) { p.group = "group.b"; }, "asked for"},
        {"a group's path elsewhere", [](Paths& p) { p.groupPath = p.data; }, "application group"},
        {"a system container of a user", [](Paths& p) { p.system = p.data; }, "system container"},
        {"a system group outside", [](Paths& p) { p.systemGroupPath = "/private/var/containers/Shared/SystemGroup/D"; },
         "system group"},
        {"a home in a container",
         [](Paths& p) {
             p.home = p.system;
             p.data = p.home + "/Containers/Data/Application/A";
             p.temporary = p.data + "/tmp";
             p.groupPath = p.home + "/Containers/Shared/AppGroup/B";
         },
         "inside another"},
    };
    for (const Row& row : rows) {
        Paths paths;
        row.lie(paths);
        EXPECT_NE(problemOf(paths.items().buffer()).find(row.problem), std::string::npos)
            << row.what << ": " << problemOf(paths.items().buffer());
    }
}

// Goal: an answer of another form is none. Method: forms that a daemon never sends, built item by item.
TEST(Reply, EveryWrongFormIsFound) {
    const Paths good;
    struct Row {
        const char* what;
        Buffer buffer;
    };
    const Row rows[] = {
        {"nothing", {}},
        {"no item", Items().buffer()},
        {"only a status", Items().number(CM_KERN_REPLY_STATUS, 1).buffer()},
        {"an item behind the status", good.items().number(CM_KERN_REPLY_STATUS, 1).buffer()},
        {"a path twice", Items()
                             .text(CM_KERN_REPLY_DATA_CONTAINER_PATH, good.data)
                             .text(CM_KERN_REPLY_DATA_CONTAINER_PATH, good.data)
                             .buffer()},
        {"a group without a path",
         Items().text(CM_KERN_REPLY_APP_GROUP_ID, "group.a").number(CM_KERN_REPLY_STATUS, 1).buffer()},
        {"a group with another kind's path", Items()
                                                 .text(CM_KERN_REPLY_APP_GROUP_ID, "group.a")
                                                 .text(CM_KERN_REPLY_SYSTEM_GROUP_PATH, good.systemGroupPath)
                                                 .buffer()},
        {"a kind that is not known", Items().text(77, "x").buffer()},
        {"a NUL in a path", Items().text(CM_KERN_REPLY_DATA_CONTAINER_PATH, good.data + '\0' + "/x").buffer()},
        {"a status that is text", Items().text(CM_KERN_REPLY_STATUS, "1").buffer()},
        {"a path that is a number", Items().number(CM_KERN_REPLY_DATA_CONTAINER_PATH, 1).buffer()},
    };
    for (const Row& row : rows)
        EXPECT_NE(problemOf(row.buffer), "") << row.what;
}

// Goal: no damage makes a path believed that is no container's. Method: every byte of a good answer in turn takes each
// of a few values, every cut; what is still believed has to be where containers are.
TEST(Reply, DamageNeverLeadsAway) {
    const Buffer good = Paths().items().buffer();
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
