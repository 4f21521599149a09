// SPDX-License-Identifier: Apache-2.0
// Calls of the C interface that wait, their errors and results, and what needs no daemon.
#include "CInterface.h"

#include "platform/Errno.h"
#include "plist/Text.h"

#include <algorithm>
#include <cstring>
#include <limits>
#include <utility>

namespace zorvane::c {

namespace {

/// The caller is known, and not entitled to what it asks for.
constexpr std::uint64_t codeNotEntitled = 55;

int kindOf(const Error& error) {
    switch (error.kind) {
    case Error::Kind::refused:
        return ZORVANE_REFUSED;
    case Error::Kind::unreachable:
        return ZORVANE_UNREACHABLE;
    case Error::Kind::timedOut:
        return ZORVANE_TIMED_OUT;
    case Error::Kind::daemon:
        if (isNotFound(error))
            return ZORVANE_NOT_FOUND;
        return error.code == codeNotEntitled ? ZORVANE_REFUSED : ZORVANE_OTHER;
    case Error::Kind::protocol:
        break;
    }
    return ZORVANE_OTHER;
}

/// As much of a text as there is room for; no character is cut into pieces.
template <std::size_t size>
void put(char (&place)[size], std::string_view text) {
    std::size_t count = std::min(text.size(), size - 1);
    const auto isContinuation = [](char byte) { return (static_cast<unsigned char>(byte) & 0xC0U) == 0x80; };
    while (count > 0 && count < text.size() && isContinuation(text[count]))
        --count;
    std::memcpy(place, text.data(), count);
    place[count] = '\0';
}

void fill(zorvane_error* error, int kind, std::uint64_t code, std::string_view message, std::string_view advice) {
    if (!error)
        return;
    *error = {};
    error->kind = static_cast<std::uint32_t>(kind);
    error->code = code;
    put(error->message, message);
    put(error->advice, advice);
}

} // namespace

int tell(zorvane_error* error, const Error& failure) noexcept {
    const int kind = kindOf(failure);
    const bool isDaemons = failure.kind == Error::Kind::daemon && failure.advice.empty();
    fill(error, kind, failure.code, failure.message, isDaemons ? errorText(failure.code).advice : failure.advice);
    return kind;
}

int tell(zorvane_error* error, const char* message) noexcept {
    fill(error, ZORVANE_OTHER, 0, message, "");
    return ZORVANE_OTHER;
}

ConnectOptions connectOptions(const char* root, std::int64_t timeoutMilliseconds) {
    if (root && *root == '\0')
        throw Wrong{"the root is empty"};
    ConnectOptions options;
    if (root)
        options.root = root;
    if (timeoutMilliseconds == ZORVANE_TIMEOUT_DEFAULT)
        return options;
    if (!std::in_range<std::uint32_t>(timeoutMilliseconds))
        throw Wrong{"the timeout is none"};
    options.timeoutMilliseconds = static_cast<std::uint32_t>(timeoutMilliseconds);
    return options;
}

Result<Client*> Session::client() {
    if (!client_)
        client_ = TRY(Client::connect(options_));
    return &*client_;
}

int Session::perform(const zorvane_request* request, std::unique_ptr<zorvane_result>& result,
                     zorvane_error* error) noexcept {
    return guarded(error, [&] {
        if (!request)
            throw std::bad_alloc();
        auto outcome = request->run(*this);
        if (!outcome) {
            if (outcome.error().kind != Error::Kind::daemon)
                client_.reset();
            return tell(error, outcome.error());
        }
        result = std::make_unique<zorvane_result>(std::move(*outcome));
        return static_cast<int>(ZORVANE_OK);
    });
}

} // namespace zorvane::c

namespace c = zorvane::c;

struct zorvane_client {
    c::Session session;
};

zorvane_client* zorvane_connect(const char* root, std::int64_t timeout_milliseconds, zorvane_error* error) {
    std::unique_ptr<zorvane_client> made;
    const int kind = c::guarded(error, [&] {
        made.reset(new zorvane_client{.session = c::Session(c::connectOptions(root, timeout_milliseconds))});
        const auto connected = made->session.client();
        return connected ? static_cast<int>(ZORVANE_OK) : c::tell(error, connected.error());
    });
    return kind == ZORVANE_OK ? made.release() : nullptr;
}

void zorvane_client_free(zorvane_client* client) {
    delete client;
}

