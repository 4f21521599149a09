// SPDX-License-Identifier: Apache-2.0
// A program that was started without standard input, output or error.
#pragma once

namespace zor::platform {

/// Opens /dev/null in the place of each missing one of the first three descriptors. To be called before anything else
/// is opened: what got one of their numbers would be read, and written to, in their place.
[[nodiscard]] bool fillStandardDescriptors();

} // namespace zor::platform
