// SPDX-License-Identifier: Apache-2.0
// Making a root that a daemon can serve: its directories, its users, and the entries of this installation's programs in
// the identity registry. Needs no daemon.
//
// Files that are there stay as they are, so a run that was stopped anywhere is finished by the next one: each file
// appears whole, each directory is given to its owner as long as it is empty. No link is followed below the root.
#include "Commands.h"
#include "fs/Durability.h"
#include "identity/Users.h"
#include "os/FileDescriptor.h"
#include "os/LinuxDisk.h"
#include "os/SystemRoot.h"
#include "platform/Errno.h"
#include "store/StorePlaces.h"

#include <array>
#include <cerrno>
#include <climits>
#include <cstring>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

namespace zorvanectl {

using zor::Errno;

namespace {

using zor::platform::FileDescriptor;
using zor::platform::openBeneath;
namespace names = zor::platform::names;

constexpr mode_t directoryMode = 0755;
constexpr mode_t fileMode = 0644;
constexpr const char* doing = "make the root";
/// The account of a root that has none, and that requests without a user mean.
constexpr const char* usualAccount = "mobile";
/// How many users a configuration made here has room for.
constexpr std::uint32_t mobileUsers = 10;

struct Wrong {
    std::string what;
    std::string advice;
};
template <typename T>
using Outcome = std::expected<T, Wrong>;

std::unexpected<Wrong> wrong(std::string what, std::string advice) {
    return std::unexpected(Wrong{.what = std::move(what), .advice = std::move(advice)});
}

std::unexpected<Wrong> cannot(const std::string& what, Errno error) {
    return wrong("cannot " + what + ": " + error.text(),
                 "look at what lies there, and run this command again as the owner of the root");
}

std::string registryEntry(const std::string& identifier, const std::string& executable, const std::string& power) {
    return "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\">\n<dict>\n    <key>Identifier</key>\n"
           "    <string>" +
           identifier + "</string>\n    <key>Executable</key>\n    <string>" + executable + "</string>\n" + power +
           "</dict>\n</plist>\n";
}

/// The characters of a path that mean something in XML.
bool isPlainPath(const std::string& path) {
    return path.find_first_of("<>&") == path.npos;
}

std::string ownProgram() {
    std::array<char, PATH_MAX> path;
    const ssize_t length = ::readlink("/proc/self/exe", path.data(), path.size());
    return length > 0 ? std::string(path.data(), static_cast<std::size_t>(length)) : std::string();
}

class Maker {
public:
    explicit Maker(zor::platform::SystemRoot root) : root_(std::move(root)) {}

    Outcome<void> make(const std::string& account);
    [[nodiscard]] const std::vector<std::string>& made() const { return made_; }
    [[nodiscard]] const std::vector<std::string>& doubts() const { return doubts_; }
    [[nodiscard]] const zor::platform::SystemRoot& root() const { return root_; }

private:
    Outcome<void> makeDirectory(const std::string& path, mode_t mode, uid_t owner);
    Outcome<void> makeFile(const std::string& directory, const std::string& name, const std::string& content);
    Outcome<void> makeUserDatabase(const std::string& account);
    Outcome<std::optional<zor::platform::PasswordEntry>> lookUp(const std::string& account);
    Outcome<void> makeConfiguration(const std::optional<zor::platform::PasswordEntry>& entry);
    Outcome<void> makeHome(const zor::platform::PasswordEntry& entry);
    Outcome<void> register_(const std::string& name, const std::string& executable, const std::string& power);
    Outcome<void> registerPrograms();
    [[nodiscard]] bool isThere(const std::string& path) const;

