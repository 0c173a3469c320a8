// A stream on which one end of a recorded session is played.
#pragma once

#include <chrono>
#include <functional>
#include <string>
#include <string_view>

#include "foundation/core/posix/OwnedDescriptor.hpp"
#include "krutil/base/Interrupt.hpp"
#include "krutil/replay/Talk.hpp"
#include "msg_svc.protobuf.SessionHandshake.pb.h"

namespace krutil_client {

/// Writes and reads at once, so that neither end waits for the other for ever. Nothing happens but in run(), and in
/// what calls it. Main thread only.
class SaidStream {
  public:
    using Clock = std::chrono::steady_clock;

    /// Owns both descriptors, which may be duplicates of each other. `peer` is how errors call the other end: "the
    /// engine". `hear` gets what it says after the handshake.
    SaidStream(foundation::core::posix::OwnedDescriptor in, foundation::core::posix::OwnedDescriptor out,
               std::string peer, Interrupt& interrupt, std::function<void(Said)> hear);

    /// Writes this behind what is not written yet, when run() is called.
    void write(std::string_view bytes) { out_ += bytes; }

    /// Reads the other end's first message. Throws Failure when there is none by the deadline, or another one than
    /// expected.
    void readHello(Clock::time_point deadline);

    /// Reads the other end's verdict. Behind it come frames.
    struct Verdict {
        std::string bytes;
        msg_svc::protobuf::SessionVerdict message{};
    };
    Verdict readVerdict(Clock::time_point deadline);

    /// Writes and reads until `done`, or until the deadline, or until the other end has closed its direction and all is
    /// written. Returns whether it is done. Throws Cancelled on Ctrl-C, and Failure for what is no frame and
    /// where nothing can be written to an end that is there.
    bool run(Clock::time_point deadline, const std::function<bool()>& done);

    /// Writes what is left, ends this direction, and waits until the other end has closed its own. What comes meanwhile
    /// is not heard. Returns whether it has closed by the deadline.
    bool finish(Clock::time_point deadline);

    /// Whether all is written, or cannot be any more.
    bool hasWritten() const noexcept { return out_.empty(); }

    /// Whether the other end has closed its direction.
    bool ended() const noexcept { return ended_; }

  private:
    std::size_t have() const noexcept { return in_.size() - taken_; }
    std::string_view received() const { return std::string_view(in_).substr(taken_); }
    void await(Clock::time_point deadline, std::size_t size, const char* what);
    std::string takeBody(Clock::time_point deadline, std::size_t head, const char* what);
    void takeFrames();
    void writeSome();
    void readSome();

    foundation::core::posix::OwnedDescriptor inDescriptor_;
    foundation::core::posix::OwnedDescriptor outDescriptor_;
    const std::string peer_;
    Interrupt& interrupt_;
    const std::function<void(Said)> hear_;
    std::string out_;
    std::size_t written_ = 0;  ///< of `out_`
    std::string in_;
    std::size_t taken_ = 0;  ///< of `in_`
    bool speaking_ = false;  ///< the handshake is over
    bool ended_ = false;
    Listener listener_;
};

/// A recorded first message without the features that `keeps` does not want. Throws Failure when it cannot be read.
std::string helloWith(const std::string& hello,
                      const std::function<bool(const msg_svc::protobuf::SessionFeature&)>& keeps);

/// Whether the feature is one of the session itself. A replayed session goes without: no descriptors are passed, and no
/// signs of life are sent.
bool isOfSession(const msg_svc::protobuf::SessionFeature& feature);

/// Text of a peer.
std::string escapedText(std::string_view text);

}  // namespace krutil_client
