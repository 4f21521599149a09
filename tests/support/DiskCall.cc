// SPDX-License-Identifier: Apache-2.0
#include "support/DiskCall.h"

namespace zor::support {

const char* nameOf(DiskCall call) {
    switch (call) {
    case DiskCall::makeDirectory:
        return "makeDirectory";
    case DiskCall::createFile:
        return "createFile";
    case DiskCall::makeSymbolicLink:
        return "makeSymbolicLink";
    case DiskCall::makeHardLink:
        return "makeHardLink";
    case DiskCall::makeFifo:
        return "makeFifo";
    case DiskCall::rename:
        return "rename";
    case DiskCall::unlinkFile:
        return "unlinkFile";
    case DiskCall::removeDirectory:
        return "removeDirectory";
    case DiskCall::changeMode:
        return "changeMode";
    case DiskCall::changeOwner:
        return "changeOwner";
    case DiskCall::setTimes:
        return "setTimes";
    case DiskCall::setAttribute:
        return "setAttribute";
    case DiskCall::setInodeFlags:
        return "setInodeFlags";
    case DiskCall::write:
        return "write";
    case DiskCall::cloneData:
        return "cloneData";
    case DiskCall::copyData:
        return "copyData";
    case DiskCall::sync:
        return "sync";
    case DiskCall::syncFileSystem:
        return "syncFileSystem";
    case DiskCall::orderData:
        return "orderData";
    }
    return "?";
}

std::string DiskCallInfo::describe() const {
    return subject.empty() ? nameOf(call) : std::string(nameOf(call)) + " " + subject;
}

} // namespace zor::support
