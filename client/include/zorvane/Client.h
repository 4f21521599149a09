// SPDX-License-Identifier: Apache-2.0
// The client of zorvaned, the container manager.
//
//     auto client = zorvane::Client::connect({});
//     if (!client) … client.error().message …
//     auto container = client->createOrLookup(
//         {.containerClass = 2, .identifier = "org.example.notes", .create = true});
//
// A Client is one connection and is used by one thread at a time; programs that call from several threads make several.
// Calls block until the answer is there or their time is over. After a transport error (any kind but daemon) the
// connection is of no more use: connect again. The daemon's identity registry decides what a caller may do. Any call
// may fail with a code that errorText explains; comments name those that a program is likely to act on.
#pragma once

#include "zorvane/Error.h"
#include "zorvane/Value.h"

#include <array>
#include <cstdint>
#include <expected>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace zorvane {

template <typename T>
using Result = std::expected<T, Error>;

struct ConnectOptions {
    /// The system root that the daemon works on.
    std::string root = "/";
    /// For connecting, and for each call; 0 waits for ever. Not given: what the environment's
    /// ZORVANE_TIMEOUT_MILLISECONDS says, else a minute, and for calls that walk a tree of files or wait for an unlock
    /// (emptyDeathRow, wipe, replace, diskUsage, recreateDefaultStructure, setDataProtection) for ever.
    std::optional<std::uint32_t> timeoutMilliseconds = {};
    /// Once this descriptor is readable, whatever waits ends, within about a second: an error of kind timedOut. It
    /// stays the caller's. -1: there is none.
    int interruptDescriptor = -1;
};

/// The user id in a request that stands for the current mobile user.
inline constexpr std::uint32_t currentMobileUser = 1;

/// Number of a class by its name ("Data/Application"), the same as one types it ("data-application"), the beginning of
/// one name alone ("data-app"), or its decimal number (1 to 13).
[[nodiscard]] std::optional<std::uint64_t> containerClassOf(std::string_view nameOrNumber);
/// Names of the classes; index is the number, index 0 is no class.
[[nodiscard]] std::string_view containerClassName(std::uint64_t number);
inline constexpr std::uint64_t containerClassMax = 13;
/// The users that own containers on a root: as its daemon serves them, the usual numbers where none has run since the
/// boot. Each call reads a small file. Any thread.
struct ContainerOwners {
    std::uint32_t installer; // of bundles, 33 unless configured
    std::uint32_t system;    // of the system's containers, 499 unless configured
    std::uint32_t first;     // of the mobile users, 501 to 510 unless configured
    std::uint32_t last;
};
[[nodiscard]] ContainerOwners containerOwners(const std::string& root = "/");
/// The user that owns containers of a class when nobody is named: the installer of bundles, the system's user of its
/// own, else the current one.
[[nodiscard]] std::uint32_t defaultUserOfClass(std::uint64_t number, const std::string& root = "/");

struct Container {
    std::array<std::uint8_t, 16> uuid{}; // the container's identity, not its directory's name
    std::string identifier;
    std::string path;
    /// It was there before this call.
    bool existed = false;
};

struct ListedContainer {
    std::array<std::uint8_t, 16> uuid{};
    std::string identifier;
};

/// The info key under which a container's data-protection class is recorded, an integer; absent means 3.
[[nodiscard]] std::string_view protectionClassInfoKey();

/// 36 characters, upper-case.
[[nodiscard]] std::string uuidText(const std::array<std::uint8_t, 16>& uuid);

class Client {
public:
    /// Connects to the daemon of a root. Fails with the kinds unreachable and timedOut.
    [[nodiscard]] static Result<Client> connect(const ConnectOptions& options);
    Client(Client&&) noexcept;
    Client& operator=(Client&&) noexcept;
    ~Client();

    struct Lookup {
        std::uint64_t containerClass = 0;
        std::uint32_t user = currentMobileUser;
        /// Empty: the caller's own identifier.
        std::string identifier;
        /// Make the container when there is none.
        bool create = false;
        /// One that lasts until it is asked for again, or the next boot.
        bool transient = false;
    };
    /// Code 21: there is none, and it was not to be made.
    [[nodiscard]] Result<Container> createOrLookup(const Lookup& lookup);

    /// One container, as list and createOrLookup name it. Calls about one fail with code 21 when it is not there.
    struct Address {
        std::uint64_t containerClass = 0;
        std::uint32_t user = currentMobileUser;
        std::string identifier;
        std::array<std::uint8_t, 16> uuid{};
    };
    /// Takes containers out of the store; their files go when death row is emptied. A container that is not there is
    /// skipped, and is no error.
    [[nodiscard]] Result<void> stageForDelete(const std::vector<Address>& containers);
    /// The same for the one container of an identifier. Code 21: there is none.
    [[nodiscard]] Result<void> deleteContainer(std::uint64_t containerClass, std::uint32_t user,
                                               const std::string& identifier, bool transient);

    /// Puts the second container in the place of the first, which goes. Without a first one, the second, a transient
    /// one, becomes the live container of its identifier. Code 27: that one exists already.
    [[nodiscard]] Result<void> replace(const std::optional<Address>& old, const Address& fresh);
    /// Empties a data container: path and UUID stay.
    [[nodiscard]] Result<void> wipe(std::uint64_t containerClass, std::uint32_t user, const std::string& identifier);
    /// The same for a plug-in's data (class 4), by a program whose registry entry names that plug-in. Code 55: it does
    /// not.
    [[nodiscard]] Result<void> wipePluginData(std::uint32_t user, const std::string& identifier);

