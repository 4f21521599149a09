// SPDX-License-Identifier: Apache-2.0
#include "service/ListenerStreams.h"

#include "ipc/Frame.h"

#include <algorithm>
#include <bit>
#include <cerrno>
#include <cstdint>
#include <cstring>
#include <sys/socket.h>
#include <sys/uio.h>
#include <utility>

namespace zor::platform {

namespace {

// Older headers do not have it; nor do kernels before 6.17, which then say nothing.
#ifdef SO_INQ
constexpr int tellWaiting = SO_INQ;
#else
constexpr int tellWaiting = 84;
#endif
/// The kernel's count of the bytes that wait behind those received is a number of four bytes, of which only the first
/// are taken: in the place of all four a descriptor of a peer's would fit.
constexpr std::size_t waitingBytesTaken = sizeof(std::uint32_t) - 1;

/// Room for the sender's credentials, the beginning of that count and nothing else: descriptors that a peer sends along
/// do not fit, and the kernel closes them without making them ours, in this thread (PassedAlong.h).
struct ControlBuffer {
    alignas(cmsghdr) char bytes[CMSG_SPACE(sizeof(ucred)) + CMSG_LEN(waitingBytesTaken)];
};

/// 0 when the kernel does not say, or cannot (another pid namespace).
pid_t senderOf(msghdr& message) {
    const cmsghdr* control = CMSG_FIRSTHDR(&message);
    if (!control || control->cmsg_level != SOL_SOCKET || control->cmsg_type != SCM_CREDENTIALS ||
        control->cmsg_len < CMSG_LEN(sizeof(ucred)))
        return 0;
    ucred credentials = {};
    std::memcpy(&credentials, CMSG_DATA(control), sizeof credentials);
    return credentials.pid;
}

/// Whether the kernel says, behind the credentials, that nothing waits. A queue of just so many bytes that only the
/// last one of the count tells them (16 MiB) is beyond what a socket may hold; who gets there has to send more to be
/// read on.
bool nothingWaits(const msghdr& message, const ControlBuffer& buffer) {
    constexpr std::size_t at = CMSG_SPACE(sizeof(ucred));
    cmsghdr control = {};
    if (std::endian::native != std::endian::little || message.msg_controllen < sizeof buffer.bytes)
        return false;
    std::memcpy(&control, buffer.bytes + at, sizeof control);
    const char* const count = buffer.bytes + at + CMSG_LEN(0);
    return control.cmsg_level == SOL_SOCKET && control.cmsg_type == tellWaiting &&
           std::all_of(count, count + waitingBytesTaken, [](char byte) { return byte == 0; });
}

} // namespace

void ListenerInput::open(ListenerCharges& charges, ListenerCharges::Account& account, int socket, pid_t peerPid) {
    // Without it a receive that finds nothing tells the same.
    const int on = 1;
    (void)::setsockopt(socket, SOL_SOCKET, tellWaiting, &on, sizeof on);
    charges_ = &charges;
    account_ = &account;
    peerPid_ = peerPid;
}

void ListenerInput::close() {
    inScratch_ = {};
    keptBegin_ = keptEnd_ = 0;
    [[maybe_unused]] const bool done = resizeKept(0);
    charges_ = nullptr;
    account_ = nullptr;
}

bool ListenerInput::resizeKept(std::size_t capacity) {
    if (capacity == keptCapacity_)
        return true;
    // Before the charge: where there is no memory nothing has been charged.
    std::unique_ptr<std::uint8_t[]> other;
    if (capacity > 0)
        other = std::make_unique_for_overwrite<std::uint8_t[]>(capacity);
    if (!charges_->changeInput(*account_, keptCapacity_, capacity))
        return false;
    if (capacity > 0)
        std::copy(kept_.get() + keptBegin_, kept_.get() + keptEnd_, other.get());
    keptEnd_ -= std::exchange(keptBegin_, 0);
    kept_ = std::move(other);
    keptCapacity_ = capacity;
    return true;
}

std::span<const std::uint8_t> ListenerInput::pending() const {
    if (keptEnd_ > keptBegin_)
        return {kept_.get() + keptBegin_, keptEnd_ - keptBegin_};
    return inScratch_;
}

void ListenerInput::consume(std::size_t count) {
    if (keptEnd_ == keptBegin_) {
        inScratch_ = inScratch_.subspan(count);
        return;
    }
    keptBegin_ += count;
    if (keptBegin_ < keptEnd_)
        return;
    keptBegin_ = keptEnd_ = 0;
    [[maybe_unused]] const bool done = resizeKept(0);
}

bool ListenerInput::keep() {
    if (inScratch_.empty())
        return true;
    // Between the two parts there is no gap: only a frame that is kept whole has scratch bytes behind it.
    const std::size_t before = keptEnd_ - keptBegin_;
    if (!resizeKept(before + inScratch_.size()))
        return false;
    std::memcpy(kept_.get() + keptEnd_, inScratch_.data(), inScratch_.size());
    keptEnd_ += inScratch_.size();
    inScratch_ = {};
    return true;
}

std::optional<ListenerInput::Room> ListenerInput::makeRoom(ListenerScratch& scratch) {
    const std::span<const std::uint8_t> partial = pending();
    if (partial.size() < listenerSmallInputBytes) {
        // A small beginning is put together in the scratch buffer, as if it had just arrived.
        if (!partial.empty())
            std::memmove(scratch.bytes.get(), partial.data(), partial.size());
        inScratch_ = {scratch.bytes.get(), partial.size()};
        keptBegin_ = keptEnd_ = 0;
        if (!resizeKept(0))
            return std::nullopt;
        return Room{.scratch = listenerScratchBytes - inScratch_.size()};
    }
    if (!keep())
        return std::nullopt;
    if (keptBegin_ > 0) {
        std::memmove(kept_.get(), kept_.get() + keptBegin_, keptEnd_ - keptBegin_);
        keptEnd_ -= std::exchange(keptBegin_, 0);
    }
    const ipc::FrameHeader header = ipc::decodeFrameHeader(
        std::span<const std::uint8_t, ipc::frameHeaderBytes>(kept_.get(), ipc::frameHeaderBytes));
    const std::size_t frameBytes = ipc::frameHeaderBytes + header.payloadBytes;
    // At most twice what has arrived, and never past the end of the frame.
    if (keptCapacity_ == keptEnd_ && !resizeKept(std::min(frameBytes, 2 * keptEnd_)))
        return std::nullopt;
    // Until the frame is whole nothing may lie behind it.
    return Room{.kept = std::min(frameBytes, keptCapacity_) - keptEnd_,
                .scratch = keptCapacity_ >= frameBytes ? listenerScratchBytes : 0};
}

ListenerInput::Received ListenerInput::receive(int socket, ListenerScratch& scratch) {
    const std::optional<Room> room = makeRoom(scratch);
    if (!room)
        return Received::tooMuch;
    iovec parts[2] = {{.iov_base = kept_.get() + keptEnd_, .iov_len = room->kept},
                      {.iov_base = scratch.bytes.get() + inScratch_.size(), .iov_len = room->scratch}};
    ControlBuffer control;
    msghdr message = {};
    message.msg_iov = room->kept > 0 ? &parts[0] : &parts[1];
    message.msg_iovlen = room->kept > 0 && room->scratch > 0 ? 2 : 1;
    message.msg_control = control.bytes;
    message.msg_controllen = sizeof control.bytes;
    ssize_t received = -1;
    scratch.receiving.begin();
    do {
        received = ::recvmsg(socket, &message, MSG_DONTWAIT | MSG_CMSG_CLOEXEC);
    } while (received < 0 && errno == EINTR);
    scratch.receiving.end();
    if (received < 0)
        return errno == EAGAIN || errno == EWOULDBLOCK ? Received::nothing : Received::ended;
    if (received == 0)
        return Received::ended;
    const pid_t sender = senderOf(message);
    if (sender != 0 && sender != peerPid_)
        return Received::foreign;
    const auto count = static_cast<std::size_t>(received);
    const std::size_t toKept = std::min(count, room->kept);
    keptEnd_ += toKept;
    inScratch_ = {scratch.bytes.get(), inScratch_.size() + count - toKept};
    return nothingWaits(message, control) ? Received::lastBytes : Received::bytes;
}

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
