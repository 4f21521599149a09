// SPDX-License-Identifier: Apache-2.0
// One client of the soak: its requests, the model that holds the daemon to what it acknowledged, and the looks at both.
#include "soak/Session.h"

#include <algorithm>
#include <array>
#include <filesystem>
#include <fstream>
#include <sys/syscall.h>
#include <unistd.h>

namespace zor::soak {

namespace {

namespace files = std::filesystem;
using zorvane::Error;

using whole::bundleApplication;
using whole::dataApplication;
constexpr std::uint64_t dataKolvexPlugin = 4;
constexpr std::uint32_t mobileUser = whole::mobile;
constexpr std::uint32_t bundleUser = 33;
constexpr const char* valueKey = "soak";
constexpr const char* contentName = "soak-content";
constexpr std::uint64_t codeNoSubdirectory = 6;
constexpr std::uint64_t codeNotFound = 21;
constexpr std::uint64_t codeNoValue = 24;
constexpr std::uint64_t codeLocked = 61;

std::string contentAt(const std::string& directory) {
    std::ifstream file(directory + "/" + contentName);
    std::string text;
    std::getline(file, text);
    return text;
}

/// This thread's own identity on the sockets that it makes; the process keeps its.
void becomeUser(std::uint32_t user) {
    if (::geteuid() == 0 && user != 0 &&
        (::syscall(SYS_setresgid, user, user, user) != 0 || ::syscall(SYS_setresuid, user, user, user) != 0))
        throw std::runtime_error("cannot become user " + std::to_string(user));
}

struct Known {
    /// Absent: made by a request whose answer did not come.
    std::optional<std::array<std::uint8_t, 16>> uuid;
    /// The content of the file that the client keeps there, and the value that it attached; empty without.
    std::string content;
    std::string value;

    [[nodiscard]] bool fits(const Known& other, bool whateverValue) const {
        return (!uuid || !other.uuid || *uuid == *other.uuid) && content == other.content &&
               (whateverValue || value == other.value);
    }
};
/// nullopt: there is no container.
using State = std::optional<Known>;

std::string textOf(const State& state) {
    if (!state)
        return "none";
    const std::string uuid = state->uuid ? zorvane::uuidText(*state->uuid) : "some UUID";
    return uuid + ", content '" + state->content + "', value '" + state->value + "'";
}

class Model {
public:
    [[nodiscard]] bool isCertain() const { return states_.size() == 1; }
    /// Only while it is certain.
    [[nodiscard]] const State& state() const { return states_.front(); }
    void become(State state) {
        states_ = {std::move(state)};
        valueDoubted_ = false;
    }
    /// The client wrote it itself.
    void setContent(const std::string& content) { states_.front()->content = content; }
    /// The daemon could not write a value and goes on with it in memory: until it writes the next, either may show.
    void doubtValue() { valueDoubted_ = true; }
    /// A request was not answered, or not carried out: what it was to make may be there or not, never half.
    void mayBe(State other) { states_.push_back(std::move(other)); }
    /// The state that was seen has to be one of the possible ones.
    [[nodiscard]] bool observe(const State& seen) {
        for (const State& possible : states_)
            if (possible.has_value() == seen.has_value() && (!seen || possible->fits(*seen, valueDoubted_))) {
                states_ = {seen};
                return true;
            }
        return false;
    }
    [[nodiscard]] std::string text() const {
        std::string all;
        for (const State& state : states_)
            all += (all.empty() ? "" : ", or ") + textOf(state);
        return all;
    }

private:
    std::vector<State> states_{std::nullopt};
    bool valueDoubted_ = false;
};

/// Each request's answer is held against what the client knows. When the daemon goes away it waits for the next one and
/// looks what became of what it had asked for.
class Life {
public:
    Life(Session& session, unsigned number, std::uint32_t user, std::uint64_t seed)
        : session_(session), name_("client" + std::to_string(number)), user_(user), choices_(seed, number),
          registered_("org.soak." + name_) {
        for (unsigned i = 0; i < 4; ++i)
            items_.push_back({dataApplication, mobileUser, registered_ + "." + std::to_string(i), {}});
        items_.push_back({dataKolvexPlugin, mobileUser, registered_ + ".plugin", {}});
        if (user == 0)
            items_.push_back({bundleApplication, bundleUser, registered_, {}});
    }

