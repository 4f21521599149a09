// SPDX-License-Identifier: Apache-2.0
// How the tool speaks: for people in words and tables, with --json for programs; results on standard output, errors on
// standard error.
#pragma once

#include "zorvane/Client.h"
#include "zorvane/Text.h"

#include <cstdint>
#include <nlohmann/json.hpp>
#include <optional>
#include <string>
#include <vector>

namespace zorvanectl {

// Exit codes; they do not change.
inline constexpr int exitDone = 0;
/// A thing that was named is not there.
inline constexpr int exitNotFound = 1;
inline constexpr int exitUsage = 2;
inline constexpr int exitUnreachable = 3;
/// A check found something.
inline constexpr int exitFindings = 4;
inline constexpr int exitLocalError = 5;
/// The daemon does not know this program, or does not do this for it.
inline constexpr int exitRefused = 6;
inline constexpr int exitTimedOut = 7;
/// The result could not be written out; what was asked for was done.
inline constexpr int exitOutputLost = 8;
/// The daemon answered with another error, or with what makes no sense.
inline constexpr int exitDaemonError = 9;

/// The version of every JSON document, as "version". A key may come with the same number; one that goes or means
/// something else raises it.
inline constexpr int jsonVersion = 1;

enum class Format { people, json };

class Output {
public:
    explicit Output(Format format) : format_(format) {}

    [[nodiscard]] bool isJson() const { return format_ == Format::json; }
    /// An object; its version is added.
    void json(nlohmann::json document) const;
    /// Before what may be longer than the terminal: for people, a pager shows it. table() does so itself.
    void page() const;
    /// One line to standard output.
    void line(const std::string& text) const;
    /// One line to standard error, beside a result.
    void remark(const std::string& text) const;
    /// Columns as wide as their widest cell, the header first; nothing but the header when there are no rows. A row
    /// that is wider than the terminal goes on in another, indented line; where most are, the last column of each has
    /// that line to itself.
    void table(const std::vector<std::string>& header, const std::vector<std::vector<std::string>>& rows) const;
    /// A name and what is under it, a line each, deeper ones indented.
    void tree(const std::string& name, const zorvane::Value& value, const std::string& indent = "") const;
    /// Asks on the terminal whether to go on. Without a terminal, or for JSON, no: said as an error.
    [[nodiscard]] bool agreed(const std::string& question, const std::string& while_) const;
    /// Says what failed, what that means and what to do. The exit code for it.
    [[nodiscard]] int error(const zorvane::Error& error, const std::string& while_) const;
    /// The same for what failed on this side; `exitCode` is the one for it.
    [[nodiscard]] int localError(int exitCode, const std::string& message, const std::string& advice,
                                 const std::string& while_) const;
    /// To be called last: `exitCode`, or that of a result which could not be written out.
    [[nodiscard]] int finished(int exitCode) const;

private:
    /// `details` are further keys of the error.
    int sayError(int exitCode, const std::string& message, const std::string& advice, const std::string& while_,
                 nlohmann::json details) const;

    const Format format_;
};

[[nodiscard]] nlohmann::json toJson(const zorvane::Value& value);
/// null for what could not be measured.
[[nodiscard]] nlohmann::json toJson(const std::optional<std::uint64_t>& bytes);
/// nullopt for null, and for what holds it: the daemon's values have none.
[[nodiscard]] std::optional<zorvane::Value> fromJson(const nlohmann::json& json);
/// Whether no row of such a table is wider than the terminal; without a terminal all fit.
[[nodiscard]] bool fits(const std::vector<std::string>& header, const std::vector<std::vector<std::string>>& rows);
/// How many columns of a terminal a text takes.
[[nodiscard]] std::size_t columnsOf(const std::string& text);
/// "1.4 MiB"; "an unknown number of bytes" for what could not be measured.
[[nodiscard]] std::string shownBytes(const std::optional<std::uint64_t>& bytes);
using zorvane::printable;

} // namespace zorvanectl
