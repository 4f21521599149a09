// SPDX-License-Identifier: Apache-2.0
// The client of zorvaned for C++17 and newer, in this header alone: it stands on the C interface (zorvane.h), so that a
// program built with it works with every libzorvane.so.0 that is not older.
//
//     zorvane::stable::Client client;
//     auto notes = client.create(ZORVANE_DATA_APPLICATION, "org.example.notes");
//     std::cout << notes.path << '\n';
//
// Failures are exceptions of the class Error; that there is no such container or info key is an empty optional where
// one is returned. Threads, timeouts and what may be asked for are as in zorvane.h.
#pragma once

#include "zorvane/zorvane.h"

#include <array>
#include <chrono>
#include <cstdint>
#include <exception>
#include <functional>
#include <list>
#include <map>
#include <memory>
#include <new>
#include <optional>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

namespace zorvane {
namespace stable {

enum class Kind {
    notFound = ZORVANE_NOT_FOUND,
    refused = ZORVANE_REFUSED,
    unreachable = ZORVANE_UNREACHABLE,
    timedOut = ZORVANE_TIMED_OUT,
    other = ZORVANE_OTHER
};

class Error : public std::runtime_error {
public:
    explicit Error(const zorvane_error& error)
        : std::runtime_error(error.message), kind_(static_cast<Kind>(error.kind)), code_(error.code),
          advice_(error.advice) {}
    Kind kind() const noexcept { return kind_; }
    /// The daemon's, or 0.
    std::uint64_t code() const noexcept { return code_; }
    /// May be empty.
    const std::string& advice() const noexcept { return advice_; }

private:
    Kind kind_;
    std::uint64_t code_;
    std::string advice_;
};

/// A text with a NUL in it would be cut there: std::invalid_argument.
inline const char* cText(const std::string& text) {
    if (text.find('\0') != std::string::npos)
        throw std::invalid_argument("a text for zorvaned has a NUL in it");
    return text.c_str();
}

using Uuid = std::array<std::uint8_t, 16>;

inline std::string text(const Uuid& uuid) {
    char characters[37];
    zorvane_uuid_text(uuid.data(), characters);
    return characters;
}

/// A value and all below it; copies copy the tree. A getter is empty for another type.
class Value {
public:
    Value(bool value) : Value(zorvane_value_boolean(value ? 1 : 0)) {}
    Value(int value) : Value(zorvane_value_integer(value)) {}
    Value(std::int64_t value) : Value(zorvane_value_integer(value)) {}
    Value(std::uint64_t value) : Value(zorvane_value_unsigned(value)) {}
    Value(double value) : Value(zorvane_value_real(value)) {}
    /// UTF-8 without NUL, else std::invalid_argument.
    Value(const char* value) : value_(zorvane_value_string(value)) { judgeText(); }
    Value(const std::string& value) : value_(zorvane_value_string(cText(value))) { judgeText(); }
    Value(const std::vector<std::uint8_t>& bytes) : Value(zorvane_value_data(bytes.data(), bytes.size())) {}
    Value(const std::vector<Value>& elements) : Value(zorvane_value_list()) {
        for (const Value& element : elements)
            judge(zorvane_value_append(value_.get(), Value(element).value_.release()));
    }
    Value(const std::map<std::string, Value>& entries) : Value(zorvane_value_map()) {
        for (const auto& entry : entries)
            judge(zorvane_value_set(value_.get(), cText(entry.first), Value(entry.second).value_.release()));
    }
    static Value date(std::chrono::duration<double> since2001) { return Value(zorvane_value_date(since2001.count())); }
    /// A copy of what a result or another value owns.
    static Value copyOf(const zorvane_value* value) { return Value(zorvane_value_copy(value)); }

    Value(const Value& other) : Value(zorvane_value_copy(other.get())) {}
    Value(Value&&) noexcept = default;
    Value& operator=(const Value& other) { return *this = Value(other); }
    Value& operator=(Value&&) noexcept = default;
    ~Value() = default;

