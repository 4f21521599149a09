// SPDX-License-Identifier: Apache-2.0
#include "base/ZORException.h"

#include "base/Mutex.h"

#include <cstdlib>
#include <execinfo.h>
#include <pthread.h>
#include <typeinfo>

namespace zor {

namespace {

constexpr int stackFramesMax = 64;

std::string joined(const std::vector<std::string>& lines, const char* separator) {
    std::string text;
    for (const std::string& line : lines) {
        if (!text.empty())
            text += separator;
        text += line;
    }
    return text;
}

std::vector<std::string> stackOf(const std::exception& exception) {
    if (const auto* own = dynamic_cast<const ZORException*>(&exception))
        return own->callStack();
    return callStackSymbols(); // of the boundary: where it was thrown is gone
}

} // namespace

std::vector<std::string> callStackSymbols() {
    void* frames[stackFramesMax];
    const int count = ::backtrace(frames, stackFramesMax);
    std::vector<std::string> symbols;
    if (char** texts = ::backtrace_symbols(frames, count)) {
        symbols.assign(texts, texts + count);
        std::free(texts);
    }
    return symbols;
}

ZORException::ZORException(std::string name, std::string reason)
    : name_(std::move(name)), reason_(std::move(reason)), description_(name_ + ": " + reason_),
      callStack_(callStackSymbols()) {}

ZORError ExceptionBoundary::caught(Here here, const std::exception& exception) {
    ZORError error = makeError(log_, here, ErrorCode::exceptionCaught, nullptr, LogFlag::yes, "Got exception: %s : %s",
                               exception.what(), joined(stackOf(exception), ", ").c_str());
    if (internalBuild_.isInternalBuild())
        reportFatal(exception);
    return error;
}

void ExceptionBoundary::reportFatal(const std::exception& exception) {
    std::string report = "** INTERNAL ERROR: Uncaught Exception **\nException: ";
    char threadName[16] = "";
    if (::pthread_getname_np(::pthread_self(), threadName, sizeof threadName) == 0 && threadName[0] != '\0')
        report += formatted("<%s> ", threadName);
    if (const auto* own = dynamic_cast<const ZORException*>(&exception))
        report += own->name() + ": " + own->reason();
    else
        report += formatted("%s: %s", typeid(exception).name(), exception.what());
    report += "\nStack:\n" + joined(stackOf(exception), "\n");

    // Never unlocked: the first report is the one that is kept, a second thread waits for the end.
    static platform::Mutex reporting;
    reporting.lock();
    crash_.record(report);
    std::abort();
}

} // namespace zor
