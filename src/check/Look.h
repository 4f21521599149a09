// SPDX-License-Identifier: Apache-2.0
// One look over a store: what its parts share. Every directory is opened anew, without following a link, and judged by
// its descriptor.
#pragma once

#include "check/Finding.h"
#include "check/StoreCheck.h"
#include "os/FileDescriptor.h"
#include "platform/Errno.h"
#include "store/ZORWhitelist.h"

#include <functional>
#include <map>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace zor::check {

struct MobileUser {
    std::uint32_t userId;
    FileURL home;
};

class Look {
public:
    Look(CheckedSystem& system, const CheckOptions& options);

    [[nodiscard]] CheckedSystem& device() { return system_; }
    [[nodiscard]] const CheckOptions& options() const { return options_; }
    [[nodiscard]] const ZORWhitelist& whitelist() const { return whitelist_; }
    /// Those that have a home, so far as it can be looked at.
    [[nodiscard]] const std::vector<MobileUser>& users() const { return users_; }

    /// Whether it is an account of a mobile user whose home is not there now, or holds no place for containers, as one
    /// that has not been mounted.
    [[nodiscard]] bool lacksHome(std::uint32_t userId) const { return homeless_.contains(userId); }

    /// Adds a finding and gives it for more to be filled in. `url` is what it is about.
    Finding& add(FindingCode code, const FileURL& url, std::string what, Mender mender);
    /// A finding that somebody who may use a shell can mend.
    Finding& addForPerson(FindingCode code, const FileURL& url, std::string what, std::string command);
    Finding& addUnexamined(const FileURL& url, Errno error);

    /// An open directory; nothing when there is none, or when there is something else, or an encryption hides it, which
    /// is then a finding.
    [[nodiscard]] std::optional<platform::FileDescriptor> openDirectory(const FileURL& url);
    /// Each name in an open directory but "." and "..".
    void forEachName(int directory, const FileURL& url, const std::function<void(const char* name)>& function);

    /// Moves something aside, within the directory of root, deleting nothing.
    [[nodiscard]] std::string moveAside(const FileURL& url) const;

    /// The live containers that shared-container rules ask about: identifier to directory, by class and user.
    std::map<std::pair<ContainerClass, std::uint32_t>, std::map<std::string, FileURL>> sharedContainers;

    [[nodiscard]] std::vector<Finding> take() { return std::move(findings_); }

private:
    void addUser(std::uint32_t userId);
    /// Whether an encryption hides what is in the directory, or the directory; said once of what hides it.
    bool isHidden(const FileURL& url);
    void addWrongShape(const FileURL& url);

    CheckedSystem& system_;
    const CheckOptions& options_;
    const ZORWhitelist whitelist_;
    std::vector<MobileUser> users_;
    std::set<std::uint32_t> homeless_;
    std::vector<Finding> findings_;
    std::set<std::string> misshapen_;
    std::set<std::string> hiding_;
};

} // namespace zor::check
