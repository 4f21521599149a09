// SPDX-License-Identifier: Apache-2.0
#include "plist/Read.h"

#include "plist/Binary.h"
#include "plist/Xml.h"

namespace zor::plist {

std::expected<Value, ReadError> readPropertyList(std::span<const std::uint8_t> bytes) {
    return looksBinary(bytes) ? readBinary(bytes) : readXml(bytes);
}

} // namespace zor::plist
