// SPDX-License-Identifier: Apache-2.0
#include "CommandLine.h"

#include "CommandWalk.h"
#include "Users.h"

#include <algorithm>
#include <cctype>
#include <charconv>
#include <unistd.h>

namespace zorvanectl {

namespace {

constexpr const char* footer = R"(
Examples:
  zorvanectl create org.example.notes --class data-app
  zorvanectl lookup org.example.notes --class 2 --user 501 --json
  zorvanectl list --all --size
  zorvanectl install org.example.notes --class bundle-app notes.tar.zst
  zorvanectl delete org.example.notes org.example.maps --class data-app
  zorvanectl entitlements set org.example.notes --app-group group.org.example
  zorvanectl check --repair --dry-run
  zorvanectl status
  zorvanectl help install

Classes, by number, name, or the beginning of one name in lower case (data-app):
   1 Bundle/Application    2 Data/Application      3 Bundle/KolvexPlugin
   4 Data/KolvexPlugin     5 Bundle/VPNPlugin      6 Data/VPNPlugin
   7 Shared/AppGroup       8 Bundle/Framework      9 Data/IpsiService
  10 Data/InternalDaemon  11 Data/TempDir         12 Data/System
  13 Shared/SystemGroup

Exit codes: 0 done, 1 what was named is not there, 2 the command line is wrong, 3 the daemon cannot be
reached, 4 a check found something, 5 something failed on this side (an archive that is refused, a full
disk), 6 the daemon refuses this program, 7 the daemon did not answer in time, 8 the result could not be
written out, 9 the daemon answered with another error.)";

constexpr const char* userHelp = "User id or name, or 'current'. Without it, the class's usual owner";

/// "data-application".
std::string typedClassName(std::uint64_t number) {
    std::string typed(zorvane::containerClassName(number));
    for (char& character : typed)
        character = character == '/' ? '-' : static_cast<char>(std::tolower(static_cast<unsigned char>(character)));
    return typed;
}

std::string checkClass(const std::string& text) {
    if (zorvane::containerClassOf(text))
        return "";
    std::vector<std::string> known;
    for (std::uint64_t number = 1; number <= zorvane::containerClassMax; ++number)
        known.push_back(typedClassName(number));
    return "'" + text + "' " + noSuchClass + suggestion(text, known);
}

/// A word that names nothing on purpose is left out: an empty one is a variable that a script forgot to set.
std::string checkName(const std::string& text) {
    return text.empty() ? "it is empty" : "";
}

std::string checkNumber(const std::string& text) {
    std::int64_t number = 0;
    const auto [end, failure] = std::from_chars(text.data(), text.data() + text.size(), number);
    return failure == std::errc() && end == text.data() + text.size() ? "" : "'" + text + "' is no number";
}

CLI::Option* addNumber(CLI::App& command, const char* name, auto& number, const char* help) {
    return command.add_option(name, number, help)->check(CLI::Validator(checkNumber, "NUMBER"));
}

CLI::Option* addName(CLI::App& command, const char* name, auto& text, const char* help) {
    return command.add_option(name, text, help)->check(CLI::Validator(checkName, ""));
}

CLI::Option* addIdentifier(CLI::App& command, std::string& identifier, const char* help = "Identifier") {
    return addName(command, "identifier", identifier, help);
}

CLI::Option* addClassAndUser(CLI::App& command, Arguments& arguments) {
    CLI::Option* containerClass = command.add_option("-c,--class", arguments.className, "Class, by name or number")
                                      ->check(CLI::Validator(checkClass, "CLASS"));
    addName(command, "-u,--user", arguments.user, userHelp);
    return containerClass;
}

void addTransient(CLI::App& command, Arguments& arguments) {
    command.add_flag("--transient", arguments.target.transient,
                     "A container that lasts until it is asked for again, or the next boot");
}

void addTargetOptions(CLI::App& command, Arguments& arguments) {
    addClassAndUser(command, arguments)->required();
    addTransient(command, arguments);
}

void addConsent(CLI::App& command, Arguments& arguments) {
    command.add_flag("-y,--yes", arguments.yes, "Do not ask");
}

Consent consentOf(const Arguments& arguments) {
    return arguments.yes ? Consent::given : Consent::ask;
}

/// Fills in what can only be told once all options are known. Nothing, or the exit code.
std::optional<int> finishTarget(Arguments& arguments, const Output& output) {
    arguments.target.root = arguments.connect.root;
    arguments.target.containerClass = zorvane::containerClassOf(arguments.className).value_or(0);
    if (arguments.user.empty())
        return std::nullopt;
    const auto number = userNumber(arguments.connect.root, arguments.user);
    if (!number)
        return output.localError(exitUsage, printable(number.error()), "name a user id, a user's name, or 'current'",
                                 "read the command line");
    arguments.target.user = *number;
    return std::nullopt;
}

void addKeepClass(CLI::App& command, Arguments& arguments) {
    command.add_flag("--keep-class", arguments.keepClass,
                     "Do nothing where the data-protection class could not be set again, because the device is locked");
}

KeepClass keepClassOf(const Arguments& arguments) {
    return arguments.keepClass ? KeepClass::always : KeepClass::ifPossible;
}

using Run = int (*)(const Arguments&, const Output&);

CLI::App* addCommand(CLI::App& above, Arguments& arguments, Action& action, const char* name, const char* help,
                     Run run) {
    CLI::App* command = above.add_subcommand(name, help);
    command->callback([&arguments, &action, run] {
        action = [&arguments, run](const Output& output) {
            const auto failed = finishTarget(arguments, output);
            return failed ? *failed : run(arguments, output);
        };
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
        addIdentifier(*command, arguments.target.identifier, "Identifier; without it, this program's own");
    CLI::App* remove = make(
        "delete", "Delete containers of a class: all those named, or none", [](const Arguments& a, const Output& o) {
            return zorvanectl::deleteContainers(a.connect, o, a.target, a.identifiers, consentOf(a));
        });
    addName(*remove, "identifiers", arguments.identifiers, "Identifiers")->required();
    addConsent(*remove, arguments);
    for (CLI::App* command : {create, lookup, remove})
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
    addConsent(*check, arguments);
    addName(*make("init", "Make a root that the daemon can serve: its directories, users, and this program's entry",
                  [](const Arguments& a, const Output& o) { return zorvanectl::init(a.connect, o, a.account); }),
            "-u,--user", arguments.account, "Name of an account that is to have containers");
    make("status", "Show how the daemon is doing, and whom it takes this program for",
         [](const Arguments& a, const Output& o) { return zorvanectl::status(a.connect, o); });
}

void addListCommands(CLI::App& app, Arguments& arguments, Action& action) {
    Listing& listing = arguments.listing;
    CLI::App* list = addCommand(
        app, arguments, action, "list", "List the containers of a class, or all",
        [](const Arguments& a, const Output& o) { return zorvanectl::list(a.connect, o, a.target, a.listing); });
    CLI::App* usage = addCommand(
        app, arguments, action, "usage", "Measure a container, those of a class, or all, and all together",
        [](const Arguments& a, const Output& o) { return zorvanectl::usage(a.connect, o, a.target, a.listing); });
    addIdentifier(*usage, arguments.target.identifier, "Identifier; without it, all");
    for (CLI::App* command : {list, usage}) {
        CLI::Option* containerClass = addClassAndUser(*command, arguments);
        addTransient(*command, arguments);
        command->add_flag("-a,--all", listing.all, "Those of every class and user")
            ->excludes(containerClass, command->get_option("--user"));
        command->add_flag("-p,--path", listing.withPath, "With each one's path");
        command->add_option("--sort", listing.order, "class (then user and identifier), identifier, user or size")
            ->check(CLI::IsMember({"class", "identifier", "user", "size"}));
    }
    list->add_flag("-s,--size", listing.withSize, "With the bytes that each one takes");
}

void addKnownContainerCommands(CLI::App& app, Arguments& arguments, Action& action) {
    const auto make = [&](CLI::App& above, const char* name, const char* help, Run run) {
        CLI::App* command = addCommand(above, arguments, action, name, help, run);
        addIdentifier(*command, arguments.target.identifier)->required();
        addTargetOptions(*command, arguments);
        return command;
    };
    CLI::App* replace = make(
        app, "replace", "Put an identifier's transient container in the place of its live one",
        [](const Arguments& a, const Output& o) { return zorvanectl::replace(a.connect, o, a.target, consentOf(a)); });
    CLI::App* wipe =
        make(app, "wipe", "Empty a data container; its path and UUID stay", [](const Arguments& a, const Output& o) {
            return zorvanectl::wipe(a.connect, o, a.target, keepClassOf(a), consentOf(a));
        });
    addKeepClass(*wipe, arguments);
    for (CLI::App* command : {replace, wipe})
        addConsent(*command, arguments);
    make(app, "metadata", "Show a container's record",
         [](const Arguments& a, const Output& o) { return zorvanectl::metadata(a.connect, o, a.target); });
    make(app, "repair", "Make a container's standard subdirectories again",
         [](const Arguments& a, const Output& o) { return zorvanectl::repair(a.connect, o, a.target); });
    make(app, "regenerate", "Give a container's directory a new name",
         [](const Arguments& a, const Output& o) { return zorvanectl::regenerate(a.connect, o, a.target); });
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
                                                                    .progress = progressFormOf(a.progress, o.isJson()),
                                                                    .keepClass = keepClassOf(a)};
                                       return zorvanectl::install(a.connect, o, a.target, options, consentOf(a));
                                   });
    addIdentifier(*command, arguments.target.identifier)->required();
    addName(*command, "source", arguments.install.source,
            "Archive (tar, zip, cpio, 7-Zip; compressed or not) or directory; at most 2,000,000 items. No link of "
            "another user leads there. - is an archive on standard input")
        ->required();
    addClassAndUser(*command, arguments)->required();
    addKeepClass(*command, arguments);
    addConsent(*command, arguments);
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
        addIdentifier(*command, arguments.target.identifier)->required();
        addTargetOptions(*command, arguments);
    }
    addNumber(*protect, "protection-class", protection.protectionClass,
              "0 none, 1 only while unlocked, 3 from the first unlock")
        ->required();
    protect->add_flag("--third-party", protection.thirdParty, "It is no program of the system's own");
    CLI::Option* noWait = protect->add_flag("--no-wait", protection.noWait,
                                            "Say that the change is pending rather than wait for an unlock");
    protect->add_flag("--fail-if-locked", protection.failIfLocked, "Fail where the device is locked")->excludes(noWait);
    CLI::App* lockState =
        make("lock-state", "Show the device's lock state, or set it for a root that is not /",
             [](const Arguments& a, const Output& o) { return zorvanectl::lockState(a.connect, o, a.lockState); });
    addNumber(*lockState, "state", arguments.lockState, "0 unlocked, 1 locked");
}

