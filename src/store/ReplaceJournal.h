// SPDX-License-Identifier: Apache-2.0
// The journal of one replace: what moves where. It is on the disk, whole, before the first move, and goes after the
// last; so the next launch knows of each replace that was under way.
//
// Its name is a random UUID, which also names the place in staging where the old container waits meanwhile.
#pragma once

#include "base/FileURL.h"
#include "base/Result.h"
#include "base/UUID.h"
#include "fs/ZORFileManager.h"

namespace zor {

struct ReplaceJournal {
    FileURL oldUrl;     // the old container
    FileURL newUrl;     // the new one, before the replace
    FileURL stagingUrl; // where the old one waits
    FileURL destUrl;    // where the new one ends up

    /// "UUID.plist" in the Replace directory.
    [[nodiscard]] static FileURL urlFor(const FileURL& replaceDirectory, const UUID& uuid);
    /// The name in staging of the old container of the journal at `url`, which need not be readable.
    [[nodiscard]] static std::string_view stagingNameFor(const FileURL& url);

    /// Writes it durably, or nothing. Error 33 when an URL is missing, 34.
    [[nodiscard]] Result<void> _writeToDiskReplaceAt(const Log& log, ZORFileManager& fileManager,
                                                     const FileURL& url) const;
    /// Error 35, logged, for a file that cannot be read or lacks a path.
    [[nodiscard]] static Result<ReplaceJournal>
    _readAndValidateReplaceFileAtUrl(const Log& log, ZORFileManager& fileManager, const FileURL& url);
    /// Whether such a failed reading says nothing of the content: the file may be a good journal, and another time may
    /// tell.
    [[nodiscard]] static bool mayStillBeRead(const ZORError& readFailure);
    /// The paths are absolute. Where the whole root was moved since the journal was written, they are made to lie below
    /// it again: its old place is what precedes the staging directory's own path in `stagingUrl`.
    void moveToRoot(const std::string& rootPath, const FileURL& stagingDirectory);
    /// For the log.
    [[nodiscard]] std::string text() const;
};

} // namespace zor
