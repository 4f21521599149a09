// SPDX-License-Identifier: Apache-2.0
// Marker files: each says that something need not be done again, and to people when it was. A marker is replaced
// atomically; a stop leaves none or a whole one. Any thread.
#pragma once

#include "base/FileURL.h"
#include "fs/ZORFileManager.h"
#include "platform/Device.h"
#include "store/ZORGlobalConfiguration.h"

#include <string_view>

namespace zor {

class MigrationMarkers {
public:
    MigrationMarkers(const Log& log, ZORFileManager& fileManager, ZORGlobalConfiguration& configuration,
                     const platform::SystemVersionQuery& systemVersion)
        : log_(log), fileManager_(fileManager), configuration_(configuration), systemVersion_(systemVersion) {}

    /// Failures are logged. In the library directory where no other is given.
    void writeMigrationFileToDiskWithName(std::string_view name, const FileURL& directory);
    void writeMigrationFileToDiskWithName(std::string_view name);
    [[nodiscard]] bool existsMigrationFileWithName(std::string_view name);
    /// Whether the marker is known not to be there: one that cannot be examined makes nothing happen a second time.
    [[nodiscard]] bool isDue(std::string_view name);

private:
    const Log& log_;
    ZORFileManager& fileManager_;
    ZORGlobalConfiguration& configuration_;
    const platform::SystemVersionQuery& systemVersion_;
};

} // namespace zor
