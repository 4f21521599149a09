// SPDX-License-Identifier: Apache-2.0
// The identity registry as the daemon reads it: which files count, why others do not, and whom an executable is taken
// for. Needs no daemon.
#include "Commands.h"
#include "identity/IdentityRegistry.h"
#include "identity/RegistryReport.h"
#include "ipc/UserNumbers.h"
#include "os/FileDescriptor.h"
#include "os/SystemRoot.h"
#include "plist/Value.h"

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <unistd.h>

namespace zorvanectl {

namespace {

using zor::platform::FileId;
using zor::platform::RegistryFileReport;
using zor::platform::RegistryReport;
using zor::platform::SystemRoot;

std::string entitlementsOf(const RegistryFileReport& file) {
    if (!file.entry->grant->entitlements)
        return "none";
    const zor::plist::Value entitlements(*file.entry->grant->entitlements);
    return zor::plist::describe(&entitlements);
}

bool isForOwnerAlone(const zor::platform::RegistryEntry& entry) {
    return !entry.userIds && !entry.admitsUser(zor::ipc::UserNumbers().last);
}

nlohmann::json toJson(const RegistryFileReport& file) {
    nlohmann::json json = {{"name", file.name}, {"counts", !file.problem}, {"remarks", file.remarks}};
    json["problem"] = file.problem ? nlohmann::json(*file.problem) : nlohmann::json();
    json["line"] = file.line != 0 ? nlohmann::json(file.line) : nlohmann::json();
    json["column"] = file.column != 0 ? nlohmann::json(file.column) : nlohmann::json();
    if (!file.entry)
        return json;
    json["executable"] = file.entry->executable;
    json["executableExists"] = file.executable.has_value();
    const auto& identifier = file.entry->grant->identifier;
    json["identifier"] = identifier ? nlohmann::json(*identifier) : nlohmann::json();
    json["userIds"] = file.entry->userIds ? nlohmann::json(*file.entry->userIds) : nlohmann::json();
    json["ownerAlone"] = isForOwnerAlone(*file.entry);
    json["unit"] = file.entry->unit ? nlohmann::json(*file.entry->unit) : nlohmann::json();
    return json;
}

std::string placeOf(const RegistryFileReport& file) {
    return file.line == 0 ? "" : "line " + std::to_string(file.line) + ", column " + std::to_string(file.column) + ": ";
}

void showRemarks(const Output& output, const RegistryFileReport& file) {
    if (file.problem)
        output.line("  it does not count: " + placeOf(file) + printable(*file.problem));
    for (const std::string& remark : file.remarks)
        output.line("  note: " + printable(remark));
}

void show(const Output& output, const RegistryFileReport& file) {
    if (!file.entry) {
        output.line(printable(file.name));
        return showRemarks(output, file);
    }
    const auto& entry = *file.entry;
    output.line(printable(file.name) + ": " + printable(entry.executable) + " is " +
                (entry.grant->identifier ? printable(*entry.grant->identifier) : "known, without an identifier"));
    std::string users;
    for (const std::uint32_t user : entry.userIds.value_or(std::vector<std::uint32_t>()))
        users += " " + std::to_string(user);
    if (entry.userIds)
        output.line("  for users" + users);
    else
        output.line(isForOwnerAlone(entry) ? "  for the owner of the root alone: it gives power, and has no \"UserIDs\""
                                           : "  for every user");
    if (entry.unit)
        output.line("  in unit " + printable(*entry.unit));
    if (entry.securityLabel)
        output.line("  with security label " + printable(*entry.securityLabel));
    output.line("  entitlements " + printable(entitlementsOf(file)));
    showRemarks(output, file);
}

bool isWhole(const RegistryReport& report) {
    return !report.problem && std::ranges::all_of(report.files, [](const RegistryFileReport& file) {
        return !file.problem && file.remarks.empty();
    });
}

int cannotOpenRoot(const Output& output, const std::string& root, zor::Errno error, const std::string& what) {
    return output.localError(exitLocalError, "the root " + printable(root) + " cannot be opened: " + error.text(),
                             "name the daemon's root with --root", what);
}

} // namespace

int registryList(const zorvane::ConnectOptions& connect, const Output& output) {
    const std::string what = "read the registry";
    const auto root = SystemRoot::open(connect.root);
    if (!root)
        return cannotOpenRoot(output, connect.root, root.error(), what);
    const RegistryReport report = zor::platform::reportRegistry(*root, ::geteuid());
    const std::string directory = root->path(zor::platform::names::identityDirectory);
    if (output.isJson()) {
        nlohmann::json document = {{"directory", directory}, {"files", nlohmann::json::array()}};
        document["problem"] = report.problem ? nlohmann::json(*report.problem) : nlohmann::json();
        for (const RegistryFileReport& file : report.files)
            document["files"].push_back(toJson(file));
        output.json(std::move(document));
        return isWhole(report) ? exitDone : exitFindings;
    }
    output.page();
    if (report.problem)
        output.line(printable(directory) + " " + printable(*report.problem));
    for (const RegistryFileReport& file : report.files)
        show(output, file);
    output.line(std::to_string(
                    std::ranges::count_if(report.files, [](const RegistryFileReport& file) { return !file.problem; })) +
                " of " + std::to_string(report.files.size()) + " files in " + printable(directory) + " count");
    return isWhole(report) ? exitDone : exitFindings;
}

int registryCheck(const Output& output, const std::string& path) {
    const std::string what = "check " + path;
    const zor::platform::FileDescriptor file(::open(path.c_str(), O_RDONLY | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
    const auto bytes = file.valid()
                           ? zor::platform::readSmallFile(file.get(), zor::platform::RegistryDirectory::fileBytesMax)
                           : zor::Errno::last();
    if (!bytes)
        return output.localError(exitLocalError, printable(path) + " cannot be read: " + bytes.error().text(),
                                 "name a file of the registry, or one that is to become one", what);
    const RegistryFileReport report = zor::platform::reportRegistryFile(path, *bytes);
    if (output.isJson())
        output.json(toJson(report));
    else
        show(output, report);
    return report.problem || !report.remarks.empty() ? exitFindings : exitDone;
}

int registryWho(const zorvane::ConnectOptions& connect, const Output& output, const std::string& executable) {
    const std::string what = "look " + executable + " up in the registry";
    const auto root = SystemRoot::open(connect.root);
    if (!root)
        return cannotOpenRoot(output, connect.root, root.error(), what);
    const auto wanted = zor::platform::RegisteredExecutables().fileAt(executable);
    if (!wanted)
        return output.localError(exitNotFound, printable(executable) + " is no file",
                                 "name an executable, not a script: the program that runs a script is known", what);
    RegistryReport report = zor::platform::reportRegistry(*root, ::geteuid());
    std::erase_if(report.files, [&](const RegistryFileReport& file) { return file.executable != wanted; });
    if (report.files.empty())
        return output.localError(exitNotFound, "no file that counts names " + printable(executable),
                                 "'zorvanectl registry list' shows which ones count, and why others do not", what);
    if (output.isJson()) {
        nlohmann::json document = {{"executable", executable}, {"files", nlohmann::json::array()}};
        for (const RegistryFileReport& file : report.files)
            document["files"].push_back(toJson(file));
        output.json(std::move(document));
        return exitDone;
    }
    for (const RegistryFileReport& file : report.files)
        show(output, file);
    if (report.files.size() > 1)
        output.line("Of these, the first that fits user, unit and label counts.");
    return exitDone;
}

} // namespace zorvanectl
