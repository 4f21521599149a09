// SPDX-License-Identifier: Apache-2.0
// The one-line form of a value. Its text often comes from clients, so nothing in it can end a log line or fill the log:
// what must not be shown is escaped, and the work stops where the text is full.
#include "plist/Codec.h"
#include "plist/Text.h"
#include "plist/Value.h"

#include <charconv>

namespace zor::plist {

namespace {

constexpr std::string_view cutMark = "...";

class Describer {
public:
    explicit Describer(std::size_t bytesMax) : bytesMax_(bytesMax) {}

    void value(const Value& value, std::size_t depth);
    /// `quoted`: quotation marks and backslashes of its own are escaped, for others to end it.
    enum class Quoted { no, yes };
    void text(std::string_view text, Quoted quoted);
    std::string finish() &&;

private:
    [[nodiscard]] bool full() const { return out_.size() > bytesMax_; }
    void string(std::string_view text);
    void character(std::string_view bytes, char32_t codePoint, Quoted quoted);
    void data(const Data& bytes);
    void array(const Array& values, std::size_t depth);
    void dictionary(const Dictionary& entries, std::size_t depth);
    void real(double number);

    std::string out_;
    std::size_t bytesMax_;
};

void Describer::character(std::string_view bytes, char32_t codePoint, Quoted quoted) {
    if (quoted == Quoted::yes && (codePoint == '"' || codePoint == '\\')) {
        out_ += '\\';
        out_ += bytes;
    } else if (codePoint == '\n') {
        out_ += "\\n";
    } else if (!isShown(codePoint)) {
        const bool isShort = codePoint <= 0xFFFF;
        out_ += isShort ? "\\u" : "\\U";
        for (int shift = isShort ? 12 : 28; shift >= 0; shift -= 4)
            out_ += hexDigits[(codePoint >> shift) & 0xFU];
    } else {
        out_ += bytes;
    }
}

void Describer::string(std::string_view text) {
    out_ += '"';
    this->text(text, Quoted::yes);
    out_ += '"';
}

void Describer::text(std::string_view text, Quoted quoted) {
    while (!text.empty() && !full()) {
        const Utf8Character next = decodeUtf8(text);
        if (next.length == 0) {
            const auto byte = static_cast<unsigned char>(text[0]);
            out_ += "\\x";
            out_ += hexDigits[byte >> 4];
            out_ += hexDigits[byte & 0xFU];
            text.remove_prefix(1);
        } else {
            character(text.substr(0, next.length), next.codePoint, quoted);
            text.remove_prefix(next.length);
        }
    }
}

void Describer::data(const Data& bytes) {
    out_ += '<';
    for (const std::uint8_t byte : bytes) {
        if (full())
            return;
        out_ += hexDigits[byte >> 4];
        out_ += hexDigits[byte & 0xFU];
    }
    out_ += '>';
}

void Describer::array(const Array& values, std::size_t depth) {
    out_ += '[';
    const char* separator = "";
    for (const Value& element : values) {
        if (full())
            return;
        out_ += separator;
        value(element, depth);
        separator = ", ";
    }
    out_ += ']';
}

void Describer::dictionary(const Dictionary& entries, std::size_t depth) {
    out_ += '{';
    const char* separator = "";
    for (const auto& [key, element] : entries) {
        if (full())
            return;
        out_ += separator;
        string(key);
        out_ += " = ";
        value(element, depth);
        separator = ", ";
    }
    out_ += '}';
}

void Describer::real(double number) {
    char text[32];
    const auto end = std::to_chars(text, text + sizeof text, number).ptr;
    out_.append(text, end);
}

void Describer::value(const Value& value, std::size_t depth) {
    switch (value.type()) {
    case Type::boolean:
        out_ += *value.asBoolean() ? "true" : "false";
        break;
    case Type::integer:
        out_ += std::to_string(*value.asSigned());
        break;
    case Type::unsignedInteger:
        out_ += std::to_string(*value.asUnsigned());
        break;
    case Type::real:
        real(*value.asReal());
        break;
    case Type::date:
        out_ += "date ";
        real(value.asDate()->secondsSinceReference);
        break;
    case Type::string:
        string(*value.asString());
        break;
    case Type::data:
        data(*value.asData());
        break;
    case Type::array:
        if (depth == nestingMax)
            out_ += "[...]";
        else
            array(*value.asArray(), depth + 1);
        break;
    case Type::dictionary:
        if (depth == nestingMax)
            out_ += "{...}";
        else
            dictionary(*value.asDictionary(), depth + 1);
        break;
    }
}

std::string Describer::finish() && {
    if (full()) {
        std::size_t keep = bytesMax_ > cutMark.size() ? bytesMax_ - cutMark.size() : 0;
        // Not in the middle of a character: its continuation bytes go with it.
        while (keep > 0 && (static_cast<unsigned char>(out_[keep]) & 0xC0U) == 0x80)
            --keep;
        out_.resize(keep);
        out_.append(cutMark.substr(0, bytesMax_));
    }
    return std::move(out_);
}

} // namespace

std::string describe(const Value* value, std::size_t bytesMax) {
    if (value == nullptr)
        return "(null)";
    Describer describer(bytesMax);
    if (const std::string* text = value->asString())
        describer.text(*text, Describer::Quoted::no);
    else
        describer.value(*value, 0);
    return std::move(describer).finish();
}

} // namespace zor::plist
