// A small protocol for tests of the session layer: a question with bulk bytes, its answer, notices, an event that
// clients may send as well, and one that ends the session. None of its types is the product's.
#pragma once

#include <atomic>
#include <boost/shared_ptr.hpp>
#include <memory>
#include <string>
#include <vector>

#include "foundation/msg_svc/eventmgr/BaseEvent.hpp"
#include "foundation/msg_svc/exchange/Message.hpp"
#include "foundation/msg_svc/exchange/Reply.hpp"
#include "foundation/msg_svc/transport/layers/session/ProtocolRegistry.hpp"
#include "foundation/vantor/carrier/framing/Frame.hpp"

namespace testing_protocol {

namespace exchange = foundation::msg_svc::exchange;
namespace eventmgr = foundation::msg_svc::eventmgr;
namespace framing = foundation::vantor::carrier::framing;
namespace session = foundation::msg_svc::transport::layers::session;

/// Bytes that travel in a data frame without being copied. The transport holds a share while it needs them; `dropped`
/// becomes true when it is done.
struct Bulk {
    std::string bytes;
    bool shareable = true;
    std::atomic<bool> dropped{false};
};

/// Travels as one data frame for each bulk and a tagged frame with the text. "fail to write" and "fail to read" make
/// the serializer throw, after it has appended the data frames or taken them out; "make nothing" makes it return null.
class Question : public exchange::Message {
  public:
    explicit Question(std::string questionText, std::vector<std::shared_ptr<Bulk>> bulks = {})
        : text(std::move(questionText)), sent(std::move(bulks)) {}

    std::string text;
    std::vector<std::shared_ptr<Bulk>> sent;
    std::vector<std::unique_ptr<framing::Frame>> received;
};

class Answer : public exchange::Reply {
  public:
    explicit Answer(std::string answerText) : text(std::move(answerText)) {}
    std::string text;
};

class Notice : public eventmgr::BaseEvent {
  public:
    explicit Notice(std::string noticeText) : text(std::move(noticeText)) {}
    std::string text;
};

/// The last message of an engine.
class Shutdown : public eventmgr::BaseEvent {};

/// What clients may send as well.
class CapabilityNews : public eventmgr::BaseEvent {};

/// No serializer is registered for it.
class Stranger : public exchange::Message {};

/// Tags, in the order of registration. "test:part" and "test:array" are only ever referred to.
inline constexpr const char* questionTag = "test:question";
inline constexpr const char* answerTag = "test:answer";
inline constexpr const char* noticeTag = "test:notice";
inline constexpr const char* shutdownTag = "test:shutdown";
inline constexpr const char* capabilitiesTag = "test:capabilities";
inline constexpr const char* partTag = "test:part";
inline constexpr const char* arrayTag = "test:array";

/// Fills a registry with serializers for all of these, whatever the version.
session::ProtocolVersion initialize(
    const std::shared_ptr<foundation::msg_svc::transport::layers::serialization::Registry>& registry,
    const session::ProtocolVersion& version, const std::unordered_map<std::string, std::string>& features);

/// Registers a protocol in this process for the lifetime of the object.
class Registered {
  public:
    explicit Registered(const std::string& name, std::vector<session::FeatureRequest> features = {},
                        session::ProtocolInitializer initializer = initialize);
    ~Registered();
    Registered(const Registered&) = delete;
    Registered& operator=(const Registered&) = delete;

  private:
    std::string name_;
};

}  // namespace testing_protocol
