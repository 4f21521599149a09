// SPDX-License-Identifier: Apache-2.0
#include "GzipInput.h"

#include <cerrno>
#include <unistd.h>

namespace zorvanectl::content {

namespace {

constexpr std::array<std::uint8_t, 2> magic{0x1f, 0x8b};
/// The largest window, and zlib's own word for the gzip form alone.
constexpr int windowBits = 15 + 16;

} // namespace

bool GzipInput::isGzip(int file) {
    std::array<std::uint8_t, magic.size()> begin{};
    return ::pread(file, begin.data(), begin.size(), 0) == static_cast<ssize_t>(begin.size()) && begin == magic;
}

GzipInput::GzipInput(int file) : file_(file), ready_(::inflateInit2(&stream_, windowBits) == Z_OK) {}

GzipInput::~GzipInput() {
    if (ready_)
        ::inflateEnd(&stream_);
}

bool GzipInput::refill() {
    if (stream_.avail_in != 0)
        return true;
    ssize_t count = 0;
    do
        count = ::read(file_, input_.data(), input_.size());
    while (count < 0 && errno == EINTR);
    if (count < 0)
        return false;
    readBytes_ += static_cast<std::uint64_t>(count);
    stream_.next_in = input_.data();
    stream_.avail_in = static_cast<uInt>(count);
    return true;
}

bool GzipInput::beginMember() {
    if (!refill() || stream_.avail_in == 0 || stream_.next_in[0] != magic[0])
        return false;
    inMember_ = ::inflateReset(&stream_) == Z_OK;
    return inMember_;
}

std::expected<std::span<const std::uint8_t>, const char*> GzipInput::next() {
    if (!ready_)
        return std::unexpected("out of memory");
    stream_.next_out = output_.data();
    stream_.avail_out = static_cast<uInt>(output_.size());
    while (stream_.avail_out != 0 && (inMember_ || beginMember())) {
        if (!refill())
            return std::unexpected("it cannot be read");
        if (stream_.avail_in == 0)
            return std::unexpected("it was cut");
        const int result = ::inflate(&stream_, Z_NO_FLUSH);
        if (result == Z_STREAM_END)
            inMember_ = false;
        else if (result != Z_OK)
            return std::unexpected("it is damaged");
    }
    return std::span<const std::uint8_t>(output_).first(output_.size() - stream_.avail_out);
}

} // namespace zorvanectl::content
