// SPDX-License-Identifier: Apache-2.0
#include "Mounts.h"

#include "Staging.h"
#include "fs/MountFences.h"
#include "os/FileDescriptor.h"
#include "platform/Errno.h"
#include "zorvane/Client.h"

#include <algorithm>
#include <cerrno>
#include <climits>
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/statvfs.h>

namespace zorvanerun {

using zor::platform::FileDescriptor;
using zor::platform::openBeneath;

namespace {

/// Directories of the system that are shown if they exist. Most are links into /usr if that holds everything.
constexpr const char* systemDirectories[] = {"/usr", "/bin", "/sbin", "/lib", "/lib32", "/lib64", "/libx32", "/etc"};
/// Places that the sandbox fills itself.
constexpr const char* ownDirectories[] = {"/proc", "/dev", memoryPlace, "/tmp"};

// The system's containers are the daemon's, or the user's that owns them by name: an older system made them so.
constexpr uid_t daemonUser = 0;

std::unexpected<Failure> failed(std::string what, std::string advice) {
    return std::unexpected(Failure{.what = std::move(what), .advice = std::move(advice)});
}

/// Why a container is not found at the place that the daemon has just told.
Failure notFound(const std::string& cannot, const std::string& path, const std::string& advice) {
    constexpr const char* unit = "start this program where the directory is seen: of its unit, take away ProtectHome=, "
                                 "InaccessiblePaths=, TemporaryFileSystem= or RootDirectory= (the sandbox shows the "
                                 "program no more than is its own)";
    // Process 1 sees what is there for all; a look at its root takes a power that the unit may lack.
    const FileDescriptor all(::open("/proc/1/root", O_PATH | O_DIRECTORY | O_CLOEXEC));
    if (!all.valid())
        return {.what = cannot + ". The daemon finds it: does the mount namespace of this process hide it",
                .advice = std::string(unit).append("; if no unit hides it, ").append(advice)};
    if (openBeneath(all.get(), path.c_str() + 1, O_PATH | O_DIRECTORY))
        return {.what = cannot + ". It is there, but the mount namespace of this process hides it", .advice = unit};
    return {.what = cannot, .advice = advice};
}

/// The index in an absolute path below the root at which the relative path begins.
std::size_t beginBelow(const Root& root) {
    return root.path == "/" ? 1 : root.path.size() + 1;
}

zor::ErrnoOr<FileDescriptor> openPlain(const Root& root, const std::string& path) {
    return openBeneath(root.descriptor.get(), path.substr(beginBelow(root)).c_str(), O_PATH | O_DIRECTORY);
}

/// A container below the home's fence, if there is one. The owner of a directory there can mount a file system that
/// never answers: none is entered.
zor::ErrnoOr<FileDescriptor> openContainer(const Root& root, const std::string& path, zor::fs::MountFence* home) {
    auto opened = home ? home->open(path.c_str() + beginBelow(root), O_PATH | O_DIRECTORY) : openPlain(root, path);
    // A program would find nothing of its own there, and make it anew.
    if (opened && zor::platform::hidesNames(opened->get()))
        return zor::Errno(ENOKEY);
    return opened;
}

std::string cannotOpen(const std::string& place, zor::Errno error) {
    if (error == EXDEV)
        return place + " is a mount point, or lies behind one";
    if (error == ELOOP)
        return place + " is a symbolic link, or lies behind one";
    if (error == ENOKEY)
        return place + " is locked: it is encrypted, and its key is not there";
    return withReason(place + " cannot be opened", error);
}

/// The absolute path that a link in /etc means.
std::string fromEtc(std::string_view target) {
    std::string path = target.starts_with('/') ? "" : "/etc";
    while (!target.empty()) {
        const std::string_view name = target.substr(0, target.find('/'));
        target.remove_prefix(std::min(name.size() + 1, target.size()));
        if (name == "..")
            path.erase(std::min(path.rfind('/'), path.size()));
        else if (!name.empty() && name != ".")
            path.append("/").append(name);
    }
    return path;
}

/// Whether the sandbox has things of its own at that place, which would hide what is mounted there.
bool isHidden(const std::string& path) {
    return isAtOrBelow(path, "/proc") || (isAtOrBelow(path, "/dev") && !isAtOrBelow(path, memoryPlace));
}

class Collector {
public:
    Collector(const Root& root, const Options& options, const std::string& home, std::vector<Mount>& mounts)
        : root_(root), options_(options),
          home_(root.descriptor.get(), std::string_view(home).substr(std::min(home.size(), beginBelow(root))),
                zor::fs::MountFence::Kind::home),
          systemUser_(zorvane::containerOwners(root.path).system), mounts_(mounts) {}

