// SPDX-License-Identifier: Apache-2.0
// The two names of a container: its identifier, and its UUID; and the name of a file that stands for an identifier.
//
// A UUID is data of exactly 16 bytes in a message, 36 characters in the names of directories and locks. It is a value
// of one thread; the functions are pure, but for random.
#pragma once

#include "plist/Value.h"

#include <array>
#include <compare>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace zor::ipc {

// The rule for identifiers: of a container, of a program, of a group. Pure; any thread.

/// An identifier is kept in memory and repeated in lists, for each container that has it. Those in use have some dozen
/// bytes; names of files and domains stay below 256.
inline constexpr std::size_t identifierBytesMax = 1024;

/// At most identifierBytesMax bytes of UTF-8, and no NUL.
[[nodiscard]] bool isIdentifier(std::string_view text);

/// For tables in memory; other ones in each process. So nobody can choose identifiers that meet, and have each lookup
/// walk past all of them.
[[nodiscard]] std::size_t hashOfIdentifier(std::string_view identifier) noexcept;

} // namespace zor::ipc

namespace zor {

class UUID {
public:
    static constexpr std::size_t byteCount = 16;
    using Bytes = std::array<std::uint8_t, byteCount>;

    UUID() = default;
    explicit UUID(const Bytes& bytes) : bytes_(bytes) {}
    /// A random (version 4) UUID from the kernel's generator. Throws std::system_error where the kernel gives none.
    static UUID random();
    /// The 8-4-4-4-12 form, digits in either case; nullopt for anything else.
    static std::optional<UUID> parse(std::string_view text);
    /// The UUID of a message. nullopt when `value` is nullptr or anything but 16 bytes of data.
    static std::optional<UUID> of(const plist::Value* value);
    static std::optional<UUID> of(const plist::Dictionary& dictionary, std::string_view key) {
        return of(dictionary.find(key));
    }

    /// Upper-case hexadecimal digits with hyphens, 36 characters.
    [[nodiscard]] std::string string() const;
    [[nodiscard]] plist::Value value() const { return plist::Data(bytes_.begin(), bytes_.end()); }
    [[nodiscard]] const Bytes& bytes() const { return bytes_; }
    auto operator<=>(const UUID&) const = default;

private:
    Bytes bytes_{};
};

} // namespace zor

namespace zor::ipc {

// Any string as one path component, and back: for names that a client chose and a directory has to hold. Pure; any
// thread.

/// The longest name a directory can hold. An encoded string that is longer has no file.
inline constexpr std::size_t componentBytesMax = 255;

/// Letters, digits, "-", "_" and "." stay; every other byte, and a "." in the first place, becomes "%" and two
/// upper-case hexadecimal digits. Different strings give different names, none of them hidden, none with a slash. An
/// empty string stays empty, which is no name.
[[nodiscard]] std::string percentEncode(std::string_view text);

/// The string that percentEncode turned into `component`; nothing when it made no such name.
[[nodiscard]] std::optional<std::string> percentDecode(std::string_view component);

} // namespace zor::ipc
