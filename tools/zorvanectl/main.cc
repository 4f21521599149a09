// SPDX-License-Identifier: Apache-2.0
// zorvanectl: the command line of the container manager. Its requests to the daemon go through the public client
// library.
#include "CommandLine.h"
#include "CommandWalk.h"
#include "Completion.h"
#include "Screen.h"
#include "os/FileDescriptor.h"

#include <algorithm>
#include <clocale>
#include <csignal>

namespace {

using namespace zorvanectl;

/// A command line that cannot be parsed may still say how that is to be told.
Format formatOfUnparsed(const std::vector<std::string>& words) {
    return std::ranges::find(words, jsonOption) != words.end() ? Format::json : Format::people;
}

int sayMistake(const CLI::App& app, const CLI::ParseError& error, const std::vector<std::string>& words) {
    const Place place = placeAfter(app, words);
    std::string message = place.mistake.value_or(error.what());
    if (!place.mistake && place.awaiting)
        message = "'--" + nameOf(*place.awaiting) + "' lacks its value";
    else if (!place.mistake && !subcommandsOf(*place.command).empty())
        message = "'" + fullNameOf(*place.command) + "' needs a command";
    return Output(formatOfUnparsed(words))
        .localError(exitUsage, printable(message),
                    "see 'zorvanectl help" + fullNameOf(*place.command).substr(app.get_name().size()) + "'",
                    "read the command line");
}

int run(int argumentCount, char** argumentValues, const std::vector<std::string>& words) {
    Arguments arguments;
    Action action;
    CLI::App app("Talks to zorvaned, the container manager.", "zorvanectl");
    describeCommandLine(app, arguments, action);
    if (!words.empty() && words.front() == completionWord)
        return complete(app, std::span(words).subspan(1));
    try {
        app.parse(argumentCount, argumentValues);
    } catch (const CLI::ParseError& error) {
        if (error.get_exit_code() == 0) // --help is one
            return app.exit(error);
        return sayMistake(app, error, words);
    }
    if (arguments.noPager)
        Screen::ofOutput().leavePlain();
    return action ? action(Output(arguments.json ? Format::json : Format::people)) : exitUsage;
}

} // namespace

int main(int argumentCount, char** argumentValues) {
    std::signal(SIGXFSZ, SIG_IGN); // a file that may not grow is an error to be told, not an end
    std::setlocale(LC_CTYPE, "C.UTF-8");
    const std::vector<std::string> words(argumentValues + std::min(argumentCount, 1), argumentValues + argumentCount);
    if (!zor::platform::fillStandardDescriptors())
        return Output(formatOfUnparsed(words))
            .localError(exitLocalError, "standard input, output or error is closed", "mount /dev", "starting");
    const int exitCode = run(argumentCount, argumentValues, words);
    return Output(formatOfUnparsed(words)).finished(exitCode);
}
