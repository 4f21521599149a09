// SPDX-License-Identifier: Apache-2.0
// The XML form of property lists, over the parser of libexpat.
#include "plist/Codec.h"
#include "plist/Text.h"
#include "plist/Value.h"

#include <algorithm>
#include <charconv>
#include <chrono>
#include <exception>
#include <expat.h>
#include <memory>
#include <optional>
#include <string_view>

namespace zor::plist {

namespace {

// The texts of the XML form's scalar elements. Each reads the whole text, white space around it aside, and answers
// nullopt for anything else. No locale takes part.

/// True for the white space of XML.
[[nodiscard]] constexpr bool isSpace(char c) {
    return c == ' ' || c == '\t' || c == '\n' || c == '\r';
}

std::string_view trimmed(std::string_view text) {
    while (!text.empty() && isSpace(text.front()))
        text.remove_prefix(1);
    while (!text.empty() && isSpace(text.back()))
        text.remove_suffix(1);
    return text;
}

/// Takes a sign off; true for minus.
bool takeSign(std::string_view& text) {
    if (text.empty() || (text.front() != '-' && text.front() != '+'))
        return false;
    const bool minus = text.front() == '-';
    text.remove_prefix(1);
    return minus;
}

/// `count` decimal digits from `at`, or -1.
int digits(std::string_view text, std::size_t at, std::size_t count) {
    int number = 0;
    for (const char c : text.substr(at, count)) {
        if (c < '0' || c > '9')
            return -1;
        number = number * 10 + (c - '0');
    }
    return number;
}

/// The six bits a base64 character stands for, or -1.
int sextet(char c) {
    if (c >= 'A' && c <= 'Z')
        return c - 'A';
    if (c >= 'a' && c <= 'z')
        return c - 'a' + 26;
    if (c >= '0' && c <= '9')
        return c - '0' + 52;
    return c == '+' ? 62 : c == '/' ? 63 : -1;
}

/// Decimal or 0x hexadecimal with an optional sign, from −2^63 to 2^64 − 1.
std::optional<Value> parseInteger(std::string_view text) {
    text = trimmed(text);
    const bool minus = takeSign(text);
    int base = 10;
    if (text.starts_with("0x") || text.starts_with("0X")) {
        base = 16;
        text.remove_prefix(2);
    }
    std::uint64_t magnitude = 0;
    const char* end = std::to_address(text.end());
    const auto [stop, error] = std::from_chars(std::to_address(text.begin()), end, magnitude, base);
    if (error != std::errc() || stop != end)
        return std::nullopt;
    if (!minus)
        return Value(magnitude);
    constexpr std::uint64_t least = std::uint64_t{1} << 63;
    if (magnitude > least)
        return std::nullopt;
    return Value(static_cast<std::int64_t>(0 - magnitude));
}

/// Decimal with optional fraction and exponent; also inf and nan.
std::optional<Value> parseReal(std::string_view text) {
    text = trimmed(text);
    const bool minus = takeSign(text);
    // The conversion takes a minus of its own.
    if (text.empty() || text.front() == '-')
        return std::nullopt;
    double number = 0;
    const char* end = std::to_address(text.end());
    const auto [stop, error] = std::from_chars(std::to_address(text.begin()), end, number);
    if (error != std::errc() || stop != end)
        return std::nullopt;
    return Value(minus ? -number : number);
}

/// YYYY-MM-DDTHH:MM:SSZ
std::optional<Value> parseDate(std::string_view text) {
    using namespace std::chrono;
    constexpr std::string_view form = "dddd-dd-ddTdd:dd:ddZ";
    text = trimmed(text);
    if (text.size() != form.size())
        return std::nullopt;
    for (std::size_t i = 0; i < form.size(); ++i)
        if (form[i] == 'd' ? digits(text, i, 1) < 0 : text[i] != form[i])
            return std::nullopt;

    const year_month_day day{year{digits(text, 0, 4)}, month{static_cast<unsigned>(digits(text, 5, 2))},
                             std::chrono::day{static_cast<unsigned>(digits(text, 8, 2))}};
    const int hour = digits(text, 11, 2);
    const int minute = digits(text, 14, 2);
    const int second = digits(text, 17, 2);
    if (!day.ok() || hour > 23 || minute > 59 || second > 59)
        return std::nullopt;
    constexpr sys_days reference{year{2001} / January / 1};
    const seconds since = sys_days{day} - reference + hours{hour} + minutes{minute} + seconds{second};
    return Value(Date{static_cast<double>(since.count())});
}

/// Base64 with padding, white space anywhere.
std::optional<Value> parseData(std::string_view text) {
    Data bytes;
    bytes.reserve(text.size() / 4 * 3);
    std::uint32_t bits = 0;
    int characters = 0;
    int padding = 0;
    for (const char c : text) {
        if (isSpace(c))
            continue;
        if (c == '=') {
            ++padding;
            continue;
        }
        const int six = sextet(c);
        if (six < 0 || padding != 0)
            return std::nullopt;
        bits = bits << 6 | static_cast<std::uint32_t>(six);
        if (++characters == 4) {
            bytes.push_back(static_cast<std::uint8_t>(bits >> 16));
            bytes.push_back(static_cast<std::uint8_t>(bits >> 8));
            bytes.push_back(static_cast<std::uint8_t>(bits));
            characters = 0;
        }
    }
    // A group cut short says so: two characters and "==" are one byte, three and "=" two.
    if (characters == 0 ? padding != 0 : characters == 1 || characters + padding != 4)
        return std::nullopt;
    if (characters >= 2)
        bytes.push_back(static_cast<std::uint8_t>(bits >> (characters == 2 ? 4 : 10)));
    if (characters == 3)
        bytes.push_back(static_cast<std::uint8_t>(bits >> 2));
    return Value(std::move(bytes));
}

enum class Element { none, plist, dict, array, key, string, integer, real, boolTrue, boolFalse, date, data };

constexpr std::pair<std::string_view, Element> elementNames[] = {
    {"plist", Element::plist}, {"dict", Element::dict},     {"array", Element::array},
    {"key", Element::key},     {"string", Element::string}, {"integer", Element::integer},
    {"real", Element::real},   {"true", Element::boolTrue}, {"false", Element::boolFalse},
    {"date", Element::date},   {"data", Element::data},
};

Element elementNamed(std::string_view name) {
    for (const auto& [known, element] : elementNames)
        if (known == name)
            return element;
    return Element::none;
}

/// A container whose end has not come yet.
struct Frame {
    Element element = Element::none;
    Array values;
    std::vector<Dictionary::Entry> entries;
    /// A key that waits for its value.
    std::optional<std::string> key;
};

struct ParserFree {
    void operator()(XML_Parser parser) const { XML_ParserFree(parser); }
};

/// Builds the value from the parser's events. Open containers are frames on a stack of at most nestingMax; nothing
/// recurses. The parser is C: no exception may pass through it, so one that a handler meets is kept and thrown on when
/// it has returned.
class XmlReader {
public:
    XmlReader();
    std::expected<Value, ReadError> read(std::span<const std::uint8_t> bytes);

private:
    void start(const XML_Char* name, const XML_Char** attributes);
    void end(const XML_Char* name);
    void text(const XML_Char* characters, int count);

