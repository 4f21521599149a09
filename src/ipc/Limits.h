// SPDX-License-Identifier: Apache-2.0
// The sizes that a frame may have. The daemon and its clients read the same numbers.
#pragma once

#include <cstddef>
#include <cstdint>

namespace zor::ipc {

/// Length, flags, id: see Frame.h.
inline constexpr std::size_t frameHeaderBytes = 16;
/// A request names one operation on one container; its largest part is an info value, and a metadata file takes 1 MiB
/// too.
inline constexpr std::uint32_t requestPayloadBytesMax = 1'048'576;
/// A reply is as long as its length field can say: a list of all containers of a class has no other bound.
inline constexpr std::uint32_t replyPayloadBytesMax = 0xFFFF'FFFF;

} // namespace zor::ipc
