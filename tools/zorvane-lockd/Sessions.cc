// SPDX-License-Identifier: Apache-2.0
#include "Sessions.h"

#include <algorithm>
#include <iterator>
#include <memory>
#include <optional>
#include <string_view>
#include <utility>
#include <vector>

namespace zorvanelockd {

namespace {

constexpr const char* service = "org.freedesktop.login1";
constexpr const char* managerPath = "/org/freedesktop/login1";
constexpr const char* managerInterface = "org.freedesktop.login1.Manager";
constexpr const char* sessionInterface = "org.freedesktop.login1.Session";
constexpr const char* properties = "org.freedesktop.DBus.Properties";
constexpr const char* busName = "org.freedesktop.DBus";

struct Unref {
    void operator()(sd_bus_message* message) const { sd_bus_message_unref(message); }
};
using Message = std::unique_ptr<sd_bus_message, Unref>;

/// Asks one session. A session that has ended has no properties; where a property cannot be had for another reason, the
/// answers say nothing.
class Question {
public:
    Question(sd_bus* bus, const std::string& path) : bus_(bus), path_(path) {}

    /// A person's; newer services tell those apart that need less of the system, or begin before it is up.
    bool isUsers() {
        constexpr std::string_view kinds[] = {"user", "user-early", "user-light", "user-early-light"};
        return std::ranges::find(kinds, text("Class")) != std::end(kinds);
    }
    bool isClosing() { return text("State") == "closing"; }
    bool hasSeat() {
        const Message reply = property("Seat", "(so)");
        const char* seat = nullptr;
        const char* seatPath = nullptr;
        return reply && sd_bus_message_read(reply.get(), "(so)", &seat, &seatPath) > 0 && *seat != '\0';
    }
    std::optional<bool> lockedHint() {
        const Message reply = property("LockedHint", "b");
        int hint = 0;
        return reply && sd_bus_message_read(reply.get(), "b", &hint) > 0 ? std::optional(hint != 0) : std::nullopt;
    }
    [[nodiscard]] bool isAnswered() const { return isAnswered_; }

private:
    Message property(const char* name, const char* type) {
        if (!isAnswered_)
            return nullptr; // a service that is slow is not waited for four times
        sd_bus_error error = SD_BUS_ERROR_NULL;
        sd_bus_message* reply = nullptr;
        const int failure =
            sd_bus_get_property(bus_, service, path_.c_str(), sessionInterface, name, &error, &reply, type);
        isAnswered_ = failure >= 0 || sd_bus_error_has_name(&error, SD_BUS_ERROR_UNKNOWN_OBJECT) != 0 ||
                      sd_bus_error_has_name(&error, "org.freedesktop.login1.NoSuchSession") != 0;
        sd_bus_error_free(&error);
        return Message(reply);
    }
    std::string text(const char* name) {
        const Message reply = property(name, "s");
        const char* text = nullptr;
        return reply && sd_bus_message_read(reply.get(), "s", &text) > 0 ? text : "";
    }

