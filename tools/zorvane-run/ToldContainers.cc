// SPDX-License-Identifier: Apache-2.0
#include "ToldContainers.h"

#include "ipc/Protocol.h"
#include "upcall/packbuff/Packbuff.h"

#include <algorithm>
#include <climits>
#include <functional>
#include <string_view>

namespace zorvanerun {

using namespace zor;
using namespace zor::upcall;
using ipc::ContainerClass;

namespace {

// The daemon keeps a user's containers below the user's home, the system's below the root.
constexpr std::string_view userContainers = "/Containers/";
constexpr std::string_view systemContainers = "/private/var/containers/";
constexpr std::string_view temporaryName = "/tmp";

bool isPlainName(std::string_view name) {
    return !name.empty() && name != "." && name != ".." && std::ranges::none_of(name, [](char character) {
        const auto byte = static_cast<unsigned char>(character);
        return byte < 0x20 || byte == 0x7f || byte == '/';
    });
}

/// A container of this class: a directory of the class's own, under any name that is not hidden.
bool isContainer(const std::string& path, const std::string& base, std::string_view parent, ContainerClass kind) {
    const std::string directory =
        base + std::string(parent) + std::string(ipc::containerClassNames[static_cast<std::size_t>(kind)]) + "/";
    if (!path.starts_with(directory))
        return false;
    const std::string_view name = std::string_view(path).substr(directory.size());
    return isPlainName(name) && name.front() != '.';
}

/// Reads items one after the other; `problem` says what was wrong with the first bad one.
class ReplyReader {
public:
    explicit ReplyReader(Bytes bytes) : bytes_(bytes.begin(), bytes.end()) {
        packbuff_.reset(sb_packbuff_init_with_buffer(bytes_.data(), bytes_.size(), true, packbuffDeallocNone));
    }

    bool read(ToldContainers& told) {
        if (!packbuff_)
            return fail("it is empty");
        std::uint16_t type = 0;
        while (sb_packbuff_get_item_value_type(packbuff_.get(), &type) != 0) {
            if (status_)
                return fail("something follows the status");
            if (!readItem(type, told))
                return false;
        }
        if (!sb_packbuff_is_at_end(packbuff_.get()) || !status_)
            return fail("it breaks off");
        if (*status_ != 1)
            return fail("the daemon could not find or make all of the containers");
        return true;
    }
    [[nodiscard]] const std::string& problem() const { return problem_; }

private:
    bool fail(const char* what) {
        problem_ = what;
        return false;
    }

    bool readItem(std::uint16_t type, ToldContainers& told) {
        switch (type) {
        case CM_KERN_REPLY_STATUS: {
            int error = packbuffSuccess;
            status_ = sb_packbuff_unpack_uint32(packbuff_.get(), &error);
            return error == packbuffSuccess || fail("its status cannot be read");
        }
        case CM_KERN_REPLY_HOME_DIR_PATH:
            return readOnce(told.home);
        case CM_KERN_REPLY_DATA_CONTAINER_PATH:
            return readOnce(told.data);
        case CM_KERN_REPLY_TEMP_DIR_PATH:
            return readOnce(told.temporary);
        case CM_KERN_REPLY_SYSTEM_CONTAINER_PATH:
            return readOnce(told.systemContainer ? *told.systemContainer : told.systemContainer.emplace());
        case CM_KERN_REPLY_APP_GROUP_ID:
            return readGroup(CM_KERN_REPLY_APP_GROUP_PATH, told.applicationGroups);
        case CM_KERN_REPLY_SYSTEM_GROUP_ID:
            return readGroup(CM_KERN_REPLY_SYSTEM_GROUP_PATH, told.systemGroups);
        default:
            return fail("it has an item of a kind that is not known");
        }
    }

    bool readText(std::string& text) {
        int error = packbuffSuccess;
        std::uint32_t length = 0;
        const char* const start = sb_packbuff_unpack_string(packbuff_.get(), &length, &error);
        if (error != packbuffSuccess)
            return fail("a text in it cannot be read");
        text.assign(start, length);
        return (!text.empty() && text.find('\0') == text.npos) || fail("a text in it is empty, or holds a NUL");
    }
    bool readOnce(std::string& text) { return text.empty() ? readText(text) : fail("it tells one path twice"); }
    bool readGroup(std::uint16_t pathType, std::map<std::string, std::string>& groups) {
        std::string identifier;
        if (!readText(identifier))
            return false;
        std::uint16_t type = 0;
        if (sb_packbuff_get_item_value_type(packbuff_.get(), &type) == 0 || type != pathType)
            return fail("a group in it has no path");
        return readOnce(groups[identifier]);
    }

