// SPDX-License-Identifier: Apache-2.0
// Builds the value from the parser's events. Open containers are frames on a stack of at most nestingMax; nothing
// recurses. The parser is C: no exception may pass through it, so one that a handler meets is kept and thrown on when
// it has returned.
#include "plist/Read.h"

#include "plist/Binary.h"
#include "plist/Errors.h"
#include "plist/Text.h"
#include "plist/XmlScalars.h"

#include <algorithm>
#include <exception>
#include <expat.h>
#include <memory>
#include <optional>

namespace zor::plist {

std::expected<Value, ReadError> readPropertyList(std::span<const std::uint8_t> bytes) {
    return looksBinary(bytes) ? readBinary(bytes) : readXml(bytes);
}

namespace {

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

class Reader {
public:
    Reader();
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
void Reader::guarded(void* self, Body body) noexcept {
    auto& reader = *static_cast<Reader*>(self);
    if (reader.failed())
        return;
    try {
        body(reader);
    } catch (...) {
        reader.exception_ = std::current_exception();
        XML_StopParser(reader.parser_.get(), XML_FALSE);
    }
}

Reader::Reader() : parser_(XML_ParserCreate(nullptr)) {
    if (!parser_)
        throw std::bad_alloc();
    XML_Parser parser = parser_.get();
    XML_SetUserData(parser, this);
    XML_SetElementHandler(
        parser,
        [](void* self, const XML_Char* name, const XML_Char** attributes) {
            guarded(self, [=](Reader& reader) { reader.start(name, attributes); });
        },
        [](void* self, const XML_Char* name) { guarded(self, [=](Reader& reader) { reader.end(name); }); });
    XML_SetCharacterDataHandler(parser, [](void* self, const XML_Char* characters, int count) {
        guarded(self, [=](Reader& reader) { reader.text(characters, count); });
    });
    // Stops before the first declaration is looked at. The declaration handler is the second lock on the same door.
    XML_SetStartDoctypeDeclHandler(
        parser, [](void* self, const XML_Char*, const XML_Char*, const XML_Char*, int hasInternalSubset) {
            if (hasInternalSubset != 0)
                guarded(self, [](Reader& reader) { reader.fail("a document type with declarations of its own"); });
        });
    XML_SetEntityDeclHandler(parser, [](void* self, const XML_Char*, int, const XML_Char*, int, const XML_Char*,
                                        const XML_Char*, const XML_Char*, const XML_Char*) {
        guarded(self, [](Reader& reader) { reader.fail("an entity declaration"); });
    });
    // With a document type that is named but not read, the parser takes unknown entities for declared there and would
    // silently leave them out of the text.
    XML_SetSkippedEntityHandler(parser, [](void* self, const XML_Char*, int) {
        guarded(self, [](Reader& reader) { reader.fail("an entity that is not predefined"); });
    });
    XML_SetParamEntityParsing(parser, XML_PARAM_ENTITY_PARSING_NEVER);
}

std::expected<Value, ReadError> Reader::read(std::span<const std::uint8_t> bytes) {
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

void Reader::fail(const char* reason) {
    if (error_)
        return;
    const XML_Index at = XML_GetCurrentByteIndex(parser_.get());
    error_ = {.offset = at > 0 ? static_cast<std::size_t>(at) : 0, .reason = reason};
    XML_StopParser(parser_.get(), XML_FALSE);
}

/// Null when the element may start here.
const char* Reader::whyNotHere(Element element) const {
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

void Reader::start(const XML_Char* name, const XML_Char** attributes) {
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

void Reader::text(const XML_Char* characters, int count) {
    const std::string_view part(characters, static_cast<std::size_t>(count));
    if (scalar_ != Element::none)
        text_ += part;
    else if (!std::all_of(part.begin(), part.end(), xml::isSpace))
        fail("text outside a scalar");
}

void Reader::end(const XML_Char* name) {
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

void Reader::put(Value value) {
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

void Reader::endContainer() {
    Frame frame = std::move(frames_.back());
    frames_.pop_back();
    if (frame.key)
        return fail("a key without a value");
    if (frame.element == Element::array)
        put(std::move(frame.values));
    else
        put(Dictionary::fromUnsorted(std::move(frame.entries)));
}

std::optional<Value> Reader::scalar() const {
    const bool blank = std::all_of(text_.begin(), text_.end(), xml::isSpace);
    switch (scalar_) {
    case Element::integer:
        return xml::parseInteger(text_);
    case Element::real:
        return xml::parseReal(text_);
    case Element::date:
        return xml::parseDate(text_);
    case Element::data:
        return xml::parseData(text_);
    case Element::boolTrue:
    case Element::boolFalse:
        return blank ? std::optional<Value>(scalar_ == Element::boolTrue) : std::nullopt;
    default:
        return Value(text_);
    }
}

void Reader::endScalar() {
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

std::expected<Value, ReadError> readXml(std::span<const std::uint8_t> bytes) {
    return Reader().read(bytes);
}

} // namespace zor::plist