void addEntitlementCommands(CLI::App& app, Arguments& arguments, Action& action) {
    Registration& registration = arguments.registration;
    CLI::App* entitlements = app.add_subcommand("entitlements", "What an identifier is entitled to");
    entitlements->require_subcommand(1);
    const auto make = [&](const char* name, const char* help, Run run) {
        CLI::App* command = addCommand(*entitlements, arguments, action, name, help, run);
        addIdentifier(*command, registration.identifier)->required();
        return command;
    };
    addCommand(*entitlements, arguments, action, "list",
               "List the identifiers for which something is registered; for the owner of the daemon's root",
               [](const Arguments& a, const Output& o) { return zorvanectl::listEntitlements(a.connect, o); });
    CLI::App* set =
        make("set", "Register entitlements in place of those that are there", [](const Arguments& a, const Output& o) {
            return zorvanectl::setEntitlements(a.connect, o, a.registration);
        });
    addName(*set, "--from", registration.file, "File with a JSON object of entitlements; - is standard input");
    addName(*set, "--app-group", registration.applicationGroups, "Application group; may repeat");
    addName(*set, "--system-group", registration.systemGroups, "System group (systemgroup.…); may repeat");
    set->add_flag("--system-container", registration.systemContainer, "It owns a system container");
    addName(*set, "--parent", registration.parent, "It is a child (an extension) of this identifier");
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
    CLI::App* groups = make("groups", "Paths of an identifier's group containers, made where they are missing",
                            [](const Arguments& a, const Output& o) {
                                const std::uint32_t user = a.target.user.value_or(zorvane::currentMobileUser);
                                return zorvanectl::groups(a.connect, o, user, a.target.identifier);
                            });
    addName(*groups, "-u,--user", arguments.user, "User id or name; the current one if not given");
    CLI::App* systemPath = make(
        "system-path", "Path of an identifier's system container, made where it is missing",
        [](const Arguments& a, const Output& o) { return zorvanectl::systemPath(a.connect, o, a.target.identifier); });
    CLI::App* systemGroupPath =
        make("system-group-path", "Path of a system group's container", [](const Arguments& a, const Output& o) {
            return zorvanectl::systemGroupPath(a.connect, o, a.group, a.target.identifier);
        });
    addName(*systemGroupPath, "group", arguments.group, "System group identifier")->required();
    for (CLI::App* command : {groups, systemPath, systemGroupPath})
        addIdentifier(*command, arguments.target.identifier, "Identifier; without it, this program's own");
    CLI::App* why = make("why", "Who holds an identifier's groups, or a group, and what would go",
                         [](const Arguments& a, const Output& o) {
                             return a.group.empty() ? zorvanectl::why(a.connect, o, a.target.identifier)
                                                    : zorvanectl::whyGroup(a.connect, o, a.group);
                         });
    CLI::Option* identifier = addIdentifier(*why, arguments.target.identifier);
    CLI::Option* group = addName(*why, "-g,--group", arguments.group, "Who holds this group");
    group->excludes(identifier);
    why->require_option(1);
}

