// SPDX-License-Identifier: Apache-2.0
#include "Decoder.h"

#include "ArchiveRecord.h"
#include "GzipInput.h"
#include "Powerless.h"

#include <algorithm>
#include <archive.h>
#include <archive_entry.h>
#include <cerrno>
#include <clocale>
#include <csignal>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <initializer_list>
#include <optional>
#include <string>
#include <string_view>
#include <sys/wait.h>
#include <unistd.h>
#include <utility>

namespace zorvanectl::content {

namespace {

// In the decoding process.
constexpr int archiveNumber = 3;
constexpr int recordsNumber = 4;
constexpr std::size_t readBytes = 256 * 1024;
constexpr int pipeBytes = 1024 * 1024;

/// Writes all of it, or ends the process: then nobody reads it any more.
void send(std::string_view bytes) {
    while (!bytes.empty()) {
        const ssize_t written = ::write(recordsNumber, bytes.data(), bytes.size());
        if (written < 0 && errno == EINTR)
            continue;
        if (written <= 0)
            ::_exit(1);
        bytes.remove_prefix(static_cast<std::size_t>(written));
    }
}

std::string_view bytesOf(const Record& record) {
    return {reinterpret_cast<const char*>(&record), sizeof record};
}

[[noreturn]] void sendFailure(std::string_view text) {
    text = text.substr(0, recordBytesMax);
    send(bytesOf({.kind = RecordKind::failure, .first = static_cast<std::uint32_t>(text.size())}));
    send(text);
    ::_exit(0);
}

class Reading {
public:
    [[noreturn]] void run();

private:
    void open();
    void sendEntry(archive_entry* entry);
    void sendData();
    [[noreturn]] void fail(const char* otherwise);
    [[nodiscard]] std::uint64_t position() const {
        return gzip_ ? gzip_->readBytes()
                     : static_cast<std::uint64_t>(std::max<la_int64_t>(::archive_filter_bytes(archive_, -1), 0));
    }
    static la_ssize_t readGzip(archive* archive, void* self, const void** bytes);

