// SPDX-License-Identifier: Apache-2.0
// The answer to commands that this version does not serve: an error, and a line in the log.
#include "daemon/commands/Commands.h"

namespace zor::commands {

void notServedYet(CommandContext& context) {
    context.log.write(logLevelError, __func__, "Command %llu is not served by this version",
                      static_cast<unsigned long long>(context.request.unsignedInteger(ipc::keys::command).value_or(0)));
    context.channel->send({{std::string(ipc::keys::replyError), static_cast<std::uint64_t>(ErrorCode::invalidObject)}});
}

} // namespace zor::commands
