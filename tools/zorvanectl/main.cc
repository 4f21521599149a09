// SPDX-License-Identifier: Apache-2.0
// zorvanectl: the command line of the container manager. Everything it does goes through the public client library.
#include "Commands.h"
#include "Output.h"

#include <CLI/CLI.hpp>

namespace {

using namespace zorvanectl;

constexpr const char* footer = R"(
Examples:
  zorvanectl create org.example.notes --class data-app
  zorvanectl lookup org.example.notes --class 2 --user 501 --json
  zorvanectl list --class Bundle/Application
  zorvanectl status

Classes, by number, name, or the beginning of one name in lower case (data-app):
   1 Bundle/Application    2 Data/Application      3 Bundle/KolvexPlugin
   4 Data/KolvexPlugin     5 Bundle/VPNPlugin      6 Data/VPNPlugin
   7 Shared/AppGroup       8 Bundle/Framework      9 Data/IpsiService
  10 Data/InternalDaemon  11 Data/TempDir         12 Data/System
  13 Shared/SystemGroup

Exit codes: 0 done, 1 the daemon answered with an error, 2 usage,
3 the daemon cannot be reached or does not answer this program.)";

struct Arguments {
    zorvane::ConnectOptions connect;
    bool json = false;
    std::string className;
    std::uint32_t user = 0;
    Target target;
};

/// Accepts what containerClassOf knows, with an error that lists nothing twice: --help does.
std::string checkClass(const std::string& text) {
    return zorvane::containerClassOf(text) ? "" : "'" + text + "' is no class; see zorvanectl --help";
}

void addTargetOptions(CLI::App& command, Arguments& arguments) {
    command.add_option("-c,--class", arguments.className, "Class, by name or number")
        ->required()
        ->check(CLI::Validator(checkClass, "CLASS"));
    command.add_option("-u,--user", arguments.user,
                       "User id; 1 is the current mobile user. Without it, the class's usual owner");
    command.add_flag("--transient", arguments.target.transient,
                     "A container that lasts until it is asked for again, or the next boot");
}

void finishTarget(const CLI::App& command, Arguments& arguments) {
    arguments.target.containerClass = zorvane::containerClassOf(arguments.className).value_or(0);
    if (command.count("--user") > 0)
        arguments.target.user = arguments.user;
}

} // namespace

int main(int argumentCount, char** argumentValues) {
    Arguments arguments;
    CLI::App app("Talks to zorvaned, the container manager.", "zorvanectl");
    app.set_version_flag("--version", "zorvanectl " ZORVANE_VERSION);
    app.add_option("--root", arguments.connect.root, "System root of the daemon")->capture_default_str();
    app.add_option("--timeout", arguments.connect.timeoutMilliseconds, "Milliseconds to wait for an answer; 0 for ever")
        ->capture_default_str();
    app.add_flag("--json", arguments.json, "Results and errors as JSON");
    app.require_subcommand(1);
    app.fallthrough();
    app.footer(footer);

    CLI::App* create = app.add_subcommand("create", "Make a container, or find the one that is there");
    CLI::App* lookup = app.add_subcommand("lookup", "Find a container");
    for (CLI::App* command : {create, lookup}) {
        command->add_option("identifier", arguments.target.identifier, "Identifier; without it, this program's own");
        addTargetOptions(*command, arguments);
    }
    CLI::App* list = app.add_subcommand("list", "List the containers of a class");
    addTargetOptions(*list, arguments);
    CLI::App* emptyDeathRow = app.add_subcommand("empty-death-row", "Delete what waits for deletion, and wait for it");
    CLI::App* status = app.add_subcommand("status", "Show whom the daemon takes this program for, and how it is doing");

    try {
        app.parse(argumentCount, argumentValues);
    } catch (const CLI::ParseError& error) {
        return app.exit(error) == 0 ? exitDone : exitUsage;
    }

    const Output output(arguments.json ? Format::json : Format::people);
    for (const CLI::App* command : {create, lookup, list})
        if (command->parsed())
            finishTarget(*command, arguments);
    if (create->parsed())
        return zorvanectl::create(arguments.connect, output, arguments.target);
    if (lookup->parsed())
        return zorvanectl::lookup(arguments.connect, output, arguments.target);
    if (list->parsed())
        return zorvanectl::list(arguments.connect, output, arguments.target);
    if (emptyDeathRow->parsed())
        return zorvanectl::emptyDeathRow(arguments.connect, output);
    return status->parsed() ? zorvanectl::status(arguments.connect, output) : exitUsage;
}