    Result<void> container(Mount::Kind kind, const std::string& identifier, const std::string& path) {
        const std::string what = "the " + std::string(kindName(kind)) + " container of " + identifier;
        for (const char* directory : systemDirectories)
            if (isAtOrBelow(path, directory))
                return failed(what + " " + path + " lies in " + directory + ", which every program sees",
                              "give the daemon a root elsewhere");
        if (isHidden(path))
            return failed(what + " " + path + " lies where the sandbox has things of its own",
                          "give the daemon a root elsewhere");
        const std::string advice =
            "somebody has changed the directory: look who can write to the one that holds it, and put the container "
            "back where it was";
        const bool users = kind == Mount::Kind::data || kind == Mount::Kind::applicationGroup;
        auto directory = openContainer(root_, path, users && !home_.path().empty() ? &home_ : nullptr);
        if (!directory && directory.error() == ENOENT)
            return std::unexpected(notFound(cannotOpen(what + " " + path, directory.error()), path, advice));
        if (!directory)
            return failed(cannotOpen(what + " " + path, directory.error()), advice);
        struct stat status{};
        if (::fstat(directory->get(), &status) != 0)
            return failed(withReason(what + " " + path + " cannot be read", zor::Errno::last()), advice);
        const bool owned =
            users ? status.st_uid == options_.user : status.st_uid == daemonUser || status.st_uid == systemUser_;
        if (!S_ISDIR(status.st_mode) || !owned)
            return failed(what + " " + path + " belongs to user " + std::to_string(status.st_uid) + ", not to " +
                              (users ? "user " + std::to_string(options_.user) : "the system"),
                          advice);
        struct statvfs space{};
        if (::fstatvfs(directory->get(), &space) == 0 && (space.f_flag & ST_RDONLY) != 0)
            return failed(
                what + " " + path + " is read-only here",
                "of the unit, take away ProtectSystem=strict and ReadOnlyPaths=, or name the homes and the "
                "system's containers in ReadWritePaths=; if no unit does it, see what befell the file system");
        mounts_.push_back({.kind = kind,
                           .identifier = identifier,
                           .path = path,
                           .descriptor = std::move(*directory),
                           .linkTarget = {}});
        return {};
    }

    Result<void> groups(Mount::Kind kind, const std::map<std::string, std::string>& groups) {
        for (const auto& [identifier, path] : groups)
            if (auto added = container(kind, identifier, path); !added)
                return added;
        return {};
    }

    Result<void> readOnly(const Root& device, const std::string& path, const std::vector<std::string>& containers) {
        const std::string advice = "name a directory by its real, absolute path; not one that holds containers or what "
                                   "the sandbox has anyway";
        bool clashes = !isPlainPath(path) || isHidden(path);
        for (const std::string& container : containers)
            clashes = clashes || isAtOrBelow(container, path) || isAtOrBelow(path, container);
        for (const char* directory : ownDirectories)
            clashes = clashes || isAtOrBelow(directory, path);
        for (const char* directory : systemDirectories)
            clashes = clashes || isAtOrBelow(path, directory);
        if (clashes)
            return failed(path + " cannot be shown read-only", advice);
        auto directory = openPlain(device, path);
        if (!directory)
            return failed(cannotOpen("the directory " + path, directory.error()), advice);
        mounts_.push_back({.kind = Mount::Kind::readOnly,
                           .identifier = {},
                           .path = path,
                           .descriptor = std::move(*directory),
                           .linkTarget = {}});
        return {};
    }

