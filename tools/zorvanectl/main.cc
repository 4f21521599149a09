// SPDX-License-Identifier: Apache-2.0
// zorvanectl: the command line of the container manager. What it asks of the daemon goes through
// the public client library.
#include "Commands.h"
#include "Output.h"
#include "os/FileDescriptor.h"

#include <CLI/CLI.hpp>
#include <algorithm>
#include <csignal>
#include <functional>
#include <unistd.h>

namespace {

using namespace zorvanectl;

constexpr const char* jsonOption = "--json";

constexpr const char* footer = R"(
Examples:
  zorvanectl create org.example.notes --class data-app
  zorvanectl lookup org.example.notes --class 2 --user 501 --json
  zorvanectl list --class Bundle/Application
  zorvanectl install org.example.notes --class bundle-app notes.tar.zst
  zorvanectl delete org.example.notes org.example.maps --class data-app
  zorvanectl entitlements set org.example.notes --app-group group.org.example
  zorvanectl why org.example.notes
  zorvanectl protect org.example.notes 1 --class data-app --third-party
  zorvanectl check --repair --dry-run
  zorvanectl status

Classes, by number, name, or the beginning of one name in lower case (data-app):
   1 Bundle/Application    2 Data/Application      3 Bundle/KolvexPlugin
   4 Data/KolvexPlugin     5 Bundle/VPNPlugin      6 Data/VPNPlugin
   7 Shared/AppGroup       8 Bundle/Framework      9 Data/IpsiService
  10 Data/InternalDaemon  11 Data/TempDir         12 Data/System
  13 Shared/SystemGroup

Exit codes: 0 done, 1 the daemon answered with an error, 2 usage,
3 the daemon cannot be reached or does not answer this program, 4 a check found something,
5 something failed on this side: an archive that is refused, a full disk, a root that check cannot look at.)";

struct Arguments {
    zorvane::ConnectOptions connect;
    bool json = false;
    std::string className;
    std::uint32_t user = 0;
    Target target;
    std::vector<std::string> identifiers;
    std::string key;
    std::string value;
    bool yes = false;
    std::string group;
    Registration registration;
    Protection protection;
    std::optional<int> lockState;
    std::string code;
    Checking checking;
    InstallOptions install;
    std::string progress;
};

/// Accepts what containerClassOf knows, with an error that lists nothing twice: --help does.
std::string checkClass(const std::string& text) {
    return zorvane::containerClassOf(text) ? "" : "'" + text + "' is no class; see zorvanectl --help";
}

void addClassAndUser(CLI::App& command, Arguments& arguments) {
    command.add_option("-c,--class", arguments.className, "Class, by name or number")
        ->required()
        ->check(CLI::Validator(checkClass, "CLASS"));
    command.add_option("-u,--user", arguments.user,
                       "User id; 1 is the current mobile user. Without it, the class's usual owner");
}

void addTargetOptions(CLI::App& command, Arguments& arguments) {
    addClassAndUser(command, arguments);
    command.add_flag("--transient", arguments.target.transient,
                     "A container that lasts until it is asked for again, or the next boot");
}

void finishTarget(const CLI::App& command, Arguments& arguments) {
    arguments.target.containerClass = zorvane::containerClassOf(arguments.className).value_or(0);
    if (command.count("--user") > 0)
        arguments.target.user = arguments.user;
}

Consent consentOf(const Arguments& arguments) {
    return arguments.yes ? Consent::given : Consent::ask;
}

/// What the command line asks for, to be done once it is parsed as a whole.
using Action = std::function<int(const Output&)>;
using Run = int (*)(const Arguments&, const Output&);

CLI::App* addCommand(CLI::App& above, Arguments& arguments, Action& action, const char* name, const char* help,
                     Run run) {
    CLI::App* command = above.add_subcommand(name, help);
    command->callback([&arguments, &action, command, run] {
        if (command->get_option_no_throw("--class"))
            finishTarget(*command, arguments);
        action = [&arguments, run](const Output& output) { return run(arguments, output); };
    });
    return command;
}

