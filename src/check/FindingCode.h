// SPDX-License-Identifier: Apache-2.0
// The kinds of finding, their stable words, and a page about each: the one home of both.
#pragma once

#include <cstddef>
#include <cstdint>
#include <span>
#include <string_view>

namespace zor::check {

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
    unexamined,
};
inline constexpr std::size_t findingCodeCount = 25;

/// Who puts it right.
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
    /// What programs know the finding by.
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

} // namespace zor::check
