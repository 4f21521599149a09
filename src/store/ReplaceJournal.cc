// SPDX-License-Identifier: Apache-2.0
#include "store/ReplaceJournal.h"

#include "base/Mutex.h"
#include "fs/Durability.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <utility>

namespace zor {

namespace {

constexpr std::string_view oldKey = "ZORReplaceOperationOldURL";
constexpr std::string_view newKey = "ZORReplaceOperationNewURL";
constexpr std::string_view stagingKey = "ZORReplaceOperationStagingURL";
constexpr std::string_view destKey = "ZORReplaceOperationDestURL";
constexpr std::string_view asideKey = "ZORReplaceOperationAsideURL"; // may be missing

bool isPlace(const std::string* path) {
    return path && path->starts_with('/') && !containsDotDotPathComponents(*path);
}

constexpr std::string_view fileSuffix = ".plist";

/// Five paths; each may have 4,096 bytes.
constexpr std::size_t journalBytesMax = std::size_t{64} << 10;

std::string shownOf(const plist::Dictionary& content, std::string_view key) {
    return plist::describe(content.find(key));
}

} // namespace

FileURL ReplaceJournal::urlFor(const FileURL& replaceDirectory, const UUID& uuid) {
    return replaceDirectory.appendingFile(uuid.string() + std::string(fileSuffix));
}

std::string_view ReplaceJournal::stagingNameFor(const FileURL& url) {
    std::string_view name = url.lastPathComponent();
    if (name.ends_with(fileSuffix))
        name.remove_suffix(fileSuffix.size());
    return name;
}

Result<void> ReplaceJournal::_writeToDiskReplaceAt(const Log& log, ZORFileManager& fileManager,
                                                   const FileURL& url) const {
    const Reporter report(log, __func__);
    if (oldUrl.empty() || newUrl.empty() || stagingUrl.empty() || destUrl.empty())
        return report.error(ErrorCode::journalValuesInvalid,
                            "Invalid Replace File Info: old: %s, new: %s, staging: %s, dest: %s", oldUrl.c_str(),
                            newUrl.c_str(), stagingUrl.c_str(), destUrl.c_str());
    plist::Dictionary content{{std::string(oldKey), oldUrl.path()},
                              {std::string(newKey), newUrl.path()},
                              {std::string(stagingKey), stagingUrl.path()},
                              {std::string(destKey), destUrl.path()}};
    if (!asideUrl.empty())
        content.set(asideKey, asideUrl.path());
    const auto written =
        writeToURL(content, url, writeAtomically | writeWithoutProtection, journalBytesMax, fileManager);
    if (!written)
        return report.error(ErrorCode::propertyListNotWritten, &written.error(),
                            "Failed to write replace dictionary to URL %s", url.c_str());
    return {};
}

Result<ReplaceJournal> ReplaceJournal::_readAndValidateReplaceFileAtUrl(const Log& log, ZORFileManager& fileManager,
                                                                        const FileURL& url) {
    const Reporter report(log, __func__);
    const auto content = readDictionaryAtURL(url, journalBytesMax, fileManager);
    if (!content)
        return report.error(ErrorCode::journalUnusable, &content.error(), "Failed to read replace file at URL %s",
                            url.c_str());
    std::array<FileURL, 4> urls;
    const std::array keys = {oldKey, newKey, stagingKey, destKey};
    for (std::size_t i = 0; i < keys.size(); ++i) {
        const std::string* path = content->string(keys[i]);
        if (!isPlace(path))
            return report.error(ErrorCode::journalUnusable,
                                "Invalid replace data: Old: %s, New: %s, Staging: %s, Dest: %s",
                                shownOf(*content, oldKey).c_str(), shownOf(*content, newKey).c_str(),
                                shownOf(*content, stagingKey).c_str(), shownOf(*content, destKey).c_str());
        urls[i] = FileURL::directory(*path);
    }
    const std::string* const aside = content->string(asideKey);
    return ReplaceJournal{.oldUrl = urls[0],
                          .newUrl = urls[1],
                          .stagingUrl = urls[2],
                          .destUrl = urls[3],
                          .asideUrl = isPlace(aside) ? FileURL::directory(*aside) : FileURL()};
}

bool ReplaceJournal::mayStillBeRead(const ZORError& readFailure) {
    const ZORError* const cause = readFailure.underlying();
    return cause && (cause->isOwnShortage() || cause->isPosix(EIO));
}

void ReplaceJournal::moveToRoot(const std::string& rootPath, const FileURL& stagingDirectory) {
    const std::string root = rootPath == "/" ? "" : rootPath;
    const std::string tail =
        stagingDirectory.path().substr(root.size()) + "/" + std::string(stagingUrl.lastPathComponent());
    const std::string& staging = stagingUrl.path();
    if (!staging.ends_with(tail))
        return;
    const std::string oldRoot = staging.substr(0, staging.size() - tail.size());
    if (oldRoot == root)
        return;
    for (FileURL* url : {&oldUrl, &newUrl, &stagingUrl, &destUrl, &asideUrl})
        if (url->path().starts_with(oldRoot + "/"))
            *url = FileURL::directory(root + url->path().substr(oldRoot.size()));
}

std::string ReplaceJournal::text() const {
    return "old: " + oldUrl.path() + ", new: " + newUrl.path() + ", staging: " + waitingUrl().path() +
           ", dest: " + destUrl.path();
}

using platform::MutexLock;

void WaitingReplaces::add(Waiting waiting) {
    const MutexLock held(mutex_);
    const auto known = std::ranges::find(waiting_, waiting.journalUrl, &Waiting::journalUrl);
    if (known != waiting_.end()) {
        // The places of a journal that was read once are not forgotten for a look that tells less.
        if (known->oldUrl.empty())
            *known = std::move(waiting);
        return;
    }
    waiting_.reserve(waiting_.size() + underWay_.size() + 1);
    waiting_.push_back(std::move(waiting));
    update();
}

void WaitingReplaces::remove(const FileURL& journalUrl) {
    const MutexLock held(mutex_);
    std::erase_if(waiting_, [&](const Waiting& one) { return one.journalUrl == journalUrl; });
    update();
}

std::vector<WaitingReplaces::Waiting> WaitingReplaces::all() const {
    const MutexLock held(mutex_);
    return waiting_;
}

bool WaitingReplaces::unlisted() const {
    const MutexLock held(mutex_);
    return unlisted_;
}

void WaitingReplaces::setUnlisted(bool unlisted) {
    const MutexLock held(mutex_);
    unlisted_ = unlisted;
    update();
}

void WaitingReplaces::begin(Waiting replace, Containers containers) {
    const MutexLock held(mutex_);
    waiting_.reserve(waiting_.size() + underWay_.size() + 1); // for each that does not come to its end
    underWay_.push_back({.replace = std::move(replace), .containers = std::move(containers)});
    update();
}

void WaitingReplaces::end(const FileURL& journalUrl, Ended how) noexcept {
    const MutexLock held(mutex_);
    const auto one = std::ranges::find_if(
        underWay_, [&](const UnderWay& underWay) { return underWay.replace.journalUrl == journalUrl; });
    if (one == underWay_.end())
        return;
    if (how == Ended::waits)
        waiting_.push_back(std::move(one->replace));
    underWay_.erase(one);
    ++ended_;
    update();
    oneEnded_.broadcast();
}

bool WaitingReplaces::isUnderWay(std::uint32_t userId, ContainerClass containerClass,
                                 const std::string_view* identifier) const {
    if (noneUnderWay())
        return false;
    const MutexLock held(mutex_);
    return std::ranges::any_of(underWay_, [&](const UnderWay& one) {
        return one.containers.userId == userId && one.containers.containerClass == containerClass &&
               (!identifier ||
                std::ranges::find(one.containers.identifiers, *identifier) != one.containers.identifiers.end());
    });
}

Result<void> WaitingReplaces::refuseIfUnderWay(std::uint32_t userId, ContainerClass containerClass,
                                               std::string_view identifier) const {
    if (!isUnderWay(userId, containerClass, &identifier))
        return {};
    return posixError(ZOR_HERE, Errno(EINPROGRESS), "a replace of %s is under way", ZOR_SHOWN(std::string(identifier)));
}

Result<void> WaitingReplaces::refuseIfUnderWay(std::uint32_t userId, ContainerClass containerClass) const {
    if (!isUnderWay(userId, containerClass, nullptr))
        return {};
    return posixError(ZOR_HERE, Errno(EINPROGRESS), "a replace in class %s is under way", className(containerClass));
}

std::uint64_t WaitingReplaces::ended() const {
    const MutexLock held(mutex_);
    return ended_;
}

void WaitingReplaces::awaitMoreThan(std::uint64_t ended) const {
    const platform::BlockingScope blocking;
    const MutexLock held(mutex_);
    while (ended_ <= ended)
        oneEnded_.wait(mutex_);
}

} // namespace zor
