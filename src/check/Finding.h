// SPDX-License-Identifier: Apache-2.0
// One thing that is wrong with a store, and the kinds of them: their stable words, and a page about each.
#pragma once

#include "base/ContainerClass.h"
#include "ipc/UUID.h"

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>

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
inline constexpr std::size_t findingCodeCount = 28;

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

} // namespace zor::check
