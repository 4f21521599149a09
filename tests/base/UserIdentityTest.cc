// SPDX-License-Identifier: Apache-2.0
// Whose containers a request may act on, as tables over every class; the lookup of the mobile user by many threads at
// once.
#include "base/UserIdentity.h"
#include "support/RecordingLog.h"

#include <atomic>
#include <cerrno>
#include <gtest/gtest.h>
#include <optional>
#include <thread>

namespace zor {
namespace {

class CountingPasswords final : public platform::PasswordDatabase {
public:
    explicit CountingPasswords(std::optional<std::uint32_t> mobile) : mobile_(mobile) {}
    [[nodiscard]] std::expected<platform::PasswordEntry, int> entryForUserId(std::uint32_t) const override {
        return std::unexpected(ENOENT);
    }
    [[nodiscard]] std::expected<platform::PasswordEntry, int> entryForName(std::string_view name) const override {
        ++lookups;
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
        if (failure != 0)
            return std::unexpected(failure);
        if (name != "mobile" || !mobile_)
            return std::unexpected(ENOENT);
        return platform::PasswordEntry{.name = "mobile", .uid = *mobile_, .homeDirectory = "/private/var/mobile"};
    }
    mutable std::atomic<int> lookups{0};
    int failure = 0;

private:
    const std::optional<std::uint32_t> mobile_;
};

// Each class accepts exactly its owners, of the ids next to every bound.
TEST(UserIdentity, EachClassHasItsOwners) {
    for (std::uint64_t number = 0; number <= 15; ++number) {
        const bool bundle = number == 1 || number == 3 || number == 5 || number == 8;
        const bool system = number == 12 || number == 13;
        const bool perUser = !bundle && number >= 2 && number <= 11;
        for (const std::uint32_t id : {0U, 1U, 32U, 33U, 34U, 498U, 499U, 500U, 501U, 510U, 511U, 4294967295U})
            EXPECT_EQ(userIdIsValidForClass(static_cast<ContainerClass>(number), id),
                      bundle   ? id == 33
                      : system ? id == 499
                               : perUser && id >= 501 && id <= 510)
                << number << " " << id;
    }
    EXPECT_FALSE(userIdIsValidForClass(static_cast<ContainerClass>((std::uint64_t{1} << 32) + 2), 501));
}

// The first matching rule decides: the resolved user, or none for error 38 and its one line.
TEST(UserIdentity, RequestsResolveByClassAndClient) {
    struct Row {
        std::uint32_t requested;
        std::uint64_t containerClass;
        std::uint32_t client;
        std::optional<std::uint32_t> resolved;
    };
    const Row rows[] = {
        // Bundle and system classes: the owner, whoever asks.
        {33, 1, 0, 33},
        {33, 8, 501, 33},
        {1, 1, 0, {}},
        {1, 1, 501, {}},
        {501, 5, 501, {}},
        {501, 3, 0, {}},
        {499, 12, 0, 499},
        {499, 13, 501, 499},
        {1, 12, 0, {}},
        {501, 13, 501, {}},
        {505, 12, 0, {}},
        // System clients: 1 is the mobile user whatever the class, others by the table of owners.
        {1, 2, 0, 507},
        {1, 2, 500, 507},
        {1, 0, 0, 507},
        {1, 14, 0, 507},
        {505, 2, 0, 505},
        {510, 11, 499, 510},
        {511, 2, 0, {}},
        {500, 2, 0, {}},
        {0, 2, 0, {}},
        {501, 14, 0, {}},
        // Mobile clients act as themselves.
        {1, 2, 501, 501},
        {501, 2, 501, 501},
        {502, 2, 501, {}},
        {0, 2, 501, {}},
        {1, 0, 501, 501},
        {1, 99, 777, 777},
        {777, 2, 777, 777},
        {507, 7, 501, {}},
    };
    for (const Row& row : rows) {
        support::RecordingLog sink(logLevelNotice);
        const Log log(sink);
        const CountingPasswords passwords(507);
        UserIdentity users(log, passwords);
        const auto resolved =
            users.validateUserId(row.requested, static_cast<ContainerClass>(row.containerClass), row.client);
        const std::string text = formatted("Invalid userId %u for class %llu from client %u", row.requested,
                                           static_cast<unsigned long long>(row.containerClass), row.client);
        const auto lines = sink.take();
        ASSERT_EQ(resolved.has_value(), row.resolved.has_value()) << text;
        if (row.resolved) {
            EXPECT_EQ(*resolved, *row.resolved) << text;
            EXPECT_FALSE(support::hasLine(lines, 3, "validateUserId", text));
        } else {
            EXPECT_TRUE(resolved.error().is(ErrorCode::valueNotAllowed)) << text;
            EXPECT_EQ(lines, (std::vector<support::LogLine>{{3, "validateUserId", text}}));
        }
    }
}

// Many threads ask at once: with the account one lookup for ever, without it one for each, and it is said once.
TEST(UserIdentity, TheMobileUserIsLookedUpOnce) {
    for (const auto& account : {std::optional<std::uint32_t>(501), std::optional<std::uint32_t>()}) {
        support::RecordingLog sink(logLevelNotice);
        const Log log(sink);
        const CountingPasswords passwords(account);
        UserIdentity users(log, passwords);
        std::atomic<int> agreeing{0};
        std::vector<std::jthread> threads;
        for (int i = 0; i < 8; ++i)
            threads.emplace_back([&] { agreeing += users.getCurrentMobileUserId() == account.value_or(0) ? 1 : 0; });
        threads.clear();
        EXPECT_EQ(agreeing, 8);
        EXPECT_EQ(passwords.lookups, account ? 1 : 8);
        const char* message = account ? "Current mobile user ID is 501" : "Failed to get mobile uid. This is bad";
        EXPECT_EQ(sink.take(), (std::vector<support::LogLine>{{3, "__getCurrentMobileUserId_block_invoke", message}}));
    }
}

// An account that was not found may be there the next time, whatever kept it from being found.
TEST(UserIdentity, AMissingAccountIsNoAnswer) {
    for (const int failure : {EMFILE, ENOMEM, EIO, ENOENT}) {
        support::RecordingLog sink(logLevelNotice);
        const Log log(sink);
        CountingPasswords passwords(501);
        UserIdentity users(log, passwords);
        passwords.failure = failure;
        EXPECT_EQ(users.getCurrentMobileUserId(), 0U);
        passwords.failure = 0;
        EXPECT_EQ(users.getCurrentMobileUserId(), 501U) << failure;
        EXPECT_EQ(passwords.lookups, 2) << failure;
    }
}

} // namespace
} // namespace zor
