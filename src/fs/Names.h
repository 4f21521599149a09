// SPDX-License-Identifier: Apache-2.0
// Names on disk that the file layer has to know.
#pragma once

#include <string_view>

namespace zor::fs {

// Names that a stop may leave behind. None of them is ever taken for the real thing. The leftover of an atomic write is
// named in Durability.h.

/// How a copy across file systems is named until it is whole.
inline constexpr const char* copyPrefix = ".zorvaned-copy-";

/// The closed directory at the top of a file system (fs/FileSystemDeathRow.h), and the directories in it: the one that
/// holds what is to be deleted, and the one for what is only out of the way.
inline constexpr const char* deathRowOuter = ".zorvaned-dead";
inline constexpr const char* deathRowInner = "com.veltra.zorvaned.dead";
inline constexpr const char* asideInner = "com.veltra.zorvaned.aside";

[[nodiscard]] inline bool isCopyLeftover(std::string_view name) {
    return name.starts_with(copyPrefix);
}

/// Whether `name` is the directory `finalName` on its way to that name.
[[nodiscard]] inline bool isDirectoryLeftover(std::string_view name, std::string_view finalName) {
    constexpr std::size_t randomCharacters = 6;
    return name.size() == finalName.size() + 1 + randomCharacters && name.starts_with(finalName) &&
           name[finalName.size()] == '.';
}

} // namespace zor::fs

namespace zor::names {

// The name of the hidden file in every container that says whom it belongs to. It has its home here because the file
// manager leaves such files alone when it changes the owner of a tree; what is inside is the store's business.

inline constexpr const char* metadataFile = ".com.veltra.zorvane.metadata.plist";

} // namespace zor::names
