// SPDX-License-Identifier: Apache-2.0
#include "support/TestRoot.h"

namespace zor::support {

void furnish(const std::string& root) {
    checked(::chmod(root.c_str(), 0755), root);
    writeFile(root + "/etc/passwd", "root:x:0:0::/private/var/root:/bin/sh\n"
                                    "mobile:x:501:501::/private/var/mobile:/bin/sh\n"
                                    "second:x:502:502::/private/var/second:/bin/sh\n"
                                    "homeless:x:503:503::/private/var/nowhere:/bin/sh\n");
    const struct {
        const char* name;
        uid_t owner;
        mode_t mode;
    } directories[] = {{"tmp", 0, 01777},
                       {"private/var/root", 0, 0700},
                       {"private/var/mobile", 501, 0755},
                       {"private/var/second", 502, 0755},
                       {"private/var/brevad", 33, 0755}};
    for (const auto& [name, owner, mode] : directories) {
        const std::string path = root + "/" + name;
        std::filesystem::create_directories(path);
        checked(::chmod(path.c_str(), mode), path);
        if (::geteuid() == 0)
            checked(::chown(path.c_str(), owner, owner), path);
    }
}

void TestRoot::makeDirectories(std::string_view relative, std::optional<uid_t> lastOwner, mode_t mode) const {
    for (std::size_t end = relative.find('/');; end = relative.find('/', end + 1)) {
        const std::filesystem::path level = path(relative.substr(0, end));
        const bool last = end == std::string_view::npos;
        struct stat above{};
        checked(::stat(level.parent_path().c_str(), &above), level);
        // A level on the way is whose the one above it is, and a class of bundles the installer's.
        const uid_t usual = level.parent_path().native().ends_with("/containers/Bundle") ? 33 : above.st_uid;
        const uid_t owner = last ? lastOwner.value_or(usual) : usual;
        if (::mkdir(level.c_str(), 0755) == 0 || (last && (lastOwner || mode != 0755))) {
            checked(::chmod(level.c_str(), last ? mode : 0755), level);
            if (::geteuid() == 0)
                checked(::chown(level.c_str(), owner, owner), level);
        }
        if (last)
            return;
    }
}

} // namespace zor::support