void addContainerCommands(CLI::App& app, Arguments& arguments, Action& action) {
    const auto make = [&](const char* name, const char* help, Run run) {
        return addCommand(app, arguments, action, name, help, run);
    };
    CLI::App* create =
        make("create", "Make a container, or find the one that is there",
             [](const Arguments& a, const Output& o) { return zorvanectl::create(a.connect, o, a.target); });
    CLI::App* lookup = make("lookup", "Find a container", [](const Arguments& a, const Output& o) {
        return zorvanectl::lookup(a.connect, o, a.target);
    });
    for (CLI::App* command : {create, lookup})
        command->add_option("identifier", arguments.target.identifier, "Identifier; without it, this program's own");
    CLI::App* list = make("list", "List the containers of a class",
                          [](const Arguments& a, const Output& o) { return zorvanectl::list(a.connect, o, a.target); });
    CLI::App* remove = make(
        "delete", "Delete containers of a class: all those named, or none", [](const Arguments& a, const Output& o) {
            return zorvanectl::deleteContainers(a.connect, o, a.target, a.identifiers, consentOf(a));
        });
    remove->add_option("identifiers", arguments.identifiers, "Identifiers")->required();
    remove->add_flag("-y,--yes", arguments.yes, "Do not ask");
    for (CLI::App* command : {create, lookup, list, remove})
        addTargetOptions(*command, arguments);
    make("empty-death-row", "Delete what waits for deletion, and wait for it",
         [](const Arguments& a, const Output& o) { return zorvanectl::emptyDeathRow(a.connect, o); });
    make("explain", "Say what a code of the daemon's or of a finding means, and what to do; without one, list them",
         [](const Arguments& a, const Output& o) { return zorvanectl::explain(o, a.code); })
        ->add_option("code", arguments.code, "The number, or the word");
    CLI::App* check = make(
        "check", "Judge the store as it lies on the disk; needs no daemon",
        [](const Arguments& a, const Output& o) { return zorvanectl::check(a.connect, o, a.checking, consentOf(a)); });
    CLI::Option* repair = check->add_flag(
        "--repair", arguments.checking.repair,
        "Have the daemon put right what it can; asks first, for all its steps, where one of them deletes");
    check->add_flag("--dry-run", arguments.checking.dryRun, "Only say what a repair would do")->needs(repair);
    check->add_flag("-y,--yes", arguments.yes, "Do not ask");
    make("status", "Show whom the daemon takes this program for, and how it is doing",
         [](const Arguments& a, const Output& o) { return zorvanectl::status(a.connect, o); });
}

void addKnownContainerCommands(CLI::App& app, Arguments& arguments, Action& action) {
    const auto make = [&](CLI::App& above, const char* name, const char* help, Run run,
                          bool identifierRequired = true) {
        CLI::App* command = addCommand(above, arguments, action, name, help, run);
        command->add_option("identifier", arguments.target.identifier, "Identifier")->required(identifierRequired);
        addTargetOptions(*command, arguments);
        return command;
    };
    CLI::App* replace = make(
        app, "replace", "Put an identifier's transient container in the place of its live one",
        [](const Arguments& a, const Output& o) { return zorvanectl::replace(a.connect, o, a.target, consentOf(a)); });
    CLI::App* wipe =
        make(app, "wipe", "Empty a data container; its path and UUID stay", [](const Arguments& a, const Output& o) {
            return zorvanectl::wipe(a.connect, o, a.target, consentOf(a));
        });
    for (CLI::App* command : {replace, wipe})
        command->add_flag("-y,--yes", arguments.yes, "Do not ask");
    make(app, "metadata", "Show a container's record",
         [](const Arguments& a, const Output& o) { return zorvanectl::metadata(a.connect, o, a.target); });
    make(app, "repair", "Make a container's standard subdirectories again",
         [](const Arguments& a, const Output& o) { return zorvanectl::repair(a.connect, o, a.target); });
    make(app, "regenerate", "Give a container's directory a new name",
         [](const Arguments& a, const Output& o) { return zorvanectl::regenerate(a.connect, o, a.target); });
    make(
        app, "usage", "Measure a container, or all of a class",
        [](const Arguments& a, const Output& o) { return zorvanectl::usage(a.connect, o, a.target); }, false);
    CLI::App* info = app.add_subcommand("info", "Values attached to a container");
    info->require_subcommand(1);
    make(*info, "list", "All of them",
         [](const Arguments& a, const Output& o) { return zorvanectl::infoList(a.connect, o, a.target); });
    CLI::App* get = make(*info, "get", "One of them", [](const Arguments& a, const Output& o) {
        return zorvanectl::infoGet(a.connect, o, a.target, a.key);
    });
    CLI::App* set = make(*info, "set", "Set one", [](const Arguments& a, const Output& o) {
        return zorvanectl::infoSet(a.connect, o, a.target, a.key, a.value);
    });
    CLI::App* unset = make(*info, "unset", "Remove one", [](const Arguments& a, const Output& o) {
        return zorvanectl::infoUnset(a.connect, o, a.target, a.key);
    });
    for (CLI::App* command : {get, set, unset})
        command->add_option("key", arguments.key, "Key")->required();
    set->add_option("value", arguments.value, "JSON; what is none is taken as a string")->required();
}

