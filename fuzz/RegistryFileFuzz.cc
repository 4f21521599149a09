// SPDX-License-Identifier: Apache-2.0
// Goal: no bytes of a registry file bring the reader down, and what it takes it understands. Method: parse; an entry
// that comes out has the form that matching relies on.
#include "identity/RegistryFiles.h"
#include "platform/Service.h"

#include <cstddef>
#include <cstdint>
#include <cstdlib>

namespace {

void require(bool condition) {
    if (!condition)
        std::abort();
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    const auto entry = zor::platform::parseIdentityFile({data, size});
    if (!entry) {
        require(!entry.error().empty());
        return 0;
    }
    require(entry->executable.starts_with('/') && entry->executable.find('\0') == std::string::npos);
    require(entry->grant != nullptr);
    require(!entry->unit || !entry->unit->empty());
    require(!entry->securityLabel || !entry->securityLabel->empty());
    const bool allowed =
        entry->grant->entitlements && entry->grant->entitlements->isTrue(zor::platform::entitlementKeys::allowed);
    if ((allowed || entry->grant->kernelAgent) && !entry->userIds)
        require(!entry->admitsUser(501));
    require(*entry == *entry);
    return 0;
}
