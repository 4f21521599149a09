// SPDX-License-Identifier: Apache-2.0
// The meaning of a configuration of users, and why one is refused: each text against a small user database.
#include "ipc/UserNumbers.h"

#include <cerrno>
#include <gtest/gtest.h>

namespace zor::ipc {
namespace {

std::expected<ConfiguredUsers, std::string> read(std::string_view text) {
    static const std::vector<Account> database = {
        {"root", 0}, {"www-data", 33}, {"zorvane-installer", 990}, {"zorvane-system", 991}, {"ann", 1000}};
    const auto find = [](auto matches) -> ErrnoOr<Account> {
        const auto found = std::ranges::find_if(database, matches);
        return found == database.end() ? Errno(ENOENT) : ErrnoOr<Account>(*found);
    };
    return readUserNumbers(
        text,
        {.named =
             [&](std::string_view name) {
                 return name == "broken" ? Errno(EIO) : find([&](const Account& a) { return a.name == name; });
             },
         .numbered = [&](std::uint32_t number) { return find([&](const Account& a) { return a.number == number; }); }});
}

// Names and numbers are taken, what is left out stays, and what was written is read again as the same.
TEST(UserNumbers, ReadsNamesAndNumbers) {
    const struct {
        const char* text;
        UserNumbers numbers;
        std::size_t doubts; // of numbers that nobody set
    } rows[] = {
        {"", {}, 1},
        {"# nothing\n\n[users]\n; nor here\n", {}, 1},
        {"[users]\r\n installer = zorvane-installer \r\nsystem=991\nfirst=1000\nlast=1099", {990, 991, 1000, 1099}, 0},
        {"[users]\ninstaller=www-data\nfirst=ann\nlast=1000\n", {33, 499, 1000, 1000}, 0},
        {"[users]\nsystem=zorvane-system\n", {33, 991, 501, 510}, 1},
    };
    for (const auto& row : rows) {
        const auto users = read(row.text);
        ASSERT_TRUE(users) << row.text << users.error();
        EXPECT_EQ(users->numbers, row.numbers) << row.text;
        EXPECT_EQ(users->doubts.size(), row.doubts) << row.text;
        const auto noAccount = [](auto) { return Errno(ENOENT); };
        const auto again = readUserNumbers(textOf(row.numbers), {.named = noAccount, .numbered = noAccount});
        EXPECT_TRUE(again && again->numbers == row.numbers) << row.text;
    }
}

// One line says where and why: whatever could give somebody else the owners' power is refused.
TEST(UserNumbers, RefusesWhatCannotBeMeant) {
    const struct {
        const char* text;
        const char* said;
    } rows[] = {
        {"installer=990", "before the line [users]"},
        {"[user]\ninstaller=990", "line 1: \"[user]\" is no section"},
        {"[users]\ninstaler=990", "line 2: \"instal"},
        {"[users]\ninstaller", "is no setting"},
        {"[users]\ninstaller=", "has no value"},
        {"[users]\nfirst=2000\nfirst=2001", "line 3: first= stands in line 2"},
        {"[users]\ninstaller=33", "belongs to the account www-data"},
        {"[users]\ninstaller=nobody", "there is no such account"},
        {"[users]\ninstaller=broken", "cannot be looked up"},
        {"[users]\ninstaller=root", "user 0 cannot own"},
        {"[users]\nsystem=1", "user 1 cannot own"},
        {"[users]\nlast=100000", "cannot own"},
        {"[users]\nlast=99999999999", "there is no such account"},
        {"[users]\nfirst=600\nlast=599", "holds no user"},
        {"[users]\nfirst=2000\nlast=2100", "more than 100 users"},
        {"[users]\ninstaller=505", "holds installer=505"},
        {"[users]\nfirst=990\nlast=1000\nsystem=991", "or system=991"},
        {"[users]\ninstaller=991\nsystem=991", "both user 991"},
    };
    for (const auto& row : rows) {
        const auto users = read(row.text);
        ASSERT_FALSE(users) << row.text;
        EXPECT_NE(users.error().find(row.said), std::string::npos) << row.text << ": " << users.error();
    }
}

// Persons are never the system's, whatever the range is.
TEST(UserNumbers, LetsNoPersonActForOthers) {
    EXPECT_EQ((UserNumbers{.first = 501, .last = 510}.lastSystemClient()), 500U);
    EXPECT_EQ((UserNumbers{.first = 2000, .last = 2009}.lastSystemClient()), 999U);
    EXPECT_EQ((UserNumbers{.installer = 40'000, .first = 1000, .last = 1009}.counted(40'000)), 40'000U);
    EXPECT_EQ(UserNumbers().counted(511), strangersUserId);
}

} // namespace
} // namespace zor::ipc