    Result<void> operatingSystem(const Root& device) {
        for (const char* const path : systemDirectories) {
            struct stat status{};
            if (::fstatat(device.descriptor.get(), path + 1, &status, AT_SYMLINK_NOFOLLOW) != 0)
                continue;
            Mount mount{
                .kind = Mount::Kind::system, .identifier = {}, .path = path, .descriptor = {}, .linkTarget = {}};
            if (S_ISLNK(status.st_mode)) {
                char target[PATH_MAX];
                const ssize_t length = ::readlinkat(device.descriptor.get(), path + 1, target, sizeof target);
                mount.linkTarget.assign(target, static_cast<std::size_t>(std::max<ssize_t>(length, 0)));
            } else {
                auto directory = openPlain(device, path);
                if (!directory)
                    return failed(cannotOpen(std::string("the directory ") + path, directory.error()),
                                  "see what stands in its place");
                mount.descriptor = std::move(*directory);
            }
            mounts_.push_back(std::move(mount));
        }
        return {};
    }

    /// With the host's network: the file that /etc/resolv.conf leads to, where the sandbox has nothing of that place.
    /// The link is root's; on the way that it names no other is followed, for there others may write. Without such a
    /// file the link dangles, as it does outside.
    void resolver(const Root& device) {
        char target[PATH_MAX];
        const ssize_t length = ::readlinkat(device.descriptor.get(), "etc/resolv.conf", target, sizeof target);
        if (options_.network != Network::host || length <= 0)
            return;
        const std::string path = fromEtc({target, static_cast<std::size_t>(length)});
        constexpr std::string_view oldRun = "/var/run/"; // everywhere a link to /run
        const std::string real = path.starts_with(oldRun) ? "/run/" + path.substr(oldRun.size()) : path;
        if (!isPlainPath(real) || isHidden(path) ||
            std::ranges::any_of(systemDirectories, [&](const char* shown) { return isAtOrBelow(path, shown); }))
            return;
        auto file = openBeneath(device.descriptor.get(), real.c_str() + 1, O_PATH | O_NOFOLLOW);
        struct stat status{};
        if (file && ::fstat(file->get(), &status) == 0 && S_ISREG(status.st_mode))
            mounts_.push_back({.kind = Mount::Kind::system,
                               .identifier = {},
                               .path = path,
                               .descriptor = std::move(*file),
                               .linkTarget = {},
                               .isFile = true});
    }

private:
    const Root& root_;
    const Options& options_;
    /// One for all containers: it asks the home once whether it answers.
    zor::fs::MountFence home_;
    const uid_t systemUser_;
    std::vector<Mount>& mounts_;
};

std::vector<std::string> pathsOf(const ToldContainers& told) {
    std::vector<std::string> paths = {told.data};
    for (const auto* groups : {&told.applicationGroups, &told.systemGroups})
        for (const auto& [identifier, path] : *groups)
            paths.push_back(path);
    if (told.systemContainer)
        paths.push_back(*told.systemContainer);
    return paths;
}

} // namespace

const char* kindName(Mount::Kind kind) {
    switch (kind) {
    case Mount::Kind::data:
        return "data";
    case Mount::Kind::applicationGroup:
        return "application-group";
    case Mount::Kind::systemContainer:
        return "system";
    case Mount::Kind::systemGroup:
        return "system-group";
    case Mount::Kind::readOnly:
        return "read-only";
    case Mount::Kind::system:
        break;
    }
    return "operating-system";
}

Result<std::vector<Mount>> openMounts(const Root& root, const Options& options, const ToldContainers& told) {
    // The system is the one that this program runs on, whatever root the daemon has.
    const Root device = TRY(Root::open("/"));
    std::vector<Mount> mounts;
    Collector collector(root, options, told.home, mounts);
    Result<void> done = collector.operatingSystem(device);
    const std::vector<std::string> containers = pathsOf(told);
    for (const std::string& path : options.readOnly)
        if (done)
            done = collector.readOnly(device, path, containers);
    if (done)
        collector.resolver(device);
    if (done)
        done = collector.container(Mount::Kind::data, options.identifier, told.data);
    if (done)
        done = collector.groups(Mount::Kind::applicationGroup, told.applicationGroups);
    if (done && told.systemContainer)
        done = collector.container(Mount::Kind::systemContainer, options.identifier, *told.systemContainer);
    if (done)
        done = collector.groups(Mount::Kind::systemGroup, told.systemGroups);
    TRY(std::move(done));
    return mounts;
}

} // namespace zorvanerun
