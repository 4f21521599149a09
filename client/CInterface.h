// SPDX-License-Identifier: Apache-2.0
// Behind zorvane.h: what its opaque types hold, and the border that no exception crosses.
//
// A request holds what is to be done, with its arguments copied and judged; a session does it, over the C++ client.
// Each object belongs to one thread at a time.
#pragma once

#include "zorvane/Client.h"
#include "zorvane/zorvane.h"

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

using zorvane_uuid = std::array<std::uint8_t, 16>;

struct zorvane_result {
    std::optional<std::string> path;
    std::optional<std::string> identifier;
    std::optional<zorvane_uuid> uuid;
    bool existed = false;
    bool transient = false;
    std::uint64_t bytes = 0;
    std::optional<zorvane::Value> value;
    struct Entry {
        std::string identifier;
        std::optional<std::string> path;
        std::optional<zorvane_uuid> uuid;
    };
    std::vector<Entry> entries;
    std::optional<std::string> nextPage;
};

namespace zorvane::c {

class Session;
using Run = std::function<Result<zorvane_result>(Session&)>;

} // namespace zorvane::c

struct zorvane_request {
    zorvane::c::Run run;
};

namespace zorvane {
// None of it is an interface of the library's.
namespace [[gnu::visibility("hidden")]] c {

/// A connection that is made when it is first needed, and again after it has failed.
class Session {
public:
    explicit Session(ConnectOptions options) : options_(std::move(options)) {}
    [[nodiscard]] const ConnectOptions& options() const { return options_; }
    [[nodiscard]] Result<Client*> client();
    /// Sets the result, or the error. `request` may be nullptr: there was no memory for it.
    int perform(const zorvane_request* request, std::unique_ptr<zorvane_result>& result, zorvane_error* error) noexcept;

private:
    const ConnectOptions options_;
    std::optional<Client> client_;
};

/// An argument of the caller's that is not allowed.
struct Wrong {
    const char* message;
};

/// Writes an error for the caller, if there is a place for it. Returns its kind.
int tell(zorvane_error* error, const Error& failure) noexcept;
int tell(zorvane_error* error, const char* message) noexcept;

/// Gives `body`'s result; an exception of it becomes the caller's error, and its kind the answer.
template <typename Body>
int guarded(zorvane_error* error, Body&& body) noexcept {
    try {
        return body();
    } catch (const Wrong& wrong) {
        return tell(error, wrong.message);
    } catch (const std::bad_alloc&) {
        return tell(error, "there is no memory left");
    } catch (const std::exception& exception) {
        return tell(error, exception.what());
    }
}

/// Gives `body`'s result, or `otherwise` when it throws.
template <typename T, typename Body>
T guardedOr(T otherwise, Body&& body) noexcept {
    try {
        return body();
    } catch (...) {
        return otherwise;
    }
}

[[nodiscard]] ConnectOptions connectOptions(const char* root, std::int64_t timeoutMilliseconds);

/// A zorvane_value is a Value under another name.
[[nodiscard]] inline const Value* valueOf(const zorvane_value* value) {
    return reinterpret_cast<const Value*>(value);
}
[[nodiscard]] inline const zorvane_value* handleOf(const Value* value) {
    return reinterpret_cast<const zorvane_value*>(value);
}

} // namespace c
} // namespace zorvane