    /// Until the session is stopped.
    void live() {
        becomeUser(user_);
        while (!session_.stopped) {
            const std::shared_lock inside(session_.requests);
            if (!client_) {
                session_.connect(client_);
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

    /// Looks at everything once more.
    void lookAtAll() {
        for (int tries = 0; !client_ && tries < 2000; ++tries)
            session_.connect(client_);
        for (Item& item : items_)
            if (client_)
                lookAt(item);
        if (client_)
            lookAtGroups();
    }

private:
    struct Item {
        std::uint64_t containerClass;
        std::uint32_t user;
        std::string identifier;
        Model model;
    };

    /// The errors that any call may be answered with: the daemon went away, or its surroundings are in trouble.
    template <typename T>
    [[nodiscard]] bool excused(const zorvane::Result<T>& answer) {
        const Error& error = answer.error();
        if (error.kind == Error::Kind::daemon)
            return session_.trouble != Trouble::none;
        client_.reset();
        // A daemon that is not killed answers, in time and in form.
        return error.kind == Error::Kind::unreachable || error.kind == Error::Kind::refused ||
               session_.trouble != Trouble::none;
    }

    /// The answer of a call that should work and changes nothing that is known.
    template <typename T>
    bool worked(const std::string& operation, const std::string& detail, const zorvane::Result<T>& answer) {
        session_.did(name_, operation, detail);
        if (!answer && !excused(answer))
            found(operation + " " + detail + ": " + answer.error().message);
        return answer.has_value();
    }

    /// The answer of a call that should change the item to `after`, which is noted as possible when it does not come.
    template <typename T>
    bool answered(Item& item, const char* operation, const zorvane::Result<T>& answer, const State& after) {
        session_.did(name_, operation,
                     item.identifier + " to " + textOf(after) + (answer ? "" : ": " + answer.error().message));
        if (answer)
            return true;
        item.model.mayBe(after);
        if (item.containerClass == bundleApplication && !after)
            groups_.emplace_back();
        if (!excused(answer))
            found(std::string(operation) + " of " + item.identifier + ": " + answer.error().message);
        // A replace that fails when the old one has moved has lost it.
        else if (session_.trouble != Trouble::none)
            item.model.mayBe(std::nullopt);
        return false;
    }

    [[nodiscard]] static zorvane::Client::Lookup lookupOf(const Item& item, bool create = false,
                                                          bool transient = false) {
        return {item.containerClass, item.user, item.identifier, create, transient};
    }

    [[nodiscard]] static zorvane::Client::Address addressOf(const Item& item, const Known& known) {
        return {item.containerClass, item.user, item.identifier, known.uuid.value()};
    }

    [[nodiscard]] State seen(const Item& item) {
        const auto there = client_->createOrLookup(lookupOf(item));
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

    void lookAt(Item& item) {
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

    void make(Item& item) {
        const auto made = client_->createOrLookup(lookupOf(item, true));
        if (!answered(item, "create", made, Known{}))
            return;
        if (made->existed)
            found(item.identifier + " existed before it was made");
        item.model.become(Known{.uuid = made->uuid, .content = "", .value = ""});
    }

    void act(Item& item) {
        const State state = item.model.state();
        if (!state)
            return choices_.oneIn(4) ? replace(item) : make(item);
        actOnLive(item, *state);
    }

    void actOnLive(Item& item, const Known& known) {
        const auto remove = [&](const char* how, const zorvane::Result<void>& gone) {
            if (answered(item, how, gone, std::nullopt))
                went(item);
        };
        const std::function<void()> actions[] = {
            [&] { remove("delete", client_->deleteContainer(item.containerClass, item.user, item.identifier, false)); },
            [&] { remove("stage", client_->stageForDelete({addressOf(item, known)})); },
            [&] { setValue(item, known); },
            [&] {
                const Known after{known.uuid, "", ""};
                if (item.containerClass != bundleApplication &&
                    answered(item, "wipe", client_->wipe(item.containerClass, item.user, item.identifier), after))
                    item.model.become(after);
            },
            [&] {
                (void)answered(item, "regenerate", client_->regenerateDirectoryUUID(addressOf(item, known)), known);
            },
            [&] { replace(item); },
            [&] { mendStructure(item, known); },
            [&] { protect(item); },
            [&] { question(item, known); },
            [&] { writeContent(item, known); },
        };
        actions[choices_.upTo(std::size(actions))]();
    }

    void setValue(Item& item, const Known& known) {
        const Known after{known.uuid, known.content, newText()};
        const auto set = client_->setInfoValue(addressOf(item, known), valueKey, zorvane::Value{after.value});
        if (answered(item, "set info", set, after))
            item.model.become(after);
        else if (set.error().kind == Error::Kind::daemon)
            item.model.doubtValue();
    }

    void went(Item& item) {
        // With a live bundle go the groups of its identifier.
        if (item.containerClass == bundleApplication && session_.trouble != Trouble::none) {
            groups_.emplace_back();
        } else if (item.containerClass == bundleApplication) {
            groups_ = {{}};
            groupsDoubted_ = false;
        }
        // A batch passes over what it can neither move nor remove, and logs it.
        if (session_.trouble == Trouble::none)
            item.model.become(std::nullopt);
        else
            item.model.mayBe(std::nullopt);
    }

    void writeContent(Item& item, const Known& known) {
        const auto data = client_->metadata(addressOf(item, known));
        if (!answered(item, "metadata", data, known))
            return;
        const std::string content = newText();
        if (putContent(data->path, content))
            item.model.setContent(content);
    }

    /// Into a file of its own, which then takes the place of the old one; false when the disk would not take it.
    bool putContent(const std::string& directory, const std::string& text) {
        const std::string half = directory + "/." + contentName;
        std::ofstream file(half, std::ios::trunc);
        file << text << std::flush;
        std::error_code error;
        if (file)
            files::rename(half, directory + "/" + contentName, error);
        else
            files::remove(half, error);
        const bool done = file && !error;
        if (!done && session_.trouble != Trouble::diskFull)
            found("cannot write into " + directory);
        return done;
    }

    void replace(Item& item) {
        const State before = item.model.state();
        const auto fresh = client_->createOrLookup(lookupOf(item, true, true));
        if (!answered(item, "create transient", fresh, before))
            return;
        Known after{.uuid = fresh->uuid, .content = newText(), .value = ""};
        if (!putContent(fresh->path, after.content))
            return;
        if (choices_.oneIn(3)) // given up: nothing of the live one's goes
            return (void)answered(item, "give up transient", client_->stageForDelete({addressOf(item, after)}), before);
        std::optional<zorvane::Client::Address> old;
        if (before)
            old = addressOf(item, *before);
        if (answered(item, before ? "replace" : "replace nothing", client_->replace(old, addressOf(item, after)),
                     after))
            item.model.become(after);
    }

    void mendStructure(const Item& item, const Known& known) {
        if (item.containerClass == bundleApplication)
            return;
        const auto data = client_->metadata(addressOf(item, known));
        if (!worked("metadata of", item.identifier, data))
            return;
        std::error_code error;
        files::remove_all(data->path + "/tmp", error);
        const bool locked = session_.locked;
        const auto made = client_->recreateDefaultStructure(addressOf(item, known));
        // New directories take the recorded class, whose key may be away.
        if (!made && made.error().code == codeNoSubdirectory && locked)
            session_.did(name_, "recreate while locked", item.identifier);
        else if (worked("recreate", item.identifier, made) && !files::is_directory(data->path + "/tmp"))
            found("recreate made no " + data->path + "/tmp");
    }

    void protect(const Item& item) {
        if (item.containerClass == bundleApplication)
            return;
        const bool locked = session_.locked;
        const auto changed = client_->setDataProtection(
            {item.containerClass, item.user, item.identifier, choices_.oneIn(2) ? 1 : 3, true});
        if (!changed && changed.error().code == codeLocked && locked)
            session_.did(name_, "protect while locked", item.identifier);
        else
            worked("protect", item.identifier, changed);
    }

    void question(const Item& item, const Known& known) {
        worked("usage of", item.identifier, client_->diskUsage(addressOf(item, known)));
        if (!client_)
            return;
        const auto listed = client_->list(item.containerClass, item.user, false);
        // A listing leaves out what it cannot look at.
        if (worked("list", "", listed) && session_.trouble == Trouble::none &&
            std::ranges::find(*listed, item.identifier, &zorvane::ListedContainer::identifier) == listed->end())
            found(item.identifier + " is not listed");
        if (client_ && choices_.oneIn(4))
            worked("empty death row", "", client_->emptyDeathRow());
    }

    void registerGroups() {
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
        if (worked("register", std::to_string(wanted.size()) + " groups", done)) {
            groups_ = {wanted};
            groupsDoubted_ = false;
            return;
        }
        groups_.push_back(wanted);
        // Groups that could not be written are undone at the next start, or written with the next registration.
        groupsDoubted_ = groupsDoubted_ || done.error().kind == Error::Kind::daemon;
    }

    void lookAtGroups() {
        const auto identifiers = client_->groupContainerIdentifiers(mobileUser, registered_);
        if (!worked("group identifiers", "", identifiers))
            return;
        const std::set<std::string> now(identifiers->begin(), identifiers->end());
        if (std::ranges::find(groups_, now) == groups_.end())
            found("other groups are registered than were asked for: " + std::to_string(now.size()));
        if (!groupsDoubted_)
            groups_ = {now};
        const auto paths = client_->groupContainerPaths(mobileUser, registered_);
        if (!worked("groups", "", paths))
            return;
        for (const std::string& group : now)
            if (!paths->contains(group) && session_.trouble == Trouble::none)
                found("the group " + group + " has no container; " + std::to_string(paths->size()) + " have one");
        for (const auto& [group, path] : *paths)
            if (!files::is_directory(path))
                found("the group " + group + " has no container at " + path);
        const auto own = client_->systemContainerPath(registered_);
        if (own || own.error().kind != Error::Kind::daemon)
            worked("system container", "", own);
    }

    std::string newText() { return std::to_string(++texts_); }
    void found(const std::string& what) { session_.found(name_ + ": " + what); }

    Session& session_;
    const std::string name_;
    const std::uint32_t user_;
    Choices choices_;
    std::vector<Item> items_;
    std::optional<zorvane::Client> client_;
    std::uint64_t texts_ = 0;
    const std::string registered_;
    /// The sets of groups of which the registration must be one.
    std::vector<std::set<std::string>> groups_{{}};
    bool groupsDoubted_ = false;
};

} // namespace

void live(Session& session, unsigned number, std::uint32_t user, std::uint64_t seed) {
    Life life(session, number, user, seed);
    life.live();
    life.lookAtAll();
}

} // namespace zor::soak
