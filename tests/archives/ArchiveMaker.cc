// SPDX-License-Identifier: Apache-2.0
#include "archives/ArchiveMaker.h"

#include <archive_entry.h>
#include <memory>
#include <stdexcept>

namespace zor::test {

namespace {

struct Freed {
    void operator()(archive* made) const { ::archive_write_free(made); }
    void operator()(archive_entry* made) const { ::archive_entry_free(made); }
};

void check(archive* made, la_int64_t result) {
    if (result < ARCHIVE_WARN)
        throw std::runtime_error(std::string("archive: ") + ::archive_error_string(made));
}

la_ssize_t append(archive* /*made*/, void* bytes, const void* buffer, std::size_t count) {
    static_cast<std::string*>(bytes)->append(static_cast<const char*>(buffer), count);
    return static_cast<la_ssize_t>(count);
}

} // namespace

std::string makeArchive(Form form, const std::vector<Made>& entries) {
    std::string bytes;
    const std::unique_ptr<archive, Freed> made(::archive_write_new());
    check(made.get(), ::archive_write_set_format(made.get(), form.format));
    check(made.get(), ::archive_write_add_filter(made.get(), form.filter));
    ::archive_write_set_bytes_in_last_block(made.get(), 1);
    check(made.get(), ::archive_write_open(made.get(), &bytes, nullptr, append, nullptr));
    for (const Made& wanted : entries) {
        const std::unique_ptr<archive_entry, Freed> entry(::archive_entry_new());
        ::archive_entry_copy_pathname(entry.get(), wanted.name.c_str());
        ::archive_entry_set_mode(entry.get(), wanted.mode);
        ::archive_entry_set_mtime(entry.get(), 1'000'000'000, 0);
        const auto dataBytes = static_cast<la_int64_t>(wanted.data.size());
        ::archive_entry_set_size(entry.get(), wanted.hole + dataBytes);
        if (wanted.hole > 0)
            ::archive_entry_sparse_add_entry(entry.get(), wanted.hole, dataBytes);
        ::archive_entry_set_uid(entry.get(), 1234);
        if (S_ISCHR(wanted.mode) || S_ISBLK(wanted.mode))
            ::archive_entry_set_rdev(entry.get(), 0x103);
        if (wanted.hardLink)
            ::archive_entry_copy_hardlink(entry.get(), wanted.target.c_str());
        else if (S_ISLNK(wanted.mode))
            ::archive_entry_copy_symlink(entry.get(), wanted.target.c_str());
        check(made.get(), ::archive_write_header(made.get(), entry.get()));
        // The writer skips what the hole stands for, but wants to be given it.
        const std::string whole = std::string(static_cast<std::size_t>(wanted.hole), '\0') + wanted.data;
        if (!whole.empty())
            check(made.get(), ::archive_write_data(made.get(), whole.data(), whole.size()));
    }
    check(made.get(), ::archive_write_close(made.get()));
    return bytes;
}

} // namespace zor::test
