// SPDX-License-Identifier: Apache-2.0
// The name of the hidden file in every container that says whom it belongs to. It has its home here because the file
// manager leaves such files alone when it changes the owner of a tree; what is inside is the store's business.
#pragma once

namespace zor::names {

inline constexpr const char* metadataFile = ".com.veltra.zorvane.metadata.plist";

} // namespace zor::names
