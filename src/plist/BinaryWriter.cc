// SPDX-License-Identifier: Apache-2.0
// Writes the binary form in two passes over the value. The first checks it and measures it to the byte, so every
// refusal comes before the first byte is written and the buffer grows once; the second writes objects, references and
// the offset table in their final places. Objects are numbered in the order met: a container, then for each member key
// and value. Nothing is made unique: looking for equal strings would cost more than the bytes saved in messages of this
// size.
#include "plist/BinaryFormat.h"
#include "plist/Codec.h"
#include "plist/Text.h"

#include <algorithm>
#include <bit>
#include <cstring>

namespace zor::plist {

namespace {

using binary::Kind;

constexpr std::uint8_t marker(Kind kind, std::size_t low) {
    return static_cast<std::uint8_t>(static_cast<unsigned>(kind) << 4 | static_cast<unsigned>(low));
}

/// The width, of 1, 2, 4 and 8 bytes, that holds `number`.
constexpr std::size_t widthOf(std::uint64_t number) {
    return number <= 0xFF ? 1 : number <= 0xFFFF ? 2 : number <= 0xFFFF'FFFF ? 4 : 8;
}

/// Marker and, from 15 up, the integer object that holds the count.
constexpr std::size_t headerBytes(std::size_t count) {
    return count < binary::countFollows ? 1 : 2 + widthOf(count);
}

std::size_t integerBytes(const Value& value) {
    if (value.type() == Type::unsignedInteger)
        return 1 + 16;
    return 1 + widthOf(static_cast<std::uint64_t>(*value.asSigned()));
}

/// First pass.
class Measure {
public:
    bool add(const Value& value, std::size_t nesting);
    bool add(const Dictionary& entries, std::size_t nesting);

    std::size_t objects = 0;
    std::size_t references = 0;
    /// The sum over all objects, without the references in containers.
    std::size_t bytes = 0;
    const char* reason = nullptr;

private:
    bool addString(const std::string& text);
    bool addContainer(std::size_t count, std::size_t referencesEach, std::size_t nesting);
    bool fail(const char* why) {
        reason = why;
        return false;
    }
};

bool Measure::addString(const std::string& text) {
    ++objects;
    if (isAsciiWithoutNul(text.data(), text.size())) {
        bytes += headerBytes(text.size()) + text.size();
        return true;
    }
    std::size_t units = 0;
    for (std::string_view rest = text; !rest.empty();) {
        const Utf8Character character = decodeUtf8(rest);
        if (character.length == 0)
            return fail("a string that is not UTF-8");
        if (character.codePoint == 0)
            return fail("a string with a NUL");
        units += character.length == 4 ? 2 : 1;
        rest.remove_prefix(character.length);
    }
    bytes += headerBytes(units) + units * 2;
    return true;
}

bool Measure::addContainer(std::size_t count, std::size_t referencesEach, std::size_t nesting) {
    if (nesting == nestingMax)
        return fail("containers nested more than 64 deep");
    ++objects;
    bytes += headerBytes(count);
    references += count * referencesEach;
    return true;
}

bool Measure::add(const Dictionary& entries, std::size_t nesting) {
    return addContainer(entries.size(), 2, nesting) &&
           std::all_of(entries.begin(), entries.end(), [&](const Dictionary::Entry& each) {
               return addString(each.first) && add(each.second, nesting + 1);
           });
}

bool Measure::add(const Value& value, std::size_t nesting) {
    switch (value.type()) {
    case Type::string:
        return addString(*value.asString());
    case Type::array: {
        const Array& values = *value.asArray();
        return addContainer(values.size(), 1, nesting) &&
               std::all_of(values.begin(), values.end(), [&](const Value& each) { return add(each, nesting + 1); });
    }
    case Type::dictionary:
        return add(*value.asDictionary(), nesting);
    case Type::data:
        bytes += headerBytes(value.asData()->size()) + value.asData()->size();
        break;
    case Type::boolean:
        bytes += 1;
        break;
    case Type::integer:
    case Type::unsignedInteger:
        bytes += integerBytes(value);
        break;
    case Type::real:
    case Type::date:
        bytes += 1 + 8;
        break;
    }
    ++objects;
    return true;
}

/// Second pass. `start` has room for all that was measured.
class Writer {
public:
    Writer(std::uint8_t* start, const Measure& measure);

