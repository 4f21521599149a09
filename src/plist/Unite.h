// SPDX-License-Identifier: Apache-2.0
// Putting together what two dictionaries grant, so that nothing of either goes. Pure function.
#pragma once

#include "plist/Value.h"

namespace zor::plist {

/// Every key of both. Of a key in both: lists, and strings as lists of one, hold the elements of the first and then the
/// strings that only the second has; a boolean is true where either is; of anything else the first's value stays. The
/// list of the second takes the place of a value that is no list.
[[nodiscard]] Dictionary united(Dictionary first, const Dictionary& second);

} // namespace zor::plist
