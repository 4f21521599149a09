// SPDX-License-Identifier: Apache-2.0
#include "soak/Life.h"

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <shared_mutex>
#include <sys/syscall.h>
#include <thread>
#include <unistd.h>

namespace zor::soak {

namespace {

namespace files = std::filesystem;
using zorvane::Error;

constexpr std::uint64_t bundleApplication = 1;
constexpr std::uint64_t dataApplication = 2;
constexpr std::uint64_t dataKolvexPlugin = 4;
constexpr std::uint32_t mobileUser = 501;
constexpr std::uint32_t bundleUser = 33;
constexpr const char* valueKey = "soak";
constexpr const char* contentName = "soak-content";
constexpr std::uint64_t codeNotFound = 21;
constexpr std::uint64_t codeNoValue = 24;
constexpr std::uint64_t codeLocked = 61;

std::string contentAt(const std::string& directory) {
    std::ifstream file(directory + "/" + contentName);
    std::string text;
    std::getline(file, text);
    return text;
}

/// False when the disk would not take it; then the file is as it was.
bool putContent(const std::string& directory, const std::string& text) {
    const std::string half = directory + "/." + contentName;
    std::ofstream file(half, std::ios::trunc);
    file << text << std::flush;
    std::error_code error;
    if (file)
        files::rename(half, directory + "/" + contentName, error);
    else
        files::remove(half, error);
    return file && !error;
}

/// This thread's own identity on the sockets that it makes; the process keeps its.
void becomeUser(std::uint32_t user) {
    if (::geteuid() == 0 && user != 0 &&
        (::syscall(SYS_setresgid, user, user, user) != 0 || ::syscall(SYS_setresuid, user, user, user) != 0))
        throw std::runtime_error("cannot become user " + std::to_string(user));
}

} // namespace

Life::Life(Session& session, unsigned number, std::uint32_t user, std::uint64_t seed)
    : session_(session), name_("client" + std::to_string(number)), user_(user), choices_(seed, number),
      registered_("org.soak." + name_) {
    for (unsigned i = 0; i < 4; ++i)
        items_.push_back({dataApplication, mobileUser, registered_ + "." + std::to_string(i), {}});
    items_.push_back({dataKolvexPlugin, mobileUser, registered_ + ".plugin", {}});
    if (user == 0)
        items_.push_back({bundleApplication, bundleUser, registered_ + ".bundle", {}});
}

void Life::live() {
    becomeUser(user_);
    while (!session_.stopped) {
        const std::shared_lock inside(session_.requests);
        if (!client_) {
            connect();
            continue;
        }
        if (choices_.oneIn(12)) {
            registerGroups();
            continue;
        }
        Item& item = items_[choices_.upTo(items_.size())];
        if (item.model.isCertain() && !choices_.oneIn(10))
            act(item);
        else
            lookAt(item);
    }
}

void Life::lookAtAll() {
    for (int tries = 0; !client_ && tries < 2000; ++tries)
        connect();
    for (Item& item : items_)
        if (client_)
            lookAt(item);
    if (client_)
        lookAtGroups();
}

void Life::connect() {
    auto connected = zorvane::Client::connect(session_.daemon().connection());
    if (!connected) {
        std::this_thread::sleep_for(std::chrono::milliseconds(2));
        return;
    }
    client_.emplace(std::move(*connected));
}

void Life::found(const std::string& what) {
    session_.found(name_ + ": " + what);
}

template <typename T>
bool Life::excused(const zorvane::Result<T>& answer) {
    const Error& error = answer.error();
    if (error.kind == Error::Kind::daemon)
        return session_.trouble != Trouble::none;
    client_.reset();
    // A daemon that is not killed answers, in time and in form.
    return error.kind == Error::Kind::unreachable || error.kind == Error::Kind::refused ||
           session_.trouble != Trouble::none;
}

template <typename T>
bool Life::answered(Item& item, const char* operation, const zorvane::Result<T>& answer, const State& after) {
    session_.did(name_, operation,
                 item.identifier + " to " + textOf(after) + (answer ? "" : ": " + answer.error().message));
    if (answer)
        return true;
    const State before = item.model.state();
    item.model.mayBe(after);
    if (!excused(answer))
        found(std::string(operation) + " of " + item.identifier + ": " + answer.error().message);
    // A replace that fails when the old one has moved has lost it.
    else if (session_.trouble != Trouble::none)
        item.model.mayBe(std::nullopt);
    return false;
}

zorvane::Client::Address Life::addressOf(const Item& item, const Known& known) const {
    return {.containerClass = item.containerClass,
            .user = item.user,
            .identifier = item.identifier,
            .uuid = known.uuid.value()};
}

State Life::seen(const Item& item) {
    const auto there = client_->createOrLookup(
        {.containerClass = item.containerClass, .user = item.user, .identifier = item.identifier});
    if (!there && there.error().kind == Error::Kind::daemon && there.error().code == codeNotFound)
        return std::nullopt;
    if (!there)
        throw there.error();
    Known known{.uuid = there->uuid, .content = contentAt(there->path), .value = ""};
    const auto value = client_->infoValue(addressOf(item, known), valueKey);
    if (value)
        known.value = std::get<std::string>(value->content);
    else if (value.error().code != codeNoValue)
        throw value.error();
    return known;
}

void Life::lookAt(Item& item) {
    try {
        const State now = seen(item);
        const std::string expected = item.model.text();
        session_.did(name_, "look", item.identifier);
        if (!item.model.observe(now))
            found(item.identifier + " is " + textOf(now) + "; it must be " + expected);
    } catch (const Error& error) {
        if (!excused(zorvane::Result<void>(std::unexpected(error))))
            found("look at " + item.identifier + ": " + error.message);
    }
}

void Life::make(Item& item) {
    const auto made = client_->createOrLookup(
        {.containerClass = item.containerClass, .user = item.user, .identifier = item.identifier, .create = true});
    if (!answered(item, "create", made, Known{}))
        return;
    if (made->existed)
        found(item.identifier + " existed before it was made");
    item.model.become(Known{.uuid = made->uuid, .content = "", .value = ""});
}

void Life::act(Item& item) {
    const State state = item.model.state();
    if (!state)
        return choices_.oneIn(4) ? replace(item) : make(item);
    actOnLive(item, *state);
}

void Life::actOnLive(Item& item, const Known& known) {
    switch (choices_.upTo(10)) {
    case 0:
        if (answered(item, "delete", client_->deleteContainer(item.containerClass, item.user, item.identifier, false),
                     std::nullopt))
            went(item);
        break;
    case 1:
        if (answered(item, "stage", client_->stageForDelete({addressOf(item, known)}), std::nullopt))
            went(item);
        break;
    case 2: {
        const Known after{known.uuid, known.content, newText()};
        const auto set = client_->setInfoValue(addressOf(item, known), valueKey, zorvane::Value{after.value});
        if (answered(item, "set info", set, after))
            item.model.become(after);
        else if (set.error().kind == Error::Kind::daemon)
            item.model.doubtValue();
        break;
    }
    case 3: {
        const Known after{known.uuid, "", ""};
        if (item.containerClass == bundleApplication)
            break;
        if (answered(item, "wipe", client_->wipe(item.containerClass, item.user, item.identifier), after))
            item.model.become(after);
        break;
    }
    case 4:
        (void)answered(item, "regenerate", client_->regenerateDirectoryUUID(addressOf(item, known)), known);
        break;
    case 5:
        replace(item);
        break;
    case 6:
        mendStructure(item, known);
        break;
    case 7:
        protect(item);
        break;
    case 8:
        question(item, known);
        break;
    default:
        writeContent(item, known);
    }
}

void Life::went(Item& item) {
    // A batch passes over what it can neither move nor remove, and logs it.
    if (session_.trouble == Trouble::none)
        item.model.become(std::nullopt);
    else
        item.model.mayBe(std::nullopt);
}

void Life::writeContent(Item& item, const Known& known) {
    const auto data = client_->metadata(addressOf(item, known));
    if (!answered(item, "metadata", data, known))
        return;
    const std::string content = newText();
    if (putContent(data->path, content))
        item.model.setContent(content);
    else if (session_.trouble != Trouble::diskFull)
        found("cannot write into " + data->path);
}

void Life::replace(Item& item) {
    const State before = item.model.state();
    const auto fresh = client_->createOrLookup({.containerClass = item.containerClass,
                                                .user = item.user,
                                                .identifier = item.identifier,
                                                .create = true,
                                                .transient = true});
    if (!answered(item, "create transient", fresh, before))
        return;
    Known after{.uuid = fresh->uuid, .content = newText(), .value = ""};
    if (!putContent(fresh->path, after.content)) {
        if (session_.trouble != Trouble::diskFull)
            found("cannot write into " + fresh->path);
        return;
    }
    std::optional<zorvane::Client::Address> old;
    if (before)
        old = addressOf(item, *before);
    if (answered(item, before ? "replace" : "replace nothing", client_->replace(old, addressOf(item, after)), after))
        item.model.become(after);
}

void Life::mendStructure(const Item& item, const Known& known) {
    if (item.containerClass == bundleApplication)
        return;
    const auto data = client_->metadata(addressOf(item, known));
    if (!data) {
        if (!excused(data))
            found("metadata of " + item.identifier + ": " + data.error().message);
        return;
    }
    std::error_code error;
    files::remove_all(data->path + "/tmp", error);
    const auto mended = client_->recreateDefaultStructure(addressOf(item, known));
    session_.did(name_, "recreate", item.identifier);
    if (!mended && !excused(mended))
        found("recreate of " + item.identifier + ": " + mended.error().message);
    if (mended && !files::is_directory(data->path + "/tmp"))
        found("recreate made no " + data->path + "/tmp");
}

void Life::protect(const Item& item) {
    if (item.containerClass == bundleApplication)
        return;
    const bool locked = session_.locked;
    const auto changed = client_->setDataProtection({.containerClass = item.containerClass,
                                                     .user = item.user,
                                                     .identifier = item.identifier,
                                                     .protectionClass = choices_.oneIn(2) ? 1 : 3,
                                                     .thirdParty = true});
    session_.did(name_, "protect", item.identifier);
    const bool refused = !changed && changed.error().code == codeLocked && locked;
    if (!changed && !refused && !excused(changed))
        found("protect " + item.identifier + ": " + changed.error().message);
}

void Life::question(const Item& item, const Known& known) {
    const auto size = client_->diskUsage(addressOf(item, known));
    session_.did(name_, "usage", item.identifier);
    if (!size && !excused(size))
        found("usage of " + item.identifier + ": " + size.error().message);
    if (!client_)
        return;
    const auto listed = client_->list(item.containerClass, item.user, false);
    session_.did(name_, "list", "");
    if (!listed && !excused(listed))
        found("list: " + listed.error().message);
    // A listing leaves out what it cannot look at.
    if (listed && session_.trouble == Trouble::none &&
        std::ranges::find(*listed, item.identifier, &zorvane::ListedContainer::identifier) == listed->end())
        found(item.identifier + " is not listed");
    if (!client_ || !choices_.oneIn(4))
        return;
    const auto emptied = client_->emptyDeathRow();
    session_.did(name_, "empty death row", "");
    if (!emptied && !excused(emptied))
        found("empty death row: " + emptied.error().message);
}

void Life::registerGroups() {
    if (choices_.oneIn(3) || (groups_.size() > 1 && !groupsDoubted_))
        return lookAtGroups();
    std::set<std::string> wanted;
    for (unsigned i = 0; i < 3; ++i)
        if (choices_.oneIn(2))
            wanted.insert("group." + registered_ + "." + std::to_string(i));
    zorvane::List list;
    for (const std::string& group : wanted)
        list.push_back(zorvane::Value{group});
    zorvane::Client::Registration registration{.identifier = registered_};
    registration.entitlements = zorvane::Map{{"com.veltra.security.application-groups", zorvane::Value{list}},
                                             {"com.veltra.security.system-container", zorvane::Value{true}}};
    if (wanted.empty())
        registration.entitlements.reset();
    const auto done = client_->processEntitlements(registration);
    session_.did(name_, "register", std::to_string(wanted.size()) + " groups");
    if (done) {
        groups_ = {wanted};
        groupsDoubted_ = false;
        return;
    }
    groups_.push_back(wanted);
    // What could not be written is undone at the next start, or written with the next registration.
    groupsDoubted_ = groupsDoubted_ || done.error().kind == Error::Kind::daemon;
    if (!excused(done))
        found("register: " + done.error().message);
}

void Life::lookAtGroups() {
    const auto identifiers = client_->groupContainerIdentifiers(mobileUser, registered_);
    session_.did(name_, "group identifiers", "");
    if (!identifiers) {
        if (!excused(identifiers))
            found("group identifiers: " + identifiers.error().message);
        return;
    }
    const std::set<std::string> now(identifiers->begin(), identifiers->end());
    if (std::ranges::find(groups_, now) == groups_.end())
        found("other groups are registered than were asked for: " + std::to_string(now.size()));
    if (!groupsDoubted_)
        groups_ = {now};
    const auto paths = client_->groupContainerPaths(mobileUser, registered_);
    session_.did(name_, "groups", "");
    if (!paths) {
        if (!excused(paths))
            found("groups: " + paths.error().message);
        return;
    }
    for (const std::string& group : now)
        if (!paths->contains(group) && session_.trouble == Trouble::none)
            found("the group " + group + " has no container; " + std::to_string(paths->size()) + " have one");
    for (const auto& [group, path] : *paths)
        if (!files::is_directory(path))
            found("the group " + group + " has no container at " + path);
    const auto own = client_->systemContainerPath(registered_);
    session_.did(name_, "system container", "");
    if (!own && own.error().kind != Error::Kind::daemon && !excused(own))
        found("system container: " + own.error().message);
}

} // namespace zor::soak