void addRegistryCommands(CLI::App& app, Arguments& arguments, Action& action) {
    CLI::App* registry = app.add_subcommand("registry", "Which programs the daemon knows; needs no daemon");
    registry->require_subcommand(1);
    const auto make = [&](const char* name, const char* help, Run run) {
        return addCommand(*registry, arguments, action, name, help, run);
    };
    make("list", "Every file of the identity registry: whether it counts, and why not",
         [](const Arguments& a, const Output& o) { return zorvanectl::registryList(a.connect, o); });
    addName(*make("check", "What the daemon would make of a file in the registry",
                  [](const Arguments& a, const Output& o) { return zorvanectl::registryCheck(o, a.path); }),
            "file", arguments.path, "The file, wherever it lies")
        ->required();
    addName(*make("who", "Whom the daemon takes an executable for",
                  [](const Arguments& a, const Output& o) { return zorvanectl::registryWho(a.connect, o, a.path); }),
            "executable", arguments.path, "Its path")
        ->required();
}

/// The help of the command that the words lead to.
int showHelp(const CLI::App& app, const std::vector<std::string>& words, const Output& output) {
    const Place place = placeAfter(app, words);
    if (place.mistake || place.positionals > 0)
        return output.localError(exitUsage, printable(place.mistake.value_or("this is no command")),
                                 "'zorvanectl --help' lists them", "help");
    const CLI::App* above = place.command->get_parent();
    std::string text = place.command->help(above ? fullNameOf(*above) : "");
    while (!text.empty() && text.back() == '\n')
        text.pop_back();
    output.line(text);
    return exitDone;
}

} // namespace

