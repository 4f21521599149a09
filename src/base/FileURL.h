// SPDX-License-Identifier: Apache-2.0
// A place in the file system: an absolute path, and whether it is meant as a directory. Names only; whoever acts on it
// resolves it anew (fs/PathResolver.h) and goes on with the descriptor.
#pragma once

#include <string>
#include <string_view>
#include <utility>

namespace zor {

class FileURL {
public:
    FileURL() = default;
    FileURL(std::string path, bool isDirectory) : path_(std::move(path)), isDirectory_(isDirectory) {
        while (path_.size() > 1 && path_.back() == '/')
            path_.pop_back();
    }
    static FileURL directory(std::string path) { return {std::move(path), true}; }
    static FileURL file(std::string path) { return {std::move(path), false}; }

    /// Without a trailing slash (but for "/").
    [[nodiscard]] const std::string& path() const { return path_; }
    [[nodiscard]] const char* c_str() const { return path_.c_str(); }
    [[nodiscard]] bool isDirectory() const { return isDirectory_; }
    [[nodiscard]] bool empty() const { return path_.empty(); }

    [[nodiscard]] FileURL appendingDirectory(std::string_view components) const { return append(components, true); }
    [[nodiscard]] FileURL appendingFile(std::string_view components) const { return append(components, false); }
    [[nodiscard]] std::string_view lastPathComponent() const {
        return std::string_view(path_).substr(path_.rfind('/') + 1);
    }
    [[nodiscard]] FileURL deletingLastPathComponent() const {
        const auto slash = path_.rfind('/');
        return {slash == 0 || slash == std::string::npos ? "/" : path_.substr(0, slash), true};
    }
    bool operator==(const FileURL&) const = default;

private:
    [[nodiscard]] FileURL append(std::string_view components, bool isDirectory) const {
        std::string joined;
        joined.reserve(path_.size() + 1 + components.size());
        joined += path_;
        if (joined.empty() || joined.back() != '/')
            joined += '/';
        joined += components;
        return {std::move(joined), isDirectory};
    }

    std::string path_;
    bool isDirectory_ = false;
};

} // namespace zor
