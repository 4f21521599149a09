// SPDX-License-Identifier: Apache-2.0
// Dictionaries on disk and the string helpers that go with paths.
#pragma once

#include "base/FileURL.h"
#include "base/ZORError.h"
#include "fs/ZORFileManager.h"
#include "plist/Value.h"

#include <string>
#include <string_view>

namespace zor {

/// How a property-list file is written. The numbers are part of the store's form.
inline constexpr std::uint32_t writeAtomically = 0x1;
inline constexpr std::uint32_t writeWithoutProtection = 0x10000000;
/// The data-protection class of what is written without protection: it can be read while the device is locked.
inline constexpr int classWithoutProtection = 4;

/// The bytes of the file that `url` is to be, in messages. EFBIG for more than `bytesMax`.
Result<plist::Data> serialisedFor(const FileURL& url, const plist::Dictionary& dictionary, std::size_t bytesMax);

/// Serialises as a binary property list and writes it, 0644 and the daemon's own; POSIX error with the previous file
/// untouched. Both options are what every caller wants; others are not offered. EFBIG, before anything is written, for
/// more than `bytesMax`: what a reader would refuse must not replace what it accepts.
Result<void> writeToURL(const plist::Dictionary& dictionary, const FileURL& url, std::uint32_t options,
                        std::size_t bytesMax, ZORFileManager& fileManager);

/// A dictionary from a file that only the daemon can have written, in either property-list form. POSIX error: ENOENT
/// when there is none, EINVAL when it is no dictionary.
Result<plist::Dictionary> readDictionaryAtURL(const FileURL& url, std::size_t bytesMax, ZORFileManager& fileManager);

/// Bytes of a path as a string: what is not UTF-8 stays as it is, for names are bytes.
std::string stringWithFileSystemRepresentation(const char* bytes, std::size_t length);
std::string stringWithFileSystemRepresentation(const char* bytes);
/// Whether a component is exactly "..".
[[nodiscard]] bool containsDotDotPathComponents(std::string_view path);

} // namespace zor
