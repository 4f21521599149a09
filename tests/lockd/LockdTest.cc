// SPDX-License-Identifier: Apache-2.0
#include "process/Program.h"
#include "support/FileTree.h"
#include "support/Files.h"

#include <gtest/gtest.h>

#include <chrono>
#include <csignal>
#include <cstdlib>
#include <filesystem>
#include <systemd/sd-bus.h>
#include <thread>
#include <unistd.h>

namespace zor::whole {
namespace {

constexpr const char* service = "org.freedesktop.login1";
constexpr const char* managerPath = "/org/freedesktop/login1";
constexpr const char* sessionInterface = "org.freedesktop.login1.Session";
constexpr auto patience = std::chrono::seconds(20);

struct Session {
    const char* kind = "user";
    const char* seat = "seat0";
    bool hint = false;
    const char* state = "active";
};

/// A login service's answers and signals, on a bus of the test's own.
class LoginService {
public:
    explicit LoginService(const std::string& address) : bus_(connected(address)) {
        sd_bus_add_object_vtable(bus_, nullptr, managerPath, "org.freedesktop.login1.Manager", managerTable, this);
        sd_bus_add_fallback_vtable(bus_, nullptr, "/org/freedesktop/login1/session", sessionInterface, sessionTable,
                                   find, this);
    }
    ~LoginService() { sd_bus_flush_close_unref(bus_); }
    LoginService(const LoginService&) = delete;
    LoginService& operator=(const LoginService&) = delete;

    static sd_bus* connected(const std::string& address) {
        sd_bus* bus = nullptr;
        EXPECT_GE(sd_bus_new(&bus), 0);
        EXPECT_GE(sd_bus_set_address(bus, address.c_str()), 0);
        EXPECT_GE(sd_bus_set_bus_client(bus, 1), 0);
        EXPECT_GE(sd_bus_start(bus), 0);
        return bus;
    }
    static std::string path(const std::string& name) { return std::string(managerPath) + "/session/" + name; }

