// SPDX-License-Identifier: Apache-2.0
// Preloaded into a test and what it starts: appends every format that is printed to the file $ZORVANE_MESSAGES, one a
// line, line breaks in it as \n. The daemon's messages and errors are all made with vsnprintf, so nothing in it knows
// of this. A line is one write to a file opened for it: no descriptor is kept, and a kill loses nothing that was
// printed before.
#include <array>
#include <atomic>
#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <dlfcn.h>
#include <fcntl.h>
#include <unistd.h>

namespace {

constexpr std::size_t slots = 4096;
constexpr std::size_t lineBytesMax = 1024;

/// Formats are literals: one address, one text.
bool isNew(const char* format) {
    static std::array<std::atomic<const char*>, slots> seen;
    const auto first = reinterpret_cast<std::size_t>(format) * 0x9E3779B97F4A7C15U >> 52U;
    for (std::size_t i = 0; i < 16; ++i) {
        std::atomic<const char*>& slot = seen[(first + i) % slots];
        const char* empty = nullptr;
        if (slot.load() == format)
            return false;
        if (slot.compare_exchange_strong(empty, format))
            return true;
    }
    return true; // no place left to remember it
}

bool append(const char* file, const char* format) {
    char line[lineBytesMax];
    std::size_t length = 0;
    for (const char* c = format; *c && length + 3 < sizeof line; ++c) {
        if (*c == '\n')
            line[length++] = '\\';
        line[length++] = *c == '\n' ? 'n' : *c;
    }
    line[length++] = '\n';
    const int descriptor = ::open(file, O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC, 0666);
    const bool written = descriptor >= 0 && ::write(descriptor, line, length) == static_cast<ssize_t>(length);
    if (descriptor >= 0)
        ::close(descriptor);
    return written;
}

/// One that was printed when no descriptor was to be had.
std::atomic<const char*> waiting;

__attribute__((destructor)) void recordWaiting() {
    const char* file = std::getenv("ZORVANE_MESSAGES");
    const char* format = waiting.exchange(nullptr);
    if (file && format && !append(file, format))
        waiting = format;
}

void record(const char* format) {
    const char* file = std::getenv("ZORVANE_MESSAGES");
    recordWaiting();
    if (file && isNew(format) && !append(file, format))
        waiting = format;
}

} // namespace

extern "C" __attribute__((visibility("default"))) int vsnprintf(char* buffer, std::size_t size, const char* format,
                                                                std::va_list arguments) noexcept {
    static const auto next = reinterpret_cast<decltype(&::vsnprintf)>(::dlsym(RTLD_NEXT, "vsnprintf"));
    const int saved = errno;
    record(format);
    errno = saved;
    return next(buffer, size, format, arguments);
}