    const char* whyNotHere(Element element) const;
    void put(Value value);
    void endScalar();
    std::optional<Value> scalar() const;
    void endContainer();
    void fail(const char* reason);
    [[nodiscard]] bool failed() const { return error_.has_value() || exception_ != nullptr; }

    /// Runs a handler unless reading has failed already: the parser may still deliver events after it was stopped.
    template <typename Body>
    static void guarded(void* self, Body body) noexcept;

    std::unique_ptr<std::remove_pointer_t<XML_Parser>, ParserFree> parser_;
    std::vector<Frame> frames_;
    /// The scalar or key whose end has not come yet, and its text so far.
    Element scalar_ = Element::none;
    std::string text_;
    bool insidePlist_ = false;
    std::optional<Value> root_;
    std::optional<ReadError> error_;
    std::exception_ptr exception_;
};

template <typename Body>
void XmlReader::guarded(void* self, Body body) noexcept {
    auto& reader = *static_cast<XmlReader*>(self);
    if (reader.failed())
        return;
    try {
        body(reader);
    } catch (...) {
        reader.exception_ = std::current_exception();
        XML_StopParser(reader.parser_.get(), XML_FALSE);
    }
}

XmlReader::XmlReader() : parser_(XML_ParserCreate(nullptr)) {
    if (!parser_)
        throw std::bad_alloc();
    XML_Parser parser = parser_.get();
    XML_SetUserData(parser, this);
    XML_SetElementHandler(
        parser,
        [](void* self, const XML_Char* name, const XML_Char** attributes) {
            guarded(self, [=](XmlReader& reader) { reader.start(name, attributes); });
        },
        [](void* self, const XML_Char* name) { guarded(self, [=](XmlReader& reader) { reader.end(name); }); });
    XML_SetCharacterDataHandler(parser, [](void* self, const XML_Char* characters, int count) {
        guarded(self, [=](XmlReader& reader) { reader.text(characters, count); });
    });
    // Stops before the first declaration is looked at. The declaration handler is the second lock on the same door.
    XML_SetStartDoctypeDeclHandler(
        parser, [](void* self, const XML_Char*, const XML_Char*, const XML_Char*, int hasInternalSubset) {
            if (hasInternalSubset != 0)
                guarded(self, [](XmlReader& reader) { reader.fail("a document type with declarations of its own"); });
        });
    XML_SetEntityDeclHandler(parser, [](void* self, const XML_Char*, int, const XML_Char*, int, const XML_Char*,
                                        const XML_Char*, const XML_Char*, const XML_Char*) {
        guarded(self, [](XmlReader& reader) { reader.fail("an entity declaration"); });
    });
    // With a document type that is named but not read, the parser takes unknown entities for declared there and would
    // silently leave them out of the text.
    XML_SetSkippedEntityHandler(parser, [](void* self, const XML_Char*, int) {
        guarded(self, [](XmlReader& reader) { reader.fail("an entity that is not predefined"); });
    });
    XML_SetParamEntityParsing(parser, XML_PARAM_ENTITY_PARSING_NEVER);
}

std::expected<Value, ReadError> XmlReader::read(std::span<const std::uint8_t> bytes) {
    if (bytes.size() > xmlBytesMax)
        return std::unexpected(ReadError{.offset = xmlBytesMax, .reason = "too long for an XML property list"});
    // In one piece: nothing is scanned twice, however long a token is.
    const XML_Status status =
        XML_Parse(parser_.get(), reinterpret_cast<const char*>(bytes.data()), static_cast<int>(bytes.size()), XML_TRUE);
    if (exception_ != nullptr)
        std::rethrow_exception(exception_);
    if (status != XML_STATUS_OK)
        fail(XML_ErrorString(XML_GetErrorCode(parser_.get())));
    if (error_)
        return std::unexpected(*error_);
    return std::move(*root_);
}

void XmlReader::fail(const char* reason) {
    if (error_)
        return;
    const XML_Index at = XML_GetCurrentByteIndex(parser_.get());
    error_ = {.offset = at > 0 ? static_cast<std::size_t>(at) : 0, .reason = reason};
    XML_StopParser(parser_.get(), XML_FALSE);
}

/// Null when the element may start here.
const char* XmlReader::whyNotHere(Element element) const {
    if (element == Element::none)
        return "an element that property lists do not have";
    if (scalar_ != Element::none)
        return "an element inside a scalar or a key";
    if ((element == Element::plist) == insidePlist_)
        return insidePlist_ ? "a plist element inside another" : "a value outside the plist element";
    if (element == Element::plist)
        return nullptr;

    const bool inDictionary = !frames_.empty() && frames_.back().element == Element::dict;
    if (inDictionary && frames_.back().key.has_value() == (element == Element::key))
        return element == Element::key ? "a key without a value" : "a value without a key";
    if (!inDictionary && element == Element::key)
        return "a key outside a dictionary";
    if (frames_.empty() && root_)
        return "more than one value";
    if ((element == Element::dict || element == Element::array) && frames_.size() == nestingMax)
        return "containers nested more than 64 deep";
    return nullptr;
}

void XmlReader::start(const XML_Char* name, const XML_Char** attributes) {
    const Element element = elementNamed(name);
    if (const char* reason = whyNotHere(element))
        return fail(reason);
    if (element == Element::plist) {
        insidePlist_ = true;
        return;
    }
    if (attributes[0] != nullptr)
        return fail("an attribute");
    if (element == Element::dict || element == Element::array) {
        frames_.emplace_back().element = element;
        return;
    }
    scalar_ = element;
    text_.clear();
}

void XmlReader::text(const XML_Char* characters, int count) {
    const std::string_view part(characters, static_cast<std::size_t>(count));
    if (scalar_ != Element::none)
        text_ += part;
    else if (!std::all_of(part.begin(), part.end(), isSpace))
        fail("text outside a scalar");
}

void XmlReader::end(const XML_Char* name) {
    switch (elementNamed(name)) {
    case Element::plist:
        if (!root_)
            fail("a plist element without a value");
        break;
    case Element::dict:
    case Element::array:
        endContainer();
        break;
    default:
        endScalar();
        break;
    }
}

void XmlReader::put(Value value) {
    if (frames_.empty()) {
        root_ = std::move(value);
        return;
    }
    Frame& frame = frames_.back();
    if (frame.element == Element::array) {
        frame.values.push_back(std::move(value));
        return;
    }
    frame.entries.emplace_back(std::move(*frame.key), std::move(value));
    frame.key.reset();
}

void XmlReader::endContainer() {
    Frame frame = std::move(frames_.back());
    frames_.pop_back();
    if (frame.key)
        return fail("a key without a value");
    if (frame.element == Element::array)
        put(std::move(frame.values));
    else
        put(Dictionary::fromUnsorted(std::move(frame.entries)));
}

std::optional<Value> XmlReader::scalar() const {
    const bool blank = std::all_of(text_.begin(), text_.end(), isSpace);
    switch (scalar_) {
    case Element::integer:
        return parseInteger(text_);
    case Element::real:
        return parseReal(text_);
    case Element::date:
        return parseDate(text_);
    case Element::data:
        return parseData(text_);
    case Element::boolTrue:
    case Element::boolFalse:
        return blank ? std::optional<Value>(scalar_ == Element::boolTrue) : std::nullopt;
    default:
        return Value(text_);
    }
}

void XmlReader::endScalar() {
    // The parser checks what it decodes; the promise that strings are valid does not rest on it.
    if (!isUtf8(text_))
        return fail("text that is not UTF-8");
    if (scalar_ == Element::key) {
        frames_.back().key = text_;
    } else if (std::optional<Value> value = scalar()) {
        put(std::move(*value));
    } else {
        return fail("a scalar whose text does not say one");
    }
    scalar_ = Element::none;
}

} // namespace

std::expected<Value, ReadError> readPropertyList(std::span<const std::uint8_t> bytes) {
    return looksBinary(bytes) ? readBinary(bytes) : readXml(bytes);
}

std::expected<Value, ReadError> readXml(std::span<const std::uint8_t> bytes) {
    return XmlReader().read(bytes);
}

} // namespace zor::plist
