// SPDX-License-Identifier: Apache-2.0
// Listing and measuring containers.
#include "Commands.h"
#include "ContainerLists.h"
#include "KnownContainer.h"
#include "Users.h"

#include <algorithm>
#include <map>

namespace zorvanectl {

namespace {

using zorvane::Client;

std::string named(const Target& target, const Listing& listing) {
    std::string text = target.identifier.empty() ? "" : target.identifier + " in ";
    return text + (listing.all ? "every class" : std::string(zorvane::containerClassName(target.containerClass)));
}

/// Names of users, each looked up once.
class ShownUsers {
public:
    explicit ShownUsers(const std::string& root) : root_(root) {}
    const std::string& operator()(std::uint32_t number) {
        if (number == zorvane::currentMobileUser)
            return current_;
        const auto [found, isNew] = texts_.try_emplace(number);
        if (isNew)
            found->second = shownUser(root_, number);
        return found->second;
    }

private:
    const std::string& root_;
    const std::string current_ = "current";
    std::map<std::uint32_t, std::string> texts_;
};

nlohmann::json toJson(const FoundContainer& container, const Listing& listing) {
    const Client::Address& address = container.address;
    nlohmann::json json = {{"identifier", address.identifier},
                           {"uuid", zorvane::uuidText(address.uuid)},
                           {"class", address.containerClass},
                           {"user", address.user}};
    if (listing.withPath)
        json["path"] = container.path;
    if (listing.withSize)
        json["bytes"] = container.bytes;
    return json;
}

nlohmann::json toJson(const FoundContainers& found, const Listing& listing) {
    nlohmann::json document = {{"containers", nlohmann::json::array()}, {"unread", nlohmann::json::array()}};
    for (const FoundContainer& container : found.containers)
        document["containers"].push_back(toJson(container, listing));
    for (const UnreadClass& unread : found.unread)
        document["unread"].push_back({{"class", unread.containerClass},
                                      {"user", unread.user},
                                      {"code", unread.error.code},
                                      {"message", unread.error.message}});
    return document;
}

void showUnread(const Output& output, const FoundContainers& found, ShownUsers& users) {
    for (const UnreadClass& unread : found.unread)
        output.remark(std::string(zorvane::containerClassName(unread.containerClass)) + " of user " +
                      users(unread.user) + " is not among them: " + unread.error.message + " (code " +
                      std::to_string(unread.error.code) + ")");
}

std::uint64_t bytesOf(const FoundContainers& found) {
    std::uint64_t sum = 0;
    for (const FoundContainer& container : found.containers)
        sum += container.bytes;
    return sum;
}

std::string countOf(const FoundContainers& found) {
    return std::to_string(found.containers.size()) + (found.containers.size() == 1 ? " container" : " containers");
}

/// Nothing, or the exit code.
std::optional<int> whichIsMissing(const Output& output, const Target& target, const Listing& listing,
                                  const std::string& what) {
    if (listing.all || target.containerClass != 0)
        return std::nullopt;
    return output.localError(exitUsage, "--class is required, or --all", "name a class, or say --all for every one",
                             what);
}

/// For a person at a terminal that is too narrow for all: what a container is called comes first, its UUID is left out.
enum class Width { all, narrow };

std::vector<std::string> rowOf(const FoundContainer& container, const Listing& listing, ShownUsers& users,
                               Width width) {
    std::vector<std::string> row = {width == Width::all ? zorvane::uuidText(container.address.uuid)
                                                        : printable(container.address.identifier)};
    if (listing.all) {
        row.emplace_back(zorvane::containerClassName(container.address.containerClass));
        row.push_back(printable(users(container.address.user)));
    }
    if (listing.withSize)
        row.push_back(shownBytes(container.bytes));
    if (width == Width::all)
        row.push_back(printable(container.address.identifier));
    if (listing.withPath)
        row.push_back(printable(container.path));
    return row;
}

std::vector<std::string> headerOf(const Listing& listing, Width width) {
    std::vector<std::string> header = {width == Width::all ? "UUID" : "IDENTIFIER"};
    if (listing.all)
        header.insert(header.end(), {"CLASS", "USER"});
    if (listing.withSize)
        header.emplace_back("SIZE");
    if (width == Width::all)
        header.emplace_back("IDENTIFIER");
    if (listing.withPath)
        header.emplace_back("PATH");
    return header;
}

void showList(const Output& output, const FoundContainers& found, Listing listing, bool pathWanted, ShownUsers& users) {
    const auto rows = [&](Width width) {
        std::vector<std::vector<std::string>> all;
        for (const FoundContainer& container : found.containers)
            all.push_back(rowOf(container, listing, users, width));
        return all;
    };
    const auto whole = rows(Width::all);
    const auto header = headerOf(listing, Width::all);
    if (!listing.all || fits(header, whole)) {
        output.table(header, whole);
        return;
    }
    listing.withPath = pathWanted;
    output.table(headerOf(listing, Width::narrow), rows(Width::narrow));
    output.line(std::string("(a wider terminal, or '| cat', shows UUIDs") +
                (pathWanted ? ")" : " and paths; --path shows paths here)"));
}

void showUsage(const Output& output, const FoundContainers& found, const Listing& listing, ShownUsers& users) {
    constexpr std::size_t barWidth = 30;
    std::uint64_t most = 1;
    for (const FoundContainer& container : found.containers)
        most = std::max(most, container.bytes);
    std::vector<std::string> header = {"SIZE", "", "IDENTIFIER"};
    if (listing.all)
        header.insert(header.end(), {"CLASS", "USER"});
    if (listing.withPath)
        header.emplace_back("PATH");
    std::vector<std::vector<std::string>> rows;
    for (const FoundContainer& container : found.containers) {
        const auto width = static_cast<double>(container.bytes) / static_cast<double>(most) * double{barWidth};
        rows.push_back({shownBytes(container.bytes), std::string(static_cast<std::size_t>(width), '#'),
                        printable(container.address.identifier)});
        if (listing.all) {
            rows.back().emplace_back(zorvane::containerClassName(container.address.containerClass));
            rows.back().push_back(printable(users(container.address.user)));
        }
        if (listing.withPath)
            rows.back().push_back(printable(container.path));
    }
    if (!fits(header, rows)) { // the bars are what can be done without
        header.erase(header.begin() + 1);
        for (auto& row : rows)
            row.erase(row.begin() + 1);
    }
    output.table(header, rows);
    output.line(shownBytes(bytesOf(found)) + " in " + countOf(found));
}

} // namespace

int list(const zorvane::ConnectOptions& connect, const Output& output, const Target& target, const Listing& listing) {
    const std::string what = "list " + named(target, listing);
    if (const auto missing = whichIsMissing(output, target, listing, "list"))
        return *missing;
    Listing detailed = listing;
    detailed.withPath = listing.withPath || listing.all;
    detailed.withSize = listing.withSize || listing.order == "size";
    auto client = Client::connect(connect);
    if (!client)
        return output.error(client.error(), what);
    const auto found = findContainers(*client, connect.root, target, detailed);
    if (!found)
        return output.error(found.error(), what);
    if (output.isJson()) {
        output.json(toJson(*found, detailed));
        return exitDone;
    }
    ShownUsers users(connect.root);
    showList(output, *found, detailed, listing.withPath, users);
    showUnread(output, *found, users);
    return exitDone;
}

int usage(const zorvane::ConnectOptions& connect, const Output& output, const Target& target, const Listing& listing) {
    const std::string what = "measure " + named(target, listing);
    if (const auto missing = whichIsMissing(output, target, listing, "measure"))
        return *missing;
    Listing measured = listing;
    measured.withSize = true;
    if (measured.order.empty())
        measured.order = "size";
    auto client = Client::connect(connect);
    if (!client)
        return output.error(client.error(), what);
    const auto found = findContainers(*client, connect.root, target, measured);
    if (!found)
        return output.error(found.error(), what);
    if (found->containers.empty() && !target.identifier.empty())
        return output.error({.kind = zorvane::Error::Kind::daemon,
                             .code = codeNotFound,
                             .message = "there is no container of this identifier"},
                            what);
    if (output.isJson()) {
        nlohmann::json document = toJson(*found, measured);
        document["totalBytes"] = bytesOf(*found);
        output.json(document);
        return exitDone;
    }
    ShownUsers users(connect.root);
    showUsage(output, *found, measured, users);
    showUnread(output, *found, users);
    return exitDone;
}

} // namespace zorvanectl
