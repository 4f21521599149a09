// SPDX-License-Identifier: Apache-2.0
// Bytes for the tests of packed buffers: as people write them, and at the very end of the memory that may be read.
#pragma once

#include "upcall/UpcallPackets.h"

#include <cstdint>
#include <cstdio>
#include <fstream>
#include <regex>
#include <span>
#include <stdexcept>
#include <sys/mman.h>
#include <unistd.h>

namespace zor::test {

/// Pairs of digits; a "#" and what follows it on its line is ignored, and so are spaces.
inline ByteVector fromHex(const std::string& text) {
    static const std::regex comment("#[^\n]*");
    static const std::regex pair("[0-9a-f]{2}");
    const std::string bare = std::regex_replace(text, comment, "");
    ByteVector bytes;
    for (std::sregex_iterator at(bare.begin(), bare.end(), pair); at != std::sregex_iterator(); ++at)
        bytes.push_back(static_cast<std::uint8_t>(std::stoi(at->str(), nullptr, 16)));
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
    explicit EdgeOfMemory(std::span<const std::uint8_t> bytes) {
        const auto pageBytes = static_cast<std::size_t>(::getpagesize());
        mappedBytes_ = (bytes.size() / pageBytes + 2) * pageBytes;
        mapped_ = ::mmap(nullptr, mappedBytes_, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
        std::uint8_t* const edge = static_cast<std::uint8_t*>(mapped_) + mappedBytes_ - pageBytes;
        if (mapped_ == MAP_FAILED || ::mprotect(edge, pageBytes, PROT_NONE) != 0)
            throw std::runtime_error("no edge of memory");
        data_ = edge - bytes.size();
        std::ranges::copy(bytes, data_);
    }
    ~EdgeOfMemory() { ::munmap(mapped_, mappedBytes_); }
    EdgeOfMemory(const EdgeOfMemory&) = delete;
    EdgeOfMemory& operator=(const EdgeOfMemory&) = delete;

    [[nodiscard]] std::uint8_t* data() const { return data_; }

private:
    std::size_t mappedBytes_ = 0;
    void* mapped_ = nullptr;
    std::uint8_t* data_ = nullptr;
};

} // namespace zor::test