    template <typename Root>
    void write(const Root& root);
    [[nodiscard]] static std::size_t size(const Measure& measure) {
        return tableAt(measure) + measure.objects * widthOf(tableAt(measure)) + binary::trailerBytes;
    }

private:
    // Offsets and references take the least width that also holds the offset of the table and the count of objects:
    // other readers of the format check exactly that.
    [[nodiscard]] static std::size_t tableAt(const Measure& measure) {
        return binary::magic.size() + measure.bytes + measure.references * widthOf(measure.objects);
    }

    void writeObject(const Value& value);
    void writeObject(const Dictionary& entries) { writeDictionary(entries); }
    void writeString(const std::string& text);
    void writeInteger(const Value& value);
    void writeArray(const Array& values);
    void writeDictionary(const Dictionary& entries);
    void writeTrailer();
    void header(Kind kind, std::size_t count);
    /// Gives the object that starts here its number.
    void begin() {
        putAt(table_ + next_ * offsetWidth_, static_cast<std::uint64_t>(at_ - start_), offsetWidth_);
        ++next_;
    }
    static void putAt(std::uint8_t* at, std::uint64_t number, std::size_t width) {
        for (std::size_t i = width; i-- > 0; number >>= 8)
            at[i] = static_cast<std::uint8_t>(number);
    }
    void put(std::uint64_t number, std::size_t width) {
        putAt(at_, number, width);
        at_ += width;
    }
    void putBytes(const void* bytes, std::size_t count) {
        if (count != 0)
            std::memcpy(at_, bytes, count);
        at_ += count;
    }

