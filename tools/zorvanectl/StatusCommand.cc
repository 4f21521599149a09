// SPDX-License-Identifier: Apache-2.0
// How the daemon is doing: what people ask for first, then all that it tells.
#include "Commands.h"
#include "ContainerLists.h"
#include "RegisteredEntitlements.h"
#include "check/Checks.h"
#include "check/StoreCheck.h"

#include <algorithm>
#include <array>
#include <cctype>
#include <sys/statvfs.h>

namespace zorvanectl {

namespace {

constexpr const char* statusDaemon = "Daemon";
constexpr const char* statusCounters = "Counters";
constexpr const char* statusPeer = "Peer";

/// For all containers to be counted: the daemon may be busy, and the rest is known.
constexpr std::uint32_t countMillisecondsMax = 5000;

struct DiskSpace {
    std::uint64_t freeBytes = 0;
    std::uint64_t bytes = 0;
};

/// The part that the daemon does not tell; nothing where it cannot be seen from here.
struct Surroundings {
    std::optional<std::size_t> containers;
    std::optional<zor::check::DeathRow> deathRow;
    std::optional<DiskSpace> disk;
};

Surroundings lookAround(const zorvane::ConnectOptions& connect) {
    Surroundings around;
    zorvane::ConnectOptions quick = connect;
    quick.timeoutMilliseconds =
        std::min(connect.timeoutMilliseconds.value_or(countMillisecondsMax), countMillisecondsMax);
    if (auto client = zorvane::Client::connect(quick))
        if (const auto found = findContainers(*client, connect.root, {}, {.all = true}))
            around.containers = found->containers.size();
    if (const auto system = zor::check::CheckedSystem::open(connect.root))
        around.deathRow = zor::check::lookAtDeathRow(**system);
    struct statvfs space{};
    for (const char* place : {"/private/var", ""})
        if (!around.disk && ::statvfs((connect.root + place).c_str(), &space) == 0)
            around.disk = {.freeBytes = space.f_bavail * space.f_frsize, .bytes = space.f_blocks * space.f_frsize};
    return around;
}

std::string shownTime(std::uint64_t seconds) {
    constexpr std::array<std::pair<std::uint64_t, const char*>, 4> units = {
        {{86'400, " d"}, {3600, " h"}, {60, " min"}, {1, " s"}}};
    for (std::size_t i = 0; i < units.size(); ++i) {
        const auto [unit, name] = units[i];
        if (seconds < unit)
            continue;
        std::string text = std::to_string(seconds / unit) + name;
        if (i + 1 < units.size() && seconds % unit >= units[i + 1].first)
            text += " " + std::to_string(seconds % unit / units[i + 1].first) + units[i + 1].second;
        return text;
    }
    return "0 s";
}

/// Keys of the daemon's own become as all keys of this tool's are: "LogLinesLost" logLinesLost, "UserID" userId, "UUID"
/// uuid.
std::string jsonKey(const std::string& key) {
    std::string made;
    for (std::size_t i = 0; i < key.size(); ++i) {
        const bool upper = std::isupper(static_cast<unsigned char>(key[i])) != 0;
        const bool afterUpper = i == 0 || std::isupper(static_cast<unsigned char>(key[i - 1])) != 0;
        const bool endsWord = i + 1 == key.size() || std::islower(static_cast<unsigned char>(key[i + 1])) == 0;
        const bool lower = upper && (i == 0 || (afterUpper && endsWord));
        made += lower ? static_cast<char>(std::tolower(static_cast<unsigned char>(key[i]))) : key[i];
    }
    return made;
}

/// Registered entitlements have keys of others, which stay as they are.
nlohmann::json withOwnKeys(const nlohmann::json& value) {
    if (value.is_array()) {
        nlohmann::json array = nlohmann::json::array();
        for (const auto& element : value)
            array.push_back(withOwnKeys(element));
        return array;
    }
    if (!value.is_object())
        return value;
    nlohmann::json object = nlohmann::json::object();
    for (const auto& [key, element] : value.items())
        object[jsonKey(key)] = key == statusEntitlements ? element : withOwnKeys(element);
    return object;
}

nlohmann::json documentOf(const nlohmann::json& status, const Surroundings& around) {
    nlohmann::json document;
    for (const auto& [key, value] : status.items()) {
        nlohmann::json& made = document[jsonKey(key)];
        if (key != statusGroupReferences)
            made = key == statusEntitlements ? value : withOwnKeys(value);
        else
            for (const auto& [kind, groups] : value.items())
                made[jsonKey(kind)] = groups;
    }
    document["containers"] = around.containers ? nlohmann::json(*around.containers) : nlohmann::json();
    document["deathRow"] = nullptr;
    if (around.deathRow)
        document["deathRow"] = {{"items", around.deathRow->items},
                                {"bytes", around.deathRow->bytes},
                                {"oldestSeconds", around.deathRow->oldestSeconds}};
    document["disk"] = nullptr;
    if (around.disk)
        document["disk"] = {{"freeBytes", around.disk->freeBytes}, {"bytes", around.disk->bytes}};
    return document;
}

std::string shown(const zor::check::DeathRow& row) {
    if (row.items == 0)
        return "empty";
    return std::to_string(row.items) + (row.items == 1 ? " item, " : " items, ") + shownBytes(row.bytes) +
           ", the oldest for " + shownTime(row.oldestSeconds);
}

void showHead(const Output& output, const std::string& root, const nlohmann::json& status, const Surroundings& around) {
    const nlohmann::json daemon = status.value(statusDaemon, nlohmann::json::object());
    const nlohmann::json peer = status.value(statusPeer, nlohmann::json::object());
    output.line("zorvaned " + printable(daemon.value("Version", "of an older version")));
    output.line("  root        " + printable(root));
    output.line("  up          " + shownTime(daemon.value("UptimeMilliseconds", std::uint64_t{0}) / 1000) + ", pid " +
                std::to_string(daemon.value("Pid", std::int64_t{0})));
    output.line("  containers  " +
                (around.containers ? std::to_string(*around.containers) : "this program may not list them"));
    output.line("  death row   " + (around.deathRow ? shown(*around.deathRow) : "only the daemon's user sees it"));
    if (around.disk)
        output.line("  free disk   " + shownBytes(around.disk->freeBytes) + " of " + shownBytes(around.disk->bytes));
    output.line("  you are     " +
                (peer.value("Known", false) ? printable(peer.value("Identifier", "a program without an identifier"))
                                            : "not known") +
                ", user " + std::to_string(peer.value("EffectiveUserID", std::int64_t{0})) + " (" +
                printable(peer.value("Explanation", "")) + ")");
}

} // namespace

int status(const zorvane::ConnectOptions& connect, const Output& output) {
    const auto answer = zorvane::status(connect);
    if (!answer)
        return output.error(answer.error(), "ask for the status");
    const nlohmann::json status = toJson(*answer);
    const Surroundings around = lookAround(connect);
    if (output.isJson()) {
        nlohmann::json document = documentOf(status, around);
        document["root"] = connect.root;
        output.json(std::move(document));
        return exitDone;
    }
    output.page();
    showHead(output, connect.root, status, around);
    if (const auto* map = std::get_if<zorvane::Map>(&answer->content))
        for (const char* key : {statusPeer, statusCounters}) // 'entitlements show' and 'why' have the others
            if (const auto found = map->find(key); found != map->end())
                output.tree(key, found->second);
    return exitDone;
}

} // namespace zorvanectl
