// SPDX-License-Identifier: Apache-2.0
// Writes down each function that a program compiled with -finstrument-functions enters and leaves. Loaded before the
// program's libraries; the C library's own empty hooks stand behind these.
//
// The file that ZORVANE_TRACE names is mapped: a count, then records. Past its end nothing is written.
#include <atomic>
#include <cstdint>
#include <cstdlib>
#include <fcntl.h>
#include <link.h>
#include <sys/mman.h>
#include <unistd.h>

namespace {

constexpr std::uint64_t recordsMax = 4'000'000;

struct Record {
    std::uint64_t address;
    std::uint32_t thread;
    std::uint32_t isEntry;
};

struct File {
    std::atomic<std::uint64_t> count;
    std::uint64_t padding;
    Record records[recordsMax];
};

File* file;
std::uintptr_t base;

__attribute__((constructor)) void open() {
    const char* const path = std::getenv("ZORVANE_TRACE");
    const int descriptor = path ? ::open(path, O_RDWR | O_CREAT | O_TRUNC | O_CLOEXEC, 0600) : -1;
    if (descriptor < 0 || ::ftruncate(descriptor, sizeof(File)) != 0)
        return;
    ::dl_iterate_phdr(
        [](dl_phdr_info* program, std::size_t, void*) {
            base = program->dlpi_addr; // the first one is the program itself
            return 1;
        },
        nullptr);
    void* const memory = ::mmap(nullptr, sizeof(File), PROT_READ | PROT_WRITE, MAP_SHARED, descriptor, 0);
    ::close(descriptor);
    if (memory != MAP_FAILED)
        file = static_cast<File*>(memory);
}

void write(void* function, std::uint32_t isEntry) {
    static thread_local const auto thread = static_cast<std::uint32_t>(::gettid());
    if (!file)
        return;
    const std::uint64_t at = file->count.fetch_add(1, std::memory_order_relaxed);
    if (at < recordsMax)
        file->records[at] = {reinterpret_cast<std::uintptr_t>(function) - base, thread, isEntry};
}

} // namespace

extern "C" {
void __cyg_profile_func_enter(void* function, void*) {
    write(function, 1);
}
void __cyg_profile_func_exit(void* function, void*) {
    write(function, 0);
}
}