    void own() { EXPECT_GE(sd_bus_request_name(bus_, service, 0), 0); }
    void leave() { EXPECT_GE(sd_bus_release_name(bus_, service), 0); }
    void begin(const std::string& name, const Session& session) {
        sessions[path(name)] = session;
        say("SessionNew", name);
    }
    void end(const std::string& name) {
        sessions.erase(path(name));
        say("SessionRemoved", name);
    }
    void signal(const std::string& name, const char* member, const std::string& to = {}) const {
        sd_bus_message* message = nullptr;
        sd_bus_message_new_signal(bus_, &message, path(name).c_str(), sessionInterface, member);
        EXPECT_GE(sd_bus_send_to(bus_, message, to.empty() ? nullptr : to.c_str(), nullptr), 0);
        sd_bus_message_unref(message);
        sd_bus_flush(bus_);
    }
    void hint(const std::string& name, bool locked) {
        sessions.at(path(name)).hint = locked;
        sd_bus_emit_properties_changed(bus_, path(name).c_str(), sessionInterface, "LockedHint", nullptr);
    }
    /// Its user has gone, and left a process behind. The service tells no more than that another screen is shown.
    void close(const std::string& name) {
        sessions.at(path(name)).state = "closing";
        sd_bus_emit_properties_changed(bus_, path(name).c_str(), sessionInterface, "Active", nullptr);
    }
    /// Answers for as long as `isOver` says no. False: it never said yes.
    bool serve(const std::function<bool()>& isOver, std::chrono::milliseconds time = patience) const {
        for (const auto end = std::chrono::steady_clock::now() + time; !isOver();) {
            if (std::chrono::steady_clock::now() > end)
                return false;
            if (sd_bus_process(bus_, nullptr) == 0)
                sd_bus_wait(bus_, 5'000);
        }
        return true;
    }

    std::map<std::string, Session> sessions;
    /// Has no answer to questions about a session.
    static inline bool isBusy = false;
    /// The connection that asked last.
    std::string asker;

private:
    void say(const char* member, const std::string& name) const {
        sd_bus_emit_signal(bus_, managerPath, "org.freedesktop.login1.Manager", member, "so", name.c_str(),
                           path(name).c_str());
    }
    static int list(sd_bus_message* call, void* self, sd_bus_error*) {
        static_cast<LoginService*>(self)->asker = sd_bus_message_get_sender(call);
        sd_bus_message* reply = nullptr;
        sd_bus_message_new_method_return(call, &reply);
        sd_bus_message_open_container(reply, 'a', "(susso)");
        for (const auto& [path, session] : static_cast<LoginService*>(self)->sessions)
            sd_bus_message_append(reply, "(susso)", "1", 501, "ann", session.seat, path.c_str());
        sd_bus_message_close_container(reply);
        const int sent = sd_bus_send(nullptr, reply, nullptr);
        sd_bus_message_unref(reply);
        return sent;
    }
    static int find(sd_bus*, const char* path, const char*, void* self, void** found, sd_bus_error*) {
        auto& sessions = static_cast<LoginService*>(self)->sessions;
        const auto session = sessions.find(path);
        *found = session == sessions.end() ? nullptr : &session->second;
        return session == sessions.end() ? 0 : 1;
    }
    static int get(sd_bus*, const char*, const char*, const char* property, sd_bus_message* reply, void* found,
                   sd_bus_error* error) {
        if (isBusy)
            return sd_bus_error_set(error, SD_BUS_ERROR_LIMITS_EXCEEDED, "busy");
        const auto& session = *static_cast<Session*>(found);
        if (std::string_view(property) == "Class")
            return sd_bus_message_append(reply, "s", session.kind);
        if (std::string_view(property) == "Seat")
            return sd_bus_message_append(reply, "(so)", session.seat, "/seat");
        if (std::string_view(property) == "State")
            return sd_bus_message_append(reply, "s", session.state);
        const bool active = session.state == std::string_view("active");
        return sd_bus_message_append(reply, "b", std::string_view(property) == "Active" ? active : session.hint);
    }
    static const sd_bus_vtable managerTable[];
    static const sd_bus_vtable sessionTable[];
    sd_bus* const bus_;
};

const sd_bus_vtable LoginService::managerTable[] = {
    SD_BUS_VTABLE_START(0), SD_BUS_METHOD("ListSessions", nullptr, "a(susso)", list, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_SIGNAL("SessionNew", "so", 0), SD_BUS_SIGNAL("SessionRemoved", "so", 0), SD_BUS_VTABLE_END};
const sd_bus_vtable LoginService::sessionTable[] = {
    SD_BUS_VTABLE_START(0),
    SD_BUS_PROPERTY("Class", "s", get, 0, SD_BUS_VTABLE_PROPERTY_CONST),
    SD_BUS_PROPERTY("Seat", "(so)", get, 0, SD_BUS_VTABLE_PROPERTY_CONST),
    SD_BUS_PROPERTY("State", "s", get, 0, 0),
    SD_BUS_PROPERTY("Active", "b", get, 0, SD_BUS_VTABLE_PROPERTY_EMITS_CHANGE),
    SD_BUS_PROPERTY("LockedHint", "b", get, 0, SD_BUS_VTABLE_PROPERTY_EMITS_CHANGE),
    SD_BUS_SIGNAL("Lock", "", 0),
    SD_BUS_SIGNAL("Unlock", "", 0),
    SD_BUS_VTABLE_END};

// Goal: the lock state is what the login service says of the sessions at the seats, whoever else talks on the bus, and
// is right again after either side was started anew. Method: steps of a service of the test's own on a real message
// bus.
TEST(Lockd, TellsWhatTheLoginServiceSays) {
    if (::access("/usr/bin/dbus-daemon", X_OK) != 0)
        GTEST_SKIP() << "there is no dbus-daemon";
    const support::TemporaryDirectory place("/tmp");
    const std::string address = "unix:path=" + place.path() + "/bus";
    const Program bus({"/usr/bin/dbus-daemon", "--session", "--nofork", "--nopidfile", "--address=" + address});
    for (int tries = 0; tries < 500 && !std::filesystem::exists(place.path() + "/bus"); ++tries)
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    const std::string state = place.path() + "/run/zorvane/lockstate";
    support::writeFile(state, "1\n");
    LoginService login(address);
    LoginService hostile(address);
    std::optional<Program> lockd;
    const auto start = [&] {
        lockd.emplace(std::vector<std::string>{"/usr/bin/env", "DBUS_SYSTEM_BUS_ADDRESS=" + address,
                                               programPath("zorvane-lockd"), "--root", place.path()});
    };
    const auto staysLocked = [&] {
        return !login.serve([&] { return support::readFile(state) != "1\n"; }, std::chrono::milliseconds(300));
    };
    login.own();
    // Each step ends in a state that is not the one before, so that it is waited for.
    const struct {
        const char* what;
        std::function<void()> act;
        const char* state;
    } steps[] = {
        {"nobody is there", start, "0\n"},
        {"a session that is locked begins", [&] { login.begin("a", {.hint = true}); }, "1\n"},
        {"one that has no seat, and one of the greeter, hold nothing open",
         [&] {
             login.begin("b", {.seat = ""});
             login.begin("c", {.kind = "greeter"});
             login.signal("a", "Unlock");
         },
         "0\n"},
        {"a signal locks", [&] { login.signal("a", "Lock"); }, "1\n"},
        {"a second session that is open", [&] { login.begin("d", {}); }, "0\n"},
        {"its hint locks", [&] { login.hint("d", true); }, "1\n"},
        {"others cannot unlock, the service can",
         [&] {
             hostile.signal("a", "Unlock", login.asker);
             login.signal("d", "Unlock");
         },
         "0\n"},
        {"the open one ends, and the other is still locked", [&] { login.end("d"); }, "1\n"},
        {"a user switch: another logs in", [&] { login.begin("e", {.kind = "user-light"}); }, "0\n"},
        {"and out again, leaving a process", [&] { login.close("e"); }, "1\n"},
        {"the service goes, which unlocks nothing, also where others say so; it comes back without an answer, then "
         "having forgotten a signal",
         [&] {
             login.leave();
             hostile.signal("a", "Unlock", login.asker);
             EXPECT_TRUE(staysLocked());
             login.sessions.at(LoginService::path("a")).hint = false;
             for (const bool busy : {true, false}) {
                 login.isBusy = busy;
                 login.own();
                 EXPECT_TRUE(staysLocked());
                 if (busy)
                     login.leave();
             }
             login.signal("a", "Unlock");
         },
         "0\n"},
        {"started anew after a kill",
         [&] {
             lockd->signal(SIGKILL);
             login.sessions.at(LoginService::path("a")).hint = true;
             start();
         },
         "1\n"},
    };
    for (const auto& step : steps) {
        SCOPED_TRACE(step.what);
        step.act();
        ASSERT_TRUE(login.serve([&] { return support::readFile(state) == step.state; })) << lockd->said();
    }
}

} // namespace
} // namespace zor::whole
