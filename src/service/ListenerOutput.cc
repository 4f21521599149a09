// SPDX-License-Identifier: Apache-2.0
#include "service/ListenerOutput.h"

#include <cerrno>
#include <sys/socket.h>
#include <utility>

namespace zor::platform {

namespace {

/// Bytes sent, 0 when the socket takes nothing now, -1 when it is broken.
ssize_t sendSome(int socket, const std::uint8_t* bytes, std::size_t count) {
    for (;;) {
        const ssize_t sent = ::send(socket, bytes, count, MSG_DONTWAIT | MSG_NOSIGNAL);
        if (sent >= 0)
            return sent;
        if (errno == EAGAIN || errno == EWOULDBLOCK)
            return 0;
        if (errno != EINTR)
            return -1;
    }
}

} // namespace

void ListenerOutput::open(ListenerCharges& charges, ListenerCharges::Account& account, std::size_t bytesMax) {
    charges_ = &charges;
    account_ = &account;
    bytesMax_ = bytesMax;
}

void ListenerOutput::discard() {
    [[maybe_unused]] const bool lessIsNeverTooMuch = charge(0);
    plist::Data().swap(kept_);
    begin_ = 0;
}

void ListenerOutput::close() {
    discard();
    charges_ = nullptr;
    account_ = nullptr;
}

bool ListenerOutput::charge(std::size_t bytes) {
    const std::size_t before = pendingBytes();
    if (bytes == before)
        return true;
    if (bytes > bytesMax_ || !charges_->changeOutput(*account_, before, bytes))
        return false;
    pendingBytes_.store(bytes, std::memory_order_relaxed);
    return true;
}

ListenerOutput::Result ListenerOutput::write(int socket, plist::Data& frame) {
    std::size_t sent = 0;
    if (pendingBytes() == 0) {
        const ssize_t result = sendSome(socket, frame.data(), frame.size());
        if (result < 0)
            return Result::broken;
        sent = static_cast<std::size_t>(result);
        if (sent == frame.size())
            return Result::done;
    }
    const std::size_t unsent = frame.size() - sent;
    if (kept_.empty()) {
        kept_.swap(frame);
        begin_ = sent;
    } else {
        append(frame);
    }
    // Afterwards: where there is no memory nothing has been charged.
    return charge(pendingBytes() + unsent) ? Result::kept : Result::tooMuch;
}

void ListenerOutput::append(const plist::Data& frame) {
    // The part that was sent goes when it is the larger one, so each byte is moved about once.
    if (begin_ > kept_.size() / 2) {
        kept_.erase(kept_.begin(), kept_.begin() + static_cast<std::ptrdiff_t>(begin_));
        begin_ = 0;
    }
    kept_.insert(kept_.end(), frame.begin(), frame.end());
}

ListenerOutput::Result ListenerOutput::flush(int socket) {
    if (pendingBytes() == 0)
        return Result::done;
    const ssize_t sent = sendSome(socket, kept_.data() + begin_, kept_.size() - begin_);
    if (sent < 0)
        return Result::broken;
    begin_ += static_cast<std::size_t>(sent);
    [[maybe_unused]] const bool lessIsNeverTooMuch = charge(pendingBytes() - static_cast<std::size_t>(sent));
    if (begin_ < kept_.size())
        return Result::kept;
    plist::Data().swap(kept_);
    begin_ = 0;
    return Result::done;
}

} // namespace zor::platform
