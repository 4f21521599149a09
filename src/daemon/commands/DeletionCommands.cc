// SPDX-License-Identifier: Apache-2.0
// Taking containers out of the store: a list of them, or the one of an identifier.
#include "daemon/commands/Commands.h"
#include "daemon/commands/Request.h"
#include "ipc/Uuid.h"

#include <limits>

namespace zor::commands {

namespace keys = ipc::keys;

namespace {

/// No valid class; what an integer beyond the unsigned ones stands for.
constexpr std::uint64_t noClass = std::numeric_limits<std::uint64_t>::max();

const plist::Array& arrayOf(const plist::Dictionary& request, std::string_view key) {
    static const plist::Array none;
    const plist::Array* array = request.array(key);
    return array ? *array : none;
}

/// The users of the list, each resolved for the class beside it. Without all of them the context has its error.
std::optional<std::vector<std::uint32_t>> usersOf(CommandContext& context, const plist::Array& classes) {
    std::vector<std::uint32_t> users;
    std::size_t index = 0;
    for (const plist::Value& element : arrayOf(context.request, keys::userIdsArray)) {
        const std::uint64_t number = index < classes.size() ? classes[index].asUnsigned().value_or(0) : 0;
        const auto user = validatedUser(context, element.asUnsigned().value_or(0), static_cast<ContainerClass>(number));
        if (!user)
            return std::nullopt;
        users.push_back(*user);
        ++index;
    }
    return users;
}

} // namespace

void stageContainersForDelete(CommandContext& context) {
    const plist::Array& classes = arrayOf(context.request, keys::containerClassesArray);
    auto users = usersOf(context, classes);
    if (!users)
        return;
    ZORClientConnection::DeletionBatch batch{.users = std::move(*users)};
    for (const plist::Value& element : classes)
        if (element.isInteger())
            batch.classes.emplace_back(element.asUnsigned().value_or(noClass));
        else
            batch.classes.emplace_back(std::unexpected(plist::describe(&element)));
    for (const plist::Value& element : arrayOf(context.request, keys::uuidsArray)) {
        const auto bytes = ipc::uuidOf(&element);
        batch.uuids.push_back(bytes ? std::optional(UUID(*bytes)) : std::nullopt);
    }
    const plist::Array* identifiers = context.request.array(keys::identifiersArray);
    if (!identifiers)
        context.log.write(logLevelError, "stageContainerForDelete", "Got non-Array input for the identifiers array");
    else
        for (const plist::Value& element : *identifiers) {
            const std::string* identifier = element.asString();
            batch.identifiers.push_back(identifier ? std::optional(*identifier) : std::nullopt);
        }
    storeError(context, context.client->stageForDeleteContainersWithUsers(batch, UseLocking::yes));
}

void deleteContainer(CommandContext& context) {
    const ContainerClass containerClass = classOf(context.request, keys::containerClass);
    const auto user = userOf(context, keys::userId, containerClass);
    if (!user)
        return;
    storeError(context,
               context.client->deleteContainerForUser(*user, context.request.string(keys::identifier), containerClass,
                                                      context.request.isTrue(keys::transient)));
}

} // namespace zor::commands
