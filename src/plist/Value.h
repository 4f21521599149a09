// SPDX-License-Identifier: Apache-2.0
// Property-list values: what messages, metadata files, the registry and the entitlement file are made of.
//
// A value owns everything below it; copying copies the tree. A dictionary keeps its entries sorted by key in one flat
// array: small (most have under ten entries), compact, compared and searched without hashing. Nothing here locks: a
// value belongs to one thread, or is const. Depth is bounded by the readers (Codec.h), so destruction may recurse.
#pragma once

#include <cstddef>
#include <cstdint>
#include <initializer_list>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <variant>
#include <vector>

namespace zor::plist {

class Value;

using Array = std::vector<Value>;
using Data = std::vector<std::uint8_t>;

/// Seconds since 2001-01-01T00:00:00Z, as both file forms store it.
struct Date {
    double secondsSinceReference = 0;
    bool operator==(const Date&) const = default;
};

/// The types of a property list, in the order of Value's variant.
enum class Type : std::uint8_t { boolean, integer, unsignedInteger, real, date, string, data, array, dictionary };

/// Entries sorted by key (byte order). Keys are unique.
class Dictionary {
public:
    using Entry = std::pair<std::string, Value>;
    using const_iterator = std::vector<Entry>::const_iterator;

    Dictionary();
    Dictionary(std::initializer_list<Entry> entries);
    /// Takes entries in any order; of two with one key the later counts. O(n log n), for readers.
    static Dictionary fromUnsorted(std::vector<Entry> entries);

    [[nodiscard]] std::size_t size() const;
    [[nodiscard]] bool empty() const;
    [[nodiscard]] const_iterator begin() const;
    [[nodiscard]] const_iterator end() const;

    /// The value under `key`, or nullptr. Valid until the dictionary changes.
    [[nodiscard]] const Value* find(std::string_view key) const;
    void set(std::string_view key, Value value);
    /// True when there was one.
    bool erase(std::string_view key);

    // Typed reads: nullptr or nullopt when the key is absent or of another type.
    [[nodiscard]] const std::string* string(std::string_view key) const;
    [[nodiscard]] const Data* data(std::string_view key) const;
    [[nodiscard]] const Array* array(std::string_view key) const;
    [[nodiscard]] const Dictionary* dictionary(std::string_view key) const;
    /// A boolean that is true; a missing key or any other type is false.
    [[nodiscard]] bool isTrue(std::string_view key) const;
    /// A non-negative integer of either signedness.
    [[nodiscard]] std::optional<std::uint64_t> unsignedInteger(std::string_view key) const;

    bool operator==(const Dictionary&) const;

private:
    std::vector<Entry> entries_;
};

class Value {
public:
    Value() : storage_(false) {}
    Value(bool value) : storage_(value) {}
    Value(std::int64_t value) : storage_(value) {}
    Value(std::int32_t value) : storage_(static_cast<std::int64_t>(value)) {}
    /// Held as a signed integer when it fits, so equal numbers compare equal whatever their source.
    Value(std::uint64_t value);
    Value(std::uint32_t value) : storage_(static_cast<std::int64_t>(value)) {}
    Value(double value) : storage_(value) {}
    Value(Date value) : storage_(value) {}
    Value(std::string value) : storage_(std::move(value)) {}
    Value(std::string_view value) : storage_(std::string(value)) {}
    Value(const char* value) : storage_(std::string(value)) {}
    Value(Data value) : storage_(std::move(value)) {}
    Value(Array value) : storage_(std::move(value)) {}
    Value(Dictionary value) : storage_(std::move(value)) {}
    /// Nothing else turns into a boolean by accident.
    template <typename T>
    Value(T*) = delete;

    [[nodiscard]] Type type() const { return static_cast<Type>(storage_.index()); }

    [[nodiscard]] const bool* asBoolean() const { return std::get_if<bool>(&storage_); }
    [[nodiscard]] const std::string* asString() const { return std::get_if<std::string>(&storage_); }
    [[nodiscard]] const Data* asData() const { return std::get_if<Data>(&storage_); }
    [[nodiscard]] const Array* asArray() const { return std::get_if<Array>(&storage_); }
    [[nodiscard]] const Dictionary* asDictionary() const { return std::get_if<Dictionary>(&storage_); }
    [[nodiscard]] const double* asReal() const { return std::get_if<double>(&storage_); }
    [[nodiscard]] const Date* asDate() const { return std::get_if<Date>(&storage_); }
    [[nodiscard]] bool isInteger() const { return type() == Type::integer || type() == Type::unsignedInteger; }
    /// The integer, when it is one and not negative.
    [[nodiscard]] std::optional<std::uint64_t> asUnsigned() const;
    /// The integer, when it is one and fits.
    [[nodiscard]] std::optional<std::int64_t> asSigned() const;

    [[nodiscard]] Array* asMutableArray() { return std::get_if<Array>(&storage_); }
    [[nodiscard]] Dictionary* asMutableDictionary() { return std::get_if<Dictionary>(&storage_); }

    bool operator==(const Value&) const;

private:
    std::variant<bool, std::int64_t, std::uint64_t, double, Date, std::string, Data, Array, Dictionary> storage_;
};

/// One line for people and logs: a string as it is but for control characters, those inside of others quoted, data as
/// <hex>, cut at `bytesMax`. "(null)" for nullptr.
std::string describe(const Value* value, std::size_t bytesMax = 1024);

// The memory that a value keeps.

/// About what it takes in memory, in bytes, itself and all below it.
[[nodiscard]] std::size_t heldBytes(const Value& value);
[[nodiscard]] std::size_t heldBytes(const Dictionary& dictionary);

// Putting together what two dictionaries grant, so that nothing of either goes. Pure function.

/// Every key of both. For a key in both: lists, and strings as lists of one, hold the elements of the first and then
/// the strings that only the second has; a boolean is true where either is; of anything else the first's value stays.
/// The list of the second takes the place of a value that is no list.
[[nodiscard]] Dictionary united(Dictionary first, const Dictionary& second);

} // namespace zor::plist
