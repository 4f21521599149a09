// SPDX-License-Identifier: Apache-2.0
#include "ipc/UserNumbers.h"

#include <array>
#include <cerrno>
#include <charconv>
#include <optional>

namespace zor::ipc {

namespace {

constexpr std::string_view sectionName = "users";

/// The file's word on one number: nothing, or a text from a line.
struct Setting {
    std::string_view key;
    std::uint32_t UserNumbers::* number;
    std::string text;
    unsigned line = 0;
};
using Settings = std::array<Setting, 4>;

std::string_view trimmed(std::string_view text) {
    constexpr std::string_view blanks = " \t\r";
    const auto first = text.find_first_not_of(blanks);
    return first == text.npos ? std::string_view() : text.substr(first, text.find_last_not_of(blanks) - first + 1);
}

std::unexpected<std::string> wrong(unsigned line, const std::string& what) {
    return std::unexpected("line " + std::to_string(line) + ": " + what);
}

std::unexpected<std::string> wrong(const Setting& setting, const std::string& what) {
    return wrong(setting.line, std::string(setting.key) + "=" + setting.text + ": " + what);
}

std::expected<void, std::string> readSetting(Settings& settings, unsigned line, std::string_view text) {
    const auto equals = text.find('=');
    const std::string_view key = trimmed(text.substr(0, equals));
    const auto found = std::ranges::find(settings, key, &Setting::key);
    if (equals == text.npos || found == settings.end())
        return wrong(line, "\"" + std::string(text) +
                               "\" is no setting of [users]; write installer=, system=, first= or last=");
    if (found->line != 0)
        return wrong(line, std::string(key) + "= stands in line " + std::to_string(found->line) +
                               " already; remove one of the two");
    const std::string_view value = trimmed(text.substr(equals + 1));
    if (value.empty())
        return wrong(line, std::string(key) + "= has no value; write a number or the name of an account");
    found->text = value;
    found->line = line;
    return {};
}

std::expected<void, std::string> readLines(Settings& settings, std::string_view text) {
    bool inUsers = false;
    for (unsigned line = 1; !text.empty(); ++line) {
        const auto end = std::min(text.find('\n'), text.size());
        const std::string_view content = trimmed(text.substr(0, end));
        text.remove_prefix(std::min(end + 1, text.size()));
        if (content.empty() || content.front() == '#' || content.front() == ';')
            continue;
        if (content.front() == '[') {
            inUsers = content.substr(1) == std::string(sectionName) + "]";
            if (!inUsers)
                return wrong(line,
                             "\"" + std::string(content) + "\" is no section of this file; the only one is [users]");
        } else if (!inUsers) {
            return wrong(line, "\"" + std::string(content) + "\" stands before the line [users]");
        } else if (auto read = readSetting(settings, line, content); !read) {
            return read;
        }
    }
    return {};
}

std::expected<std::uint32_t, std::string> numberOf(const Setting& setting, bool isOwner, const Accounts& accounts) {
    const std::string& text = setting.text;
    std::uint32_t number = 0;
    const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), number);
    const bool isNumber = error == std::errc() && end == text.data() + text.size();
    if (!isNumber) {
        const auto account = accounts.named(text);
        if (!account)
            return wrong(setting, account.error() == ENOENT
                                      ? "there is no such account; make it, or write a number"
                                      : std::string("the account cannot be looked up (") + account.error().text() +
                                            "); start again when it can");
        number = account->number;
    }
    if (number <= currentMobileUser || number > UserNumbers::configuredMax)
        return wrong(setting, "user " + std::to_string(number) + " cannot own containers; take one from 2 to " +
                                  std::to_string(UserNumbers::configuredMax));
    if (!isNumber || !isOwner)
        return number;
    const auto account = accounts.numbered(number);
    if (account && account->name != installerAccount && account->name != systemAccount)
        return wrong(setting, "this number belongs to the account " + account->name +
                                  ", which could change what it owns; take a number that is free, or write the name " +
                                  account->name + " if it is meant");
    return number;
}

std::expected<void, std::string> judge(const UserNumbers& numbers) {
    const std::string range = "first=" + std::to_string(numbers.first) + " to last=" + std::to_string(numbers.last);
    if (numbers.first > numbers.last)
        return std::unexpected(range + " holds no user; set both in [users], first= to the smaller one");
    if (numbers.mobileUsers() > UserNumbers::mobileUsersMax)
        return std::unexpected(range + " holds more than " + std::to_string(UserNumbers::mobileUsersMax) +
                               " users; choose a shorter range");
    if (numbers.isMobile(numbers.installer) || numbers.isMobile(numbers.system))
        return std::unexpected(range + " holds installer=" + std::to_string(numbers.installer) +
                               " or system=" + std::to_string(numbers.system) + "; set them apart in [users]");
    if (numbers.installer == numbers.system)
        return std::unexpected("installer= and system= are both user " + std::to_string(numbers.system) +
                               "; give each an account of its own");
    return {};
}

/// The doubt about an owner that nobody configured.
std::optional<std::string> doubtOf(const Setting& setting, std::uint32_t number, const Accounts& accounts) {
    if (setting.line != 0)
        return std::nullopt;
    const auto account = accounts.numbered(number);
    if (!account || account->name == installerAccount || account->name == systemAccount)
        return std::nullopt;
    return "The account " + account->name + " has number " + std::to_string(number) +
           " and so may change containers of " + (setting.key == "installer" ? "every bundle" : "the system") +
           "; set " + std::string(setting.key) +
           "= in section [users] of /etc/zorvane/zorvaned.conf to an account of its own before there are containers";
}

} // namespace

std::expected<ConfiguredUsers, std::string> readUserNumbers(std::string_view text, const Accounts& accounts) {
    Settings settings{{{.key = "installer", .number = &UserNumbers::installer},
                       {.key = "system", .number = &UserNumbers::system},
                       {.key = "first", .number = &UserNumbers::first},
                       {.key = "last", .number = &UserNumbers::last}}};
    if (auto read = readLines(settings, text); !read)
        return std::unexpected(std::move(read).error());
    ConfiguredUsers users;
    for (std::size_t i = 0; i < settings.size(); ++i) {
        const Setting& setting = settings[i];
        const bool isOwner = i < 2;
        if (setting.line == 0)
            continue;
        const auto number = numberOf(setting, isOwner, accounts);
        if (!number)
            return std::unexpected(number.error());
        users.numbers.*setting.number = *number;
    }
    if (auto judged = judge(users.numbers); !judged)
        return std::unexpected(std::move(judged).error());
    for (const Setting& setting : {settings[0], settings[1]})
        if (auto doubt = doubtOf(setting, users.numbers.*setting.number, accounts))
            users.doubts.push_back(std::move(*doubt));
    return users;
}

std::string textOf(const UserNumbers& numbers) {
    return "[" + std::string(sectionName) + "]\ninstaller=" + std::to_string(numbers.installer) +
           "\nsystem=" + std::to_string(numbers.system) + "\nfirst=" + std::to_string(numbers.first) +
           "\nlast=" + std::to_string(numbers.last) + "\n";
}

} // namespace zor::ipc