    sd_bus* const bus_;
    const std::string& path_;
    bool isAnswered_ = true;
};

} // namespace

template <int (Sessions::*handle)(sd_bus_message*)>
int Sessions::handler(sd_bus_message* message, void* sessions, sd_bus_error*) {
    return (static_cast<Sessions*>(sessions)->*handle)(message);
}

int Sessions::follow() {
    const struct {
        const char* sender;
        const char* path;
        const char* interface;
        const char* member;
        sd_bus_message_handler_t handle;
    } matches[] = {
        {service, managerPath, managerInterface, "SessionNew", handler<&Sessions::added>},
        {service, managerPath, managerInterface, "SessionRemoved", handler<&Sessions::removed>},
        {service, nullptr, sessionInterface, "Lock", handler<&Sessions::lockSaid>},
        {service, nullptr, sessionInterface, "Unlock", handler<&Sessions::lockSaid>},
        {service, nullptr, properties, "PropertiesChanged", handler<&Sessions::propertiesChanged>},
        {busName, "/org/freedesktop/DBus", busName, "NameOwnerChanged", handler<&Sessions::ownerChanged>},
    };
    for (const auto& match : matches)
        if (const int failure = sd_bus_match_signal(bus_, nullptr, match.sender, match.path, match.interface,
                                                    match.member, match.handle, this);
            failure < 0)
            return failure;
    begin();
    return 0;
}

void Sessions::begin() {
    owner_.clear();
    sd_bus_message* reply = nullptr;
    const char* owner = nullptr;
    if (sd_bus_call_method(bus_, busName, "/org/freedesktop/DBus", busName, "GetNameOwner", nullptr, &reply, "s",
                           service) >= 0 &&
        sd_bus_message_read(reply, "s", &owner) > 0)
        owner_ = owner;
    sd_bus_message_unref(reply);
    reply = nullptr;
    // As long as nobody says what is so, what was told last holds: a service that has died unlocks nothing.
    if (!owner_.empty() && sd_bus_call_method(bus_, service, managerPath, managerInterface, "ListSessions", nullptr,
                                              &reply, nullptr) >= 0) {
        const auto before = std::exchange(sessions_, {});
        const char* path = nullptr;
        (void)sd_bus_message_enter_container(reply, 'a', "(susso)");
        while (sd_bus_message_read(reply, "(susso)", nullptr, nullptr, nullptr, nullptr, &path) > 0) {
            add(path);
            const auto now = sessions_.find(path);
            const auto then = before.find(path);
            if (now == sessions_.end() || then == before.end())
                continue;
            // The service does not remember a signal, and this one remembers what cannot be asked.
            if ((now->second == Lock::open && then->second == Lock::bySignal) || now->second == Lock::unknown)
                now->second = then->second;
        }
        tell();
    }
    sd_bus_message_unref(reply);
}

void Sessions::add(const std::string& path) {
    Question question(bus_, path);
    const bool counts = question.isUsers() && question.hasSeat() && !question.isClosing();
    const auto hint = counts ? question.lockedHint() : std::nullopt;
    if (!question.isAnswered())
        sessions_.try_emplace(path, Lock::unknown);
    else if (hint)
        sessions_[path] = *hint ? Lock::byHint : Lock::open;
    else
        sessions_.erase(path);
}

void Sessions::askUnknownAgain() {
    std::vector<std::string> paths;
    for (const auto& [path, lock] : sessions_)
        if (lock == Lock::unknown)
            paths.push_back(path);
    for (const std::string& path : paths)
        add(path);
}

void Sessions::forgetClosing() {
    std::erase_if(sessions_, [&](const auto& session) {
        return session.second == Lock::open && Question(bus_, session.first).isClosing();
    });
}

void Sessions::tell() {
    askUnknownAgain();
    forgetClosing();
    changed_(!sessions_.empty() &&
             std::ranges::all_of(sessions_, [](const auto& session) { return session.second != Lock::open; }));
}

bool Sessions::isServices(sd_bus_message* message) const {
    const char* const sender = sd_bus_message_get_sender(message);
    return sender && !owner_.empty() && owner_ == sender;
}

int Sessions::added(sd_bus_message* message) {
    const char* path = nullptr;
    if (isServices(message) && sd_bus_message_read(message, "so", nullptr, &path) > 0) {
        add(path);
        tell();
    }
    return 0;
}

int Sessions::removed(sd_bus_message* message) {
    const char* path = nullptr;
    if (isServices(message) && sd_bus_message_read(message, "so", nullptr, &path) > 0) {
        sessions_.erase(path);
        tell();
    }
    return 0;
}

int Sessions::lockSaid(sd_bus_message* message) {
    const auto session = sessions_.find(sd_bus_message_get_path(message));
    if (isServices(message) && session != sessions_.end()) {
        session->second = std::string_view(sd_bus_message_get_member(message)) == "Lock" ? Lock::bySignal : Lock::open;
        tell();
    }
    return 0;
}

int Sessions::propertiesChanged(sd_bus_message* message) {
    if (!isServices(message))
        return 0;
    const auto session = sessions_.find(sd_bus_message_get_path(message));
    if (session == sessions_.end()) {
        tell(); // another's screen may be shown because a session is closing
        return 0;
    }
    // Other properties change often, and say nothing of a lock that was only signalled.
    const char* interface = nullptr;
    const char* name = nullptr;
    if (sd_bus_message_read(message, "s", &interface) <= 0 || std::string_view(interface) != sessionInterface ||
        sd_bus_message_enter_container(message, 'a', "{sv}") <= 0)
        return 0;
    while (sd_bus_message_enter_container(message, 'e', "sv") > 0) {
        int hint = 0;
        if (sd_bus_message_read(message, "s", &name) > 0 && std::string_view(name) == "LockedHint" &&
            sd_bus_message_read(message, "v", "b", &hint) > 0)
            session->second = hint != 0 ? Lock::byHint : Lock::open;
        else
            (void)sd_bus_message_skip(message, "v");
        (void)sd_bus_message_exit_container(message);
    }
    tell();
    return 0;
}

int Sessions::ownerChanged(sd_bus_message* message) {
    const char* const sender = sd_bus_message_get_sender(message);
    const char* name = nullptr;
    if (sender && std::string_view(sender) == busName && sd_bus_message_read(message, "s", &name) > 0 &&
        std::string_view(name) == service)
        begin();
    return 0;
}

} // namespace zorvanelockd
