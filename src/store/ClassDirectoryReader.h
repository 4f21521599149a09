// SPDX-License-Identifier: Apache-2.0
// Reads the metadata of every container in a class directory.
//
// Reading is one open, one fstat, one read and one close an entry. In a large directory a second thread takes every
// other stretch of entries: when the directory is not in memory, two reads are under way at the disk instead of one,
// and when it is, two processors parse. Each record is handed over in the directory's order all the same, so that of
// two containers with one identifier the later listed counts.
#pragma once

#include "store/ZORMetadata.h"

#include <functional>
#include <memory>
#include <string>
#include <vector>

namespace zor {

class ClassDirectoryReader {
public:
    ClassDirectoryReader(const Log& log, ZORFileManager& fileManager, FileURL directory, std::uint32_t userId)
        : log_(log), fileManager_(fileManager), directory_(std::move(directory)), userId_(userId) {}

    /// Calls `found` for each valid container, on this thread; what is not valid is logged and left out. Fails with the
    /// listing's error, ENOKEY where an encryption hides the names, and `found` is then not called.
    Result<void> forEach(const std::function<void(std::shared_ptr<ZORMetadata>)>& found);
    /// Whether an entry of the last listing may be a container that an encryption hides.
    [[nodiscard]] bool metHidden() const { return metHidden_; }

private:
    const Log& log_;
    ZORFileManager& fileManager_;
    const FileURL directory_;
    const std::uint32_t userId_;
    bool metHidden_ = false;
};

} // namespace zor
