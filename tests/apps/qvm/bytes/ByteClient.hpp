// A client that writes its bytes itself, to a real engine: as one that is written from the documents.
//
//     ByteClient client;
//     client.write(client.evaluation(1, "print(1)"));
//     const Received reply = client.awaitReply(1);
#pragma once

#include <cstdint>
#include <map>
#include <string>
#include <vector>

#include "apps/qvm/fixture/EngineFixture.hpp"
#include "krutil.protobuf.EvalIIP.pb.h"
#include "krutil.protobuf.FEvalIIP.pb.h"
#include "krutil.protobuf.IIPEnqueueMessage.pb.h"
#include "krutil.protobuf.RuntimeException.pb.h"
#include "platform/session/support/ByteEnd.hpp"

namespace qvm_test {

/// One frame as it came.
struct ReceivedFrame {
    unsigned kind = 0;
    std::string tag;
    std::string content;
};

/// One message as it came. Without frames: the stream has ended.
struct Received {
    std::uint32_t stream = 0;
    std::vector<ReceivedFrame> frames;

    /// Tag of the root; "abort" for an abort, empty at the end of the stream.
    std::string tag() const;

    /// The message of a frame of its own kind.
    template <class Proto>
    Proto as(std::size_t index) const {
        Proto proto;
        proto.ParseFromString(frames.at(index - 1).content);
        return proto;
    }
};

/// For the test's thread only.
class ByteClient {
  public:
    /// Starts an engine and shakes hands. The client states the capabilities that the engine has.
    ByteClient();

    void write(const std::string& bytes) { end_.write(bytes); }
    std::string readAll() { return end_.readAll(); }

    Received read();
    /// The reply of this exchange, or what ends the session before it. Replies of others are kept until they are asked
    /// for.
    Received awaitReply(std::uint32_t stream);
    /// Reads up to a message with this tag.
    Received awaitTag(const std::string& tag);
    /// Text that has come so far, of whatever kind.
    const std::string& text() const noexcept { return text_; }

    EngineProcess& engine() noexcept { return engine_; }

  private:
    EngineProcess engine_{{"--stdio"}};
    const int connection_ = engine_.connection();
    wire::ByteEnd end_;
    std::string text_;
    std::map<std::uint32_t, Received> replies_;
};

/// The core of a request, with nothing but what must be there.
krutil::protobuf::IIP requestCore();

/// The message that enqueues the request of frame `request`, with its number as the identifier.
krutil::protobuf::IIPEnqueueMessage enqueueing(std::uint64_t request, std::uint64_t id);

/// Frames of a request: those before it, which end with frame `index` - 1, then itself, then what enqueues it.
std::string requestBytes(std::uint32_t stream, const std::string& before, std::uint64_t index, const std::string& tag,
                         const std::string& content, const krutil::protobuf::IIPEnqueueMessage& enqueue);

std::string evaluation(std::uint32_t stream, const std::string& code,
                       const krutil::protobuf::IIPEnqueueMessage& enqueue);
std::string cancel(std::uint32_t stream, std::uint64_t id, bool evenIfRunning = true);

/// The error in the result of a reply; the empty record for none.
krutil::protobuf::RuntimeException errorOf(const Received& reply);

}  // namespace qvm_test
