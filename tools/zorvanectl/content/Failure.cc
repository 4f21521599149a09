// SPDX-License-Identifier: Apache-2.0
#include "Failure.h"

namespace zorvanectl::content {

std::unexpected<Failure> failed(const std::string& what, zor::Errno error) {
    return failed(what + ": " + error.text());
}

std::unexpected<Failure> failed(std::string what) {
    return std::unexpected(Failure{.what = std::move(what)});
}

std::unexpected<Failure> refused(std::string what) {
    return std::unexpected(
        Failure{.what = std::move(what),
                .advice = "put the archive or directory together without that: as it is, it is refused every time"});
}

std::unexpected<Failure> lacksRoom(std::string what) {
    return std::unexpected(Failure{
        .what = std::move(what),
        .advice = "make room first: 'zorvanectl empty-death-row' deletes what waits for it, 'zorvanectl usage --all' "
                  "shows what takes how much"});
}

} // namespace zorvanectl::content
