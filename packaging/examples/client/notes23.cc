// SPDX-License-Identifier: Apache-2.0
// The same as notes.c, in C++23 and without exceptions.
#include <zorvane/Client.h>

#include <cstdio>

namespace {

int fail(const zorvane::Error& error) {
    std::fprintf(stderr, "notes: %s\n", error.message.c_str());
    return 1;
}

} // namespace

int main(int count, char** arguments) {
    auto client = zorvane::Client::connect({.root = count > 1 ? arguments[1] : "/"});
    if (!client)
        return fail(client.error());
    const auto container =
        client->createOrLookup({.containerClass = 2, .identifier = "org.example.notes", .create = true});
    if (!container)
        return fail(container.error());
    const zorvane::Client::Address notes{
        .containerClass = 2, .identifier = container->identifier, .uuid = container->uuid};
    std::int64_t starts = 1;
    if (const auto stored = client->infoValue(notes, "starts"))
        if (const auto* number = std::get_if<std::int64_t>(&stored->content))
            starts = *number + 1;
    if (const auto set = client->setInfoValue(notes, "starts", zorvane::Value{starts}); !set)
        return fail(set.error());
    std::printf("%s, start %lld\n", container->path.c_str(), static_cast<long long>(starts));
    return 0;
}
