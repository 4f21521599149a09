// SPDX-License-Identifier: Apache-2.0
#include "support/DiskCall.h"

#include <iterator>

namespace zor::support {

const char* nameOf(DiskCall call) {
    static constexpr const char* names[] = {"makeDirectory", "createFile",     "makeSymbolicLink", "makeHardLink",
                                            "makeFifo",      "rename",         "unlinkFile",       "removeDirectory",
                                            "changeMode",    "changeOwner",    "setTimes",         "setAttribute",
                                            "setInodeFlags", "write",          "cloneData",        "copyData",
                                            "sync",          "syncFileSystem", "orderData"};
    static_assert(std::size(names) == static_cast<std::size_t>(DiskCall::orderData) + 1);
    return names[static_cast<std::size_t>(call)];
}

std::string DiskCallInfo::describe() const {
    return subject.empty() ? nameOf(call) : std::string(nameOf(call)) + " " + subject;
}

} // namespace zor::support
