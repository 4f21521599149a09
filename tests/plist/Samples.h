// SPDX-License-Identifier: Apache-2.0
// What the tests of the property-list forms share: byte strings, binary lists assembled object by object, and the
// memory that a call takes.
#pragma once

#include "plist/Value.h"

#include <cstddef>
#include <cstdint>
#include <string_view>
#include <vector>

namespace zor::plist::test {

using Objects = std::vector<Data>;

inline Data bytesOf(std::string_view text) {
    return {text.begin(), text.end()};
}

/// Where a trailer says something else than the truth.
struct Frame {
    std::uint64_t root = 0;
    std::size_t offsetWidth = 1;
    std::size_t referenceWidth = 1;
};

inline void putNumber(Data& out, std::uint64_t number, std::size_t width) {
    for (std::size_t i = width; i-- > 0;)
        out.push_back(i < 8 ? static_cast<std::uint8_t>(number >> (8 * i)) : 0);
}

/// Magic, the objects as they are given, a true offset table, and the trailer.
inline Data assemble(const Objects& objects, const Frame& frame = {}) {
    Data out = bytesOf("bplist00");
    std::vector<std::size_t> offsets;
    for (const Data& object : objects) {
        offsets.push_back(out.size());
        out.insert(out.end(), object.begin(), object.end());
    }
    const std::size_t table = out.size();
    for (const std::size_t offset : offsets)
        putNumber(out, offset, frame.offsetWidth);
    putNumber(out, 0, 6);
    putNumber(out, frame.offsetWidth, 1);
    putNumber(out, frame.referenceWidth, 1);
    putNumber(out, objects.size(), 8);
    putNumber(out, frame.root, 8);
    putNumber(out, table, 8);
    return out;
}

/// `depth` arrays inside each other.
inline Value nestedArrays(std::size_t depth) {
    Value value(Array{});
    for (std::size_t i = 1; i < depth; ++i) {
        Array outer;
        outer.push_back(std::move(value));
        value = Value(std::move(outer));
    }
    return value;
}

/// Watches what this thread allocates with operator new from here on.
class MemoryWatch {
public:
    MemoryWatch();
    /// The most bytes that lived at one time since.
    [[nodiscard]] std::size_t peakBytes() const;
};

} // namespace zor::plist::test
