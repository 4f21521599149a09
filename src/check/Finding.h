// SPDX-License-Identifier: Apache-2.0
// One thing that is wrong with a store, and the kinds of them: their stable words, and a page about each.
#pragma once

#include "base/ContainerClass.h"
#include "ipc/Identifiers.h"

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

namespace zor::check {

// The kinds of finding, their stable words, and a page about each: the one home of both.

enum class FindingCode : std::uint8_t {
    metadataMissing,
    metadataInvalid,
    wrongClassDirectory,
    doubledContainer,
    containerName,
    containerAttributes,
    subdirectoryMissing,
    subdirectoryAttributes,
    wrongShape,
    protectionDiffers,
    infoUnsaved,
    mappingDangling,
    stagingLeftover,
    asideLeftover,
    deathRowItem,
    journalLeftover,
    writeLeftover,
    copyLeftover,
    directoryLeftover,
    groupUnreferenced,
    groupNotMade,
    systemUnentitled,
    entitlementsUnreadable,
    entitlementsAside,
    bootMarkerForeign,
    bootMarkerMissing,
    rootIncomplete,
    userNumberTaken,
    unexamined,
};
inline constexpr std::size_t findingCodeCount = 29;

/// The one who puts it right.
enum class Mender : std::uint8_t {
    /// It is no fault.
    nobody,
    /// The daemon, when a client asks it to.
    daemon,
    /// The daemon, when it next writes the file.
    nextWrite,
    /// The daemon, when it is next started.
    launch,
    /// The daemon, at its first start after a boot.
    boot,
    person,
};
/// A stable word for programs.
[[nodiscard]] std::string_view wordOf(Mender mender);

/// Static strings, never empty.
struct FindingPage {
    FindingCode code;
    /// The word by which programs know the finding.
    std::string_view word;
    /// A note says what is as it should be but may surprise: a store with notes alone is whole.
    bool isNote;
    const char* meaning;
    const char* cause;
    const char* consequence;
    const char* whatToDo;
};
/// In the order of the codes.
[[nodiscard]] std::span<const FindingPage> findingPages();
[[nodiscard]] const FindingPage& pageOf(FindingCode code);
/// nullptr for a word that is none.
[[nodiscard]] const FindingPage* pageOf(std::string_view word);

// One thing that is wrong with a store, as a check found it.

struct Finding {
    FindingCode code{};
    /// Below the root, without a leading slash; absolute when it lies outside. Names that others chose: bytes.
    std::string path;
    /// One sentence without a full stop. May quote names.
    std::string what;
    std::optional<ContainerClass> containerClass;
    std::optional<std::uint32_t> user;
    /// Empty when it is not known.
    std::string identifier;
    bool transient = false;
    /// The container's identity, when its metadata was believed.
    std::optional<UUID> uuid;
    /// The rule that metadata breaks when it is not valid, a short word.
    std::string rule;
    Mender mender = Mender::person;
    /// The command that a person may type; empty when nothing helps.
    std::string command;

    /// Whether two looks have seen the same.
    [[nodiscard]] bool isSameAs(const Finding& other) const {
        return code == other.code && path == other.path && identifier == other.identifier && user == other.user &&
               rule == other.rule;
    }
};

// Command lines for people to type.

/// One word of a shell's, whatever bytes it holds; nothing in it steers a terminal.
[[nodiscard]] std::string shellQuoted(std::string_view text);

/// A program of the system's that takes "--root", for this root.
[[nodiscard]] std::string programFor(std::string_view program, std::string_view root);

/// `command`, in this directory and nowhere else: the directory lies where a client may put a link in its place
/// meanwhile, and root types this.
[[nodiscard]] std::string inDirectory(std::string_view directory, std::string_view command);

struct RepairStep {
    enum class Act : std::uint8_t {
        /// Nothing is done here.
        none,
        /// The standard subdirectories of the container below are made again, with their owner and mode.
        recreateStructure,
        /// The items that wait for their deletion are deleted.
        emptyDeathRow,
    };
    Act act = Act::none;
    Mender mender = Mender::person;
    /// One line for people: what is done, or has to be. May quote names.
    std::string text;
    /// The command that a person may type to have it done; empty when there is nothing to type.
    std::string command;
    // The container that it is done to.
    ContainerClass containerClass = ContainerClass::undefined;
    std::uint32_t user = 0;
    std::string identifier;
    UUID uuid;

    /// Whether something is gone for good when it is done.
    [[nodiscard]] bool destroys() const { return act == Act::emptyDeathRow; }
};

/// In the order in which they are to be done: first what the daemon does now. `root` is the system root's path.
[[nodiscard]] std::vector<RepairStep> repairSteps(const std::vector<Finding>& findings, const std::string& root);

} // namespace zor::check
