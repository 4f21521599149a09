// SPDX-License-Identifier: Apache-2.0
// The daemon's own directories and marks.
#include "check/Checks.h"

#include "device/LinkSandboxUserState.h"
#include "fs/Durability.h"
#include "fs/Names.h"
#include "fs/Trees.h"
#include "ipc/Identifiers.h"
#include "os/FileDescriptor.h"
#include "os/SystemRoot.h"
#include "store/ReplaceJournal.h"

#include <algorithm>
#include <ctime>
#include <fcntl.h>
#include <set>
#include <sys/stat.h>

namespace zor::check {

void forEachTop(Look& look, const std::function<void(const fs::MountTop& top)>& function) {
    std::vector<FileURL> places = look.device().places().placesOfSharedContainers();
    for (const MobileUser& user : look.users())
        places.push_back(user.home);
    std::set<std::pair<dev_t, ino_t>> seen;
    for (const FileURL& place : places) {
        const auto top = fs::topOfMount(look.device().fileManager().resolver(), place);
        if (top && seen.insert(top->identity).second)
            function(*top);
    }
}

void forEachDeathRow(Look& look, const std::function<void(int row, const FileURL& url)>& function) {
    const FileURL own = look.device().places().deathrowDirectory();
    if (const auto directory = look.openDirectory(own))
        function(directory->get(), own);
    forEachTop(look, [&](const fs::MountTop& top) {
        if (const auto directory = fs::openDeathRow(top.directory.get()))
            function(directory->get(), fs::deathRowBelow(top.url));
    });
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

namespace {

/// A running daemon deletes at its leisure: what came to death row within this time may just not have had its turn.
constexpr std::time_t leisureSeconds = 600;

/// Whether an item has been there for less than that.
bool isYoung(int directory, const char* name) {
    struct stat status{};
    return ::fstatat(directory, name, &status, AT_SYMLINK_NOFOLLOW) != 0 ||
           std::time(nullptr) - status.st_mtim.tv_sec < leisureSeconds;
}

} // namespace

void WorkCheck::checkAll() {
    checkStaging();
    checkAside();
    checkDeathRow();
    checkJournals();
    checkLibrary();
    checkMappings();
    checkBootMarker();
}

void WorkCheck::checkStaging() {
    const FileURL staging = look_.device().places().stagingDirectory();
    const auto directory = look_.openDirectory(staging);
    if (!directory)
        return;
    look_.forEachName(directory->get(), staging, [&](const char* name) {
        if (fs::isCopyLeftover(name))
            look_.add(FindingCode::copyLeftover, staging.appendingDirectory(name),
                      "is a copy from another file system that was cut short", Mender::launch);
        else
            look_.add(FindingCode::stagingLeftover, staging.appendingDirectory(name),
                      "was being made or replaced when the daemon stopped", Mender::launch);
    });
}

void WorkCheck::checkAside() {
    forEachTop(look_, [this](const fs::MountTop& top) {
        const auto directory = fs::openAside(top.directory.get());
        if (!directory)
            return;
        const FileURL aside = fs::asideBelow(top.url);
        look_.forEachName(directory->get(), aside, [&](const char* name) {
            look_.add(FindingCode::asideLeftover, aside.appendingDirectory(name),
                      "was out of the way of a replace when the daemon stopped", Mender::launch);
        });
    });
}

void WorkCheck::checkDeathRow() {
    forEachDeathRow(look_, [this](int directory, const FileURL& row) { addDeathRowItems(directory, row); });
}

void WorkCheck::addDeathRowItems(int directory, const FileURL& row) {
    look_.forEachName(directory, row, [&](const char* name) {
        if (look_.options().daemonServes && isYoung(directory, name))
            return;
        look_.add(FindingCode::deathRowItem, row.appendingDirectory(name), "waits for its deletion", Mender::daemon);
    });
}

void WorkCheck::checkJournals() {
    const FileURL replace = look_.device().places().replaceDirectory();
    const auto directory = look_.openDirectory(replace);
    if (!directory)
        return;
    look_.forEachName(directory->get(), replace, [&](const char* name) {
        const FileURL url = replace.appendingFile(name);
        if (fs::isWriteLeftover(name))
            look_.add(FindingCode::writeLeftover, url, "is a journal whose writing was cut short", Mender::launch);
        else if (name[0] != '.') // the recovery looks at no other
            addJournal(url);
    });
}

void WorkCheck::addJournal(const FileURL& url) {
    ZORFileManager& fileManager = look_.device().fileManager();
    auto journal = ReplaceJournal::_readAndValidateReplaceFileAtUrl(look_.device().log(), fileManager, url);
    std::string what = "is no journal that can be read; it will be discarded, unless the disk cannot read it";
    if (journal) {
        journal->moveToRoot(look_.device().root().canonicalPath(), look_.device().places().stagingDirectory());
        if (fileManager.itemExistsAtURL(journal->destUrl))
            what = "is the journal of a replace that is done, or has not begun";
        else if (fileManager.itemExistsAtURL(journal->oldUrl))
            what = "is the journal of a replace that has not begun";
        else if (fileManager.itemExistsAtURL(journal->waitingUrl()))
            what = std::string("is the journal of a replace that will be undone: its old container waits ") +
                   (journal->asideUrl.empty() ? "in staging" : "aside on its own file system");
        else
            what = "is the journal of a replace of which nothing is left";
    }
    look_.add(FindingCode::journalLeftover, url, std::move(what), Mender::launch);
}

void WorkCheck::checkLibrary() {
    const FileURL library = look_.device().places().libraryDirectory();
    const auto directory = look_.openDirectory(library);
    if (!directory)
        return;
    look_.forEachName(directory->get(), library, [&](const char* name) {
        if (fs::isWriteLeftover(name))
            look_.add(FindingCode::writeLeftover, library.appendingFile(name), "is a file whose writing was cut short",
                      Mender::nextWrite);
    });
}

void WorkCheck::checkMappings() {
    const platform::SystemRoot& root = look_.device().root();
    const FileURL sandbox = FileURL::directory(root.path(platform::names::runtimeDirectory))
                                .appendingDirectory(platform::names::sandboxDirectory);
    platform::forEachSandboxDirectory(root, [&](const platform::SandboxDirectory& directory) {
        const auto user = directory.userId();
        const FileURL url = sandbox.appendingDirectory(directory.user).appendingDirectory(directory.itemType);
        for (const std::string& name : platform::directoryNamesIfAny(directory.descriptor)) {
            if (platform::isSandboxLeftover(name)) {
                look_.add(FindingCode::writeLeftover, url.appendingFile(name),
                          "is a sandbox mapping whose making was cut short", Mender::launch);
                continue;
            }
            // A home that is not there comes back with its containers.
            if ((user && look_.lacksHome(*user)) ||
                !platform::isDanglingSandboxLink(
                    root, directory.descriptor, name.c_str(), [this](const std::string& path) {
                        return look_.device().fileManager().itemIsGone(FileURL::directory(path));
                    }))
                continue;
            Finding& finding = look_.add(FindingCode::mappingDangling, url.appendingFile(name),
                                         "is a sandbox mapping that leads to no container", Mender::launch);
            finding.identifier = ipc::percentDecode(name).value_or("");
            finding.user = user;
        }
    });
}

void WorkCheck::checkBootMarker() {
    const platform::BootMarker& marker =
        look_.options().bootMarker ? *look_.options().bootMarker : look_.device().bootMarker();
    const platform::BootMarker::State state = marker.look();
    const FileURL url = FileURL::directory(platform::names::semaphoreDirectory)
                            .appendingFile(platform::names::semaphoreFilePrefix + marker.name());
    if (state.foreign && !state.present)
        look_.add(FindingCode::bootMarkerForeign, url, "is the boot marker's name, and somebody else's file",
                  Mender::launch);
    else if (!state.present && look_.options().daemonServes)
        look_.addForPerson(FindingCode::bootMarkerMissing, url, "is the boot marker, and is missing",
                           "ls -ld -- " + shellQuoted(platform::names::semaphoreDirectory));
}

} // namespace zor::check
