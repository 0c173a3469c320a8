// An end of a session that a test plays by hand, byte by byte.
#pragma once

#include <chrono>
#include <string>
#include <vector>

#include "foundation/core/posix/OwnedDescriptor.hpp"
#include "msg_svc.protobuf.SessionHandshake.pb.h"

namespace wire {

/// Owns descriptors and reads and writes them with a generous time limit; what does not come within it fails the test.
class ByteEnd {
  public:
    /// Takes over both descriptors, which may be equal.
    ByteEnd(int in, int out);
    ~ByteEnd();
    ByteEnd(const ByteEnd&) = delete;
    ByteEnd& operator=(const ByteEnd&) = delete;

    void write(const std::string& bytes);
    /// Writes what the stream takes within a short while; returns how much that is. Only for sockets.
    std::size_t writeSome(const std::string& bytes);
    /// Writes bytes, with the descriptors beside the first of them; only for sockets.
    void writeWith(const std::string& bytes, const std::vector<int>& descriptors);
    std::string read(std::size_t count);
    /// Reads bytes, and appends the descriptors that come beside them; only for sockets.
    std::string readWith(std::size_t count, std::vector<foundation::core::posix::OwnedDescriptor>& descriptors);
    /// All that comes until the stream ends.
    std::string readAll();
    void close();
    /// Ends the direction from this end to the other; only for sockets.
    void closeWriting();

    /// The other end's first message.
    msg_svc::protobuf::SessionHello readHello();
    msg_svc::protobuf::SessionVerdict readVerdict();

    /// Performs the handshake as the counterpart of the other end, whatever that is, accepting everything but signs of
    /// life and shared memory. With `sharedMemory` it accepts that, too, and the probe follows.
    void shakeHands(bool sharedMemory = false);

  private:
    int in_;
    int out_;
};

std::string helloBytes(const std::string& body, std::uint32_t layout = 1);
std::string helloBytes(const msg_svc::protobuf::SessionHello& hello, std::uint32_t layout = 1);
std::string verdictBytes(const msg_svc::protobuf::SessionVerdict& verdict);

/// A hello that fits the test protocol.
msg_svc::protobuf::SessionHello hello(msg_svc::protobuf::SessionHello::Role role);

/// A verdict that accepts, without features.
msg_svc::protobuf::SessionVerdict acceptance();

}  // namespace wire
