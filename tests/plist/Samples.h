// SPDX-License-Identifier: Apache-2.0
// What the tests of the property-list forms share: byte strings, binary lists assembled object by object, damage, and
// the memory that a call takes.
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

inline Data operator+(Data left, const Data& right) {
    left.insert(left.end(), right.begin(), right.end());
    return left;
}

/// Where a trailer says something else than the truth.
struct Frame {
    std::uint64_t root = 0;
    std::size_t offsetWidth = 1;
    std::size_t referenceWidth = 1;
};

/// Magic, the objects as they are given, a true offset table, and the trailer.
inline Data assemble(const Objects& objects, const Frame& frame = {}) {
    Data out = bytesOf("bplist00");
    const auto put = [&out](std::uint64_t number, std::size_t width) {
        for (std::size_t i = width; i-- > 0;)
            out.push_back(i < 8 ? static_cast<std::uint8_t>(number >> (8 * i)) : 0);
    };
    std::vector<std::size_t> offsets;
    for (const Data& object : objects) {
        offsets.push_back(out.size());
        out.insert(out.end(), object.begin(), object.end());
    }
    const std::size_t table = out.size();
    for (const std::size_t offset : offsets)
        put(offset, frame.offsetWidth);
    put(frame.offsetWidth, 7);
    put(frame.referenceWidth, 1);
    for (const std::uint64_t number : {std::uint64_t{objects.size()}, frame.root, std::uint64_t{table}})
        put(number, 8);
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

/// The bytes with each single bit of each byte, and with all bits of each, turned over.
template <typename Try>
void forEachDamage(const Data& whole, const Try& tryOne) {
    for (std::size_t at = 0; at < whole.size(); ++at)
        for (const int bits : {1, 2, 4, 8, 16, 32, 64, 128, 255}) {
            Data damaged = whole;
            damaged[at] = static_cast<std::uint8_t>(damaged[at] ^ bits);
            tryOne(damaged);
        }
}

} // namespace zor::plist::test