int zorvane_call(zorvane_client* client, zorvane_request* request, zorvane_result** result, zorvane_error* error) {
    const std::unique_ptr<zorvane_request> owned(request);
    std::unique_ptr<zorvane_result> made;
    if (result)
        *result = nullptr;
    const int kind = client ? client->session.perform(owned.get(), made, error) : c::tell(error, "there is no client");
    if (result && kind == ZORVANE_OK)
        *result = made.release();
    return kind;
}

namespace {

const char* textOf(const std::optional<std::string>& text) {
    return text ? text->c_str() : nullptr;
}

const std::uint8_t* bytesOf(const std::optional<zorvane_uuid>& uuid) {
    return uuid ? uuid->data() : nullptr;
}

const zorvane_result::Entry* entryOf(const zorvane_result* result, std::size_t index) {
    return result && index < result->entries.size() ? &result->entries[index] : nullptr;
}

} // namespace

void zorvane_result_free(zorvane_result* result) {
    delete result;
}

const char* zorvane_result_path(const zorvane_result* result) {
    return result ? textOf(result->path) : nullptr;
}

const char* zorvane_result_identifier(const zorvane_result* result) {
    return result ? textOf(result->identifier) : nullptr;
}

const std::uint8_t* zorvane_result_uuid(const zorvane_result* result) {
    return result ? bytesOf(result->uuid) : nullptr;
}

int zorvane_result_existed(const zorvane_result* result) {
    return result && result->existed ? 1 : 0;
}

int zorvane_result_transient(const zorvane_result* result) {
    return result && result->transient ? 1 : 0;
}

std::uint64_t zorvane_result_bytes(const zorvane_result* result) {
    return result ? result->bytes : 0;
}

const zorvane_value* zorvane_result_value(const zorvane_result* result) {
    return result && result->value ? c::handleOf(&*result->value) : nullptr;
}

std::size_t zorvane_result_count(const zorvane_result* result) {
    return result ? result->entries.size() : 0;
}

const char* zorvane_result_identifier_at(const zorvane_result* result, std::size_t index) {
    const auto* const entry = entryOf(result, index);
    return entry ? entry->identifier.c_str() : nullptr;
}

const char* zorvane_result_path_at(const zorvane_result* result, std::size_t index) {
    const auto* const entry = entryOf(result, index);
    return entry ? textOf(entry->path) : nullptr;
}

const std::uint8_t* zorvane_result_uuid_at(const zorvane_result* result, std::size_t index) {
    const auto* const entry = entryOf(result, index);
    return entry ? bytesOf(entry->uuid) : nullptr;
}

const char* zorvane_result_next_page(const zorvane_result* result) {
    return result ? textOf(result->nextPage) : nullptr;
}

const char* zorvane_code_meaning(std::uint64_t code) {
    return zorvane::errorText(code).meaning;
}

const char* zorvane_code_cause(std::uint64_t code) {
    return zorvane::errorText(code).cause;
}

const char* zorvane_code_consequence(std::uint64_t code) {
    return zorvane::errorText(code).consequence;
}

const char* zorvane_code_advice(std::uint64_t code) {
    return zorvane::errorText(code).advice;
}

const char* zorvane_version() {
    return ZORVANE_VERSION;
}

std::uint32_t zorvane_class_by_name(const char* name) {
    return c::guardedOr(std::uint32_t{0}, [&] {
        return static_cast<std::uint32_t>(name ? zorvane::containerClassOf(name).value_or(0) : 0);
    });
}

const char* zorvane_class_name(std::uint32_t container_class) {
    const bool isClass = container_class >= 1 && container_class <= zorvane::containerClassMax;
    return isClass ? zorvane::containerClassName(container_class).data() : nullptr; // of a literal, which has its NUL
}

std::uint32_t zorvane_default_user(std::uint32_t container_class, const char* root) {
    return c::guardedOr(ZORVANE_CURRENT_USER,
                        [&] { return zorvane::defaultUserOfClass(container_class, root ? root : "/"); });
}

void zorvane_uuid_text(const std::uint8_t uuid[16], char text[37]) {
    // The text has 36 characters, more than a string keeps in itself.
    text[0] = '\0';
    (void)c::guardedOr(0, [&] {
        zorvane_uuid bytes;
        std::copy_n(uuid, bytes.size(), bytes.begin());
        std::memcpy(text, zorvane::uuidText(bytes).c_str(), 37);
        return 0;
    });
}