    std::vector<std::uint8_t> bytes_;
    PackbuffPointer packbuff_;
    std::optional<std::uint32_t> status_;
    std::string problem_;
};

bool areThose(const std::map<std::string, std::string>& told, const std::set<std::string>& wanted) {
    return std::ranges::equal(told, wanted, {}, [](const auto& pair) { return pair.first; });
}

std::vector<std::string> containersOf(const ToldContainers& told) {
    std::vector<std::string> paths = {told.data};
    for (const auto& [identifier, path] : told.applicationGroups)
        paths.push_back(path);
    for (const auto& [identifier, path] : told.systemGroups)
        paths.push_back(path);
    if (told.systemContainer)
        paths.push_back(*told.systemContainer);
    return paths;
}

/// nullptr, or why the paths are not what a daemon on this root would tell.
const char* judge(const ToldContainers& told, const WantedContainers& wanted, const std::string& root) {
    const std::string base = root == "/" ? "" : root;
    if (!areThose(told.applicationGroups, wanted.applicationGroups) ||
        !areThose(told.systemGroups, wanted.systemGroups) || told.systemContainer.has_value() != wanted.systemContainer)
        return "it does not tell what was asked for";
    if (!isPlainPath(told.home) || told.home == root || !isAtOrBelow(told.home, root))
        return "the user's home is not below the root";
    if (!isContainer(told.data, told.home, userContainers, ContainerClass::dataApplication))
        return "the data container is not where data containers are";
    if (told.temporary != told.data + std::string(temporaryName))
        return "the temporary directory is not in the data container";
    for (const auto& [identifier, path] : told.applicationGroups)
        if (!isContainer(path, told.home, userContainers, ContainerClass::sharedAppGroup))
            return "an application group's container is not where those are";
    for (const auto& [identifier, path] : told.systemGroups)
        if (!isContainer(path, base, systemContainers, ContainerClass::sharedSystemGroup))
            return "a system group's container is not where those are";
    if (told.systemContainer && !isContainer(*told.systemContainer, base, systemContainers, ContainerClass::dataSystem))
        return "the system container is not where those are";
    // One inside another would be next to it in order, were each written with a slash at its end.
    std::vector<std::string> paths = containersOf(told);
    for (std::string& path : paths)
        path += '/';
    std::ranges::sort(paths);
    for (std::size_t i = 1; i < paths.size(); ++i)
        if (paths[i].starts_with(paths[i - 1]))
            return "one container is inside another, or told twice";
    return nullptr;
}

} // namespace

bool isPlainPath(const std::string& path) {
    if (!path.starts_with('/') || path.size() >= PATH_MAX)
        return false;
    for (std::string_view rest = std::string_view(path).substr(1);;) {
        const std::size_t end = rest.find('/');
        if (!isPlainName(rest.substr(0, end)))
            return false;
        if (end == rest.npos)
            return true;
        rest.remove_prefix(end + 1);
    }
}

bool isAtOrBelow(const std::string& inner, const std::string& outer) {
    if (outer == "/" || inner == outer)
        return true;
    return inner.starts_with(outer) && inner[outer.size()] == '/';
}

std::vector<std::uint8_t> packRequest(const std::string& identifier, std::uint32_t user,
                                      const WantedContainers& wanted) {
    const PackbuffPointer packbuff(sb_packbuff_new(4096));
    bool packed = packbuff != nullptr;
    const auto text = [&](RequestValueType type, const std::string& value) {
        const bool whole = value.find('\0') == value.npos && value.size() < UINT32_MAX;
        packed = packed && whole &&
                 sb_packbuff_pack_string(packbuff.get(), type, value.c_str(),
                                         static_cast<std::uint32_t>(value.size())) == packbuffSuccess;
    };
    text(CM_KERN_REQUEST_CONTAINER_ID, identifier);
    packed = packed && sb_packbuff_pack_uint32(packbuff.get(), CM_KERN_REQUEST_PERSONA_ID, user) == packbuffSuccess;
    for (const std::string& group : wanted.applicationGroups)
        text(CM_KERN_REQUEST_APP_GROUP_ID, group);
    if (wanted.systemContainer)
        text(CM_KERN_REQUEST_SYSTEM_CONTAINER_ID, identifier);
    for (const std::string& group : wanted.systemGroups)
        text(CM_KERN_REQUEST_SYSTEM_GROUP_CONTAINER_ID, group);
    if (!packed)
        return {};
    const std::uint8_t* const bytes = sb_packbuff_get_bytes(packbuff.get());
    return {bytes, bytes + sb_packbuff_get_size(packbuff.get())};
}

std::expected<ToldContainers, std::string> readReply(Bytes buffer, const WantedContainers& wanted,
                                                     const std::string& root) {
    ToldContainers told;
    ReplyReader reader(buffer);
    if (!reader.read(told))
        return std::unexpected(reader.problem());
    if (const char* problem = judge(told, wanted, root))
        return std::unexpected(problem);
    return told;
}

} // namespace zorvanerun
