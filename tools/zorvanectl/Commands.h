// SPDX-License-Identifier: Apache-2.0
// The actions of the tool's commands, each with its options and its exit code.
#pragma once

#include "Output.h"
#include "ProgressDisplay.h"
#include "zorvane/Client.h"

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

namespace zorvanectl {

struct Target {
    /// The system root, which may have users of its own.
    std::string root = "/";
    std::uint64_t containerClass = 0;
    /// Nobody named: the class's usual owner.
    std::optional<std::uint32_t> user;
    std::string identifier;
    bool transient = false;
};

/// Whether what destroys something is done: asked on a terminal, or said beforehand with --yes.
enum class Consent { ask, given };
/// Whether a container's data-protection class, where it cannot be set again after its content went, keeps the content
/// from going.
enum class KeepClass { ifPossible, always };

// ContainerCommands.cc
int create(const zorvane::ConnectOptions& connect, const Output& output, const Target& target);
int lookup(const zorvane::ConnectOptions& connect, const Output& output, const Target& target);
/// Those of a class; all of them are there, or none goes.
int deleteContainers(const zorvane::ConnectOptions& connect, const Output& output, const Target& target,
                     const std::vector<std::string>& identifiers, Consent consent);
int emptyDeathRow(const zorvane::ConnectOptions& connect, const Output& output);

// ListCommands.cc
struct Listing {
    /// Every class and every user, not those of the target.
    bool all = false;
    bool withPath = false;
    bool withSize = false;
    /// "class", "identifier", "user" or "size"; empty: the command's own order.
    std::string order;
};
/// The target names no identifier.
int list(const zorvane::ConnectOptions& connect, const Output& output, const Target& target, const Listing& listing);
/// Bytes of each container and of all together; of one alone where the target names its identifier.
int usage(const zorvane::ConnectOptions& connect, const Output& output, const Target& target, const Listing& listing);

// StatusCommand.cc
int status(const zorvane::ConnectOptions& connect, const Output& output);

// InitCommand.cc
/// Makes a root that the daemon can serve, with that account; empty: the usual one, where it is needed.
int init(const zorvane::ConnectOptions& connect, const Output& output, const std::string& account);

// KnownContainerCommands.cc: a container that is there.
/// Puts the transient container of an identifier in the place of its live one, or makes it that one.
int replace(const zorvane::ConnectOptions& connect, const Output& output, const Target& target, Consent consent);
int wipe(const zorvane::ConnectOptions& connect, const Output& output, const Target& target, KeepClass keep,
         Consent consent);
int metadata(const zorvane::ConnectOptions& connect, const Output& output, const Target& target);
int repair(const zorvane::ConnectOptions& connect, const Output& output, const Target& target);
int regenerate(const zorvane::ConnectOptions& connect, const Output& output, const Target& target);
int infoList(const zorvane::ConnectOptions& connect, const Output& output, const Target& target);
int infoGet(const zorvane::ConnectOptions& connect, const Output& output, const Target& target, const std::string& key);
/// `value` is JSON; what is no JSON is taken as a string.
int infoSet(const zorvane::ConnectOptions& connect, const Output& output, const Target& target, const std::string& key,
            const std::string& value);
int infoUnset(const zorvane::ConnectOptions& connect, const Output& output, const Target& target,
              const std::string& key);

// InstallCommand.cc
struct InstallOptions {
    /// An archive or a directory; "-" is an archive on standard input.
    std::string source;
    ProgressForm progress = ProgressForm::none;
    KeepClass keepClass = KeepClass::ifPossible;
};
/// Makes it the content of a container, in the place of the one that is there.
int install(const zorvane::ConnectOptions& connect, const Output& output, const Target& target,
            const InstallOptions& options, Consent consent);

// ProtectionCommands.cc
struct Protection {
    std::int32_t protectionClass = 0;
    bool thirdParty = false;
    /// Say that a change is pending rather than wait for an unlock.
    bool noWait = false;
    bool failIfLocked = false;
};
int protect(const zorvane::ConnectOptions& connect, const Output& output, const Target& target,
            const Protection& protection);
/// The recorded class, the one on the disk, and a change that is pending.
int protection(const zorvane::ConnectOptions& connect, const Output& output, const Target& target);
/// Shows the device's lock state, and sets it before that when one is given.
int lockState(const zorvane::ConnectOptions& connect, const Output& output, const std::optional<int>& state);

// Check.cc
struct Checking {
    /// Have put right what the daemon can, and say what it cannot.
    bool repair = false;
    /// Say what a repair would do.
    bool dryRun = false;
};
int check(const zorvane::ConnectOptions& connect, const Output& output, const Checking& checking, Consent consent);

// Explain.cc
/// One code, the daemon's or a finding's; empty: all of them.
int explain(const Output& output, const std::string& text);

// RegistryCommands.cc
/// Every file of the identity registry, and whether it counts; what is wrong is a finding.
int registryList(const zorvane::ConnectOptions& connect, const Output& output);
int registryCheck(const Output& output, const std::string& path);
int registryWho(const zorvane::ConnectOptions& connect, const Output& output, const std::string& executable);

// EntitlementCommands.cc
struct Registration {
    std::string identifier;
    /// A file with a JSON object of entitlements; "-" is standard input; empty: none.
    std::string file;
    std::vector<std::string> applicationGroups;
    std::vector<std::string> systemGroups;
    bool systemContainer = false;
    std::string parent;
    bool placeholder = false;
};
int setEntitlements(const zorvane::ConnectOptions& connect, const Output& output, const Registration& registration);
int showEntitlements(const zorvane::ConnectOptions& connect, const Output& output, const std::string& identifier);
/// The identifiers that have some.
int listEntitlements(const zorvane::ConnectOptions& connect, const Output& output);
int clearEntitlements(const zorvane::ConnectOptions& connect, const Output& output, const std::string& identifier);

// GroupCommands.cc. An empty identifier is this program's own.
int groups(const zorvane::ConnectOptions& connect, const Output& output, std::uint32_t user,
           const std::string& identifier);
int systemPath(const zorvane::ConnectOptions& connect, const Output& output, const std::string& identifier);
int systemGroupPath(const zorvane::ConnectOptions& connect, const Output& output, const std::string& group,
                    const std::string& identifier);
/// The holders of an identifier's groups, and what goes when the identifier goes.
int why(const zorvane::ConnectOptions& connect, const Output& output, const std::string& identifier);
/// The holders of a group, application's or system's.
int whyGroup(const zorvane::ConnectOptions& connect, const Output& output, const std::string& group);

} // namespace zorvanectl
