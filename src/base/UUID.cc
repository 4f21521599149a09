// SPDX-License-Identifier: Apache-2.0
#include "base/UUID.h"

#include "base/ZORException.h"

#include <algorithm>
#include <unistd.h>

namespace zor {

UUID UUID::random() {
    UUID uuid;
    if (::getentropy(uuid.bytes_.data(), byteCount) != 0)
        throw ZORException("RandomUnavailable", "the kernel gave no random bytes");
    uuid.bytes_[6] = static_cast<std::uint8_t>((uuid.bytes_[6] & 0x0f) | 0x40);
    uuid.bytes_[8] = static_cast<std::uint8_t>((uuid.bytes_[8] & 0x3f) | 0x80);
    return uuid;
}

std::optional<UUID> UUID::parse(std::string_view text) {
    if (const auto bytes = ipc::uuidOfText(text))
        return UUID(*bytes);
    return std::nullopt;
}

std::string UUID::string() const {
    return ipc::uuidText(bytes_);
}

} // namespace zor
