// SPDX-License-Identifier: Apache-2.0
// Values of the C interface.
#include "CInterface.h"

#include "plist/Text.h"

#include <bit>
#include <limits>
#include <utility>

using zorvane::Value;
using zorvane::c::guardedOr;
using zorvane::c::handleOf;
using zorvane::c::valueOf;

namespace {

template <typename T>
zorvane_value* made(T&& content) noexcept {
    return guardedOr(static_cast<zorvane_value*>(nullptr), [&] {
        return reinterpret_cast<zorvane_value*>(std::make_unique<Value>(std::forward<T>(content)).release());
    });
}

template <typename T>
const T* contentOf(const zorvane_value* value) {
    return value ? std::get_if<T>(&valueOf(value)->content) : nullptr;
}

template <typename T>
T contentOr(const zorvane_value* value, T otherwise) {
    const T* content = contentOf<T>(value);
    return content ? *content : otherwise;
}

/// The list or map that gets an element.
template <typename T>
T* changeable(zorvane_value* value) {
    return value ? std::get_if<T>(&reinterpret_cast<Value*>(value)->content) : nullptr;
}

std::unique_ptr<Value> taken(zorvane_value* value) {
    return std::unique_ptr<Value>(reinterpret_cast<Value*>(value));
}

int typeOf(const Value& value) {
    static_assert(std::variant_size_v<decltype(value.content)> == 9);
    constexpr int types[] = {ZORVANE_BOOLEAN, ZORVANE_INTEGER, ZORVANE_UNSIGNED, ZORVANE_REAL, ZORVANE_STRING,
                             ZORVANE_LIST,    ZORVANE_MAP,     ZORVANE_DATA,     ZORVANE_DATE};
    return types[value.content.index()];
}

} // namespace

zorvane_value* zorvane_value_boolean(int value) {
    return made(value != 0);
}

zorvane_value* zorvane_value_integer(std::int64_t value) {
    return made(value);
}

zorvane_value* zorvane_value_unsigned(std::uint64_t value) {
    return std::in_range<std::int64_t>(value) ? made(static_cast<std::int64_t>(value)) : made(value);
}

zorvane_value* zorvane_value_real(double value) {
    return made(value);
}

zorvane_value* zorvane_value_string(const char* text) {
    return text && zor::plist::isUtf8(text)
               ? guardedOr(static_cast<zorvane_value*>(nullptr), [&] { return made(std::string(text)); })
               : nullptr;
}

zorvane_value* zorvane_value_data(const void* bytes, std::size_t size) {
    const auto* const begin = static_cast<const std::uint8_t*>(bytes);
    return guardedOr(static_cast<zorvane_value*>(nullptr),
                     [&] { return made(size == 0 ? zorvane::Data() : zorvane::Data(begin, begin + size)); });
}

zorvane_value* zorvane_value_date(double seconds) {
    return made(zorvane::Date{seconds});
}

zorvane_value* zorvane_value_list() {
    return made(zorvane::List());
}

zorvane_value* zorvane_value_map() {
    return made(zorvane::Map());
}

zorvane_value* zorvane_value_copy(const zorvane_value* value) {
    return value ? made(valueOf(value)->content) : nullptr;
}

void zorvane_value_free(zorvane_value* value) {
    taken(value).reset();
}

int zorvane_value_append(zorvane_value* list, zorvane_value* element) {
    const auto owned = taken(element);
    auto* const content = changeable<zorvane::List>(list);
    if (!content || !owned)
        return ZORVANE_OTHER;
    return guardedOr<int>(ZORVANE_OTHER, [&] {
        content->push_back(std::move(*owned));
        return ZORVANE_OK;
    });
}

int zorvane_value_set(zorvane_value* map, const char* key, zorvane_value* element) {
    const auto owned = taken(element);
    auto* const content = changeable<zorvane::Map>(map);
    if (!content || !owned || !key || !zor::plist::isUtf8(key))
        return ZORVANE_OTHER;
    return guardedOr<int>(ZORVANE_OTHER, [&] {
        (*content)[key] = std::move(*owned);
        return ZORVANE_OK;
    });
}

int zorvane_value_type(const zorvane_value* value) {
    return value ? typeOf(*valueOf(value)) : 0;
}

int zorvane_value_get_boolean(const zorvane_value* value) {
    return contentOr(value, false) ? 1 : 0;
}

std::int64_t zorvane_value_get_integer(const zorvane_value* value) {
    return contentOr(value, std::int64_t{0});
}

std::uint64_t zorvane_value_get_unsigned(const zorvane_value* value) {
    const auto number = contentOr(value, std::int64_t{0});
    return number > 0 ? static_cast<std::uint64_t>(number) : contentOr(value, std::uint64_t{0});
}

double zorvane_value_get_real(const zorvane_value* value) {
    const auto* const date = contentOf<zorvane::Date>(value);
    return date ? date->seconds : contentOr(value, 0.0);
}

const char* zorvane_value_get_string(const zorvane_value* value) {
    const auto* const text = contentOf<std::string>(value);
    return text ? text->c_str() : nullptr;
}

const void* zorvane_value_get_data(const zorvane_value* value, std::size_t* size) {
    const auto* const data = contentOf<zorvane::Data>(value);
    if (size)
        *size = data ? data->size() : 0;
    if (!data)
        return nullptr;
    return data->empty() ? static_cast<const void*>("") : data->data();
}

std::size_t zorvane_value_count(const zorvane_value* value) {
    if (const auto* const list = contentOf<zorvane::List>(value))
        return list->size();
    const auto* const map = contentOf<zorvane::Map>(value);
    return map ? map->size() : 0;
}

const zorvane_value* zorvane_value_at(const zorvane_value* list, std::size_t index) {
    const auto* const content = contentOf<zorvane::List>(list);
    return content && index < content->size() ? handleOf(&(*content)[index]) : nullptr;
}

const zorvane_value* zorvane_value_get(const zorvane_value* map, const char* key) {
    const auto* const content = contentOf<zorvane::Map>(map);
    if (!content || !key)
        return nullptr;
    return guardedOr(static_cast<const zorvane_value*>(nullptr), [&] {
        const auto found = content->find(key);
        return found == content->end() ? nullptr : handleOf(&found->second);
    });
}

const char* zorvane_value_next_key(const zorvane_value* map, const char* key) {
    const auto* const content = contentOf<zorvane::Map>(map);
    if (!content)
        return nullptr;
    return guardedOr(static_cast<const char*>(nullptr), [&] {
        const auto next = key ? content->upper_bound(key) : content->begin();
        return next == content->end() ? nullptr : next->first.c_str();
    });
}