/// Drawn for people who look on, unless something else is asked for.
ProgressForm progressFormOf(const std::string& text, bool json) {
    if (text == "json")
        return ProgressForm::json;
    const bool wanted = text == "bar" || (text.empty() && !json && ::isatty(STDERR_FILENO) != 0);
    return wanted ? ProgressForm::bar : ProgressForm::none;
}

void addInstallCommand(CLI::App& app, Arguments& arguments, Action& action) {
    CLI::App* command = addCommand(app, arguments, action, "install",
                                   "Make an archive or a directory the content of a bundle or data container",
                                   [](const Arguments& a, const Output& o) {
                                       const InstallOptions options{.source = a.install.source,
                                                                    .progress = progressFormOf(a.progress, o.isJson())};
                                       return zorvanectl::install(a.connect, o, a.target, options, consentOf(a));
                                   });
    command->add_option("identifier", arguments.target.identifier, "Identifier")->required();
    command
        ->add_option("source", arguments.install.source,
                     "Archive (tar, zip, cpio, 7-Zip; compressed or not) or directory; at most 2,000,000 items. No "
                     "link of another user leads there")
        ->required();
    addClassAndUser(*command, arguments);
    command->add_flag("-y,--yes", arguments.yes, "Do not ask");
    command
        ->add_option("--progress", arguments.progress,
                     "On standard error: bar, json (a line now and then), none; a bar on a terminal if not given")
        ->check(CLI::IsMember({"bar", "json", "none"}));
}

void addProtectionCommands(CLI::App& app, Arguments& arguments, Action& action) {
    Protection& protection = arguments.protection;
    const auto make = [&](const char* name, const char* help, Run run) {
        return addCommand(app, arguments, action, name, help, run);
    };
    CLI::App* protect = make(
        "protect", "Change the data-protection class of a container; waits for an unlock",
        [](const Arguments& a, const Output& o) { return zorvanectl::protect(a.connect, o, a.target, a.protection); });
    CLI::App* show =
        make("protection", "Show a container's data-protection class, and a change that is pending",
             [](const Arguments& a, const Output& o) { return zorvanectl::protection(a.connect, o, a.target); });
    for (CLI::App* command : {protect, show}) {
        command->add_option("identifier", arguments.target.identifier, "Identifier")->required();
        addTargetOptions(*command, arguments);
    }
    protect
        ->add_option("protection-class", protection.protectionClass,
                     "0 none, 1 only while unlocked, 3 from the first unlock")
        ->required();
    protect->add_flag("--third-party", protection.thirdParty, "It is no program of the system's own");
    CLI::Option* noWait = protect->add_flag("--no-wait", protection.noWait,
                                            "Say that the change is pending rather than wait for an unlock");
    protect->add_flag("--fail-if-locked", protection.failIfLocked, "Fail where the device is locked")->excludes(noWait);
    CLI::App* lockState =
        make("lock-state", "Show the device's lock state, or set it for a root that is not /",
             [](const Arguments& a, const Output& o) { return zorvanectl::lockState(a.connect, o, a.lockState); });
    lockState->add_option("state", arguments.lockState, "0 unlocked, 1 locked");
}

void addEntitlementCommands(CLI::App& app, Arguments& arguments, Action& action) {
    Registration& registration = arguments.registration;
    CLI::App* entitlements = app.add_subcommand("entitlements", "What an identifier is entitled to");
    entitlements->require_subcommand(1);
    const auto make = [&](const char* name, const char* help, Run run) {
        CLI::App* command = addCommand(*entitlements, arguments, action, name, help, run);
        command->add_option("identifier", registration.identifier, "Identifier")->required();
        return command;
    };
    CLI::App* set =
        make("set", "Register entitlements in place of those that are there", [](const Arguments& a, const Output& o) {
            return zorvanectl::setEntitlements(a.connect, o, a.registration);
        });
    set->add_option("--from", registration.file, "File with a JSON object of entitlements; - is standard input");
    set->add_option("--app-group", registration.applicationGroups, "Application group; may repeat");
    set->add_option("--system-group", registration.systemGroups, "System group (systemgroup.…); may repeat");
    set->add_flag("--system-container", registration.systemContainer, "It owns a system container");
    set->add_option("--parent", registration.parent, "It is a child (an extension) of this identifier");
    set->add_flag("--placeholder", registration.placeholder, "The entitlements are a placeholder");
    make("show", "Show what is registered; for the owner of the daemon's root",
         [](const Arguments& a, const Output& o) {
             return zorvanectl::showEntitlements(a.connect, o, a.registration.identifier);
         });
    make("clear", "Remove what is registered, with the containers that go with it",
         [](const Arguments& a, const Output& o) {
             return zorvanectl::clearEntitlements(a.connect, o, a.registration.identifier);
         });
}

