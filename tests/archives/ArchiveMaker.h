// SPDX-License-Identifier: Apache-2.0
// Archives as a test describes them, hostile ones too.
#pragma once

#include <archive.h>
#include <cstdint>
#include <string>
#include <sys/stat.h>
#include <vector>

namespace zor::test {

struct Made {
    std::string name;
    mode_t mode = S_IFREG | 0644;
    std::string data{};
    /// The target of a symbolic link, or of a hard link when that is said.
    std::string target{};
    bool hardLink = false;
    /// So many bytes of hole come before the data; for Form::tar.
    std::int64_t hole = 0;
};

/// The archive library's name for it.
struct Form {
    int format;
    int filter = ARCHIVE_FILTER_NONE;
    bool operator==(const Form&) const = default;
    static const Form tar, gnuTar, tarGzip, tarBzip2, tarCompress, tarLz4, tarLzip, tarLzma, tarXz, tarZstd, zip, cpio,
        sevenZip;
};
inline constexpr int paxFormat = ARCHIVE_FORMAT_TAR_PAX_RESTRICTED;
inline const Form Form::tar{paxFormat};
inline const Form Form::gnuTar{ARCHIVE_FORMAT_TAR_GNUTAR};
inline const Form Form::tarGzip{paxFormat, ARCHIVE_FILTER_GZIP};
inline const Form Form::tarBzip2{paxFormat, ARCHIVE_FILTER_BZIP2};
inline const Form Form::tarCompress{paxFormat, ARCHIVE_FILTER_COMPRESS};
inline const Form Form::tarLz4{paxFormat, ARCHIVE_FILTER_LZ4};
inline const Form Form::tarLzip{paxFormat, ARCHIVE_FILTER_LZIP};
inline const Form Form::tarLzma{paxFormat, ARCHIVE_FILTER_LZMA};
inline const Form Form::tarXz{paxFormat, ARCHIVE_FILTER_XZ};
inline const Form Form::tarZstd{paxFormat, ARCHIVE_FILTER_ZSTD};
inline const Form Form::zip{ARCHIVE_FORMAT_ZIP};
inline const Form Form::cpio{ARCHIVE_FORMAT_CPIO_SVR4_NOCRC};
inline const Form Form::sevenZip{ARCHIVE_FORMAT_7ZIP};

/// The bytes. Throws std::runtime_error when the form cannot hold the entries.
std::string makeArchive(Form form, const std::vector<Made>& entries);

inline Made directory(std::string name, mode_t mode = 0755) {
    return {.name = std::move(name), .mode = S_IFDIR | mode};
}
inline Made file(std::string name, std::string data = "x", mode_t mode = 0644) {
    return {.name = std::move(name), .mode = S_IFREG | mode, .data = std::move(data)};
}
inline Made symbolicLink(std::string name, std::string target) {
    return {.name = std::move(name), .mode = S_IFLNK | 0777, .target = std::move(target)};
}
inline Made hardLink(std::string name, std::string target) {
    return {.name = std::move(name), .target = std::move(target), .hardLink = true};
}

} // namespace zor::test
