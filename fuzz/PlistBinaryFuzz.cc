// SPDX-License-Identifier: Apache-2.0
// Any bytes as a binary property list. A value that reads has to be writable, and to read back as the same value and
// the same bytes.
#include "plist/Codec.h"

#include <cstdlib>

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* bytes, std::size_t size) {
    using namespace zor::plist;
    const auto read = readBinary({bytes, size});
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
    if (writeBinary(*again) != written.value())
        std::abort();
    if (describe(&*read, 100).size() > 100)
        std::abort();
    return 0;
}
