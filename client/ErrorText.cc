// SPDX-License-Identifier: Apache-2.0
// The daemon's codes in words for people, in one table.
#include "zorvane/Error.h"

#include <algorithm>
#include <cstring>
#include <iterator>

namespace zorvane {

namespace {

struct Row {
    std::uint64_t code;
    ErrorText text;
};

constexpr const char* seeLog = "the daemon's log says what stood in the way (zorvaned.log)";
constexpr const char* diskFailed = "the file system is full, damaged or read-only";
constexpr const char* seeDisk = "check that the file system has room and is writable; the daemon's log has the details";

constexpr Row rows[] = {
    {1, {"done", "the daemon did what was asked", "what was asked for is on the disk", "nothing"}},
    {4,
     {"an item on death row could be neither deleted nor moved to the temporary directory",
      "the file system is full, damaged or read-only, or the item is a mount point",
      "it stays on death row; the next pass tries again", seeDisk}},
    {5,
     {"the old transient container could not be taken away", diskFailed,
      "the old one is still there, and no new one was made", seeDisk}},
    {6,
     {"a standard subdirectory could not be made",
      "the file system is full, damaged or read-only, or something else has its name",
      "no container was made, or it lacks the subdirectory", seeDisk}},
    {7, {"the container could not be made in the staging directory", diskFailed, "no container was made", seeDisk}},
    {8,
     {"the finished container could not be moved into its class directory",
      "the file system is full, damaged or read-only, or its place is taken", "no container was made", seeDisk}},
    {9,
     {"the half-made container could not be taken away", diskFailed,
      "it lies in staging until the daemon is next started; clients do not see it", seeDisk}},
    {10,
     {"the container is no longer where it was; the operation was cancelled",
      "it was replaced, moved or deleted while the operation waited, or its directory has another name than containers "
      "have",
      "nothing more was changed", "try again"}},
    {11,
     {"the request is not valid",
      "its identifier, class, user or UUID is missing, of a wrong type, or does not fit the others",
      "nothing was changed", "check identifier, class and user; the daemon's log names what was wrong"}},
    {12,
     {"the container's metadata file cannot be read", "somebody removed or changed it, or the file system failed",
      "clients cannot find the container", "'zorvanectl check' says what is wrong with it"}},
    {14,
     {"the old container could not be moved aside", diskFailed,
      "nothing was replaced: the old container is where it was", seeDisk}},
    {15,
     {"the new container could not be moved into place", diskFailed,
      "the old container is gone; the new one is where it was before",
      "look at the file system, then replace again: the new container is still there"}},
    {17,
     {"something on death row could not be destroyed",
      "the file system is full, damaged or read-only, or the item is immutable or a mount point",
      "it stays there and takes its space; the rest was deleted", "try again later; the daemon's log names the item"}},
    {18,
     {"the identifier is missing", "the request has none, or one that is no string", "nothing was changed",
      "name one"}},
    {21,
     {"there is no such container",
      "it was never made, it was deleted, or it is another class's, another user's or a transient one",
      "nothing was changed", "create it, or check identifier, class, user and whether it is transient"}},
    {22,
     {"a container cannot replace itself", "old and new container are the same", "nothing was changed",
      "name two different containers"}},
    {23,
     {"containers of different classes cannot replace each other", "old and new container are of two classes",
      "nothing was changed", "name two of one class"}},
    {24,
     {"the container has no such info key", "the key was never set, or was removed", "nothing was changed",
      "list the keys that it has"}},
    {27,
     {"the container exists already",
      "a live container has the identifier, or something lies where the new one is to be", "nothing was changed",
      "replace it, or look what lies in its place and move that aside"}},
    {28,
     {"the items to delete could not be listed or deleted", diskFailed, "what was not deleted waits for the next pass",
      seeLog}},
    {29,
     {"the container's metadata is not valid", "somebody changed the file, or moved the container",
      "clients cannot find the container", "'zorvanectl check' says which rule it breaks"}},
    {33,
     {"the values of a replace are not valid", "a path that the replace needs could not be worked out",
      "nothing was changed", seeLog}},
    {34,
     {"a file of the container manager could not be written",
      "the file system is full, damaged or read-only, or the values do not fit into the file, or not beside those of "
      "the user's other containers",
      "the file, if there was one, is as it was, and no container was moved; an info value that could not be saved is "
      "shown until the daemon is next started, where it would have fit",
      seeDisk}},
    {35,
     {"the journal of a replace is unreadable or could not be recovered",
      "the file was changed by somebody else, or a move back or a sync failed",
      "the journal stays, and with it what it names: nothing is made or deleted in the old container's place meanwhile",
      "repair what the daemon's log names, then ask again: each request tries the recovery, and so does the next "
      "start"}},
    {36,
     {"what a replace leaves behind could not be cleaned up, whether the replace was done or not", diskFailed,
      "a journal, or a container that waits in staging, lies there until the daemon is next started",
      "look the identifier up to see which container it has; the daemon's log says what stood in the way"}},
    {38,
     {"this user, key, class or data-protection class is not allowed here",
      "the request asks for what no client, or not this one, may have", "nothing was changed",
      "for a user: bundles and system containers belong to one user each, all others to the users from first= to last= "
      "in section [users] of /etc/zorvane/zorvaned.conf (33, 499, 501 to 510 unless it says otherwise), and a mobile "
      "user "
      "acts only as itself; for data protection: name class 0, 1 or 3; for a new container: a mobile user has 100000 "
      "at "
      "most, unless zorvaned is started with another number"}},
    {40,
     {"the daemon caught an exception", "memory ran out, or the daemon has a fault",
      "the operation was given up; a replace was undone as far as it could be", "report it with the daemon's log"}},
    {41, {"the container could not be moved to death row", diskFailed, "it is where it was", seeDisk}},
    {43,
     {"the containers of this class could not be read",
      "the user's home is not there or is locked, the class directory cannot be listed, or the user may not own "
      "containers of the class",
      "no container of the class is found until it can be read; nothing was changed",
      "mount or unlock the home and ask again; the daemon's log says which directory and why"}},
    {44,
     {"the container has lost its metadata file",
      "somebody removed it, or moved the container away, while the daemon ran",
      "the container cannot be used; the next boot deletes it",
      "put the file, or the container's directory, back: the daemon looks for it at the next request"}},
    {45,
     {"the container was made, but not taken into the cache", "the class directory could not be read",
      "it is on the disk, and is not found before the daemon is started again", "restart the daemon; it will find it"}},
    {46,
     {"the container could not be taken out of the cache", "the class directory could not be read",
      "the daemon may still name a container that is gone", "restart the daemon"}},
    {47,
     {"the request's class, user or identifier is not valid",
      "one of them is out of range, or they do not fit each other", "nothing was changed", "check them"}},
    {48, {"the container's directory could not be renamed", diskFailed, "the container is where it was", seeDisk}},
    {49,
     {"there is no such command", "the number is none of the daemon's", "the connection was ended",
      "the client is newer than the daemon"}},
    {55,
     {"the caller is not entitled to this container", "neither its entitlements nor its registry entry allow it",
      "nothing was changed", "register the entitlement, or ask as a program that has it"}},
    {56,
     {"containers of different users cannot replace each other", "old and new container belong to two users",
      "nothing was changed", "name two of one user"}},
    {59,
     {"the entitlement file could not be written",
      "the file system is full, damaged or read-only, or the map is longer than it may be",
      "the change holds until the daemon ends, and is written with the next one", seeDisk}},
    {60,
     {"the request names different numbers of things", "its lists are of different lengths", "nothing was changed",
      "give as many of each"}},
    {61,
     {"the device is locked",
      "files of the class may not be changed while it is, and the request was not to wait, or too many wait already",
      "what was changed already stays so; the record still names the old class",
      "unlock it, or let the change wait for the unlock"}},
    {62,
     {"ownership could not be changed",
      "the file system is full, damaged or read-only, while an older system's containers were brought to their place",
      "the container is in its place with its old owner", seeLog}},
};

/// The daemon's codes for what is not there: a container, an info key.
constexpr std::uint64_t codesNotFound[] = {21, 24};

} // namespace

bool isNotFound(const Error& error) {
    return error.kind == Error::Kind::daemon && std::ranges::find(codesNotFound, error.code) != std::end(codesNotFound);
}

ErrorText errorText(std::uint64_t code) {
    for (const Row& row : rows)
        if (row.code == code)
            return row.text;
    // An errno that would read as a code of the daemon's own comes with an offset.
    constexpr std::uint64_t errnoOffset = 1000;
    const std::uint64_t number = code > errnoOffset ? code - errnoOffset : code;
    if (const char* const text = number > 0 && number < 200 ? ::strerrordesc_np(static_cast<int>(number)) : nullptr)
        return {text, "the system refused a step of the request for this reason",
                "what was done before that step stays done", seeLog};
    return {"the daemon met an error that this client does not know", "the daemon is newer than the client",
            "unknown to this client", seeLog};
}

std::vector<std::uint64_t> errorCodes() {
    std::vector<std::uint64_t> codes;
    for (const Row& row : rows)
        codes.push_back(row.code);
    return codes;
}

} // namespace zorvane
