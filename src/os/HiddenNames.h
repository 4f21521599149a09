// SPDX-License-Identifier: Apache-2.0
// Whether a directory shows what is in it. One that is encrypted by its file system, while its key is away, does not:
// it lists names that are none, and a name that is there is answered as missing. Any thread.
#pragma once

namespace zor::platform {

/// False also where that cannot be told. `directory` is open, O_PATH will do.
[[nodiscard]] bool hidesNames(int directory);

} // namespace zor::platform
