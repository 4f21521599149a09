// SPDX-License-Identifier: Apache-2.0
#include "check/ShellText.h"

#include "base/Log.h"

namespace zor::check {

std::string shellQuoted(std::string_view text) {
    // $'…' where a byte could steer a terminal; a plain quotation can hold everything else. A shell that does not know
    // $'…' ends it at the first quote, whatever stands before that: so there is none in it.
    bool plain = true;
    for (const char c : text)
        plain = plain && static_cast<unsigned char>(c) >= 0x20 && static_cast<unsigned char>(c) < 0x7F;
    std::string quoted = plain ? "'" : "$'";
    for (const char c : text) {
        const auto byte = static_cast<unsigned char>(c);
        if (plain)
            quoted += c == '\'' ? std::string("'\\''") : std::string(1, c);
        else if (byte >= 0x20 && byte < 0x7F && c != '\'' && c != '\\')
            quoted += c;
        else
            quoted += formatted("\\%03o", static_cast<unsigned>(byte));
    }
    return quoted + "'";
}

std::string programFor(std::string_view program, std::string_view root) {
    const std::string name(program);
    return root == "/" ? name : name + " --root " + shellQuoted(root);
}

std::string inDirectory(std::string_view directory, std::string_view command) {
    const std::string place = shellQuoted(directory);
    return "(cd -P -- " + place + " && [ \"$PWD\" = " + place + " ] && " + std::string(command) + ")";
}

} // namespace zor::check