    /// ZORVANE_BOOLEAN and so on.
    int type() const { return zorvane_value_type(get()); }
    const zorvane_value* get() const noexcept { return value_.get(); }
    std::optional<bool> boolean() const { return when(ZORVANE_BOOLEAN, zorvane_value_get_boolean(get()) != 0); }
    std::optional<std::int64_t> integer() const { return when(ZORVANE_INTEGER, zorvane_value_get_integer(get())); }
    std::optional<std::uint64_t> unsignedInteger() const {
        const bool is = type() == ZORVANE_UNSIGNED || (type() == ZORVANE_INTEGER && *integer() >= 0);
        return is ? std::optional<std::uint64_t>(zorvane_value_get_unsigned(get())) : std::nullopt;
    }
    std::optional<double> real() const { return when(ZORVANE_REAL, zorvane_value_get_real(get())); }
    std::optional<std::chrono::duration<double>> dateSince2001() const {
        return when(ZORVANE_DATE, std::chrono::duration<double>(zorvane_value_get_real(get())));
    }
    std::optional<std::string> string() const {
        const char* const content = zorvane_value_get_string(get());
        return content ? std::optional<std::string>(content) : std::nullopt;
    }
    std::optional<std::vector<std::uint8_t>> data() const {
        std::size_t size = 0;
        const auto* const bytes = static_cast<const std::uint8_t*>(zorvane_value_get_data(get(), &size));
        return bytes ? std::optional<std::vector<std::uint8_t>>({bytes, bytes + size}) : std::nullopt;
    }
    std::optional<std::vector<Value>> list() const {
        if (type() != ZORVANE_LIST)
            return std::nullopt;
        std::vector<Value> elements;
        for (std::size_t i = 0; i < zorvane_value_count(get()); ++i)
            elements.push_back(copyOf(zorvane_value_at(get(), i)));
        return elements;
    }
    std::optional<std::map<std::string, Value>> map() const {
        if (type() != ZORVANE_MAP)
            return std::nullopt;
        std::map<std::string, Value> entries;
        for (const char* key = nullptr; (key = zorvane_value_next_key(get(), key)) != nullptr;)
            entries.emplace(key, copyOf(zorvane_value_get(get(), key)));
        return entries;
    }

private:
    struct Free {
        void operator()(zorvane_value* value) const { zorvane_value_free(value); }
    };
    explicit Value(zorvane_value* value) : value_(value) {
        if (!value_)
            throw std::bad_alloc();
    }
    template <typename T>
    std::optional<T> when(int wanted, T content) const {
        return type() == wanted ? std::optional<T>(std::move(content)) : std::nullopt;
    }
    static void judge(int kind) {
        if (kind != ZORVANE_OK)
            throw std::invalid_argument("a value's key is no UTF-8, or there is no memory left");
    }
    void judgeText() const {
        if (!value_)
            throw std::invalid_argument("a value's text is no UTF-8, or there is no memory left");
    }

    std::unique_ptr<zorvane_value, Free> value_;
};

/// The answer to a call; see zorvane.h for what a command's answer has.
class Result {
public:
    explicit Result(zorvane_result* result = nullptr) : result_(result) {}
    const zorvane_result* get() const noexcept { return result_.get(); }
    std::string path() const { return textOf(zorvane_result_path(get())); }
    std::string identifier() const { return textOf(zorvane_result_identifier(get())); }
    Uuid uuid() const { return uuidOf(zorvane_result_uuid(get())); }
    std::optional<Value> value() const {
        const zorvane_value* const value = zorvane_result_value(get());
        return value ? std::optional<Value>(Value::copyOf(value)) : std::nullopt;
    }

    static std::string textOf(const char* text) { return text ? text : ""; }
    static Uuid uuidOf(const std::uint8_t* bytes) {
        Uuid uuid{};
        for (std::size_t i = 0; bytes && i < uuid.size(); ++i)
            uuid[i] = bytes[i];
        return uuid;
    }

private:
    struct Free {
        void operator()(zorvane_result* result) const { zorvane_result_free(result); }
    };
    std::unique_ptr<zorvane_result, Free> result_;
};

struct Address {
    std::uint32_t containerClass = 0;
    std::uint32_t user = ZORVANE_CURRENT_USER;
    std::string identifier;
    Uuid uuid{};

