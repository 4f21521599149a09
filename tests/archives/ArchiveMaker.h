// SPDX-License-Identifier: Apache-2.0
// Archives as a test describes them, hostile ones too.
#pragma once

#include <cstdint>
#include <string>
#include <sys/stat.h>
#include <vector>

namespace zor::test {

struct Made {
    std::string name;
    mode_t mode = S_IFREG | 0644;
    std::string data{};
    /// Of a symbolic link, or of a hard link when that is said.
    std::string target{};
    bool hardLink = false;
    /// So many bytes of hole come before the data; for Form::tar.
    std::int64_t hole = 0;
};

enum class Form {
    tar,
    gnuTar,
    tarGzip,
    tarBzip2,
    tarCompress,
    tarLz4,
    tarLzip,
    tarLzma,
    tarXz,
    tarZstd,
    zip,
    cpio,
    sevenZip
};

/// The bytes. Throws std::runtime_error when the form cannot hold the entries.
std::string makeArchive(Form form, const std::vector<Made>& entries);

inline Made directory(std::string name, mode_t mode = 0755) {
    return {.name = std::move(name), .mode = S_IFDIR | mode};
}
inline Made file(std::string name, std::string data = "x", mode_t mode = 0644) {
    return {.name = std::move(name), .mode = S_IFREG | mode, .data = std::move(data)};
}
inline Made symbolicLink(std::string name, std::string target) {
    return {.name = std::move(name), .mode = S_IFLNK | 0777, .target = std::move(target)};
}
inline Made hardLink(std::string name, std::string target) {
    return {.name = std::move(name), .target = std::move(target), .hardLink = true};
}

} // namespace zor::test
