// SPDX-License-Identifier: Apache-2.0
// The class directories and the containers in them.
#include "check/Checks.h"

#include "base/ContainerClass.h"
#include "check/Finding.h"
#include "fs/Durability.h"
#include "fs/MountFences.h"
#include "fs/Names.h"
#include "ipc/Protocol.h"
#include "os/FileDescriptor.h"
#include "os/SystemRoot.h"
#include "store/Configuration.h"
#include "store/StorePlaces.h"

#include <algorithm>
#include <cerrno>
#include <fcntl.h>
#include <sys/stat.h>

namespace zor::check {

using platform::openBeneathOnMount;

namespace {

/// Set on the directories that carry a class; what has this one is never changed by the daemon.
constexpr int protectionClassKept = 2;

constexpr ContainerClass classes(std::uint64_t number) {
    return static_cast<ContainerClass>(number);
}

const char* ruleWord(MetadataRule rule) {
    switch (rule) {
    case MetadataRule::readable:
        return "readable";
    case MetadataRule::user:
        return "user";
    case MetadataRule::identifier:
        return "identifier";
    case MetadataRule::uuid:
        return "uuid";
    case MetadataRule::containerClass:
        return "class";
    case MetadataRule::info:
        return "info";
    case MetadataRule::place:
        return "place";
    }
    return "";
}

std::string attributesText(mode_t mode, uid_t uid, gid_t gid, bool ownersCount) {
    return ownersCount ? formatted("mode %04o and owner %u:%u", static_cast<unsigned>(mode), uid, gid)
                       : formatted("mode %04o", static_cast<unsigned>(mode));
}

/// The faults of a directory's owner and mode, as the end of a sentence; empty when there are none.
std::string attributesFault(const struct stat& status, mode_t mode, std::uint32_t owner, bool ownersCount) {
    const bool rightOwner = !ownersCount || (status.st_uid == owner && status.st_gid == owner);
    const mode_t found = status.st_mode & ALLPERMS;
    if (found == mode && rightOwner)
        return "";
    return "has " + attributesText(found, status.st_uid, status.st_gid, ownersCount) + " instead of " +
           attributesText(mode, owner, owner, ownersCount);
}

std::string chownCommand(const FileURL& url, mode_t mode, std::uint32_t owner, bool ownersCount) {
    const std::string chmod = formatted("chmod %04o .", static_cast<unsigned>(mode));
    return inDirectory(url.path(), ownersCount ? formatted("chown %u:%u . && ", owner, owner) + chmod : chmod);
}

} // namespace

void ContainerCheck::checkAll() {
    checkWellKnownTable();
    checkPlacesOfMoves();
    for (std::uint64_t number = 1; ipc::isContainerClass(number); ++number) {
        const ContainerClass containerClass = classes(number);
        if (isBundleClass(containerClass))
            checkClass(containerClass, look_.device().users().installer, std::nullopt);
        else if (isSystemClass(containerClass))
            checkClass(containerClass, look_.device().users().system, std::nullopt);
        else
            for (const MobileUser& user : look_.users())
                checkClass(containerClass, user.userId, user.home);
    }
}

void ContainerCheck::checkWellKnownTable() {
    const ZORWhitelist& table = look_.whitelist();
    if (table.isWhole(ContainerClass::dataSystem) && table.isWhole(ContainerClass::sharedSystemGroup))
        return;
    const FileURL url = FileURL::file(look_.device().root().path(platform::names::wellKnownTable));
    look_.addForPerson(FindingCode::unexamined, url, "cannot be read whole, so no boot judges names by it",
                       "ls -ld " + shellQuoted(url.path()));
}

void ContainerCheck::checkPlacesOfMoves() {
    const StorePlaces& places = look_.device().places();
    std::vector<FileURL> parents = {places.formerBundleDirectory().deletingLastPathComponent(),
                                    places.sharedContainersDirectory(), places.bundleDirectory(),
                                    places.cachesDirectory(),
                                    places.transientBundleDirectory().deletingLastPathComponent()};
    for (const MobileUser& user : look_.users())
        parents.push_back(StorePlaces::userTransientDirectory(user.home).deletingLastPathComponent());
    for (const FileURL& parent : parents) {
        // The parent of the old location may lie behind a link of the administrator's; where the others do, their
        // classes say so.
        const auto directory = look_.device().fileManager().resolver().openDirectory(parent);
        if (directory)
            look_.forEachName(directory->get(), parent, [&](const char* name) { checkHidden(parent, name); });
        else if (directory.error() != ENOENT && directory.error() != ELOOP && directory.error() != ENOTDIR)
            look_.addUnexamined(parent, directory.error());
    }
}

void ContainerCheck::checkClass(ContainerClass containerClass, std::uint32_t user, const std::optional<FileURL>& home) {
    for (const bool transient : {false, true}) {
        const auto base = look_.device().places().baseOfClass(containerClass, transient, home);
        ClassDirectory directory{.containerClass = containerClass,
                                 .user = user,
                                 .transient = transient,
                                 .url = base->appendingDirectory(className(containerClass)),
                                 .descriptor = -1,
                                 .known = {}};
        const auto parent = look_.openDirectory(directory.url.deletingLastPathComponent());
        if (!parent)
            continue;
        look_.forEachName(parent->get(), directory.url.deletingLastPathComponent(), [&](const char* name) {
            if (fs::isDirectoryLeftover(name, directory.url.lastPathComponent())) {
                addDirectoryLeftover(directory.url.deletingLastPathComponent(), name);
            }
        });
        const auto opened = look_.openDirectory(directory.url);
        if (!opened)
            continue;
        directory.descriptor = opened->get();
        checkDirectory(directory);
        if (!transient && (containerClass == ContainerClass::sharedAppGroup || isSystemClass(containerClass)))
            look_.sharedContainers[{containerClass, user}] = std::move(directory.known);
    }
}

void ContainerCheck::checkDirectory(ClassDirectory& directory) {
    const MetadataReader reader(look_.device().fileManager().disk(), directory.descriptor, directory.url.path(),
                                directory.user, CheckClassPath::yes);
    look_.forEachName(directory.descriptor, directory.url, [&](const char* name) {
        if (name[0] == '.')
            checkHidden(directory.url, name);
        else
            checkEntry(directory, reader, name);
    });
}

void ContainerCheck::checkHidden(const FileURL& directory, const char* name) {
    // Other hidden names are nobody's business: no listing of the daemon shows them.
    if (fs::isCopyLeftover(name))
        look_.add(FindingCode::copyLeftover, directory.appendingDirectory(name),
                  "is a copy from another file system that was cut short", Mender::boot);
}

void ContainerCheck::checkEntry(ClassDirectory& directory, const MetadataReader& reader, const char* name) {
    const FileURL url = directory.url.appendingDirectory(name);
    // One that nobody can judge a boot leaves alone.
    const bool nameAcceptable =
        look_.whitelist().judgeName(name, directory.containerClass) != ZORWhitelist::NameOf::noContainer;
    const auto opened = openBeneathOnMount(directory.descriptor, name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW);
    if (!opened && (opened.error() == ELOOP || opened.error() == ENOTDIR)) {
        checkMisshapen(directory, url, nameAcceptable);
        return;
    }
    if (!opened) {
        if (opened.error() != ENOENT)
            look_.addUnexamined(url, opened.error());
        return;
    }
    if (!nameAcceptable) {
        Finding& finding =
            look_.add(FindingCode::containerName, url, "has a name that no container here has", Mender::boot);
        finding.containerClass = directory.containerClass;
        finding.user = directory.user;
    }
    auto record = readRecord(directory, reader, name, opened->get());
    if (!record)
        return;
    const Container container{
        .directory = directory, .url = url, .descriptor = opened->get(), .record = std::move(record)};
    remember(directory, container);
    checkInside(container);
}

void ContainerCheck::checkMisshapen(const ClassDirectory& directory, const FileURL& url, bool nameAcceptable) {
    struct stat status{};
    const std::string name(url.lastPathComponent());
    const bool isLink = !fs::statusOfName(directory.descriptor, name.c_str(), status) && S_ISLNK(status.st_mode);
    const std::string what =
        isLink ? "is a link where only containers belong" : "is no directory where only containers belong";
    // A boot removes what has another name than containers have; what has one it leaves, for it cannot look inside.
    Finding& finding = nameAcceptable ? look_.addForPerson(FindingCode::wrongShape, url, what, look_.moveAside(url))
                                      : look_.add(FindingCode::wrongShape, url, what, Mender::boot);
    finding.containerClass = directory.containerClass;
    finding.user = directory.user;
}

std::shared_ptr<ZORMetadata> ContainerCheck::readRecord(const ClassDirectory& directory, const MetadataReader& reader,
                                                        const char* name, int container) {
    auto read = reader.judge(name);
    if (read)
        return std::move(*read);
    // Nobody can tell its owner while the key of its encryption is away: it may well be whole.
    if (const ZORError* cause = read.error().error.underlying(); cause && cause->isPosix(ENOKEY)) {
        look_.addUnexamined(directory.url.appendingDirectory(name), Errno(ENOKEY)).user = directory.user;
        return nullptr;
    }
    struct stat status{};
    if (fs::statusOfName(container, names::metadataFile, status) == ENOENT) {
        // One that has gone altogether was read a moment too late.
        if (!fs::statusOfName(directory.descriptor, name, status)) {
            const FileURL url = directory.url.appendingDirectory(name);
            constexpr const char* what = "has no metadata file";
            Finding& finding =
                look_.whitelist().judgeName(name, directory.containerClass) == ZORWhitelist::NameOf::unknown
                    ? look_.addForPerson(FindingCode::metadataMissing, url, what, look_.moveAside(url))
                    : look_.add(FindingCode::metadataMissing, url, what, Mender::boot);
            finding.containerClass = directory.containerClass;
            finding.user = directory.user;
        }
        return nullptr;
    }
    addRefused(directory, name, read.error());
    return nullptr;
}

void ContainerCheck::addRefused(const ClassDirectory& directory, const char* name, const MetadataRefusal& refusal) {
    const FileURL url = directory.url.appendingDirectory(name);
    const ZORError* cause = refusal.error.underlying();
    std::string what = refusal.error.description().value_or("");
    if (cause && cause->isPosix(EPERM))
        what = "has a metadata file that is not the daemon's alone: its owner, its permissions or a second name";
    else if (cause)
        what += std::string(": ") + Errno(cause->code()).text();
    const bool elsewhere = refusal.rule == MetadataRule::user || refusal.rule == MetadataRule::place;
    if (const auto right = elsewhere ? rightPlace(directory, name) : std::nullopt)
        what += "; it belongs in " + look_.device().belowRoot(*right);
    Finding& finding = look_.addForPerson(elsewhere ? FindingCode::wrongClassDirectory : FindingCode::metadataInvalid,
                                          url, std::move(what), look_.moveAside(url));
    finding.containerClass = directory.containerClass;
    finding.user = directory.user;
    finding.rule = ruleWord(refusal.rule);
}

std::optional<FileURL> ContainerCheck::rightPlace(const ClassDirectory& directory, const char* name) const {
    std::vector<MobileUser> owners = look_.users();
    owners.push_back({look_.device().users().installer, {}});
    owners.push_back({look_.device().users().system, {}});
    for (const auto& [userId, home] : owners) {
        const MetadataReader reader(look_.device().fileManager().disk(), directory.descriptor, directory.url.path(),
                                    userId, CheckClassPath::no);
        const auto record = reader.read(name);
        if (!record || !look_.device().users().mayOwn((*record)->containerClass(), userId))
            continue;
        const auto base = look_.device().places().baseOfClass((*record)->containerClass(), directory.transient,
                                                              home.empty() ? std::nullopt : std::optional(home));
        if (base)
            return base->appendingDirectory(className((*record)->containerClass()));
    }
    return std::nullopt;
}

Finding& ContainerCheck::addDirectoryLeftover(const FileURL& parent, std::string_view name) {
    return look_.addForPerson(FindingCode::directoryLeftover, parent.appendingDirectory(name),
                              "never got the name that it was made for",
                              inDirectory(parent.path(), "rmdir -- " + shellQuoted(name)));
}

Finding& ContainerCheck::describe(Finding& finding, const Container& container) const {
    finding.containerClass = container.directory.containerClass;
    finding.user = container.directory.user;
    finding.identifier = container.record->identifier();
    finding.uuid = container.record->uuid();
    finding.transient = container.directory.transient;
    return finding;
}

void ContainerCheck::remember(ClassDirectory& directory, const Container& container) {
    const auto [row, isFirst] = directory.known.try_emplace(container.record->identifier(), container.url);
    if (isFirst)
        return;
    // The later of two in the directory counts; a daemon that runs may have read another order.
    FileURL hidden = std::exchange(row->second, container.url);
    const CheckOptions& options = look_.options();
    const bool asks = options.daemonServes && !directory.transient;
    const auto served = asks && options.servedPath
                            ? options.servedPath(directory.containerClass, directory.user, row->first)
                            : std::nullopt;
    const auto isServed = [&](const FileURL& url) {
        return served && FileURL::directory(*served).lastPathComponent() == url.lastPathComponent();
    };
    if (isServed(hidden))
        std::swap(hidden, row->second);
    const bool known = !asks || isServed(row->second);
    const std::string what = "has the identifier of " + std::string(row->second.lastPathComponent()) +
                             (known ? ", which clients are given"
                                    : "; the daemon does not say which of them its clients are given, and has to be "
                                      "started again after one was moved");
    std::string command = look_.moveAside(hidden);
    if (!known && look_.device().root().canonicalPath() == "/")
        command += " && systemctl try-restart zorvaned.service";
    // A boot clears all transient ones.
    Finding& finding = directory.transient
                           ? look_.add(FindingCode::doubledContainer, hidden, what, Mender::boot)
                           : look_.addForPerson(FindingCode::doubledContainer, hidden, what, std::move(command));
    finding.containerClass = directory.containerClass;
    finding.user = directory.user;
    finding.identifier = container.record->identifier();
}

void ContainerCheck::checkInside(const Container& container) {
    const ContainerLayout layout = layoutOf(container.directory.containerClass, container.directory.user);
    checkOwnDirectory(container, layout);
    std::set<std::string, std::less<>> unusable;
    for (const char* subdirectory : layout.subdirectories) {
        const std::string_view path = subdirectory;
        const std::size_t slash = path.rfind('/');
        // A thing that cannot be there for want of its parent is said once.
        if (slash != path.npos && unusable.contains(path.substr(0, slash)))
            continue;
        if (!checkSubdirectory(container, layout, subdirectory))
            unusable.emplace(path);
    }
    checkNamesInside(container, layout);
}

void ContainerCheck::checkOwnDirectory(const Container& container, const ContainerLayout& layout) {
    if (look_.options().unsavedInfo.contains(container.record->uuid().string()))
        describe(look_.add(FindingCode::infoUnsaved, container.url.appendingFile(names::metadataFile),
                           "does not hold the info values that the daemon shows", Mender::nextWrite),
                 container);
    struct stat status{};
    const bool ownersCount = look_.device().ownersCount();
    if (::fstat(container.descriptor, &status) != 0)
        return;
    const std::string fault = attributesFault(status, layout.topLevelMode, layout.topLevelOwner, ownersCount);
    if (fault.empty())
        return;
    describe(look_.addForPerson(FindingCode::containerAttributes, container.url, fault,
                                chownCommand(container.url, layout.topLevelMode, layout.topLevelOwner, ownersCount)),
             container);
}

bool ContainerCheck::checkSubdirectory(const Container& container, const ContainerLayout& layout,
                                       const char* subdirectory) {
    const FileURL url = container.url.appendingDirectory(subdirectory);
    const auto item = openBeneathOnMount(container.descriptor, subdirectory, O_PATH | O_NOFOLLOW);
    struct stat status{};
    const Errno error = !item ? item.error() : ::fstat(item->get(), &status) != 0 ? Errno::last() : Errno();
    if (error == ENOENT) {
        describe(look_.add(FindingCode::subdirectoryMissing, url, "is missing", Mender::daemon), container);
        return false;
    }
    // With O_PATH a link in the last place may be given or refused; it is a link in both cases.
    if (error == ELOOP || error == ENOTDIR || (!error && !S_ISDIR(status.st_mode))) {
        const bool isLink = error == ELOOP || S_ISLNK(status.st_mode);
        describe(
            look_.addForPerson(FindingCode::wrongShape, url,
                               isLink ? "is a link where a directory belongs" : "is no directory where one belongs",
                               look_.moveAside(url)),
            container);
        return false;
    }
    if (error) {
        look_.addUnexamined(url, error);
        return false;
    }
    const std::string fault =
        attributesFault(status, layout.subdirectoryMode, layout.subdirectoryOwner, look_.device().ownersCount());
    // The daemon gives no directory of another's away; a container's owner may have given it this name.
    if (!fault.empty())
        describe(look_.device().ownersCount() && status.st_uid != layout.subdirectoryOwner
                     ? look_.addForPerson(FindingCode::subdirectoryAttributes, url, fault, look_.moveAside(url))
                     : look_.add(FindingCode::subdirectoryAttributes, url, fault, Mender::daemon),
                 container);
    checkProtection(container, subdirectory, item->get());
    return true;
}

void ContainerCheck::checkProtection(const Container& container, const char* subdirectory, int descriptor) {
    const ContainerClass containerClass = container.directory.containerClass;
    const auto& carriers = ZORGlobalConfiguration::appUserDataItemNames();
    if (container.directory.transient || !isPerUserClass(containerClass) ||
        std::ranges::find(carriers, subdirectory) == carriers.end() ||
        look_.options().changingProtection.contains(container.record->uuid().string()))
        return;
    const plist::Value* value =
        container.record->info() ? container.record->info()->find(ipc::infoKeys::contentProtectionClass) : nullptr;
    const auto number = value ? value->asSigned() : std::nullopt;
    const std::int64_t recorded = number.value_or(platform::defaultProtectionClass);
    const auto directory = openBeneathOnMount(descriptor, ".", O_RDONLY | O_DIRECTORY);
    const auto found = directory ? look_.device().protection().classOf(directory->get()) : directory.error();
    if (!found || *found == recorded || *found == protectionClassKept)
        return;
    const std::string protect = programFor("zorvanectl", look_.device().root().canonicalPath()) + " protect --class " +
                                className(containerClass) + " --user " + std::to_string(container.directory.user) +
                                " -- " + shellQuoted(container.record->identifier()) + " ";
    const std::string other = recorded == 1 ? "3" : "1";
    describe(look_.addForPerson(FindingCode::protectionDiffers, container.url.appendingDirectory(subdirectory),
                                "has data-protection class " + std::to_string(*found) + "; " +
                                    std::to_string(recorded) + " is recorded",
                                protect + other + " && " + protect + std::to_string(recorded)),
             container);
}

void ContainerCheck::checkNamesInside(const Container& container, const ContainerLayout& layout) {
    look_.forEachName(container.descriptor, container.url, [&](const char* name) {
        const std::string_view text = name;
        if (fs::isWriteLeftover(text) && text.substr(1).starts_with(names::metadataFile)) {
            describe(look_.add(FindingCode::writeLeftover, container.url.appendingFile(text),
                               "is a metadata file whose writing was cut short", Mender::nextWrite),
                     container);
            return;
        }
        const bool half = std::ranges::any_of(layout.subdirectories,
                                              [&](const char* final) { return fs::isDirectoryLeftover(text, final); });
        struct stat status{};
        // Programs have such names too; one that still is the daemon's own was not given away.
        if (!half || fs::statusOfName(container.descriptor, name, status) || !S_ISDIR(status.st_mode) ||
            status.st_uid != ::geteuid() || (layout.subdirectoryOwner == status.st_uid && look_.device().ownersCount()))
            return;
        describe(addDirectoryLeftover(container.url, text), container);
    });
}

} // namespace zor::check
