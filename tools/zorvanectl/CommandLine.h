// SPDX-License-Identifier: Apache-2.0
// The one description of the tool's commands and options: the command line is parsed by it, help is printed from it,
// and completions ask it.
#pragma once

#include "Commands.h"

#include <CLI/CLI.hpp>
#include <functional>
#include <string>
#include <vector>

namespace zorvanectl {

struct Arguments {
    zorvane::ConnectOptions connect;
    bool json = false;
    bool noPager = false;
    std::string className;
    /// A number or a name.
    std::string user;
    Target target;
    Listing listing;
    std::vector<std::string> identifiers;
    std::string key;
    std::string value;
    bool yes = false;
    bool keepClass = false;
    std::string group;
    Registration registration;
    Protection protection;
    std::optional<int> lockState;
    std::string code;
    /// The path of a file of the registry, or of an executable.
    std::string path;
    Checking checking;
    InstallOptions install;
    std::string progress;
    /// The name of one that may be made.
    std::string account;
    /// Those that help is asked for.
    std::vector<std::string> commands;
};

/// The action that the command line asks for, to be done once the line is parsed as a whole.
using Action = std::function<int(const Output&)>;

inline constexpr const char* jsonOption = "--json";
inline constexpr const char* noSuchClass = "is no class; 'zorvanectl --help' lists them";

/// Adds all commands. All three live as long as what is parsed is used.
void describeCommandLine(CLI::App& app, Arguments& arguments, Action& action);

} // namespace zorvanectl
