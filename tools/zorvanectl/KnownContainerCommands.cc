// SPDX-License-Identifier: Apache-2.0
// The commands for a container that is there: replacing, wiping, repairing, measuring it, and its info values.
#include "Commands.h"
#include "KnownContainer.h"
#include "LostRecord.h"

namespace zorvanectl {

namespace {

using zorvane::Client;

std::string named(const Target& target) {
    return target.identifier + " in " + std::string(zorvane::containerClassName(target.containerClass));
}

int done(const zorvane::Result<void>& result, const Output& output, const std::string& what, const Target& target,
         const char* verb) {
    if (!result)
        return output.error(result.error(), what);
    if (output.isJson())
        output.json({{"identifier", target.identifier}, {"class", target.containerClass}, {verb, true}});
    else
        output.line(printable(target.identifier) + " " + verb);
    return exitDone;
}

int destroyed(const zorvane::Result<void>& result, const Output& output, const std::string& what, const Target& target,
              const char* verb, const std::optional<std::uint64_t>& bytes) {
    if (!result)
        return output.error(result.error(), what);
    if (output.isJson())
        output.json({{"identifier", target.identifier},
                     {"class", target.containerClass},
                     {verb, true},
                     {"bytes", toJson(bytes)}});
    else
        output.line(printable(target.identifier) + " " + verb + ", " + shownBytes(bytes) + " went");
    return exitDone;
}

} // namespace

int replace(const zorvane::ConnectOptions& connect, const Output& output, const Target& target, Consent consent) {
    const std::string what = "replace " + named(target);
    auto client = Client::connect(connect);
    if (!client)
        return output.error(client.error(), what);
    const auto fresh = find(*client, target, true);
    if (!fresh)
        return output.error(fresh.error(), what);
    const auto old = find(*client, target, false);
    if (!old && old.error().code != codeNotFound)
        return output.error(old.error(), what);
    std::optional<std::uint64_t> bytes = 0;
    if (old) {
        bytes = measured(connect, {&*old, 1});
        if (consent == Consent::ask && !output.agreed(lossQuestion("Replace", bytes, target.identifier), what))
            return exitUsage;
    }
    return destroyed(client->replace(old ? std::optional(*old) : std::nullopt, *fresh), output, what, target,
                     "replaced", bytes);
}

int wipe(const zorvane::ConnectOptions& connect, const Output& output, const Target& target, KeepClass keep,
         Consent consent) {
    const std::string what = "wipe " + named(target);
    return withContainer(connect, output, target, what, [&](Client& client, const Client::Address& address) {
        const LostRecord lost = lostRecordOf(client, address);
        if (const auto refused = refuseToLoseClass(connect, output, lost, keep, what))
            return *refused;
        const auto bytes = measured(connect, {&address, 1});
        if (consent == Consent::ask &&
            !output.agreed(lossQuestion("Wipe", bytes, target.identifier, lostInfoText(lost)), what))
            return exitUsage;
        if (const auto wiped = client.wipe(address.containerClass, address.user, address.identifier); !wiped)
            return output.error(wiped.error(), what);
        const bool kept = setClassAgain(client, output, target, lost);
        if (output.isJson()) {
            nlohmann::json document = {{"identifier", target.identifier},
                                       {"class", target.containerClass},
                                       {"wiped", true},
                                       {"bytes", toJson(bytes)}};
            addLost(document, lost, kept);
            output.json(std::move(document));
        } else {
            output.line(printable(target.identifier) + " wiped, " + shownBytes(bytes) + " went" +
                        (lost.infoKeys.empty() ? "" : ", and " + lostInfoText(lost)));
        }
        return kept || keep == KeepClass::ifPossible ? exitDone : exitLocalError;
    });
}

int metadata(const zorvane::ConnectOptions& connect, const Output& output, const Target& target) {
    const std::string what = "show the metadata of " + named(target);
    return withContainer(connect, output, target, what, [&](Client& client, const Client::Address& address) {
        const auto found = client.metadata(address);
        if (!found)
            return output.error(found.error(), what);
        if (output.isJson()) {
            output.json({{"identifier", address.identifier},
                         {"uuid", zorvane::uuidText(address.uuid)},
                         {"class", address.containerClass},
                         {"path", found->path},
                         {"transient", found->transient},
                         {"info", toJson({found->info})}});
            return exitDone;
        }
        output.line(printable(address.identifier));
        output.line("  uuid       " + zorvane::uuidText(address.uuid));
        output.line("  path       " + printable(found->path));
        output.line(std::string("  transient  ") + (found->transient ? "yes" : "no"));
        for (const auto& [key, value] : found->info)
            output.tree(key, value, "  ");
        return exitDone;
    });
}

int repair(const zorvane::ConnectOptions& connect, const Output& output, const Target& target) {
    const std::string what = "repair " + named(target);
    return withContainer(connect, output, target, what, [&](Client& client, const Client::Address& address) {
        return done(client.recreateDefaultStructure(address), output, what, target, "repaired");
    });
}

int regenerate(const zorvane::ConnectOptions& connect, const Output& output, const Target& target) {
    const std::string what = "rename the directory of " + named(target);
    return withContainer(connect, output, target, what, [&](Client& client, const Client::Address& address) {
        if (const auto renamed = client.regenerateDirectoryUUID(address); !renamed)
            return output.error(renamed.error(), what);
        const auto found = client.metadata(address);
        if (!found)
            return output.error(found.error(), what);
        if (output.isJson())
            output.json({{"identifier", address.identifier}, {"path", found->path}});
        else
            output.line(printable(address.identifier) + " is now at " + printable(found->path));
        return exitDone;
    });
}

int infoList(const zorvane::ConnectOptions& connect, const Output& output, const Target& target) {
    const std::string what = "list the info of " + named(target);
    return withContainer(connect, output, target, what, [&](Client& client, const Client::Address& address) {
        const auto found = client.metadata(address);
        if (!found)
            return output.error(found.error(), what);
        if (output.isJson()) {
            output.json({{"identifier", address.identifier}, {"info", toJson({found->info})}});
            return exitDone;
        }
        if (found->info.empty())
            output.remark(target.identifier + " has no info values");
        for (const auto& [key, value] : found->info)
            output.tree(key, value);
        return exitDone;
    });
}

int infoGet(const zorvane::ConnectOptions& connect, const Output& output, const Target& target,
            const std::string& key) {
    const std::string what = "get " + key + " of " + named(target);
    return withContainer(connect, output, target, what, [&](Client& client, const Client::Address& address) {
        const auto value = client.infoValue(address, key);
        if (!value)
            return output.error(value.error(), what);
        if (output.isJson())
            output.json({{"identifier", address.identifier}, {"key", key}, {"value", toJson(*value)}});
        else
            output.tree(key, *value);
        return exitDone;
    });
}

int infoSet(const zorvane::ConnectOptions& connect, const Output& output, const Target& target, const std::string& key,
            const std::string& value) {
    const std::string what = "set " + key + " of " + named(target);
    const auto json = nlohmann::json::parse(value, nullptr, false);
    auto parsed = json.is_discarded() ? std::optional(zorvane::Value{value}) : fromJson(json);
    if (!parsed)
        return output.localError(exitUsage, printable(value) + " cannot be a value: null has no form there",
                                 "give another value, or remove the key with 'info unset'", what);
    return withContainer(connect, output, target, what, [&](Client& client, const Client::Address& address) {
        return done(client.setInfoValue(address, key, parsed), output, what, target, "set");
    });
}

int infoUnset(const zorvane::ConnectOptions& connect, const Output& output, const Target& target,
              const std::string& key) {
    const std::string what = "unset " + key + " of " + named(target);
    return withContainer(connect, output, target, what, [&](Client& client, const Client::Address& address) {
        return done(client.setInfoValue(address, key, std::nullopt), output, what, target, "unset");
    });
}

} // namespace zorvanectl
