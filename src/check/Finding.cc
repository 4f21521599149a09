// SPDX-License-Identifier: Apache-2.0
#include "check/Finding.h"

#include "base/Log.h"

#include <algorithm>
#include <array>
#include <set>
#include <tuple>

namespace zor::check {

namespace {

constexpr bool note = true;
constexpr bool fault = false;

constexpr std::array<FindingPage, findingCodeCount> pages = {{
    {FindingCode::metadataMissing, "metadata-missing", fault, "a container's directory has no metadata file",
     "somebody removed the file, or made a directory where only containers may lie",
     "no client can find it, and the first start of the daemon after a boot deletes it with all it holds",
     "move it out of the class directory if its content is wanted; else nothing"},
    {FindingCode::metadataInvalid, "metadata-invalid", fault, "a container's metadata file is not believed",
     "the file was changed by somebody else than the daemon: it has another owner, other permissions, a second name or "
     "another content (the rule says which)",
     "no client can find the container; a new one is made when its identifier is asked for. Nothing deletes it",
     "look at it; move the directory out of the class directory, and copy what is wanted into a fresh container"},
    {FindingCode::wrongClassDirectory, "wrong-class-directory", fault,
     "a container lies in another class's or user's directory than its metadata file says",
     "somebody moved it, or a copy of a whole store was put together by hand",
     "no client can find it there. Nothing deletes it",
     "move it to the directory where it belongs, and start the daemon again"},
    {FindingCode::doubledContainer, "doubled-container", fault, "an identifier has two containers of one class",
     "somebody copied a container, or an error met a replace whose journal was removed by hand",
     "clients are given one of them, after a start of the daemon the one that the directory lists last; the other one "
     "is "
     "invisible and takes its space",
     "compare them, and move the one that is not wanted out of the class directory, with the command that the check "
     "names for the one that clients are not given; after moving the other one start the daemon again"},
    {FindingCode::containerName, "container-name", fault,
     "something in a class directory has a name that no container has",
     "somebody put it there: containers are named by a UUID or, for a few of the system's, by their well-known name",
     "the first start of the daemon after a boot deletes it, container or not",
     "move it out of the class directory if it is wanted; else nothing"},
    {FindingCode::containerAttributes, "container-attributes", fault,
     "a container's directory has another owner or mode than the daemon gave it", "its owner, or root, changed them",
     "its user may not reach it, or others may",
     "give it its owner and mode again, with the command that the check names"},
    {FindingCode::subdirectoryMissing, "subdirectory-missing", fault, "a container lacks a standard subdirectory",
     "its program removed it", "programs that count on it fail", "zorvanectl repair makes it again"},
    {FindingCode::subdirectoryAttributes, "subdirectory-attributes", fault,
     "a standard subdirectory has another owner or mode than the daemon gave it", "its program, or root, changed them",
     "its user may not reach it, or others may",
     "zorvanectl repair sets the mode again; it leaves another's directory as it is: move that aside, with the command "
     "that "
     "the check names, and repair the container"},
    {FindingCode::wrongShape, "wrong-shape", fault,
     "there is a link, a file or something else where a directory belongs",
     "a program put it there, perhaps to lead the daemon astray: it follows no link",
     "what should lie below is not there for the daemon: lookups or repairs fail",
     "move it aside, with the command that the check names, and repair the container"},
    {FindingCode::protectionDiffers, "protection-differs", fault,
     "a container's directories have another data-protection class than the one recorded",
     "a change of the class was stopped midway or could not be recorded, or the program made the directory anew",
     "files are kept less, or more, strictly than the record says",
     "ask for another class and then for the recorded one again: zorvanectl protect. A change that waits for an unlock "
     "is "
     "not reported while the daemon runs"},
    {FindingCode::infoUnsaved, "info-unsaved", fault,
     "the daemon shows info values of a container, among them the recorded protection class, that are not on the disk",
     "the file system was full, damaged or read-only when they were set",
     "the next start of the daemon shows the old ones",
     "see to the file system, and set a value again: zorvanectl info set"},
    {FindingCode::mappingDangling, "mapping-dangling", fault, "a sandbox mapping leads to no container",
     "the daemon was stopped between the move of a container and its mapping",
     "a sandbox that is built from it does not find the container", "nothing: the next start of the daemon removes it"},
    {FindingCode::stagingLeftover, "staging-leftover", fault, "something lies in the staging directory",
     "the daemon was stopped while it made or replaced a container; or it is at work on something large right now",
     "it takes its space", "nothing: the next start of the daemon finishes or discards it"},
    {FindingCode::asideLeftover, "aside-leftover", fault,
     "an old container lies aside at the top of its file system, or a copy that was to take its place",
     "the daemon was stopped in the middle of a replace; or it is at one right now",
     "it takes its space; no client can see it",
     "nothing: the next start of the daemon brings it back or discards it. If it stays, the journal beside it cannot "
     "be "
     "settled: see journal-leftover"},
    {FindingCode::deathRowItem, "death-row-item", fault, "something waits for its deletion",
     "the daemon was stopped before it came to it, or something in it cannot be removed",
     "it takes its space; no client can see it", "zorvanectl empty-death-row deletes it; so does the next start"},
    {FindingCode::journalLeftover, "journal-leftover", fault, "the journal of a replace lies there",
     "the daemon was stopped in the middle of a replace, or its recovery could not finish",
     "the old container or the new one is where the other one should be, whole in either case",
     "nothing: the next start of the daemon finishes or undoes the replace. If it stays, the daemon's log says why"},
    {FindingCode::writeLeftover, "write-leftover", fault, "a file lies there whose atomic writing was cut short",
     "the daemon was stopped while it wrote", "none: the old file holds, and this one is never read",
     "nothing: the daemon removes it when it next writes the file, or when it is next started"},
    {FindingCode::copyLeftover, "copy-leftover", fault, "a copy between two file systems lies there that was cut short",
     "the daemon was stopped while it moved a container, or a directory of them, to another file system",
     "it takes its space; it is never taken for a container",
     "nothing: the daemon discards it when it is next started, outside of its staging directory at the next boot"},
    {FindingCode::directoryLeftover, "directory-leftover", fault,
     "a directory lies there that never got its final name", "the daemon was stopped while it made the directory",
     "none: it is empty and has no meaning", "remove it, with the command that the check names"},
    {FindingCode::groupUnreferenced, "group-unreferenced", fault,
     "a group container's group is in nobody's entitlements",
     "it was made without a registration, or the registration was removed by hand",
     "the first start of the daemon after a boot deletes it with all it holds",
     "register the entitlement of whoever uses it (zorvanectl entitlements set) before the next boot, if its content "
     "is "
     "wanted; else nothing"},
    {FindingCode::groupNotMade, "group-not-made", note, "a group that is in somebody's entitlements has no container",
     "no client has asked for its path yet", "none: it is made when somebody first asks", "nothing"},
    {FindingCode::systemUnentitled, "system-unentitled", fault,
     "a system container's identifier is not entitled to one",
     "it was made without a registration, or the registration was removed by hand",
     "the first start of the daemon after a boot deletes it with all it holds",
     "register the entitlement (zorvanectl entitlements set --system-container) before the next boot, if its content "
     "is "
     "wanted; else nothing"},
    {FindingCode::entitlementsUnreadable, "entitlements-unreadable", fault, "the entitlement file cannot be read",
     "it was damaged, or somebody else than the daemon wrote it",
     "which groups are in use cannot be known; the next start of the daemon moves the file aside and begins with none",
     "put a good copy in its place while the daemon is stopped, or start it and register what was lost"},
    {FindingCode::entitlementsAside, "entitlements-aside", fault,
     "an entitlement file that could not be read was moved aside",
     "the file was damaged, or somebody else than the daemon wrote it",
     "the entitlements in it are lost to the daemon. As long as it lies there, nothing is deleted for want of an "
     "entitlement",
     "register what was lost (zorvanectl entitlements set), then remove the file: that says that the loss is accepted"},
    {FindingCode::bootMarkerForeign, "boot-marker-foreign", fault, "the boot marker belongs to somebody else",
     "any user can make a file of this name",
     "it counts as absent: the next start of the daemon does the work of a boot again, and discards transient "
     "containers",
     "nothing: the next start of the daemon makes its own"},
    {FindingCode::bootMarkerMissing, "boot-marker-missing", fault, "the daemon runs, and there is no boot marker",
     "the daemon could not make it, or somebody removed it",
     "the next start of the daemon does the work of a boot again, and discards transient containers",
     "the daemon's log says what stood in the way; start the daemon again when it is out of it"},
    {FindingCode::rootIncomplete, "root-incomplete", fault, "the root lacks a directory or a file that it has to hold",
     "nobody has made it, or somebody removed it", "the daemon does not start there",
     "make it, with the command that the check names"},
    {FindingCode::userNumberTaken, "user-number-taken", fault,
     "another account has the number of the installer or of the system",
     "nothing is configured, and the system gave the usual number to an account of its own",
     "programs of that account can change containers that are not theirs",
     "set installer= and system= in section [users] of /etc/zorvane/zorvaned.conf to accounts of their own. Containers "
     "that are there keep their owner: give them to the new one while the daemon is stopped"},
    {FindingCode::unexamined, "unexamined", fault, "something could not be looked at",
     "the check has not the right to, or the file system failed", "nothing is known of what lies there",
     "run the check as the user that the daemon runs as; else look at the file system"},
}};

constexpr bool isComplete() {
    for (std::size_t i = 0; i < pages.size(); ++i) {
        const FindingPage& page = pages[i];
        if (page.code != static_cast<FindingCode>(i) || page.word.empty())
            return false;
        for (const char* text : {page.meaning, page.cause, page.consequence, page.whatToDo})
            if (!text || *text == '\0')
                return false;
    }
    return true;
}
static_assert(isComplete(), "every code has a page, in the order of the codes");

} // namespace

std::string_view wordOf(Mender mender) {
    static constexpr std::array<std::string_view, 6> words = {"nobody", "daemon", "next-write",
                                                              "launch", "boot",   "person"};
    return words[static_cast<std::size_t>(mender)];
}

std::span<const FindingPage> findingPages() {
    return pages;
}

const FindingPage& pageOf(FindingCode code) {
    return pages[static_cast<std::size_t>(code)];
}

const FindingPage* pageOf(std::string_view word) {
    const auto found = std::ranges::find(pages, word, &FindingPage::word);
    return found == pages.end() ? nullptr : &*found;
}

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
