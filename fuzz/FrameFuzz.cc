// SPDX-License-Identifier: Apache-2.0
// Any bytes as the stream of a client, cut anywhere. The frames that the listener's input finds in them have to be
// those that a reader finds who has the whole stream before it: the same frames with the same bytes, or the same broken
// header at the same place.
//
// The first byte chooses how the stream is cut, how many frames a turn may take, and whether nothing is served in the
// turn in which it arrives (as when the peer leaves replies unread); the rest is the stream.
#include "ipc/Frame.h"
#include "service/ListenerStreams.h"

#include <algorithm>
#include <cstdlib>
#include <sys/socket.h>
#include <unistd.h>
#include <vector>

namespace {

using namespace zor;
using Bytes = std::span<const std::uint8_t>;

void mustHold(bool condition) {
    if (!condition)
        std::abort();
}

/// The end of the stream's next frame; 0 when it is not whole, or broken.
std::size_t wholeFrame(Bytes stream, bool& broken) {
    if (stream.size() < ipc::frameHeaderBytes)
        return 0;
    const ipc::FrameHeader header = ipc::decodeFrameHeader(stream.first<ipc::frameHeaderBytes>());
    std::array<std::uint8_t, ipc::frameHeaderBytes> again;
    ipc::encodeFrameHeader(header, again);
    mustHold(std::equal(again.begin(), again.end(), stream.begin()));
    broken = !header.isValidRequest();
    if (broken || stream.size() - ipc::frameHeaderBytes < header.payloadBytes)
        return 0;
    return ipc::frameHeaderBytes + header.payloadBytes;
}

class Listener {
public:
    Listener(Bytes stream, int socket, unsigned framesPerTurn, bool servesLater, std::size_t cut)
        : rest_(stream), framesPerTurn_(framesPerTurn), servesLater_(servesLater),
          scratchUsed_(std::min(platform::listenerSmallInputBytes + cut, platform::listenerScratchBytes)) {
        account_ = charges_.openConnection(1, false);
        input_.open(charges_, *account_, socket, ::getpid());
    }
    ~Listener() {
        input_.close();
        charges_.closeConnection(*account_);
    }

    /// Takes what the socket has, as a connection does. False when the stream is broken.
    bool take(int socket) {
        for (bool saidLast = false;;) {
            unsigned left = framesPerTurn_;
            if (!serveArrived(left))
                return false;
            if (left > 0) {
                const auto received = input_.receive(socket, scratch_);
                if (received == platform::ListenerInput::Received::nothing)
                    return input_.keep();
                mustHold(!saidLast);
                saidLast = received == platform::ListenerInput::Received::lastBytes;
                mustHold(saidLast || received == platform::ListenerInput::Received::bytes);
                if (!servesLater_ && !serveArrived(left))
                    return false;
            }
            mustHold(input_.keep());
            // Another connection has its turn and uses the scratch buffer.
            std::fill_n(scratch_.bytes.get(), scratchUsed_, std::uint8_t{0xEE});
        }
    }

    [[nodiscard]] Bytes rest() const { return rest_; }

private:
    bool serveArrived(unsigned& left) {
        while (left > 0) {
            const Bytes pending = input_.pending();
            bool broken = false;
            const std::size_t size = wholeFrame(pending, broken);
            bool brokenThere = false;
            const std::size_t expected = wholeFrame(rest_, brokenThere);
            if (broken) {
                mustHold(brokenThere);
                return false;
            }
            if (size == 0)
                return true;
            mustHold(size == expected);
            mustHold(std::equal(pending.begin(), pending.begin() + static_cast<std::ptrdiff_t>(size), rest_.begin()));
            input_.consume(size);
            rest_ = rest_.subspan(size);
            --left;
        }
        return true;
    }

    platform::ListenerCharges charges_{platform::ListenerLimits{}};
    platform::ListenerCharges::Account* account_ = nullptr;
    platform::ListenerInput input_;
    platform::ListenerScratch scratch_;
    Bytes rest_;
    const unsigned framesPerTurn_;
    const bool servesLater_;
    /// The bytes that one receive can have touched.
    const std::size_t scratchUsed_;
};

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* bytes, std::size_t size) {
    if (size == 0)
        return 0;
    const Bytes stream(bytes + 1, size - 1);
    const std::size_t cut = std::size_t{1} << (bytes[0] & 15U);
    const unsigned framesPerTurn = 1 + (bytes[0] >> 4U & 7U);
    const bool servesLater = bytes[0] >> 7U != 0;
    int pair[2];
    mustHold(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair) == 0);
    const platform::FileDescriptor sender(pair[0]);
    const platform::FileDescriptor receiver(pair[1]);
    const int on = 1;
    mustHold(::setsockopt(receiver.get(), SOL_SOCKET, SO_PASSCRED, &on, sizeof on) == 0);

    Listener listener(stream, receiver.get(), framesPerTurn, servesLater, cut);
    bool whole = true;
    for (std::size_t done = 0; done < stream.size() && whole;) {
        const ssize_t sent =
            ::send(sender.get(), stream.data() + done, std::min(cut, stream.size() - done), MSG_DONTWAIT);
        mustHold(sent > 0);
        done += static_cast<std::size_t>(sent);
        whole = listener.take(receiver.get());
    }
    // Nothing whole is left over, and nothing broken was passed by.
    bool broken = false;
    mustHold(wholeFrame(listener.rest(), broken) == 0);
    mustHold(broken == !whole);
    return 0;
}
