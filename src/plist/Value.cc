// SPDX-License-Identifier: Apache-2.0
#include "plist/Value.h"

#include <algorithm>
#include <cmath>
#include <functional>
#include <limits>
#include <numeric>
#include <optional>
#include <set>
#include <string>
#include <utility>

namespace zor::plist {

namespace {

/// Messages have no more.
constexpr std::size_t fewEntries = 8;

/// A number that is none equals itself here: what was stored compares equal to what was asked to be stored.
bool sameNumber(double left, double right) {
    return left == right || (std::isnan(left) && std::isnan(right));
}

template <typename Iterator>
Iterator lowerBound(Iterator first, Iterator last, std::string_view key) {
    return std::lower_bound(
        first, last, key, [](const Dictionary::Entry& entry, std::string_view wanted) { return entry.first < wanted; });
}

/// Moves the entry at order[i] to i, for each i, without a second array. `order` is used up.
void putInOrder(std::vector<Dictionary::Entry>& entries, std::vector<std::size_t>& order) {
    for (std::size_t first = 0; first < order.size(); ++first) {
        if (order[first] == first)
            continue;
        Dictionary::Entry held = std::move(entries[first]);
        std::size_t at = first;
        while (order[at] != first) {
            entries[at] = std::move(entries[order[at]]);
            at = std::exchange(order[at], at);
        }
        entries[at] = std::move(held);
        order[at] = at;
    }
}

} // namespace

Dictionary::Dictionary() = default;

Dictionary::Dictionary(std::initializer_list<Entry> entries) : Dictionary(fromUnsorted(std::vector<Entry>(entries))) {}

Dictionary Dictionary::fromUnsorted(std::vector<Entry> entries) {
    Dictionary result;
    const auto notAscending = [](const Entry& left, const Entry& right) { return left.first >= right.first; };
    // The writer's own output comes back sorted.
    if (std::adjacent_find(entries.begin(), entries.end(), notAscending) == entries.end()) {
        result.entries_ = std::move(entries);
        return result;
    }
    std::vector<std::size_t> order(entries.size());
    std::iota(order.begin(), order.end(), std::size_t{0});
    std::sort(order.begin(), order.end(), [&entries](std::size_t left, std::size_t right) {
        const int compared = entries[left].first.compare(entries[right].first);
        return compared != 0 ? compared < 0 : left < right;
    });
    putInOrder(entries, order);
    // The last of a run of equal keys stays, no other.
    std::size_t kept = 0;
    for (std::size_t at = 0; at < entries.size(); ++at)
        if (at + 1 == entries.size() || entries[at].first != entries[at + 1].first) {
            if (kept != at)
                entries[kept] = std::move(entries[at]);
            ++kept;
        }
    entries.erase(entries.begin() + static_cast<std::ptrdiff_t>(kept), entries.end());
    result.entries_ = std::move(entries);
    return result;
}

std::size_t Dictionary::size() const {
    return entries_.size();
}

bool Dictionary::empty() const {
    return entries_.empty();
}

Dictionary::const_iterator Dictionary::begin() const {
    return entries_.begin();
}

Dictionary::const_iterator Dictionary::end() const {
    return entries_.end();
}

const Value* Dictionary::find(std::string_view key) const {
    // Most keys of a few are told apart by their lengths, without a look at their bytes.
    if (entries_.size() <= fewEntries) {
        for (const Entry& entry : entries_)
            if (entry.first == key)
                return &entry.second;
        return nullptr;
    }
    const auto found = lowerBound(entries_.begin(), entries_.end(), key);
    return found != entries_.end() && found->first == key ? &found->second : nullptr;
}

void Dictionary::set(std::string_view key, Value value) {
    const auto found = lowerBound(entries_.begin(), entries_.end(), key);
    if (found != entries_.end() && found->first == key)
        found->second = std::move(value);
    else
        entries_.emplace(found, std::string(key), std::move(value));
}

bool Dictionary::erase(std::string_view key) {
    const auto found = lowerBound(entries_.begin(), entries_.end(), key);
    if (found == entries_.end() || found->first != key)
        return false;
    entries_.erase(found);
    return true;
}

const std::string* Dictionary::string(std::string_view key) const {
    const Value* value = find(key);
    return value != nullptr ? value->asString() : nullptr;
}

const Data* Dictionary::data(std::string_view key) const {
    const Value* value = find(key);
    return value != nullptr ? value->asData() : nullptr;
}

const Array* Dictionary::array(std::string_view key) const {
    const Value* value = find(key);
    return value != nullptr ? value->asArray() : nullptr;
}

const Dictionary* Dictionary::dictionary(std::string_view key) const {
    const Value* value = find(key);
    return value != nullptr ? value->asDictionary() : nullptr;
}

bool Dictionary::isTrue(std::string_view key) const {
    const Value* value = find(key);
    const bool* boolean = value != nullptr ? value->asBoolean() : nullptr;
    return boolean != nullptr && *boolean;
}

std::optional<std::uint64_t> Dictionary::unsignedInteger(std::string_view key) const {
    const Value* value = find(key);
    return value != nullptr ? value->asUnsigned() : std::nullopt;
}

bool Dictionary::operator==(const Dictionary& other) const {
    return entries_ == other.entries_;
}

Value::Value(std::uint64_t value) {
    if (value <= static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max()))
        storage_ = static_cast<std::int64_t>(value);
    else
        storage_ = value;
}