    const zor::platform::SystemRoot root_;
    const zor::platform::LinuxPasswordDatabase passwords_{root_};
    zor::platform::LinuxDisk disk_;
    std::vector<std::string> made_;
    std::vector<std::string> doubts_;
};

bool Maker::isThere(const std::string& path) const {
    const auto opened = openBeneath(root_.descriptor(), path.c_str(), O_PATH | O_NOFOLLOW);
    return opened || opened.error() != ENOENT;
}

Outcome<void> Maker::makeDirectory(const std::string& path, mode_t mode, uid_t owner) {
    const std::string shown = root_.path(path);
    const auto slash = path.rfind('/');
    const std::string above = slash == path.npos ? "." : path.substr(0, slash);
    const auto parent = openBeneath(root_.descriptor(), above.c_str(), O_RDONLY | O_DIRECTORY);
    if (!parent)
        return cannot("open " + root_.path(above), parent.error());
    const std::string name = path.substr(slash == path.npos ? 0 : slash + 1);
    const Errno made = disk_.makeDirectory(parent->get(), name.c_str(), mode);
    if (made && made != EEXIST)
        return cannot("make " + shown, made);
    const auto directory = openBeneath(parent->get(), name.c_str(), O_RDONLY | O_DIRECTORY);
    if (!directory)
        return cannot("open " + shown, directory.error());
    if (made)
        return {};
    Errno failed = disk_.changeMode(directory->get(), mode);
    if (!failed && owner != ::geteuid())
        failed = disk_.changeOwner(directory->get(), owner, owner);
    if (!failed)
        failed = disk_.sync(parent->get());
    if (failed)
        return cannot("give " + shown + " its owner and mode", failed);
    made_.push_back("made " + shown);
    return {};
}

Outcome<void> Maker::makeFile(const std::string& directory, const std::string& name, const std::string& content) {
    const auto opened = openBeneath(root_.descriptor(), directory.c_str(), O_RDONLY | O_DIRECTORY);
    if (!opened)
        return cannot("open " + root_.path(directory), opened.error());
    const std::string shown = root_.path(directory + "/" + name);
    if (const Errno failed =
            zor::fs::replaceFileDurably(disk_, opened->get(), name, fileMode,
                                        {reinterpret_cast<const std::uint8_t*>(content.data()), content.size()}))
        return cannot("write " + shown, failed);
    made_.push_back("wrote " + shown);
    return {};
}

Outcome<void> Maker::makeUserDatabase(const std::string& account) {
    if (root_.isDeviceRoot() || isThere(names::passwordFile))
        return {};
    const std::uint32_t number = zor::ipc::UserNumbers().first;
    const std::string id = std::to_string(number);
    return makeFile("etc", "passwd",
                    "root:x:0:0:root:/private/var/root:/bin/sh\n" + account + ":x:" + id + ":" + id +
                        "::/private/var/" + account + ":/bin/sh\n");
}

Outcome<std::optional<zor::platform::PasswordEntry>> Maker::lookUp(const std::string& account) {
    const auto entry = passwords_.entryForName(account.empty() ? usualAccount : account);
    if (entry)
        return *entry;
    if (account.empty())
        return std::nullopt;
    const std::string where = root_.isDeviceRoot() ? "this system" : root_.path(names::passwordFile);
    return wrong("there is no account " + account + " in " + where,
                 root_.isDeviceRoot() ? "make it first: useradd --create-home " + account : "add a line for it");
}

Outcome<void> Maker::makeConfiguration(const std::optional<zor::platform::PasswordEntry>& entry) {
    if (!isThere(names::configurationFile)) {
        std::string settings;
        const zor::ipc::UserNumbers usual;
        for (const auto& [key, account] :
             {std::pair("installer", zor::ipc::installerAccount), std::pair("system", zor::ipc::systemAccount)})
            if (passwords_.entryForName(account))
                settings += std::string(key) + "=" + std::string(account) + "\n";
        if (entry && !usual.isMobile(entry->uid))
            settings += "first=" + std::to_string(entry->uid) + "\nlast=" +
                        std::to_string(std::min(entry->uid + mobileUsers - 1, zor::ipc::UserNumbers::configuredMax)) +
                        "\n";
        if (!settings.empty())
            TRY(makeFile("etc/zorvane", "zorvaned.conf", "[users]\n" + settings));
    }
    const auto configured = zor::platform::configuredUsers(root_, passwords_);
    if (!configured)
        return wrong(configured.error(), "mend that, and run this command again");
    doubts_ = configured->doubts;
    if (entry && !configured->numbers.isMobile(entry->uid))
        return wrong("user " + entry->name + " (" + std::to_string(entry->uid) + ") is not among the users " +
                         std::to_string(configured->numbers.first) + " to " + std::to_string(configured->numbers.last),
                     "set first= and last= in section [users] of " + root_.path(names::configurationFile));
    // The installer's number is known from here on.
    for (const zor::RootDirectory& directory : zor::rootDirectories)
        TRY(makeDirectory(std::string(directory.path), directory.mode,
                          directory.isInstallers ? configured->numbers.installer : ::geteuid()));
    return {};
}

Outcome<void> Maker::makeHome(const zor::platform::PasswordEntry& entry) {
    const std::string prefix = root_.isDeviceRoot() ? "/" : root_.canonicalPath() + "/";
    const std::string path = entry.homeDirectory.substr(std::min(prefix.size(), entry.homeDirectory.size()));
    if (root_.isDeviceRoot() || path.empty()) {
        struct stat status{};
        if (::stat(entry.homeDirectory.c_str(), &status) != 0 || !S_ISDIR(status.st_mode))
            doubts_.push_back("The home " + entry.homeDirectory + " of " + entry.name +
                              " is not there yet: until it is, this user has no containers");
        return {};
    }
    for (auto slash = path.find('/'); slash != path.npos; slash = path.find('/', slash + 1))
        TRY(makeDirectory(path.substr(0, slash), directoryMode, ::geteuid()));
    return makeDirectory(path, directoryMode, entry.uid);
}

Outcome<void> Maker::register_(const std::string& name, const std::string& executable, const std::string& power) {
    const std::string file = name + names::identityFileSuffix;
    std::string path = names::identityDirectory;
    path.append("/").append(file);
    if (isThere(path))
        return {};
    if (!isPlainPath(executable))
        return wrong("the path " + executable + " has a character that an entry of the registry cannot hold",
                     "install the programs elsewhere");
    return makeFile(names::identityDirectory, file, registryEntry("com.veltra." + name, executable, power));
}

Outcome<void> Maker::registerPrograms() {
    const std::string own = ownProgram();
    if (own.empty())
        return wrong("this program cannot find its own path", "mount /proc");
    TRY(register_("zorvanectl", own,
                  "    <key>Entitlements</key>\n    <dict>\n        "
                  "<key>com.veltra.private.Zorvane.allowed</key>\n        <true/>\n    </dict>\n"));
    const std::string folder = own.substr(0, own.rfind('/'));
    const std::string beside = folder.substr(0, folder.rfind('/')) + "/sbin";
    for (const std::string& place : {folder, beside}) {
        const std::string launcher = place + "/zorvane-run";
        struct stat status{};
        if (::stat(launcher.c_str(), &status) == 0 && S_ISREG(status.st_mode))
            return register_("zorvane-run", launcher,
                             "    <key>KernelAgent</key>\n    <true/>\n    <key>Entitlements</key>\n    <dict/>\n");
    }
    return {};
}

Outcome<void> Maker::make(const std::string& account) {
    for (const char* directory : {"etc", "etc/zorvane", names::identityDirectory})
        TRY(makeDirectory(directory, directoryMode, ::geteuid()));
    TRY(makeUserDatabase(account.empty() ? usualAccount : account));
    const auto entry = TRY(lookUp(account));
    TRY(makeConfiguration(entry));
    if (entry)
        TRY(makeHome(*entry));
    return registerPrograms();
}

/// The root, made where its parent is there.
Outcome<zor::platform::SystemRoot> openRoot(const std::string& directory) {
    zor::platform::LinuxDisk disk;
    if (const Errno failed = disk.makeDirectory(AT_FDCWD, directory.c_str(), directoryMode); failed && failed != EEXIST)
        return cannot("make the root " + directory, failed);
    auto root = zor::platform::SystemRoot::open(directory);
    if (!root)
        return cannot("open the root " + directory, root.error());
    struct stat status{};
    if (::fstat(root->descriptor(), &status) != 0)
        return cannot("look at the root " + directory, Errno::last());
    if (status.st_uid != ::geteuid())
        return wrong("the root " + directory + " belongs to user " + std::to_string(status.st_uid),
                     "run this command as that user");
    return std::move(*root);
}

} // namespace

int init(const zorvane::ConnectOptions& connect, const Output& output, const std::string& account) {
    if (account.find_first_of(":/\n") != account.npos)
        return output.localError(exitUsage, "'" + printable(account) + "' is no name of an account",
                                 "name one that the root has, or is to have", doing);
    auto root = openRoot(connect.root);
    if (!root)
        return output.localError(exitLocalError, root.error().what, root.error().advice, doing);
    Maker maker(std::move(*root));
    const auto made = maker.make(account);
    if (!made)
        return output.localError(exitLocalError, made.error().what, made.error().advice, doing);
    if (output.isJson()) {
        output.json({{"root", maker.root().canonicalPath()}, {"done", maker.made()}, {"doubts", maker.doubts()}});
        return exitDone;
    }
    for (const std::string& line : maker.made())
        output.line(line);
    for (const std::string& line : maker.doubts())
        output.line("note: " + line);
    output.line(maker.made().empty() ? "all was there already"
                                     : "the root " + maker.root().canonicalPath() + " is ready");
    return exitDone;
}

} // namespace zorvanectl
