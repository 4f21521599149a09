// SPDX-License-Identifier: Apache-2.0
// The replies of one connection that its peer has not taken yet. Nothing here blocks: what the socket does not take is
// kept and charged to the user, up to a limit. Guarded by the connection's mutex.
#pragma once

#include "plist/Value.h"
#include "service/ListenerLimits.h"

#include <atomic>
#include <cstddef>

namespace zor::platform {

class ListenerOutput {
public:
    ListenerOutput() = default;
    ListenerOutput(const ListenerOutput&) = delete;
    ListenerOutput& operator=(const ListenerOutput&) = delete;

    void open(ListenerCharges& charges, ListenerCharges::Account& account, std::size_t bytesMax);
    /// Drops what is kept and gives its charge back.
    void discard();
    /// The same, for good.
    void close();

    /// The bytes that are kept. This alone may be read without the mutex.
    [[nodiscard]] std::size_t pendingBytes() const { return pendingBytes_.load(std::memory_order_relaxed); }

    enum class Result { done, kept, broken, tooMuch };
    /// Sends a frame behind what is kept. `frame` may be left with anything in it. After broken and tooMuch what is
    /// kept is to be discarded. Throws std::bad_alloc, and has done nothing then.
    [[nodiscard]] Result write(int socket, plist::Data& frame);
    /// Sends once of what is kept.
    [[nodiscard]] Result flush(int socket);

private:
    [[nodiscard]] bool charge(std::size_t bytes);
    void append(const plist::Data& frame);

    ListenerCharges* charges_ = nullptr;
    ListenerCharges::Account* account_ = nullptr;
    std::size_t bytesMax_ = 0;
    plist::Data kept_;
    std::size_t begin_ = 0;
    std::atomic<std::size_t> pendingBytes_{0};
};

} // namespace zor::platform