void addGroupCommands(CLI::App& app, Arguments& arguments, Action& action) {
    const auto make = [&](const char* name, const char* help, Run run) {
        return addCommand(app, arguments, action, name, help, run);
    };
    const char* ownByDefault = "Identifier; without it, this program's own";
    CLI::App* groups = make("groups", "Paths of an identifier's group containers, made where they are missing",
                            [](const Arguments& a, const Output& o) {
                                return zorvanectl::groups(a.connect, o, a.user, a.target.identifier);
                            });
    groups->add_option("-u,--user", arguments.user, "User id; 1 is the current mobile user")
        ->default_val(zorvane::currentMobileUser);
    CLI::App* systemPath = make(
        "system-path", "Path of an identifier's system container, made where it is missing",
        [](const Arguments& a, const Output& o) { return zorvanectl::systemPath(a.connect, o, a.target.identifier); });
    CLI::App* systemGroupPath =
        make("system-group-path", "Path of a system group's container", [](const Arguments& a, const Output& o) {
            return zorvanectl::systemGroupPath(a.connect, o, a.group, a.target.identifier);
        });
    systemGroupPath->add_option("group", arguments.group, "System group identifier")->required();
    for (CLI::App* command : {groups, systemPath, systemGroupPath})
        command->add_option("identifier", arguments.target.identifier, ownByDefault);
    CLI::App* why =
        make("why", "Who holds an identifier's groups, and what would go if it went",
             [](const Arguments& a, const Output& o) { return zorvanectl::why(a.connect, o, a.target.identifier); });
    why->add_option("identifier", arguments.target.identifier, "Identifier")->required();
}

/// A command line that cannot be parsed may still say how that is to be told.
Format formatOfUnparsed(int argumentCount, char** argumentValues) {
    const bool json = std::any_of(argumentValues, argumentValues + argumentCount,
                                  [](const char* word) { return std::string_view(word) == jsonOption; });
    return json ? Format::json : Format::people;
}

} // namespace

int main(int argumentCount, char** argumentValues) {
    std::signal(SIGXFSZ, SIG_IGN); // a file that may not grow is an error to be told, not an end
    Arguments arguments;
    Action action;
    CLI::App app("Talks to zorvaned, the container manager.", "zorvanectl");
    app.set_version_flag("--version", "zorvanectl " ZORVANE_VERSION);
    app.add_option("--root", arguments.connect.root, "System root of the daemon")->capture_default_str();
    app.add_option("--timeout", arguments.connect.timeoutMilliseconds, "Milliseconds to wait for an answer; 0 for ever")
        ->capture_default_str();
    app.add_flag(jsonOption, arguments.json, "Results and errors as JSON");
    app.require_subcommand(1);
    app.fallthrough();
    app.footer(footer);
    addContainerCommands(app, arguments, action);
    addKnownContainerCommands(app, arguments, action);
    addInstallCommand(app, arguments, action);
    addProtectionCommands(app, arguments, action);
    addEntitlementCommands(app, arguments, action);
    addGroupCommands(app, arguments, action);
    try {
        app.parse(argumentCount, argumentValues);
    } catch (const CLI::ParseError& error) {
        if (error.get_exit_code() == 0) // --help is one
            return app.exit(error);
        return Output(formatOfUnparsed(argumentCount, argumentValues))
            .localError(exitUsage, printable(error.what()), "see 'zorvanectl COMMAND --help'", "read the command line");
    }
    const Output output(arguments.json ? Format::json : Format::people);
    if (!zor::platform::fillStandardDescriptors())
        return output.localError(exitLocalError, "standard input, output or error is closed", "mount /dev", "starting");
    return action ? action(output) : exitUsage;
}
