// SPDX-License-Identifier: Apache-2.0
// Reads the binary form. Every place and count is compared with what the input still holds before it is used, and every
// piece of memory is charged before it is taken: the sum of charges stays within memoryBytesMax of the input, however
// often objects are shared. Containers being read are on a stack of at most nestingMax: meeting one again is a cycle.
#include "plist/BinaryFormat.h"
#include "plist/Codec.h"
#include "plist/Text.h"

#include <algorithm>
#include <array>
#include <bit>
#include <cstring>

namespace zor::plist {

namespace {

using binary::Kind;
using Bytes = std::span<const std::uint8_t>;

/// `width` is 1 to 8 and the bytes are there.
std::uint64_t bigEndian(const std::uint8_t* at, std::size_t width) {
    // Small property lists, the usual ones, have offsets and references of one byte.
    if (width == 1)
        return *at;
    std::uint64_t number = 0;
    for (std::size_t i = 0; i < width; ++i)
        number = (number << 8) | at[i];
    return number;
}

class BinaryReader {
public:
    explicit BinaryReader(Bytes bytes) : bytes_(bytes), memoryLeft_(memoryBytesMax(bytes.size())) {}

    std::expected<Value, ReadError> read();

private:
    /// An object's marker as it reads, and the place where its content starts.
    struct Header {
        Kind kind{};
        std::uint8_t low = 0;
        /// The count of a data, string or container object; 0 for the others.
        std::size_t count = 0;
        std::size_t content = 0;
    };

    bool readTrailer();
    bool locate(std::uint64_t number, std::size_t& at);
    bool readHeader(std::size_t at, Header& header);
    bool readCount(std::size_t& at, std::size_t& count);
    bool readObject(std::uint64_t number, Value& out);
    bool readSimple(const Header& header, Value& out);
    bool readInteger(const Header& header, Value& out);
    bool readReal(const Header& header, Value& out);
    bool readDate(const Header& header, Value& out);
    bool readData(const Header& header, Value& out);
    bool readString(const Header& header, std::string& out);
    bool readAscii(const Header& header, std::string& out);
    bool readUtf16(const Header& header, std::string& out);
    bool readKey(std::uint64_t number, std::string& out);
    bool readArray(const Header& header, Value& out);
    bool readDictionary(const Header& header, Value& out);
    bool enter(std::uint64_t number, std::size_t at);

    /// The reference at `index` of a container whose references start at `at`. They are known to be there.
    [[nodiscard]] std::uint64_t reference(std::size_t at, std::size_t index) const {
        return bigEndian(bytes_.data() + at + index * referenceWidth_, referenceWidth_);
    }
    /// True when `count` items of `width` bytes from `at` lie before the offset table.
    [[nodiscard]] bool holds(std::size_t at, std::size_t count, std::size_t width) const {
        return count <= (tableAt_ - at) / width;
    }
    bool charge(std::size_t at, std::size_t bytes) {
        if (bytes > memoryLeft_)
            return fail(at, "shared objects would take more memory than the bytes pay for");
        memoryLeft_ -= bytes;
        return true;
    }
    bool fail(std::size_t at, const char* reason) {
        error_ = {.offset = at, .reason = reason};
        return false;
    }

