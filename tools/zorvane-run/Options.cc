// SPDX-License-Identifier: Apache-2.0
#include "Options.h"

#include "Failure.h"
#include "identity/Users.h"

#include <algorithm>
#include <getopt.h>

namespace zorvanerun {

namespace {

constexpr const char* help =
    R"(Usage: zorvane-run [OPTION]... --identifier ID --user USER [--] PROGRAM [ARGUMENT]...

Runs a program as a user in a sandbox that holds the containers of its identifier,
a read-only system, and nothing else of any user. What is missing is made.

  --identifier ID        whose containers: data, groups, system
  --user USER            user id or name that the program runs with; its group has the same number
  --app-group G          this application group, and no other; may repeat
  --system-group G       this system group, and no other; may repeat
  --system-container ID  fail unless ID, which is the identifier, owns a system container
  --read-only DIR        show DIR too, read-only: the program's own files; may repeat
  --setenv NAME=VALUE    put this into the program's environment; may repeat
  --root DIR             system root of the daemon (default /)
  --network none|host    no network but the program's own loopback (default), or the host's
  --bubblewrap FILE      the program that makes the sandbox (default /usr/bin/bwrap)
  --wait                 wait while the daemon keeps the program from being started
  --dry-run              say what would be mounted, run nothing
  --json                 the same, and errors, as JSON
  -h, --help; -V, --version

Without a group named, all those registered for the identifier are there; one that is
named has to be registered ('zorvanectl entitlements set'), since the next boot deletes
containers that nothing registered refers to. The same holds for the system container.
While the data protection of its files is being changed, a program is not started.

The program finds HOME (its data container), TMPDIR (in it), ZORVANE_IDENTIFIER,
ZORVANE_SYSTEM_CONTAINER (a path, where there is one), and ZORVANE_APP_GROUPS and
ZORVANE_SYSTEM_GROUPS (a line for each: group, tab, path). Of the caller's environment
it gets LANG, LANGUAGE, LC_*, TERM and TZ; --setenv gives more. What it tells the
caller's NOTIFY_SOCKET of its own state is passed on; the caller's sockets (LISTEN_FDS)
are passed to it where a registry entry of the identifier allows that.

Examples:
  zorvane-run --identifier org.example.notes --user 501 -- /usr/bin/notes --new
  zorvane-run --identifier org.example.notes --user 501 --read-only /opt/notes \
      --setenv DEBUG=1 -- /opt/notes/bin/notes
  zorvane-run --identifier org.example.notes --user 501 --dry-run -- notes

Exit codes: that of the program, 128+n when signal n ended it; 125 when zorvane-run
failed, 126 when the program cannot be executed, 127 when it is not found. HUP, INT,
QUIT, TERM, USR1 and USR2 are passed on to the program. It needs root; see
zorvane-run(8) for how the daemon gets to know it.
)";

constexpr std::uint32_t rootUser = 0;
constexpr std::uint32_t currentUserPlaceholder = 1;

OptionsEnd usage(const std::string& what) {
    return {.text = what, .exitCode = exitFailure};
}

/// Puts in the user that a program may become; nullopt when there is one.
std::optional<OptionsEnd> findUser(Options& options) {
    const auto root = zor::platform::SystemRoot::open(options.root);
    if (!root)
        return usage(withReason("the root " + options.root + " cannot be opened", root.error()));
    const auto user = zor::platform::userNumberOf(*root, options.userText);
    if (!user)
        return usage(user.error());
    options.user = *user;
    // The largest number is what the kernel takes for "leave it as it is".
    if (*user == rootUser || *user == currentUserPlaceholder || *user == UINT32_MAX)
        return usage("'" + options.userText + "' is no user that a program can be run as");
    return std::nullopt;
}

/// nullptr for what a program may find. The loader's names count in this program's own part of the sandbox, too, which
/// has powers yet; the others are said by this program.
const char* whyNotSet(std::string_view variable) {
    constexpr std::string_view taken[] = {
        "LD_",     "LISTEN_", "WATCHDOG_", "ZORVANE_",       "GLIBC_TUNABLES=", "HOME=",
        "TMPDIR=", "PATH=",   "PWD=",      "NOTIFY_SOCKET=", "GCONV_PATH="};
    const std::string_view name = variable.substr(0, variable.find('='));
    if (name.size() == variable.size() || name.empty() ||
        name.find_first_not_of("ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789_") != name.npos)
        return "it is not of the form NAME=VALUE";
    if (std::ranges::any_of(taken, [&](std::string_view begin) { return variable.starts_with(begin); }))
        return "the loader or zorvane-run itself gives that name a meaning; env(1) in front of the program can set it";
    return nullptr;
}

enum Option : int {
    root = 1,
    identifier,
    user,
    appGroup,
    systemGroup,
    systemContainer,
    readOnly,
    setEnvironment,
    network,
    bubblewrap,
    dryRun,
    wait,
    json
};

constexpr option known[] = {
    {"root", required_argument, nullptr, Option::root},
    {"identifier", required_argument, nullptr, Option::identifier},
    {"user", required_argument, nullptr, Option::user},
    {"app-group", required_argument, nullptr, Option::appGroup},
    {"system-group", required_argument, nullptr, Option::systemGroup},
    {"system-container", required_argument, nullptr, Option::systemContainer},
    {"read-only", required_argument, nullptr, Option::readOnly},
    {"setenv", required_argument, nullptr, Option::setEnvironment},
    {"network", required_argument, nullptr, Option::network},
    {"bubblewrap", required_argument, nullptr, Option::bubblewrap},
    {"dry-run", no_argument, nullptr, Option::dryRun},
    {"wait", no_argument, nullptr, Option::wait},
    {"json", no_argument, nullptr, Option::json},
    {"help", no_argument, nullptr, 'h'},
    {"version", no_argument, nullptr, 'V'},
    {nullptr, 0, nullptr, 0},
};

/// nullopt when the option is taken, else how parsing ends.
std::optional<OptionsEnd> take(int option, const char* value, const char* argument, Options& options) {
    switch (option) {
    case Option::root:
        options.root = value;
        return std::nullopt;
    case Option::identifier:
        options.identifier = value;
        return std::nullopt;
    case Option::user:
        options.userText = value;
        return std::nullopt;
    case Option::appGroup:
        options.applicationGroups.emplace_back(value);
        return std::nullopt;
    case Option::systemGroup:
        options.systemGroups.emplace_back(value);
        return std::nullopt;
    case Option::systemContainer:
        options.systemContainer = value;
        return std::nullopt;
    case Option::readOnly:
        options.readOnly.emplace_back(value);
        return std::nullopt;
    case Option::setEnvironment:
        if (const char* const why = whyNotSet(value))
            return usage("'" + std::string(value) + "' cannot be set: " + why);
        options.environment.emplace_back(value);
        return std::nullopt;
    case Option::network:
        if (const auto network = networkNamed(value)) {
            options.network = *network;
            return std::nullopt;
        }
        return usage("'" + std::string(value) + "' is no network: there are none and host");
    case Option::bubblewrap:
        options.bubblewrap = value;
        return std::nullopt;
    case Option::dryRun:
        options.dryRun = true;
        return std::nullopt;
    case Option::wait:
        options.wait = true;
        return std::nullopt;
    case Option::json:
        options.json = true;
        return std::nullopt;
    case 'h':
        return OptionsEnd{.text = help, .exitCode = exitDone};
    case 'V':
        return OptionsEnd{.text = "zorvane-run " ZORVANE_VERSION "\n", .exitCode = exitDone};
    case ':':
        return usage("option '" + std::string(argument) + "' needs a value");
    default:
        return usage("'" + std::string(argument) + "' is no option");
    }
}

} // namespace

