// SPDX-License-Identifier: Apache-2.0
#include "identity/RegistryReport.h"

#include "base/Log.h"
#include "identity/IdentityRegistry.h"
#include "os/FileDescriptor.h"
#include "os/SystemRoot.h"
#include "platform/Service.h"
#include "plist/Codec.h"

#include <algorithm>
#include <array>

namespace zor::platform {

namespace {

void setPlace(RegistryFileReport& report, std::string_view bytes, std::size_t offset) {
    const std::string_view before = bytes.substr(0, std::min(offset, bytes.size()));
    report.line = 1 + static_cast<std::size_t>(std::ranges::count(before, '\n'));
    report.column = before.size() - (before.rfind('\n') + 1) + 1; // npos + 1 is 0
}

/// A problem names its key first, in quotes: the key's place in an XML file is the problem's.
void setPlaceOfKey(RegistryFileReport& report, std::string_view bytes) {
    const std::string& text = *report.problem;
    const std::size_t end = text.find('"', 1);
    if (!text.starts_with('"') || end == std::string::npos)
        return;
    const std::size_t place = bytes.find("<key>" + text.substr(1, end - 1) + "</key>");
    if (place != std::string_view::npos)
        setPlace(report, bytes, place);
}

std::string shown(const plist::Value& value) {
    const std::string* const text = value.asString();
    return text ? "the string \"" + *text + "\"" : plist::describe(&value);
}

void remarkEntitlements(RegistryFileReport& report, const plist::Dictionary& entitlements) {
    constexpr std::array known = {entitlementKeys::allowed, entitlementKeys::otherIdLookup,
                                  entitlementKeys::wipeContainer};
    constexpr std::string_view ownBegin = "com.veltra.private.Zorvane.";
    for (const auto& [key, value] : entitlements) {
        const std::string quoted = "\"" + key + "\"";
        const bool isList = key == entitlementKeys::wipeContainer;
        if (std::ranges::find(known, key) == known.end()) {
            if (key.starts_with(ownBegin))
                report.remarks.push_back(quoted + " is no entitlement that the daemon knows, and grants nothing");
        } else if (isList && !value.asArray()) {
            report.remarks.push_back(quoted + " is " + shown(value) +
                                     ", which grants nothing: write an array of strings");
        } else if (!isList && !value.asBoolean()) {
            report.remarks.push_back(quoted + " is " + shown(value) + ", which grants nothing: write <true/>");
        }
    }
}

void remarkEntry(RegistryFileReport& report) {
    const RegistryEntry& entry = *report.entry;
    report.executable = RegisteredExecutables().fileAt(entry.executable);
    if (!report.executable)
        report.remarks.push_back("no file is at " + entry.executable);
    if (entry.grant->entitlements)
        remarkEntitlements(report, *entry.grant->entitlements);
}

RegistryFileReport ignored(const std::string& name, std::string problem) {
    RegistryFileReport report;
    report.name = name;
    report.problem = std::move(problem);
    return report;
}

} // namespace

RegistryFileReport reportRegistryFile(std::string name, std::string_view bytes) {
    RegistryFileReport report;
    report.name = std::move(name);
    const std::span content(reinterpret_cast<const std::uint8_t*>(bytes.data()), bytes.size());
    auto parsed = parseIdentityFile(content);
    if (parsed) {
        report.entry = std::move(*parsed);
        remarkEntry(report);
        return report;
    }
    report.problem = std::move(parsed.error());
    if (const auto list = plist::readPropertyList(content); !list) {
        report.problem = list.error().reason;
        setPlace(report, bytes, list.error().offset);
    } else {
        setPlaceOfKey(report, bytes);
    }
    return report;
}

RegistryReport reportRegistry(const SystemRoot& root, uid_t daemonUserId) {
    RegistryReport report;
    const RegistryDirectory directory(root, daemonUserId);
    const RegistryListing listing = directory.list();
    if (listing.problem)
        report.problem = listing.problem->text;
    if (!listing.directory.valid()) {
        if (!report.problem)
            report.problem = "is not there";
        return report;
    }
    std::size_t bytesLeft = RegistryDirectory::allBytesMax;
    for (const auto& [name, stamp] : listing.files) {
        const auto bytes = directory.bytes(listing, name);
        const bool isTooMuch = static_cast<std::size_t>(stamp.bytes) > bytesLeft;
        bytesLeft -= isTooMuch ? 0 : static_cast<std::size_t>(stamp.bytes);
        if (isTooMuch)
            report.files.push_back(ignored(name, "all files together are too large"));
        else
            report.files.push_back(bytes ? reportRegistryFile(name, *bytes) : ignored(name, bytes.error().text));
    }
    const auto names = directoryNames(listing.directory.get());
    for (const std::string& name : names ? *names : std::vector<std::string>())
        if (!listing.files.contains(name))
            report.files.push_back(ignored(
                name, formatted("its name does not end in %s, or begins with a dot, or too many files come before it",
                                names::identityFileSuffix)));
    return report;
}

} // namespace zor::platform
