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

} // namespace zorvanectl::content