std::optional<std::uint64_t> Value::asUnsigned() const {
    if (const auto* big = std::get_if<std::uint64_t>(&storage_))
        return *big;
    if (const auto* number = std::get_if<std::int64_t>(&storage_); number != nullptr && *number >= 0)
        return static_cast<std::uint64_t>(*number);
    return std::nullopt;
}

std::optional<std::int64_t> Value::asSigned() const {
    // The unsigned alternative only ever holds what does not fit.
    if (const auto* number = std::get_if<std::int64_t>(&storage_))
        return *number;
    return std::nullopt;
}

bool Value::operator==(const Value& other) const {
    if (type() != other.type())
        return false;
    if (const double* real = asReal())
        return sameNumber(*real, *other.asReal());
    if (const Date* date = asDate())
        return sameNumber(date->secondsSinceReference, other.asDate()->secondsSinceReference);
    return storage_ == other.storage_;
}

std::size_t heldBytes(const Dictionary& dictionary) {
    std::size_t bytes = 0;
    for (const auto& [key, value] : dictionary)
        bytes += sizeof(std::string) + key.size() + heldBytes(value);
    return bytes;
}

std::size_t heldBytes(const Value& value) {
    std::size_t bytes = sizeof value;
    if (const std::string* text = value.asString())
        bytes += text->size();
    else if (const Data* data = value.asData())
        bytes += data->size();
    else if (const Dictionary* dictionary = value.asDictionary())
        bytes += heldBytes(*dictionary);
    else if (const Array* array = value.asArray())
        for (const Value& element : *array)
            bytes += heldBytes(element);
    return bytes;
}

namespace {

/// A list, or a string as a list of one.
std::optional<Array> listIn(const Value& value) {
    if (const Array* array = value.asArray())
        return *array;
    return value.asString() ? std::optional(Array{value}) : std::nullopt;
}

Array unitedLists(Array first, const Array& second) {
    std::set<std::string, std::less<>> present;
    for (const Value& element : first)
        if (const std::string* text = element.asString())
            present.insert(*text);
    for (const Value& element : second)
        if (const std::string* text = element.asString(); text && present.insert(*text).second)
            first.push_back(element);
    return first;
}

} // namespace

Dictionary united(Dictionary first, const Dictionary& second) {
    for (const auto& [key, value] : second) {
        const Value* const known = first.find(key);
        if (!known) {
            first.set(key, value);
            continue;
        }
        if (*known == value)
            continue;
        const auto list = listIn(value);
        if (auto knownList = listIn(*known))
            first.set(key, unitedLists(std::move(*knownList), list.value_or(Array())));
        else if (list || (known->asBoolean() && second.isTrue(key)))
            first.set(key, value);
    }
    return first;
}

} // namespace zor::plist