    std::uint8_t* start_;
    std::uint8_t* at_;
    std::uint8_t* table_;
    std::size_t objects_;
    std::size_t offsetWidth_;
    std::size_t referenceWidth_;
    std::uint64_t next_ = 0;
};

Writer::Writer(std::uint8_t* start, const Measure& measure)
    : start_(start), at_(start), table_(start + tableAt(measure)), objects_(measure.objects),
      offsetWidth_(widthOf(tableAt(measure))), referenceWidth_(widthOf(measure.objects)) {}

template <typename Root>
void Writer::write(const Root& root) {
    putBytes(binary::magic.data(), binary::magic.size());
    writeObject(root);
    // The size measured and the size written are the same, or memory is already damaged.
    if (at_ != table_ || next_ != objects_)
        __builtin_trap();
    at_ += objects_ * offsetWidth_;
    writeTrailer();
}

void Writer::writeTrailer() {
    std::memset(at_, 0, binary::trailerOffsetWidth);
    at_ += binary::trailerOffsetWidth;
    put(offsetWidth_, 1);
    put(referenceWidth_, 1);
    put(objects_, 8);
    put(0, 8);
    put(static_cast<std::uint64_t>(table_ - start_), 8);
}

void Writer::header(Kind kind, std::size_t count) {
    if (count < binary::countFollows) {
        put(marker(kind, count), 1);
        return;
    }
    const std::size_t width = widthOf(count);
    put(marker(kind, binary::countFollows), 1);
    put(marker(Kind::integer, static_cast<std::size_t>(std::countr_zero(width))), 1);
    put(count, width);
}

void Writer::writeObject(const Value& value) {
    switch (value.type()) {
    case Type::string:
        return writeString(*value.asString());
    case Type::array:
        return writeArray(*value.asArray());
    case Type::dictionary:
        return writeDictionary(*value.asDictionary());
    case Type::integer:
    case Type::unsignedInteger:
        return writeInteger(value);
    case Type::boolean:
        begin();
        put(*value.asBoolean() ? binary::markerTrue : binary::markerFalse, 1);
        return;
    case Type::real:
        begin();
        put(marker(Kind::real, 3), 1);
        put(std::bit_cast<std::uint64_t>(*value.asReal()), 8);
        return;
    case Type::date:
        begin();
        put(binary::markerDate, 1);
        put(std::bit_cast<std::uint64_t>(value.asDate()->secondsSinceReference), 8);
        return;
    case Type::data:
        begin();
        header(Kind::data, value.asData()->size());
        putBytes(value.asData()->data(), value.asData()->size());
        return;
    }
}

void Writer::writeInteger(const Value& value) {
    begin();
    if (value.type() == Type::unsignedInteger) {
        put(marker(Kind::integer, 4), 1);
        put(0, 8);
        put(*value.asUnsigned(), 8);
        return;
    }
    // One to four bytes read as unsigned, so a negative number always takes eight.
    const auto bits = static_cast<std::uint64_t>(*value.asSigned());
    const std::size_t width = widthOf(bits);
    put(marker(Kind::integer, static_cast<std::size_t>(std::countr_zero(width))), 1);
    put(bits, width);
}

void Writer::writeString(const std::string& text) {
    begin();
    if (isAsciiWithoutNul(text.data(), text.size())) {
        header(Kind::ascii, text.size());
        putBytes(text.data(), text.size());
        return;
    }
    std::size_t units = 0;
    for (const char byte : text) {
        // A lead byte is one unit, that of a four-byte character two; continuation bytes are none.
        const auto bits = static_cast<unsigned char>(byte);
        units += (bits & 0xC0U) == 0x80 ? 0 : bits >= 0xF0 ? 2 : 1;
    }
    header(Kind::utf16, units);
    for (std::string_view rest = text; !rest.empty();) {
        const Utf8Character character = decodeUtf8(rest);
        rest.remove_prefix(character.length);
        if (character.codePoint < 0x10000) {
            put(character.codePoint, 2);
        } else {
            put(0xD800 + ((character.codePoint - 0x10000) >> 10), 2);
            put(0xDC00 + ((character.codePoint - 0x10000) & 0x3FFU), 2);
        }
    }
}

void Writer::writeArray(const Array& values) {
    begin();
    header(Kind::array, values.size());
    std::uint8_t* reference = at_;
    at_ += values.size() * referenceWidth_;
    for (const Value& value : values) {
        putAt(reference, next_, referenceWidth_);
        reference += referenceWidth_;
        writeObject(value);
    }
}

void Writer::writeDictionary(const Dictionary& entries) {
    begin();
    header(Kind::dictionary, entries.size());
    std::uint8_t* key = at_;
    std::uint8_t* member = key + entries.size() * referenceWidth_;
    at_ = member + entries.size() * referenceWidth_;
    for (const auto& [name, value] : entries) {
        putAt(key, next_, referenceWidth_);
        key += referenceWidth_;
        writeString(name);
        putAt(member, next_, referenceWidth_);
        member += referenceWidth_;
        writeObject(value);
    }
}

template <typename Root>
std::expected<void, WriteError> append(const Root& root, Data& out) {
    Measure measure;
    if (!measure.add(root, 0))
        return std::unexpected(WriteError{measure.reason});
    const std::size_t before = out.size();
    out.resize(before + Writer::size(measure));
    Writer(out.data() + before, measure).write(root);
    return {};
}

} // namespace

std::expected<void, WriteError> appendBinary(const Value& value, Data& out) {
    return append(value, out);
}

std::expected<void, WriteError> appendBinary(const Dictionary& root, Data& out) {
    return append(root, out);
}

std::expected<Data, WriteError> writeBinary(const Value& value) {
    Data out;
    if (const auto done = appendBinary(value, out); !done)
        return std::unexpected(done.error());
    return out;
}

} // namespace zor::plist
