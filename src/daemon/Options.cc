// SPDX-License-Identifier: Apache-2.0
#include "daemon/Options.h"

#include <charconv>
#include <cstring>
#include <getopt.h>

namespace zor {

namespace {

constexpr int usageExitStatus = 2;

constexpr const char* help =
    R"(Usage: zorvaned [--root DIR] [--foreground] [--log-level N] [--forget-boot]
                [--containers-per-user N]

Keeps the containers of every application, extension and service of a device.

  --root DIR       work below DIR instead of / (for tests and demonstrations);
                   DIR must hold etc/passwd, the home directories named there,
                   private/var/brevad and tmp: 'zorvanectl --root DIR init'
                   makes what is missing
  --foreground     write the log to standard error, too
  --log-level N    3 errors, 5 notable events (the default), 7 debug traces
  --forget-boot    do the work of a first launch after a boot once more
  --containers-per-user N
                   containers that one user may have before clients other than
                   the owner of the root can make no more; 100000 by default
  -h, --help       show this text
  -V, --version    show the version

Set ZORVANE_DURABILITY=none to leave out syncs on a root that may be thrown away;
it is ignored on /. Clients find the daemon at DIR/run/zorvane/com.veltra.zorvaned;
see zorvaned(8) and zorvanectl(1).
)";

OptionsEnd usage(const std::string& what) {
    return {"zorvaned: " + what + "\nTry 'zorvaned --help'.\n", usageExitStatus};
}

bool parseLevel(const char* text, int& level) {
    if (std::strlen(text) != 1 || text[0] < '0' || text[0] > '7')
        return false;
    level = text[0] - '0';
    return true;
}

bool parseCount(const char* text, std::optional<std::size_t>& count) {
    const char* end = text + std::strlen(text);
    std::size_t number = 0;
    const auto [parsedTo, failure] = std::from_chars(text, end, number);
    if (failure != std::errc() || parsedTo != end)
        return false;
    count = number;
    return true;
}

} // namespace

std::expected<DaemonOptions, OptionsEnd> parseDaemonOptions(int argumentCount, char** arguments) {
    static constexpr option known[] = {
        {"root", required_argument, nullptr, 'r'},
        {"foreground", no_argument, nullptr, 'f'},
        {"log-level", required_argument, nullptr, 'l'},
        {"forget-boot", no_argument, nullptr, 'b'},
        {"containers-per-user", required_argument, nullptr, 'c'},
        {"help", no_argument, nullptr, 'h'},
        {"version", no_argument, nullptr, 'V'},
        {nullptr, 0, nullptr, 0},
    };
    DaemonOptions options;
    opterr = 0;
    optind = 0; // glibc: also forget where an earlier call stopped inside an argument
    for (;;) {
        const int next = ::getopt_long(argumentCount, arguments, ":hV", known, nullptr);
        switch (next) {
        case -1:
            if (optind < argumentCount && std::strcmp(arguments[optind], "help") == 0)
                return std::unexpected(OptionsEnd{help, 0});
            if (optind < argumentCount)
                return std::unexpected(usage(std::string("unexpected argument '") + arguments[optind] + "'"));
            return options;
        case 'r':
            options.rootDirectory = optarg;
            break;
        case 'f':
            options.foreground = true;
            break;
        case 'l':
            if (!parseLevel(optarg, options.logLevel))
                return std::unexpected(usage(std::string("log level '") + optarg + "' is not a number from 0 to 7"));
            break;
        case 'c':
            if (!parseCount(optarg, options.containersPerUser))
                return std::unexpected(usage(std::string("'") + optarg + "' is no number of containers"));
            break;
        case 'b':
            options.forgetBoot = true;
            break;
        case 'h':
            return std::unexpected(OptionsEnd{help, 0});
        case 'V':
            return std::unexpected(OptionsEnd{"zorvaned " ZORVANE_VERSION "\n", 0});
        case ':':
            return std::unexpected(usage(std::string("option '") + arguments[optind - 1] + "' needs a value"));
        default:
            // A short one is told by its letter: it may stand among others.
            return std::unexpected(
                usage("unknown option '" +
                      (optopt ? std::string{'-', static_cast<char>(optopt)} : arguments[optind - 1]) + "'"));
        }
    }
}

} // namespace zor
