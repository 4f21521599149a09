// SPDX-License-Identifier: Apache-2.0
#include "check/DeathRow.h"

#include "fs/DiskUsage.h"
#include "fs/FileSystemDeathRow.h"
#include "os/Openat2.h"

#include <algorithm>
#include <ctime>
#include <fcntl.h>
#include <set>
#include <sys/stat.h>

namespace zor::check {

void forEachDeathRow(Look& look, const std::function<void(int row, const FileURL& url)>& function) {
    const FileURL own = look.device().places().deathrowDirectory();
    if (const auto directory = look.openDirectory(own))
        function(directory->get(), own);
    // That of each other file system.
    std::vector<FileURL> places = look.device().places().placesOfSharedContainers();
    for (const MobileUser& user : look.users())
        places.push_back(user.home);
    std::set<std::pair<dev_t, ino_t>> seen;
    for (const FileURL& place : places) {
        const auto top = fs::topOfMount(look.device().fileManager().resolver(), place);
        if (!top || !seen.insert(top->identity).second)
            continue;
        if (const auto directory = fs::openDeathRow(top->directory.get()))
            function(directory->get(), fs::deathRowBelow(top->url));
    }
}

DeathRow lookAtDeathRow(CheckedSystem& system) {
    DeathRow row;
    const CheckOptions options;
    Look look(system, options);
    const std::time_t now = std::time(nullptr);
    forEachDeathRow(look, [&](int directory, const FileURL& url) {
        look.forEachName(directory, url, [&](const char* name) {
            struct stat status{};
            if (::fstatat(directory, name, &status, AT_SYMLINK_NOFOLLOW) != 0)
                return; // it has been deleted meanwhile
            ++row.items;
            // The move there is the last change of it, and a later one by its deletion only makes it younger.
            row.oldestSeconds = std::max(row.oldestSeconds,
                                         static_cast<std::uint64_t>(std::max<std::time_t>(now - status.st_ctime, 0)));
            if (!S_ISDIR(status.st_mode)) {
                row.bytes += static_cast<std::uint64_t>(status.st_blocks) * 512;
                return;
            }
            if (const auto item = platform::openBeneathOnMount(directory, name, O_RDONLY | O_DIRECTORY))
                row.bytes += fs::diskUsage(item->get(), name, {}).bytes;
        });
    });
    return row;
}

} // namespace zor::check
