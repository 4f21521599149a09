// SPDX-License-Identifier: Apache-2.0
#include "store/SetupProgress.h"

#include "fs/Durability.h"

#include <ctime>
#include <string>

namespace zor {

namespace {

constexpr std::size_t markerBytesMax = 4096;

std::string currentTime() {
    const std::time_t now = std::time(nullptr);
    std::tm parts{};
    ::gmtime_r(&now, &parts);
    char text[64];
    (void)std::strftime(text, sizeof text, "%Y-%m-%d %H:%M:%S +0000", &parts);
    return text;
}

} // namespace

void MigrationMarkers::writeMigrationFileToDiskWithName(std::string_view name, const FileURL& directory) {
    const std::string version = systemVersion_.buildVersion();
    const plist::Dictionary marker{{"ZORMigrationVersionNumber", version.empty() ? "Unknown" : version},
                                   {"ZORMigrationTime", currentTime()}};
    const auto written = writeToURL(marker, directory.appendingFile(name), writeAtomically | writeWithoutProtection,
                                    markerBytesMax, fileManager_);
    const std::string shown(name);
    if (written)
        log_.write(logLevelNotice, __func__, "Migration successfully completed for %s", shown.c_str());
    else
        log_.write(logLevelError, __func__, "Failed to write migration file %s : %s", shown.c_str(),
                   written.error().text().c_str());
}

void MigrationMarkers::writeMigrationFileToDiskWithName(std::string_view name) {
    writeMigrationFileToDiskWithName(name, configuration_.libraryDirectory());
}

bool MigrationMarkers::existsMigrationFileWithName(std::string_view name) {
    return fileManager_.itemExistsAtURL(configuration_.libraryDirectory().appendingFile(name));
}

bool MigrationMarkers::isDue(std::string_view name) {
    return fileManager_.itemDoesNotExistAtURL(configuration_.libraryDirectory().appendingFile(name));
}

} // namespace zor
