// SPDX-License-Identifier: Apache-2.0
// Bytes for the tests of packed buffers: as people write them, and at the very end of the memory that may be read.
#pragma once

#include <cctype>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <fstream>
#include <span>
#include <stdexcept>
#include <string>
#include <string_view>
#include <sys/mman.h>
#include <unistd.h>
#include <vector>

namespace zor::test {

using ByteVector = std::vector<std::uint8_t>;

/// Pairs of digits; everything else but a "#" and what follows it on its line is ignored.
inline ByteVector fromHex(std::string_view text) {
    ByteVector bytes;
    int high = -1;
    for (std::size_t i = 0; i < text.size(); ++i) {
        if (text[i] == '#') {
            i = std::min(text.find('\n', i), text.size() - 1);
            continue;
        }
        if (std::isxdigit(static_cast<unsigned char>(text[i])) == 0)
            continue;
        const int digit = std::stoi(std::string(1, text[i]), nullptr, 16);
        if (high < 0) {
            high = digit;
        } else {
            bytes.push_back(static_cast<std::uint8_t>(high * 16 + digit));
            high = -1;
        }
    }
    return bytes;
}

inline std::string toHex(std::span<const std::uint8_t> bytes) {
    std::string text;
    for (std::size_t i = 0; i < bytes.size(); ++i) {
        char pair[8];
        std::snprintf(pair, sizeof pair, "%02x%s", bytes[i], i % 8 == 7 ? "\n" : " ");
        text += pair;
    }
    return text;
}

/// A file of tests/upcall/golden.
inline ByteVector golden(const std::string& name) {
    std::ifstream file(std::string(ZORVANE_SOURCE_DIR) + "/tests/upcall/golden/" + name);
    const std::string text{std::istreambuf_iterator<char>(file), {}};
    if (text.empty())
        throw std::runtime_error("no golden file " + name);
    return fromHex(text);
}

/// A copy of bytes that ends where the memory does: reading one byte further ends the process, in every build.
class EdgeOfMemory {
public:
    explicit EdgeOfMemory(std::span<const std::uint8_t> bytes) : pageBytes_(static_cast<std::size_t>(::getpagesize())) {
        mappedBytes_ = (bytes.size() / pageBytes_ + 2) * pageBytes_;
        void* const mapped = ::mmap(nullptr, mappedBytes_, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
        if (mapped == MAP_FAILED)
            throw std::runtime_error("no memory");
        start_ = static_cast<std::uint8_t*>(mapped);
        std::uint8_t* const edge = start_ + mappedBytes_ - pageBytes_;
        if (::mprotect(edge, pageBytes_, PROT_NONE) != 0)
            throw std::runtime_error("no edge");
        data_ = edge - bytes.size();
        if (!bytes.empty())
            std::memcpy(data_, bytes.data(), bytes.size());
    }
    ~EdgeOfMemory() { ::munmap(start_, mappedBytes_); }
    EdgeOfMemory(const EdgeOfMemory&) = delete;
    EdgeOfMemory& operator=(const EdgeOfMemory&) = delete;

    [[nodiscard]] std::uint8_t* data() const { return data_; }

private:
    const std::size_t pageBytes_;
    std::size_t mappedBytes_ = 0;
    std::uint8_t* start_ = nullptr;
    std::uint8_t* data_ = nullptr;
};

} // namespace zor::test
