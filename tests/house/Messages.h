// SPDX-License-Identifier: Apache-2.0
// The messages in the daemon's sources: the format of every log line and error, with the error codes it is made with.
#pragma once

#include <map>
#include <set>
#include <string>
#include <string_view>
#include <vector>

namespace zor::house {

/// The names of the error codes that are made with it (none for a line that is no error of ours), for each format,
/// written as in the source (`\t`, `\"`, `%s`).
using Messages = std::map<std::string, std::set<std::string>>;

/// Adds the messages of a source to `messages`.
void addMessages(Messages& messages, std::string_view text);

/// All below src/ but those of the check, which the tool prints.
Messages messagesOfTheDaemon();

/// ErrorCode's numbers by their names.
std::map<std::string, int> errorCodes();

/// Functions of ours whose formats the compiler checks and which addMessages does not know.
std::vector<std::string> unknownFormatFunctions();

/// What a format of the sources is when it is printed, but for line breaks, which stay `\n`.
std::string printedForm(std::string_view format);

} // namespace zor::house
