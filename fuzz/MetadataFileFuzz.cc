// SPDX-License-Identifier: Apache-2.0
// Any bytes as a container's metadata file. A file that is accepted holds what the daemon relies on, and a file written
// from the record reads back as the same record. The first byte chooses the user and whether the class path is checked.
#include "plist/Codec.h"
#include "store/ZORMetadata.h"

#include <cstdlib>
#include <string>

namespace {

void require(bool holds) {
    if (!holds)
        std::abort();
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* bytes, std::size_t size) {
    using namespace zor;
    if (size == 0)
        return 0;
    const std::uint32_t userId = 501 + (bytes[0] & 1U);
    const CheckClassPath check = (bytes[0] & 2U) != 0 ? CheckClassPath::yes : CheckClassPath::no;
    static const ContainerPlace place(FileURL::directory("/private/var/mobile/Containers/Data/Application/X"));
    const auto record = parseMetadata({bytes + 1, size - 1}, place, userId, check);
    if (!record) {
        const ZORError& error = record.error().error;
        require(error.is(ErrorCode::metadataUnreadable) || error.is(ErrorCode::metadataInvalid));
        require(error.description().has_value());
        return 0;
    }
    require(isValidClass((*record)->containerClass()));
    require((*record)->uid() == userId);
    require(check == CheckClassPath::no || (*record)->containerClass() == ContainerClass::dataApplication);
    const auto written = plist::writeBinary((*record)->fileContent());
    require(written.has_value());
    const auto again = parseMetadata(*written, place, userId, check);
    require(again.has_value());
    require((*again)->identifier() == (*record)->identifier());
    require((*again)->uuid() == (*record)->uuid());
    require((*again)->containerClass() == (*record)->containerClass());
    require(((*again)->info() == nullptr) == ((*record)->info() == nullptr));
    require(!(*again)->info() || *(*again)->info() == *(*record)->info());
    return 0;
}
