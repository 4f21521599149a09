// SPDX-License-Identifier: Apache-2.0
// Whose containers a request may act on, as a table; the lookup of the mobile user by many threads at once.
#include "base/ContainerClass.h"
#include "support/RecordingLog.h"
#include "support/Waiting.h"

#include <gtest/gtest.h>

namespace zor {
namespace {

class CountingPasswords final : public platform::PasswordDatabase {
public:
    explicit CountingPasswords(std::uint32_t mobile) : mobile_(mobile) {}
    [[nodiscard]] ErrnoOr<platform::PasswordEntry> entryForUserId(std::uint32_t) const override {
        return Errno(ENOENT);
    }
    [[nodiscard]] ErrnoOr<platform::PasswordEntry> entryForName(std::string_view name) const override {
        ++lookups;
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
        if (failure != 0)
            return Errno(failure);
        if (name != "mobile")
            return Errno(ENOENT);
        return platform::PasswordEntry{.name = "mobile", .uid = mobile_, .homeDirectory = "/private/var/mobile"};
    }
    mutable std::atomic<int> lookups{0};
    int failure = 0;

private:
    const std::uint32_t mobile_;
};

// The first matching rule decides: the resolved user, or none for error 38 and its one line. Bundle and system classes
// have their owner, whoever asks; for system clients 1 is the mobile user whatever the class, others go by the table of
// owners; mobile clients act as themselves; a class of more than 32 bits is none.
TEST(UserIdentity, RequestsResolveByClassAndClient) {
    struct Row {
        std::uint32_t requested;
        std::uint64_t containerClass;
        std::uint32_t client;
        std::optional<std::uint32_t> resolved;
    };
    const Row rows[] = {{33, 1, 0, 33},     {33, 8, 501, 33},    {1, 1, 0, {}},
                        {1, 1, 501, {}},    {501, 5, 501, {}},   {501, 3, 0, {}},
                        {499, 12, 0, 499},  {499, 13, 501, 499}, {1, 12, 0, {}},
                        {501, 13, 501, {}}, {505, 12, 0, {}},    {1, 2, 0, 507},
                        {1, 2, 500, 507},   {1, 0, 0, 507},      {1, 14, 0, 507},
                        {505, 2, 0, 505},   {510, 11, 499, 510}, {511, 2, 0, {}},
                        {500, 2, 0, {}},    {0, 2, 0, {}},       {501, 14, 0, {}},
                        {1, 2, 501, 501},   {501, 2, 501, 501},  {502, 2, 501, {}},
                        {0, 2, 501, {}},    {1, 0, 501, 501},    {1, 99, 777, 777},
                        {777, 2, 777, 777}, {507, 7, 501, {}},   {501, (std::uint64_t{1} << 32) + 2, 0, {}}};
    for (const Row& row : rows) {
        support::RecordingLog sink(logLevelNotice);
        const Log log(sink);
        const CountingPasswords passwords(507);
        UserIdentity users(log, passwords, {});
        const auto resolved =
            users.validateUserId(row.requested, static_cast<ContainerClass>(row.containerClass), row.client);
        const std::string text = formatted("Invalid userId %u for class %llu from client %u", row.requested,
                                           static_cast<unsigned long long>(row.containerClass), row.client);
        const auto lines = sink.take();
        EXPECT_EQ(resolved ? std::optional(*resolved) : std::nullopt, row.resolved) << text;
        EXPECT_TRUE(resolved || resolved.error().is(ErrorCode::valueNotAllowed)) << text;
        EXPECT_EQ(support::hasLine(lines, 3, "validateUserId", text), !resolved);
    }
}

// Many threads ask at once: an account is looked up once, for ever; where it was not found, whatever kept it from being
// found, each asks again, for it may be there the next time.
TEST(UserIdentity, TheMobileUserIsLookedUpUntilItIsFound) {
    support::RecordingLog sink(logLevelNotice);
    const Log log(sink);
    CountingPasswords passwords(501);
    UserIdentity users(log, passwords, {});
    for (const int failure : {EMFILE, ENOMEM, EIO, ENOENT, 0, 0}) {
        passwords.failure = failure;
        const int before = passwords.lookups;
        std::atomic<int> agreeing{0};
        support::inThreads(
            8, [&](unsigned) { agreeing += users.getCurrentMobileUserId() == (failure == 0 ? 501U : 0U) ? 1 : 0; });
        EXPECT_EQ(agreeing, 8) << failure;
        EXPECT_EQ(passwords.lookups - before, failure == 0 ? before == 32 : 8) << failure;
    }
    EXPECT_EQ(sink.take().size(), 2U) << "each of both is said once";
}

} // namespace
} // namespace zor
