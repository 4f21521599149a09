// SPDX-License-Identifier: Apache-2.0
// What the daemon's codes mean to people, in one table.
#include "zorvane/Error.h"

namespace zorvane {

namespace {

struct Row {
    std::uint64_t code;
    ErrorText text;
};

constexpr const char* seeLog = "the daemon's log says what stood in the way (zorvaned.log)";
constexpr const char* seeDisk = "check that the file system has room and is writable; the daemon's log has the details";

constexpr Row rows[] = {
    {1, {"done", "nothing"}},
    {4, {"an item on death row could be neither deleted nor moved to the temporary directory", seeDisk}},
    {5, {"the old transient container could not be taken away", seeDisk}},
    {6, {"a standard subdirectory could not be made", seeDisk}},
    {7, {"the container could not be made in the staging directory", seeDisk}},
    {8, {"the finished container could not be moved into its class directory", seeDisk}},
    {9, {"the half-made container could not be taken away", seeDisk}},
    {10, {"the container is no longer where it was; the operation was cancelled", "try again"}},
    {11, {"the request is not valid", "check identifier, class and user; the daemon's log names what was wrong"}},
    {12, {"the container's metadata file cannot be read", seeLog}},
    {14, {"the old container could not be moved aside", seeDisk}},
    {15, {"the new container could not be moved into place", seeDisk}},
    {17, {"something on death row could not be destroyed", "try again later; the daemon's log names the item"}},
    {18, {"the identifier is missing", "name one"}},
    {21, {"there is no such container", "create it, or check identifier, class, user and whether it is transient"}},
    {22, {"a container cannot replace itself", "name two different containers"}},
    {23, {"containers of different classes cannot replace each other", "name two of one class"}},
    {24, {"the container has no such info key", "list the keys that it has"}},
    {27, {"the container exists already", "remove it first, or replace it"}},
    {28, {"the items to delete could not be listed or deleted", seeLog}},
    {29, {"the container's metadata is not valid", seeLog}},
    {33, {"the values of a replace are not valid", seeLog}},
    {34, {"a file of the container manager could not be written", seeDisk}},
    {35, {"the journal of a replace is unreadable or could not be recovered", seeLog}},
    {36, {"a replace was done, but not cleaned up", seeLog}},
    {38,
     {"this user, key, class or data-protection class is not allowed here",
      "bundles belong to user 33, system containers to 499, all others "
      "to 501 to 510; a mobile user acts only as itself"}},
    {40, {"the daemon caught an exception", "report it with the daemon's log"}},
    {41, {"the container could not be moved to death row", seeDisk}},
    {43, {"the containers of this class could not be read", "the daemon's log says which directory and why"}},
    {44,
     {"the container has lost its metadata file", "somebody removed it; restart the daemon to forget the container"}},
    {45, {"the container was made, but not taken into the cache", "restart the daemon; it will find it"}},
    {46, {"the container could not be taken out of the cache", "restart the daemon"}},
    {47, {"the request's class, user or identifier is not valid", "check them"}},
    {48, {"the container's directory could not be renamed", seeDisk}},
    {49, {"there is no such command", "the client is newer than the daemon"}},
    {55, {"the caller is not entitled to this container", "register the entitlement, or ask as a program that has it"}},
    {56, {"containers of different users cannot replace each other", "name two of one user"}},
    {59, {"the entitlement file could not be written", seeDisk}},
    {60, {"the request names different numbers of things", "give as many of each"}},
    {61, {"the device is locked", "unlock it, or let the change wait for the unlock"}},
    {62, {"ownership could not be changed", seeLog}},
};

} // namespace

ErrorText errorText(std::uint64_t code) {
    for (const Row& row : rows)
        if (row.code == code)
            return row.text;
    return {"the daemon met an error that this client does not know", seeLog};
}

std::vector<std::uint64_t> errorCodes() {
    std::vector<std::uint64_t> codes;
    for (const Row& row : rows)
        codes.push_back(row.code);
    return codes;
}

} // namespace zorvane
