// SPDX-License-Identifier: Apache-2.0
#include "check/Repair.h"

#include "base/Log.h"

#include <algorithm>
#include <set>
#include <tuple>

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

namespace {

std::string counted(std::size_t count, const char* what) {
    return std::to_string(count) + " " + what + (count == 1 ? "" : "s");
}

RepairStep structureStep(const Finding& finding, const std::string& root) {
    const std::string name = className(*finding.containerClass);
    return {.act = RepairStep::Act::recreateStructure,
            .mender = Mender::daemon,
            .text = "the standard subdirectories of " + finding.identifier + " in " + name + " are made again",
            .command = programFor("zorvanectl", root) + " repair --class " + name + " --user " +
                       std::to_string(*finding.user) + (finding.transient ? " --transient" : "") + " -- " +
                       shellQuoted(finding.identifier),
            .containerClass = *finding.containerClass,
            .user = *finding.user,
            .identifier = finding.identifier,
            .uuid = *finding.uuid};
}

/// One step for all containers whose subdirectories are wrong, each once.
void addStructureSteps(std::vector<RepairStep>& steps, const std::vector<Finding>& findings, const std::string& root) {
    std::set<std::tuple<std::string, std::string, std::uint32_t, ContainerClass>> known;
    for (const Finding& finding : findings) {
        const bool isStructure =
            finding.code == FindingCode::subdirectoryMissing || finding.code == FindingCode::subdirectoryAttributes;
        if (!isStructure || finding.mender != Mender::daemon || !finding.uuid)
            continue;
        if (known.emplace(finding.uuid->string(), finding.identifier, *finding.user, *finding.containerClass).second)
            steps.push_back(structureStep(finding, root));
    }
}

} // namespace

std::vector<RepairStep> repairSteps(const std::vector<Finding>& findings, const std::string& root) {
    const auto count = [&](auto&& belongs) {
        return static_cast<std::size_t>(std::ranges::count_if(findings, belongs));
    };
    const auto ofMender = [&](Mender mender) {
        return count([mender](const Finding& finding) { return finding.mender == mender; });
    };
    const bool isDevice = root == "/";
    std::vector<RepairStep> steps;
    addStructureSteps(steps, findings, root);
    if (const std::size_t items = count([](const Finding& f) { return f.code == FindingCode::deathRowItem; }))
        steps.push_back({.act = RepairStep::Act::emptyDeathRow,
                         .mender = Mender::daemon,
                         .text = "what waits for its deletion is deleted: " + counted(items, "item"),
                         .command = programFor("zorvanectl", root) + " empty-death-row"});
    if (const std::size_t left = ofMender(Mender::nextWrite))
        steps.push_back({.mender = Mender::nextWrite,
                         .text = "the daemon removes " + counted(left, "leftover") + " when it next writes there"});
    if (const std::size_t left = ofMender(Mender::launch))
        steps.push_back({.mender = Mender::launch,
                         .text = "the next start of the daemon puts right " + counted(left, "finding"),
                         .command = isDevice ? "systemctl restart zorvaned" : programFor("zorvaned", root)});
    if (const std::size_t left = ofMender(Mender::boot))
        steps.push_back({.mender = Mender::boot,
                         .text = "the first start of the daemon after a boot deletes what " + counted(left, "finding") +
                                 (left == 1 ? " names; move it" : " name; move them") + " away before if wanted",
                         .command = isDevice ? "systemctl reboot" : programFor("zorvaned", root) + " --forget-boot"});
    for (const Finding& finding : findings)
        if (finding.mender == Mender::person)
            steps.push_back({.mender = Mender::person,
                             .text = finding.path + ": " + pageOf(finding.code).whatToDo,
                             .command = finding.command});
    return steps;
}

} // namespace zor::check