void describeCommandLine(CLI::App& app, Arguments& arguments, Action& action) {
    app.set_version_flag("-V,--version", "zorvanectl " ZORVANE_VERSION);
    addName(app, "--root", arguments.connect.root, "System root of the daemon")->capture_default_str();
    addNumber(app, "--timeout", arguments.connect.timeoutMilliseconds,
              "Milliseconds to wait for an answer; 0 for ever");
    app.add_flag(jsonOption, arguments.json, "Results and errors as JSON");
    app.add_flag("--no-pager", arguments.noPager, "Show long results on the terminal as they come");
    app.require_subcommand(1);
    app.fallthrough();
    addContainerCommands(app, arguments, action);
    addListCommands(app, arguments, action);
    addKnownContainerCommands(app, arguments, action);
    addInstallCommand(app, arguments, action);
    addProtectionCommands(app, arguments, action);
    addEntitlementCommands(app, arguments, action);
    addGroupCommands(app, arguments, action);
    addRegistryCommands(app, arguments, action);
    CLI::App* help = app.add_subcommand("help", "Say how a command is used");
    help->add_option("command", arguments.commands, "The command's words");
    help->callback([&app, &arguments, &action] {
        action = [&](const Output& output) { return showHelp(app, arguments.commands, output); };
    });
    app.footer(footer); // after the commands, which would take it over
}

} // namespace zorvanectl