    struct Metadata {
        std::string path;
        bool transient = false;
        Map info;
    };
    [[nodiscard]] Result<Metadata> metadata(const Address& address);
    /// Code 24: there is no such key.
    [[nodiscard]] Result<Value> infoValue(const Address& address, const std::string& key);
    /// Without a value the key is removed.
    [[nodiscard]] Result<void> setInfoValue(const Address& address, const std::string& key,
                                            const std::optional<Value>& value);
    /// Makes the standard subdirectories again.
    [[nodiscard]] Result<void> recreateDefaultStructure(const Address& address);
    /// Gives the directory a new name; the UUID stays.
    [[nodiscard]] Result<void> regenerateDirectoryUUID(const Address& address);
    /// Bytes on the disk.
    [[nodiscard]] Result<std::uint64_t> diskUsage(const Address& address);

    struct ProtectionChange {
        std::uint64_t containerClass = 0;
        std::uint32_t user = currentMobileUser;
        std::string identifier;
        /// 0, 1, 3, or for the system's own programs another; never 2.
        std::int32_t protectionClass = 0;
        /// The container is of no program of the system's own.
        bool thirdParty = false;
        /// Wait for the unlock of a locked device, and try again. The answer comes after that, so the call may take as
        /// long as the device stays locked.
        bool retryIfLocked = false;
    };
    /// Changes the data-protection class of a data container. Codes 38: a class that may not be asked for; 61: the
    /// device is locked; 10, 21: the container was moved or went meanwhile.
    [[nodiscard]] Result<void> setDataProtection(const ProtectionChange& change);

    // Shared containers. An empty identifier is the caller's own; paths are of containers that are made when they are
    // first asked for.
    /// From group identifier to path.
    using GroupPaths = std::map<std::string, std::string>;
    [[nodiscard]] Result<GroupPaths> groupContainerPaths(std::uint32_t user, const std::string& identifier);
    [[nodiscard]] Result<std::vector<std::string>> groupContainerIdentifiers(std::uint32_t user,
                                                                             const std::string& identifier);
    /// Code 55: the identifier is not entitled to one.
    [[nodiscard]] Result<std::string> systemContainerPath(const std::string& identifier);
    /// The containers of the identifier's system groups.
    [[nodiscard]] Result<GroupPaths> systemGroupContainerPaths(const std::string& identifier);
    /// The containers that an identifier shares, or has of the system, in one exchange.
    struct SharedContainers {
        GroupPaths applicationGroups;
        GroupPaths systemGroups;
        /// Nothing where the identifier is not entitled to one.
        std::optional<std::string> systemContainer;
        /// Whether its programs may be given sockets that a service manager opened. Nothing where the daemon is of a
        /// version that does not say.
        std::optional<bool> passedSockets;
    };
    [[nodiscard]] Result<SharedContainers> sharedContainers(std::uint32_t user, const std::string& identifier);
    /// Codes 55: the caller is not entitled to the group; 21: it has no container.
    [[nodiscard]] Result<std::string> systemGroupContainerPath(const std::string& groupIdentifier,
                                                               const std::string& identifier);

    struct Registration {
        std::string identifier;
        /// Without: what is registered for the identifier is removed, with the containers that go with it.
        std::optional<Map> entitlements;
        /// Not empty: the identifier is a child (an extension) of this one.
        std::string parentIdentifier;
        bool placeholder = false;
    };
    /// Replaces what is registered for an identifier.
    [[nodiscard]] Result<void> processEntitlements(const Registration& registration);

    /// In no particular order. The list is asked for in pages: what is made or goes meanwhile may be in it or not.
    [[nodiscard]] Result<std::vector<ListedContainer>> list(std::uint64_t containerClass, std::uint32_t user,
                                                            bool transient);
    /// One page of it, in the order of the identifiers' bytes.
    struct Page {
        std::vector<ListedContainer> containers;
        /// To be asked for after this one; nothing: this was the last.
        std::optional<std::string> next;
    };
    /// `after` is empty for the first page, then what the page before names.
    [[nodiscard]] Result<Page> listPage(std::uint64_t containerClass, std::uint32_t user, bool transient,
                                        const std::string& after);

    /// Deletes what is on death row, and returns when that is done. Other answers of this connection may come before.
    [[nodiscard]] Result<void> emptyDeathRow();

    /// For tests of clients: on an internal build, the daemon ends without an answer as often as this says, and then
    /// answers. Elsewhere nothing happens.
    [[nodiscard]] Result<void> retryTest(std::uint32_t user, std::uint64_t crashes);

    /// The implementation's own.
    class Connection;

private:
    explicit Client(std::unique_ptr<Connection> connection);
    std::unique_ptr<Connection> connection_;
};

/// Whom the daemon takes this program for, and why ("Peer"); for the owner of the root also how it is doing
/// ("Counters"), what is registered ("Entitlements") and who refers to which group ("GroupReferences"). The last two
/// are missing when they are too long for the socket or nest too deep, or the daemon lacks the memory for them;
/// "EntitlementsLeftOut" is then true.
[[nodiscard]] Result<Value> status(const ConnectOptions& options);

} // namespace zorvane
