// SPDX-License-Identifier: Apache-2.0
// What the tool's commands do, each with its options and its exit code.
#pragma once

#include "Output.h"
#include "zorvane/Client.h"

#include <cstdint>
#include <optional>
#include <string>

namespace zorvanectl {

struct Target {
    std::uint64_t containerClass = 0;
    /// Nobody named: the class's usual owner.
    std::optional<std::uint32_t> user;
    std::string identifier;
    bool transient = false;
};

int create(const zorvane::ConnectOptions& connect, const Output& output, const Target& target);
int lookup(const zorvane::ConnectOptions& connect, const Output& output, const Target& target);
int list(const zorvane::ConnectOptions& connect, const Output& output, const Target& target);
int emptyDeathRow(const zorvane::ConnectOptions& connect, const Output& output);
int status(const zorvane::ConnectOptions& connect, const Output& output);

} // namespace zorvanectl
