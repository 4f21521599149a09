// SPDX-License-Identifier: Apache-2.0
// The sessions at the device's seats, and whether all of them are locked, as the login service (logind) says.
//
// A session counts when it is a user's, has a seat and is not closing: a remote one cannot be locked, and nobody sits
// at one whose user has logged out and left a process behind; either would hold the device open.
// It is locked by the service's Lock signal and by its LockedHint, which the desktop sets, and unlocked by Unlock and
// by the hint going; whichever is heard last counts. The service remembers hints and forgets signals: a session that a
// signal alone has locked stays so when the service is started anew. Anybody may send a signal to this connection, so
// one counts only when it comes from the connection that owns the service's name. One thread: that of the bus.
#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <string>
#include <systemd/sd-bus.h>

namespace zorvanelockd {

class Sessions {
public:
    /// `changed` is told the state after each event that may have changed it, and when the service has been asked.
    using Changed = std::function<void(bool isLocked)>;
    Sessions(sd_bus* bus, Changed changed) : bus_(bus), changed_(std::move(changed)) {}
    Sessions(const Sessions&) = delete;
    Sessions& operator=(const Sessions&) = delete;
    /// Once, before the bus is processed. 0, or a negative errno.
    int follow();

private:
    template <int (Sessions::*handle)(sd_bus_message*)>
    static int handler(sd_bus_message* message, void* sessions, sd_bus_error*);
    int added(sd_bus_message* message);
    int removed(sd_bus_message* message);
    int lockSaid(sd_bus_message* message);
    int propertiesChanged(sd_bus_message* message);
    int ownerChanged(sd_bus_message* message);

    /// Asks the service for all that there is. One that does not answer leaves everything as it was.
    void begin();
    /// One that cannot be asked stays as it is known.
    void add(const std::string& path);
    void askUnknownAgain();
    /// Leaves out the open sessions that are closing: the service does not say when they begin to.
    void forgetClosing();
    void tell();
    [[nodiscard]] bool isServices(sd_bus_message* message) const;

    sd_bus* const bus_;
    const Changed changed_;
    /// The connection that owns the service's name; empty while nobody does.
    std::string owner_;
    /// One that could not be asked holds nothing open: it may be locked.
    enum class Lock : std::uint8_t { open, bySignal, byHint, unknown };
    /// By the sessions' object paths.
    std::map<std::string, Lock> sessions_;
};

} // namespace zorvanelockd
