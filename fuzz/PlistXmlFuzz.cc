// SPDX-License-Identifier: Apache-2.0
// Any bytes as an XML property list. A value that reads has to be writable in the binary form and to read back from it
// equal.
#include "plist/Codec.h"

#include <cstdlib>

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* bytes, std::size_t size) {
    using namespace zor::plist;
    const auto read = readXml({bytes, size});
    if (!read) {
        if (read.error().offset > size)
            std::abort();
        return 0;
    }
    const auto written = writeBinary(*read);
    if (!written)
        std::abort();
    const auto again = readBinary(*written);
    if (!again || !(*again == *read))
        std::abort();
    return 0;
}
