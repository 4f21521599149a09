// SPDX-License-Identifier: Apache-2.0
// One client with identifiers of its own.
#pragma once

#include "soak/Session.h"

namespace zor::soak {

/// Random requests until the session is stopped, and a look at everything. `user`: as whom it connects; root or a
/// mobile user.
void live(Session& session, unsigned number, std::uint32_t user, std::uint64_t seed);

} // namespace zor::soak