    archive* archive_ = ::archive_read_new();
    std::optional<GzipInput> gzip_;
};

void Reading::fail(const char* otherwise) {
    const char* text = ::archive_error_string(archive_);
    sendFailure(text ? text : otherwise);
}

void Reading::open() {
    using Support = int (*)(archive*);
    for (const Support support : std::initializer_list<Support>{
             ::archive_read_support_format_tar, ::archive_read_support_format_zip, ::archive_read_support_format_cpio,
             ::archive_read_support_format_7zip, ::archive_read_support_filter_bzip2,
             ::archive_read_support_filter_compress, ::archive_read_support_filter_lz4,
             ::archive_read_support_filter_lzip, ::archive_read_support_filter_lzma, ::archive_read_support_filter_xz,
             ::archive_read_support_filter_zstd})
        // A warning is about another program, which this process cannot start.
        if (support(archive_) < ARCHIVE_WARN)
            fail("a form of archives is not supported");
    if (GzipInput::isGzip(archiveNumber))
        gzip_.emplace(archiveNumber);
    const int opened = gzip_ ? ::archive_read_open(archive_, this, nullptr, readGzip, nullptr)
                             : ::archive_read_open_fd(archive_, archiveNumber, readBytes);
    if (opened != ARCHIVE_OK)
        fail("it is no archive");
}

la_ssize_t Reading::readGzip(archive* archive, void* self, const void** bytes) {
    const auto read = static_cast<Reading*>(self)->gzip_->next();
    if (!read) {
        ::archive_set_error(archive, EIO, "%s", read.error());
        return ARCHIVE_FATAL;
    }
    *bytes = read->data();
    return static_cast<la_ssize_t>(read->size());
}

void Reading::run() {
    if (!archive_)
        sendFailure("out of memory");
    open();
    for (;;) {
        archive_entry* entry = nullptr;
        const int result = ::archive_read_next_header(archive_, &entry);
        if (result == ARCHIVE_EOF)
            break;
        if (result < ARCHIVE_WARN)
            fail("it is broken");
        sendEntry(entry);
        if (::archive_entry_filetype(entry) == AE_IFREG)
            sendData();
    }
    const bool tar = (::archive_format(archive_) & ARCHIVE_FORMAT_BASE_MASK) == ARCHIVE_FORMAT_TAR;
    const Record record{.kind = RecordKind::end,
                        .flags = tar && !gzip_ && ::archive_filter_count(archive_) == 1 ? recordUncompressedTar : 0,
                        .readBytes = position()};
    send(bytesOf(record));
    ::_exit(0);
}

void Reading::sendEntry(archive_entry* entry) {
    const char* name = ::archive_entry_pathname(entry);
    const char* hardLink = ::archive_entry_hardlink(entry);
    const char* link = hardLink ? hardLink : ::archive_entry_symlink(entry);
    if (!name)
        sendFailure("an entry has no name, or one that cannot be read");
    if (::archive_entry_is_encrypted(entry) != 0)
        sendFailure("it is encrypted");
    if (::archive_entry_filetype(entry) == AE_IFLNK && !link)
        sendFailure("a symbolic link's target cannot be read");
    const std::size_t nameBytes = std::strlen(name);
    const std::size_t linkBytes = link ? std::strlen(link) : 0;
    if (nameBytes > recordBytesMax / 2 || linkBytes > recordBytesMax / 2)
        sendFailure("an entry has a name of more than " + std::to_string(recordBytesMax / 2) + " bytes");
    Record record{.kind = RecordKind::entry,
                  .first = static_cast<std::uint32_t>(nameBytes),
                  .second = static_cast<std::uint32_t>(linkBytes),
                  .mode = static_cast<std::uint32_t>(::archive_entry_mode(entry)),
                  .readBytes = position()};
    if (hardLink)
        record.flags |= recordHardLink;
    if (::archive_entry_mtime_is_set(entry) != 0) {
        record.flags |= recordHasTime;
        record.timeSeconds = ::archive_entry_mtime(entry);
        record.timeNanoseconds = static_cast<std::uint32_t>(::archive_entry_mtime_nsec(entry));
    }
    if (::archive_entry_size_is_set(entry) != 0) {
        record.flags |= recordHasSize;
        record.offset = ::archive_entry_size(entry);
    }
    std::string whole(bytesOf(record));
    whole.append(name, nameBytes);
    if (link)
        whole.append(link, linkBytes);
    send(whole);
}

void Reading::sendData() {
    for (;;) {
        const void* block = nullptr;
        std::size_t bytes = 0;
        la_int64_t offset = 0;
        const int result = ::archive_read_data_block(archive_, &block, &bytes, &offset);
        if (result == ARCHIVE_EOF)
            return;
        // A sum that does not fit is but a warning to the library.
        if (result != ARCHIVE_OK)
            fail("it is broken");
        for (std::size_t sent = 0; sent < bytes;) {
            const std::size_t piece = std::min(bytes - sent, recordBytesMax);
            const Record record{.kind = RecordKind::data,
                                .first = static_cast<std::uint32_t>(piece),
                                .offset = offset + static_cast<la_int64_t>(sent),
                                .readBytes = position()};
            send(bytesOf(record));
            send({static_cast<const char*>(block) + sent, piece});
            sent += piece;
        }
    }
}

/// Leaves the archive and the pipe open, under their numbers, and nothing else: the terminal, or what standard output
/// goes to, would be the caller's.
bool keepOnly(int archive, int records) {
    // Neither may be where the other one is to go.
    const int high = ::fcntl(records, F_DUPFD_CLOEXEC, recordsNumber + 1);
    const int highArchive = ::fcntl(archive, F_DUPFD_CLOEXEC, recordsNumber + 1);
    return high >= 0 && highArchive >= 0 && ::dup3(highArchive, archiveNumber, O_CLOEXEC) >= 0 &&
           ::dup3(high, recordsNumber, O_CLOEXEC) >= 0 && ::close_range(0, archiveNumber - 1, 0) == 0 &&
           ::close_range(recordsNumber + 1, ~0U, 0) == 0;
}

[[noreturn]] void decode(int archive, int records, pid_t parent) {
    // A terminal or a service manager may send them to both; the parent decides.
    for (const int signal : {SIGINT, SIGTERM, SIGHUP})
        std::signal(signal, SIG_IGN);
    if (!keepOnly(archive, records))
        ::_exit(1);
    // Names are bytes, and UTF-8 where a form of archive says what they are.
    std::setlocale(LC_CTYPE, "C.UTF-8");
    if (!becomePowerless(parent))
        sendFailure("the decoder's powers cannot be dropped");
    Reading().run();
}

} // namespace

Outcome<Decoder> Decoder::start(int archive) {
    int ends[2];
    if (::pipe2(ends, O_CLOEXEC) != 0)
        return failed("no pipe", zor::Errno::last());
    zor::platform::FileDescriptor reading(ends[0]);
    const zor::platform::FileDescriptor writing(ends[1]);
    // A larger one saves switches; where it is not granted, the usual one does.
    (void)::fcntl(writing.get(), F_SETPIPE_SZ, pipeBytes);
    const pid_t parent = ::getpid();
    std::fflush(nullptr);
    const pid_t pid = ::fork();
    if (pid < 0)
        return failed("no process to decode in", zor::Errno::last());
    if (pid == 0)
        decode(archive, writing.get(), parent);
    return Decoder(pid, std::move(reading));
}

Decoder::Decoder(Decoder&& other) noexcept : pid_(std::exchange(other.pid_, -1)), records_(std::move(other.records_)) {}

Decoder::~Decoder() {
    if (pid_ < 0)
        return;
    records_.reset();
    ::kill(pid_, SIGKILL);
    while (::waitpid(pid_, nullptr, 0) < 0 && errno == EINTR) {
    }
}

} // namespace zorvanectl::content