    /// Lasts as long as this address is not changed.
    zorvane_address forC() const {
        zorvane_address address{containerClass, user, cText(identifier), {}};
        for (std::size_t i = 0; i < uuid.size(); ++i)
            address.uuid[i] = uuid[i];
        return address;
    }
};

struct Container : Address {
    std::string path;
    /// It was there before the call; false in a list.
    bool existed = false;
};

struct Metadata {
    std::string path;
    bool transient = false;
    std::map<std::string, Value> info;
};

/// Not given: as ZORVANE_TIMEOUT_DEFAULT; zero: never.
using Timeout = std::optional<std::chrono::milliseconds>;

inline std::int64_t forC(const Timeout& timeout) {
    return timeout ? static_cast<std::int64_t>(timeout->count()) : ZORVANE_TIMEOUT_DEFAULT;
}

/// One connection, which the next call makes anew after it has failed.
class Client {
public:
    explicit Client(const std::string& root = "/", Timeout timeout = std::nullopt) {
        zorvane_error error;
        client_.reset(zorvane_connect(cText(root), forC(timeout), &error));
        if (!client_)
            throw Error(error);
    }

    /// Any request of zorvane.h.
    Result call(zorvane_request* request) {
        zorvane_error error;
        zorvane_result* result = nullptr;
        if (zorvane_call(client_.get(), request, &result, &error) != ZORVANE_OK)
            throw Error(error);
        return Result(result);
    }

    /// Flag: ZORVANE_TRANSIENT. An empty identifier is the caller's own.
    std::optional<Container> find(std::uint32_t containerClass, const std::string& identifier,
                                  std::uint32_t user = ZORVANE_CURRENT_USER, std::uint32_t flags = 0) {
        return whenFound([&] { return lookedUp(containerClass, identifier, user, flags); });
    }
    /// The same; made where there is none.
    Container create(std::uint32_t containerClass, const std::string& identifier,
                     std::uint32_t user = ZORVANE_CURRENT_USER, std::uint32_t flags = 0) {
        return lookedUp(containerClass, identifier, user, flags | ZORVANE_CREATE);
    }
    std::vector<Container> list(std::uint32_t containerClass, std::uint32_t user = ZORVANE_CURRENT_USER,
                                std::uint32_t flags = 0) {
        const Result result = call(zorvane_request_list(containerClass, user, flags));
        std::vector<Container> containers;
        for (std::size_t i = 0; i < zorvane_result_count(result.get()); ++i) {
            Container container;
            container.containerClass = containerClass;
            container.user = user;
            container.identifier = zorvane_result_identifier_at(result.get(), i);
            container.uuid = Result::uuidOf(zorvane_result_uuid_at(result.get(), i));
            containers.push_back(std::move(container));
        }
        return containers;
    }
    /// False: there was none.
    bool remove(std::uint32_t containerClass, const std::string& identifier, std::uint32_t user = ZORVANE_CURRENT_USER,
                std::uint32_t flags = 0) {
        return whenFound([&] { return call(zorvane_request_delete(containerClass, user, cText(identifier), flags)); })
            .has_value();
    }
    void stageForDelete(const std::vector<Container>& containers) {
        std::vector<zorvane_address> addresses;
        for (const Container& container : containers)
            addresses.push_back(container.forC());
        call(zorvane_request_stage_for_delete(addresses.data(), addresses.size()));
    }
    void emptyDeathRow() { call(zorvane_request_empty_death_row()); }
    void replace(const Address& old, const Address& fresh) {
        const zorvane_address first = old.forC();
        const zorvane_address second = fresh.forC();
        call(zorvane_request_replace(&first, &second));
    }
    /// A transient container becomes the live one of its identifier.
    void promote(const Address& transient) {
        const zorvane_address address = transient.forC();
        call(zorvane_request_replace(nullptr, &address));
    }
    void wipe(const Address& container) {
        call(zorvane_request_wipe(container.containerClass, container.user, cText(container.identifier)));
    }
    void wipePluginData(const std::string& identifier, std::uint32_t user = ZORVANE_CURRENT_USER) {
        call(zorvane_request_wipe_plugin_data(user, cText(identifier)));
    }

