// SPDX-License-Identifier: Apache-2.0
#include "Failure.h"

#include <system_error>

namespace zorvanectl::content {

std::unexpected<Failure> failed(const std::string& what, int number) {
    return failed(what + ": " + std::generic_category().message(number));
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