    Bytes bytes_;
    std::size_t memoryLeft_;
    std::size_t offsetWidth_ = 0;
    std::size_t referenceWidth_ = 0;
    std::uint64_t objectCount_ = 0;
    std::uint64_t root_ = 0;
    /// Also where the objects end.
    std::size_t tableAt_ = 0;
    /// Numbers of the containers being read, outermost first.
    std::array<std::uint64_t, nestingMax> open_;
    std::size_t nesting_ = 0;
    ReadError error_;
};

std::expected<Value, ReadError> BinaryReader::read() {
    Value root;
    if (!readTrailer() || !readObject(root_, root))
        return std::unexpected(error_);
    return root;
}

bool BinaryReader::readTrailer() {
    const std::size_t size = bytes_.size();
    if (size < binary::magic.size() || std::memcmp(bytes_.data(), binary::magic.data(), binary::magic.size()) != 0)
        return fail(0, "not a binary property list of version 00");
    // The least: one object of one byte and its one-byte offset.
    if (size < binary::magic.size() + 1 + 1 + binary::trailerBytes)
        return fail(size, "too short for a property list");

    const std::size_t at = size - binary::trailerBytes;
    const std::uint8_t* trailer = bytes_.data() + at;
    offsetWidth_ = trailer[binary::trailerOffsetWidth];
    referenceWidth_ = trailer[binary::trailerReferenceWidth];
    objectCount_ = bigEndian(trailer + binary::trailerObjectCount, 8);
    root_ = bigEndian(trailer + binary::trailerRoot, 8);
    const std::uint64_t table = bigEndian(trailer + binary::trailerTable, 8);

    if (offsetWidth_ < 1 || offsetWidth_ > 8)
        return fail(at + binary::trailerOffsetWidth, "the width of an offset is not 1 to 8");
    if (referenceWidth_ < 1 || referenceWidth_ > 8)
        return fail(at + binary::trailerReferenceWidth, "the width of a reference is not 1 to 8");
    if (table <= binary::magic.size() || table >= at)
        return fail(at + binary::trailerTable, "the offset table lies outside");
    tableAt_ = static_cast<std::size_t>(table);
    if ((at - tableAt_) % offsetWidth_ != 0 || objectCount_ != (at - tableAt_) / offsetWidth_)
        return fail(at + binary::trailerObjectCount, "the offset table does not hold as many objects as counted");
    return true;
}

bool BinaryReader::locate(std::uint64_t number, std::size_t& at) {
    if (number >= objectCount_)
        return fail(bytes_.size() - binary::trailerBytes, "a reference to an object that does not exist");
    const std::size_t entry = tableAt_ + static_cast<std::size_t>(number) * offsetWidth_;
    const std::uint64_t offset = bigEndian(bytes_.data() + entry, offsetWidth_);
    if (offset < binary::magic.size() || offset >= tableAt_)
        return fail(entry, "an object offset that lies outside the objects");
    at = static_cast<std::size_t>(offset);
    return true;
}

bool BinaryReader::readHeader(std::size_t at, Header& header) {
    const std::uint8_t marker = bytes_[at];
    header.kind = static_cast<Kind>(marker >> 4);
    header.low = marker & 0xFU;
    header.content = at + 1;
    switch (header.kind) {
    case Kind::simple:
    case Kind::integer:
    case Kind::real:
    case Kind::date:
        return true;
    case Kind::data:
    case Kind::ascii:
    case Kind::utf16:
    case Kind::array:
    case Kind::dictionary:
        header.count = header.low;
        return header.low != binary::countFollows || readCount(header.content, header.count);
    }
    return fail(at, "an object of a type that property lists do not have");
}

bool BinaryReader::readCount(std::size_t& at, std::size_t& count) {
    if (!holds(at, 1, 1))
        return fail(at, "a count that is cut off");
    const std::uint8_t marker = bytes_[at];
    const std::size_t log2Width = marker & 0xFU;
    if (static_cast<Kind>(marker >> 4) != Kind::integer || log2Width > 3)
        return fail(at, "a count that is no integer of 1 to 8 bytes");
    const std::size_t width = std::size_t{1} << log2Width;
    if (!holds(at + 1, 1, width))
        return fail(at, "a count that is cut off");
    count = static_cast<std::size_t>(bigEndian(bytes_.data() + at + 1, width));
    at += 1 + width;
    return true;
}

bool BinaryReader::enter(std::uint64_t number, std::size_t at) {
    const auto last = open_.begin() + static_cast<std::ptrdiff_t>(nesting_);
    if (std::find(open_.begin(), last, number) != last)
        return fail(at, "a container that contains itself");
    if (nesting_ == nestingMax)
        return fail(at, "containers nested more than 64 deep");
    open_[nesting_++] = number;
    return true;
}

bool BinaryReader::readObject(std::uint64_t number, Value& out) {
    std::size_t at = 0;
    Header header;
    if (!locate(number, at) || !readHeader(at, header))
        return false;
    switch (header.kind) {
    case Kind::simple:
        return readSimple(header, out);
    case Kind::integer:
        return readInteger(header, out);
    case Kind::real:
        return readReal(header, out);
    case Kind::date:
        return readDate(header, out);
    case Kind::data:
        return readData(header, out);
    case Kind::ascii:
    case Kind::utf16: {
        std::string text;
        if (!readString(header, text))
            return false;
        out = Value(std::move(text));
        return true;
    }
    case Kind::array:
    case Kind::dictionary: {
        if (!enter(number, at))
            return false;
        const bool done = header.kind == Kind::array ? readArray(header, out) : readDictionary(header, out);
        --nesting_;
        return done;
    }
    }
    return fail(at, "an object of a type that property lists do not have");
}

bool BinaryReader::readSimple(const Header& header, Value& out) {
    if (header.low != binary::markerFalse && header.low != binary::markerTrue)
        return fail(header.content - 1, "a null or fill object");
    out = Value(header.low == binary::markerTrue);
    return true;
}

bool BinaryReader::readInteger(const Header& header, Value& out) {
    if (header.low > 4)
        return fail(header.content - 1, "an integer of more than 16 bytes");
    const std::size_t width = std::size_t{1} << header.low;
    if (!holds(header.content, 1, width))
        return fail(header.content, "an integer that is cut off");
    const std::uint8_t* at = bytes_.data() + header.content;
    if (width == 16) {
        // The wide form exists for what eight signed bytes cannot say; beyond 64 bits there is no value for it.
        if (bigEndian(at, 8) != 0)
            return fail(header.content, "an integer that does not fit 64 bits");
        out = Value(bigEndian(at + 8, 8));
    } else if (width == 8) {
        out = Value(static_cast<std::int64_t>(bigEndian(at, 8)));
    } else {
        out = Value(bigEndian(at, width));
    }
    return true;
}

bool BinaryReader::readReal(const Header& header, Value& out) {
    if (header.low != 2 && header.low != 3)
        return fail(header.content - 1, "a real of neither 4 nor 8 bytes");
    const std::size_t width = std::size_t{1} << header.low;
    if (!holds(header.content, 1, width))
        return fail(header.content, "a real that is cut off");
    const std::uint64_t bits = bigEndian(bytes_.data() + header.content, width);
    if (width == 4)
        out = Value(static_cast<double>(std::bit_cast<float>(static_cast<std::uint32_t>(bits))));
    else
        out = Value(std::bit_cast<double>(bits));
    return true;
}

bool BinaryReader::readDate(const Header& header, Value& out) {
    if (header.low != 3)
        return fail(header.content - 1, "a date that is not 8 bytes");
    if (!holds(header.content, 1, 8))
        return fail(header.content, "a date that is cut off");
    out = Value(Date{std::bit_cast<double>(bigEndian(bytes_.data() + header.content, 8))});
    return true;
}

bool BinaryReader::readData(const Header& header, Value& out) {
    if (!holds(header.content, header.count, 1))
        return fail(header.content, "data that is cut off");
    if (!charge(header.content, header.count))
        return false;
    const Bytes content = bytes_.subspan(header.content, header.count);
    out = Value(Data(content.begin(), content.end()));
    return true;
}

bool BinaryReader::readString(const Header& header, std::string& out) {
    return header.kind == Kind::ascii ? readAscii(header, out) : readUtf16(header, out);
}

bool BinaryReader::readAscii(const Header& header, std::string& out) {
    if (!holds(header.content, header.count, 1))
        return fail(header.content, "a string that is cut off");
    if (!charge(header.content, header.count))
        return false;
    const char* text = reinterpret_cast<const char*>(bytes_.data() + header.content);
    if (!isAsciiWithoutNul(text, header.count))
        return fail(header.content, "an ASCII string with a NUL or a byte above 127");
    out.assign(text, header.count);
    return true;
}

bool BinaryReader::readUtf16(const Header& header, std::string& out) {
    if (!holds(header.content, header.count, 2))
        return fail(header.content, "a string that is cut off");
    // A unit of two bytes becomes at most three bytes of UTF-8.
    if (!charge(header.content, header.count * 3))
        return false;
    out.reserve(header.count);
    const std::size_t end = header.content + header.count * 2;
    for (std::size_t at = header.content; at < end; at += 2) {
        char32_t unit = static_cast<char32_t>(bigEndian(bytes_.data() + at, 2));
        if (unit == 0)
            return fail(at, "a string with a NUL");
        if (unit >= 0xD800 && unit <= 0xDFFF) {
            if (unit >= 0xDC00 || at + 2 >= end)
                return fail(at, "a surrogate without its pair");
            const auto low = static_cast<char32_t>(bigEndian(bytes_.data() + at + 2, 2));
            if (low < 0xDC00 || low > 0xDFFF)
                return fail(at, "a surrogate without its pair");
            unit = 0x10000 + ((unit - 0xD800) << 10) + (low - 0xDC00);
            at += 2;
        }
        appendUtf8(out, unit);
    }
    return true;
}

bool BinaryReader::readKey(std::uint64_t number, std::string& out) {
    std::size_t at = 0;
    Header header;
    if (!locate(number, at) || !readHeader(at, header))
        return false;
    if (header.kind != Kind::ascii && header.kind != Kind::utf16)
        return fail(at, "a dictionary key that is no string");
    return readString(header, out);
}

bool BinaryReader::readArray(const Header& header, Value& out) {
    if (!holds(header.content, header.count, referenceWidth_))
        return fail(header.content, "an array that is cut off");
    if (!charge(header.content, header.count * sizeof(Value)))
        return false;
    Array values;
    values.reserve(header.count);
    for (std::size_t i = 0; i < header.count; ++i)
        if (!readObject(reference(header.content, i), values.emplace_back()))
            return false;
    out = Value(std::move(values));
    return true;
}

bool BinaryReader::readDictionary(const Header& header, Value& out) {
    if (!holds(header.content, header.count, 2 * referenceWidth_))
        return fail(header.content, "a dictionary that is cut off");
    if (!charge(header.content, header.count * sizeof(Dictionary::Entry)))
        return false;
    std::vector<Dictionary::Entry> entries;
    entries.reserve(header.count);
    for (std::size_t i = 0; i < header.count; ++i) {
        Dictionary::Entry& entry = entries.emplace_back();
        if (!readKey(reference(header.content, i), entry.first) ||
            !readObject(reference(header.content, header.count + i), entry.second))
            return false;
    }
    out = Value(Dictionary::fromUnsorted(std::move(entries)));
    return true;
}

// A container that shares nothing has to fit its own charge, with the payload of each member to spare. The members of a
// long list, of at least 256 objects, take two bytes of reference, one of marker and two of offset each.
constexpr std::size_t longInputBytes = std::size_t{1} << 30;
static_assert(sizeof(Value) < memoryBytesMax(1));
static_assert(sizeof(Dictionary::Entry) < memoryBytesMax(2));
static_assert(sizeof(Value) < memoryBytesMax(longInputBytes + 5) - memoryBytesMax(longInputBytes));
static_assert(sizeof(Dictionary::Entry) < memoryBytesMax(longInputBytes + 10) - memoryBytesMax(longInputBytes));

} // namespace

bool looksBinary(std::span<const std::uint8_t> bytes) {
    constexpr std::string_view anyVersion = binary::magic.substr(0, 6);
    return bytes.size() >= anyVersion.size() && std::memcmp(bytes.data(), anyVersion.data(), anyVersion.size()) == 0;
}

std::expected<Value, ReadError> readBinary(std::span<const std::uint8_t> bytes) {
    return BinaryReader(bytes).read();
}

} // namespace zor::plist
