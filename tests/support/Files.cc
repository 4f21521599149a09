// SPDX-License-Identifier: Apache-2.0
#include "support/Files.h"

#include <fcntl.h>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <sys/stat.h>

namespace zor::support {

using platform::FileDescriptor;

FileDescriptor openDirectory(int parent, const std::string& path) {
    constexpr int flags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;
    return FileDescriptor(checked(::openat(parent, path.c_str(), flags), "open directory " + path));
}

FileDescriptor openDirectory(const std::string& path) {
    return openDirectory(AT_FDCWD, path);
}

void makeDirectory(int parent, const std::string& path, mode_t mode) {
    checked(::mkdirat(parent, path.c_str(), 0755), "mkdir " + path);
    checked(::fchmodat(parent, path.c_str(), mode, 0), "chmod " + path);
}

void makeFile(int parent, const std::string& path, const std::string& content, mode_t mode) {
    constexpr int flags = O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC;
    const FileDescriptor fd(checked(::openat(parent, path.c_str(), flags, 0600), "create " + path));
    const ssize_t written = ::write(fd.get(), content.data(), content.size());
    checked(written == static_cast<ssize_t>(content.size()) ? 0 : -1, "write " + path);
    checked(::fchmod(fd.get(), mode), "chmod " + path);
}

void makeLink(int parent, const std::string& path, const std::string& target) {
    checked(::symlinkat(target.c_str(), parent, path.c_str()), "symlink " + path);
}

void makeFifo(int parent, const std::string& path) {
    checked(::mkfifoat(parent, path.c_str(), 0644), "mkfifo " + path);
}

void makeItems(int parent, const std::vector<std::string>& items) {
    for (const std::string& item : items) {
        const std::size_t arrow = item.find(" -> ");
        if (arrow != std::string::npos)
            makeLink(parent, item.substr(0, arrow), item.substr(arrow + 4));
        else if (item.ends_with('/'))
            makeDirectory(parent, item.substr(0, item.size() - 1));
        else if (item.ends_with('|'))
            makeFifo(parent, item.substr(0, item.size() - 1));
        else
            makeFile(parent, item);
    }
}

bool exists(int parent, const std::string& path) {
    struct stat status{};
    return ::fstatat(parent, path.c_str(), &status, AT_SYMLINK_NOFOLLOW) == 0;
}

void writeFile(const std::string& path, std::string_view bytes, mode_t mode) {
    std::filesystem::create_directories(std::filesystem::path(path).parent_path());
    std::ofstream file(path, std::ios::trunc | std::ios::binary);
    file << bytes;
    file.close();
    checked(file && ::chmod(path.c_str(), mode) == 0 ? 0 : -1, "write " + path);
}

std::string readFile(const std::string& path) {
    std::ifstream file(path, std::ios::binary);
    return {std::istreambuf_iterator<char>(file), {}};
}

} // namespace zor::support