const char* networkName(Network network) {
    return network == Network::host ? "host" : "none";
}

std::optional<Network> networkNamed(std::string_view name) {
    for (const Network network : {Network::none, Network::host})
        if (name == networkName(network))
            return network;
    return std::nullopt;
}

std::expected<Options, OptionsEnd> parseOptions(int argumentCount, char** arguments) {
    Options options;
    opterr = 0;
    optind = 0; // glibc: also forget where an earlier call stopped inside an argument
    // The plus: the first word that is no option is the program, and what follows is the program's.
    for (int next = 0; (next = ::getopt_long(argumentCount, arguments, "+:hV", known, nullptr)) != -1;)
        if (auto end = take(next, optarg, arguments[optind - 1], options))
            return std::unexpected(std::move(*end));
    options.command.assign(arguments + optind, arguments + argumentCount);
    if (argumentCount == 2 && options.command == std::vector<std::string>{"help"})
        return std::unexpected(OptionsEnd{.text = help, .exitCode = exitDone});
    if (options.identifier.empty())
        return std::unexpected(usage("--identifier is missing, or empty"));
    if (options.userText.empty())
        return std::unexpected(usage("--user is missing, or empty"));
    if (options.command.empty() || options.command.front().empty())
        return std::unexpected(usage("no program is named"));
    if (auto end = findUser(options))
        return std::unexpected(std::move(*end));
    return options;
}

} // namespace zorvanerun