    Metadata metadata(const Address& container) {
        const zorvane_address address = container.forC();
        const Result result = call(zorvane_request_metadata(&address));
        Metadata metadata;
        metadata.path = result.path();
        metadata.transient = zorvane_result_transient(result.get()) != 0;
        if (const auto info = result.value())
            metadata.info = info->map().value_or(std::map<std::string, Value>());
        return metadata;
    }
    std::optional<Value> info(const Address& container, const std::string& key) {
        const zorvane_address address = container.forC();
        const auto result = whenFound([&] { return call(zorvane_request_info(&address, cText(key))); });
        return result ? result->value() : std::nullopt;
    }
    void setInfo(const Address& container, const std::string& key, const Value& value) {
        const zorvane_address address = container.forC();
        call(zorvane_request_set_info(&address, cText(key), value.get()));
    }
    void removeInfo(const Address& container, const std::string& key) {
        const zorvane_address address = container.forC();
        call(zorvane_request_set_info(&address, cText(key), nullptr));
    }
    std::uint64_t diskUsage(const Address& container) {
        const zorvane_address address = container.forC();
        return zorvane_result_bytes(call(zorvane_request_disk_usage(&address)).get());
    }
    void recreateStructure(const Address& container) {
        const zorvane_address address = container.forC();
        call(zorvane_request_recreate_structure(&address));
    }
    void regenerateDirectory(const Address& container) {
        const zorvane_address address = container.forC();
        call(zorvane_request_regenerate_directory(&address));
    }
    /// Flags: ZORVANE_THIRD_PARTY, ZORVANE_RETRY_IF_LOCKED.
    void setProtection(const Address& container, std::int32_t protectionClass, std::uint32_t flags = 0) {
        call(zorvane_request_set_protection(container.containerClass, container.user, cText(container.identifier),
                                            protectionClass, flags));
    }

    /// Group to path. An empty identifier is the caller's own, here and below.
    std::map<std::string, std::string> groupPaths(const std::string& identifier = {},
                                                  std::uint32_t user = ZORVANE_CURRENT_USER) {
        return paths(zorvane_request_group_paths(user, orOwn(identifier)));
    }
    std::vector<std::string> groupIdentifiers(const std::string& identifier = {},
                                              std::uint32_t user = ZORVANE_CURRENT_USER) {
        std::vector<std::string> groups;
        const Result result = call(zorvane_request_group_identifiers(user, orOwn(identifier)));
        for (std::size_t i = 0; i < zorvane_result_count(result.get()); ++i)
            groups.emplace_back(zorvane_result_identifier_at(result.get(), i));
        return groups;
    }
    std::string systemPath(const std::string& identifier = {}) {
        return call(zorvane_request_system_path(orOwn(identifier))).path();
    }
    std::map<std::string, std::string> systemGroupPaths(const std::string& identifier = {}) {
        return paths(zorvane_request_system_group_paths(orOwn(identifier)));
    }
    std::string systemGroupPath(const std::string& group, const std::string& identifier = {}) {
        return call(zorvane_request_system_group_path(cText(group), orOwn(identifier))).path();
    }
    /// Flag: ZORVANE_PLACEHOLDER.
    void registerEntitlements(const std::string& identifier, const std::map<std::string, Value>& entitlements,
                              const std::string& parent = {}, std::uint32_t flags = 0) {
        const Value map(entitlements);
        call(zorvane_request_register(cText(identifier), map.get(), orOwn(parent), flags));
    }
    void unregister(const std::string& identifier) {
        call(zorvane_request_register(cText(identifier), nullptr, nullptr, 0));
    }
    std::map<std::string, Value> status() {
        const auto value = call(zorvane_request_status()).value();
        return value ? value->map().value_or(std::map<std::string, Value>()) : std::map<std::string, Value>();
    }

private:
    struct Free {
        void operator()(zorvane_client* client) const { zorvane_client_free(client); }
    };
    static const char* orOwn(const std::string& identifier) { return identifier.empty() ? nullptr : cText(identifier); }
    template <typename Call>
    static auto whenFound(Call&& call) -> std::optional<decltype(call())> {
        try {
            return call();
        } catch (const Error& error) {
            if (error.kind() != Kind::notFound)
                throw;
            return std::nullopt;
        }
    }
    Container lookedUp(std::uint32_t containerClass, const std::string& identifier, std::uint32_t user,
                       std::uint32_t flags) {
        const Result result = call(zorvane_request_lookup(containerClass, user, orOwn(identifier), flags));
        Container container;
        container.containerClass = containerClass;
        container.user = user;
        container.identifier = result.identifier();
        container.uuid = result.uuid();
        container.path = result.path();
        container.existed = zorvane_result_existed(result.get()) != 0;
        return container;
    }
    std::map<std::string, std::string> paths(zorvane_request* request) {
        std::map<std::string, std::string> paths;
        const Result result = call(request);
        for (std::size_t i = 0; i < zorvane_result_count(result.get()); ++i)
            paths.emplace(zorvane_result_identifier_at(result.get(), i),
                          Result::textOf(zorvane_result_path_at(result.get(), i)));
        return paths;
    }

