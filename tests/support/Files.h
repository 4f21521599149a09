// SPDX-License-Identifier: Apache-2.0
// Items of a test's own making on a real file system. All throw std::system_error when they fail; `path` is relative to
// the open directory `parent` and may have directories in it.
#pragma once

#include "os/FileDescriptor.h"

#include <cerrno>
#include <cstdint>
#include <span>
#include <string>
#include <string_view>
#include <sys/types.h>
#include <system_error>
#include <vector>

namespace zor::support {

/// The result of a system call, unless the call failed.
template <typename Result>
Result checked(Result result, const std::string& what) {
    if (result < 0)
        throw std::system_error(errno, std::generic_category(), what);
    return result;
}

platform::FileDescriptor openDirectory(int parent, const std::string& path);
platform::FileDescriptor openDirectory(const std::string& path);
void makeDirectory(int parent, const std::string& path, mode_t mode = 0755);
void makeFile(int parent, const std::string& path, const std::string& content = "x", mode_t mode = 0644);
void makeLink(int parent, const std::string& path, const std::string& target);
void makeFifo(int parent, const std::string& path);
/// "NAME/" a directory, "NAME -> TARGET" a link, "NAME|" a FIFO, anything else a file holding "x".
void makeItems(int parent, const std::vector<std::string>& items);
bool exists(int parent, const std::string& path);
/// By paths, with the directories on the way; what a file holds is "" where there is none.
void writeFile(const std::string& path, std::string_view bytes, mode_t mode = 0644);
std::string readFile(const std::string& path);

inline std::span<const std::uint8_t> bytesOf(const std::string& text) {
    return {reinterpret_cast<const std::uint8_t*>(text.data()), text.size()};
}

} // namespace zor::support
