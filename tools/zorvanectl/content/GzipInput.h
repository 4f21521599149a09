// SPDX-License-Identifier: Apache-2.0
// A gzip file undone and checked against its own sums, which the library that reads archives does not do. One thread.
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <expected>
#include <span>
#include <vector>
#include <zlib.h>

namespace zorvanectl::content {

class GzipInput {
public:
    /// Whether a file begins as a gzip file does. Its offset stays.
    [[nodiscard]] static bool isGzip(int file);

    /// `file` is open at its beginning.
    explicit GzipInput(int file);
    ~GzipInput();
    GzipInput(const GzipInput&) = delete;
    GzipInput& operator=(const GzipInput&) = delete;

    /// The next bytes, good until the next call; none at the end. The error says what is wrong.
    [[nodiscard]] std::expected<std::span<const std::uint8_t>, const char*> next();
    /// The bytes of the file that were read so far.
    [[nodiscard]] std::uint64_t readBytes() const { return readBytes_; }

private:
    /// Reads on when the input is used up. False: it cannot be read.
    bool refill();
    /// Another member may follow the one that ended; what is not one is left, as gzip leaves it.
    bool beginMember();

    static constexpr std::size_t bufferBytes = 256 * 1024;

    const int file_;
    z_stream stream_{};
    const bool ready_;
    bool inMember_ = true;
    std::uint64_t readBytes_ = 0;
    std::vector<std::uint8_t> input_ = std::vector<std::uint8_t>(bufferBytes);
    std::vector<std::uint8_t> output_ = std::vector<std::uint8_t>(bufferBytes);
};

} // namespace zorvanectl::content