    std::unique_ptr<zorvane_client, Free> client_;
};

/// Calls that do not wait, for any event loop: watch fd(), and dispatch() when it is readable. If a callback throws,
/// dispatch throws the same when it has called the others.
class Async {
public:
    /// A failed call leaves the result empty, and the error is there.
    using Callback = std::function<void(Result result, const std::optional<Error>& error)>;

    explicit Async(const std::string& root = "/", Timeout timeout = std::nullopt) {
        zorvane_error error;
        async_.reset(zorvane_async_new(cText(root), forC(timeout), &error));
        if (!async_)
            throw Error(error);
    }

    int fd() const { return zorvane_async_fd(async_.get()); }
    /// Any request of zorvane.h. The number of the call, for cancel.
    std::uint64_t start(zorvane_request* request, Callback callback) {
        std::list<Pending> one;
        try {
            one.push_back(Pending{this, {}, std::move(callback), 0});
        } catch (...) {
            zorvane_request_free(request);
            throw;
        }
        one.front().place = one.begin();
        zorvane_error error;
        const std::uint64_t call = zorvane_async_start(async_.get(), request, &Async::answered, &one.front(), &error);
        if (call == 0)
            throw Error(error);
        one.front().call = call;
        pending_.splice(pending_.end(), one);
        return call;
    }
    std::size_t dispatch() {
        const std::size_t count = zorvane_async_dispatch(async_.get());
        if (thrown_)
            std::rethrow_exception(std::exchange(thrown_, nullptr));
        return count;
    }
    /// False: its callback was called already.
    bool cancel(std::uint64_t call) {
        if (zorvane_async_cancel(async_.get(), call) == 0)
            return false;
        pending_.remove_if([&](const Pending& pending) { return pending.call == call; });
        return true;
    }
    Async(const Async&) = delete;
    Async& operator=(const Async&) = delete;

private:
    struct Pending {
        Async* owner;
        std::list<Pending>::iterator place;
        Callback callback;
        std::uint64_t call;
    };
    struct Free {
        void operator()(zorvane_async* async) const { zorvane_async_free(async); }
    };
    static void answered(void* data, zorvane_result* result, const zorvane_error* error) {
        Result owned(result);
        Pending& pending = *static_cast<Pending*>(data);
        Async& async = *pending.owner;
        std::list<Pending> one;
        one.splice(one.begin(), async.pending_, pending.place);
        try {
            if (pending.callback)
                pending.callback(std::move(owned), error ? std::optional<Error>(Error(*error)) : std::nullopt);
        } catch (...) {
            if (!async.thrown_)
                async.thrown_ = std::current_exception();
        }
    }

    std::list<Pending> pending_;
    std::exception_ptr thrown_;
    std::unique_ptr<zorvane_async, Free> async_;
};

} // namespace stable
} // namespace zorvane
