#include "engine/EngineClient.hpp"

#include <boost/make_shared.hpp>
#include <boost/variant/get.hpp>
#include <cstdint>
#include <stdexcept>
#include <utility>

#include "cmddistributor/EvalIIP.hpp"
#include "cmddistributor/FEvalIIP.hpp"
#include "cmddistributor/FEvalResult.hpp"
#include "cmddistributor/IIPEnqueueMessage.hpp"
#include "cmddistributor/IIPResult.hpp"
#include "common/KrutilSession.hpp"
#include "krutil/cmddistributor/IIPReply.hpp"
#include "krutil/io/TextBase.hpp"
#include "msg_svc/protobuf/ustring.hpp"

namespace bench {
namespace {

namespace exchange = foundation::msg_svc::exchange;
using cmddistributor::IqmStreamID;
using msg_svc::protobuf::ustring_to_utf8;
using msg_svc::protobuf::utf8_to_ustring;

krutil_client::EngineProcess startEngine(std::vector<std::string> arguments) {
    arguments.insert(arguments.begin(), {KRUTIL_QVM, "--stdio"});
    return krutil_client::EngineProcess::start(arguments);
}

}  // namespace

EngineClient::EngineClient(krutil_client::EngineProcess engine, const session::Limits& limits, bool counting,
                           bool sharedMemory)
    : engine_(std::move(engine)) {
    session::SessionConfig config = apps::krutilSession(session::Role::Client);
    config.build = "benchmark";
    config.limits = limits;
    config.sharedMemory = sharedMemory;
    if (counting) {
        config.trace = [this](const session::FrameTrace& trace) {
            constexpr std::size_t header = 24;
            const auto* const tagged = dynamic_cast<const session::framing::TaggedFrame*>(&trace.frame);
            (trace.outgoing ? there_ : back_) +=
                header + (tagged != nullptr ? tagged->tag().size() : 0) + trace.frame.size();
        };
    }
    const int stream = engine_.takeStream();
    session_ = session::Session::open(stream, stream, std::move(config));
    session_->start(*this);
}

EngineClient::EngineClient(const std::vector<std::string>& arguments, const session::Limits& limits, bool counting,
                           bool sharedMemory)
    : EngineClient(startEngine(arguments), limits, counting, sharedMemory) {}

EngineClient::~EngineClient() {
    session_->sayGoodbye();
    std::unique_lock lock(mutex_);
    changed_.wait(lock, [this] { return over_; });
}

void EngineClient::send(const Request& request) {
    ++sent_;
    session_->send(session_->newStreamID(), boost::shared_ptr<const exchange::Message>(
                                                boost::make_shared<const cmddistributor::IIPEnqueueMessage>(
                                                    request, exchange::IDType(1, sent_), 0, boost::none, nullptr,
                                                    krutil::cmddistributor::WhenToDequeue::DEQUEUE_AT_IDLE, u"",
                                                    capabilities::CapabilityList(), nullptr, false)));
}

EngineClient::Request EngineClient::evaluation(const std::string& code) {
    return boost::make_shared<const cmddistributor::EvalIIP>(
        "python", IqmStreamID::ekIqmCmdWinStream, nullptr, krutil::io::SinkTraits(), krutil::io::SinkTraits(),
        utf8_to_ustring(code), cmddistributor::CodeType::CodeBlockType);
}

void EngineClient::awaitReplies() {
    std::unique_lock lock(mutex_);
    changed_.wait(lock, [this] { return over_ || answered_ == sent_; });
    if (answered_ != sent_) {
        throw std::runtime_error("the session with the engine is over");
    }
}

void EngineClient::awaitAll() {
    awaitReplies();
    if (!failure_.empty()) {
        throw std::runtime_error("a request failed with " + std::exchange(failure_, {}));
    }
}

void EngineClient::evaluate(const Request& request, const std::string& expected) {
    text_.clear();
    send(request);
    awaitAll();
    if (text_.size() != expected.size() || ustring_to_utf8(text_) != expected) {
        throw std::runtime_error("evaluation: expected \"" + expected + "\", got \"" + ustring_to_utf8(text_) + "\"");
    }
}

void EngineClient::fail(const std::string& code, const std::string& identifier) {
    send(code);
    awaitReplies();
    if (std::exchange(failure_, {}) != identifier) {
        throw std::runtime_error("evaluation: expected an error, " + identifier);
    }
}

void EngineClient::send(const std::string& function, Arrays arguments, unsigned long outputs) {
    using cmddistributor::FEvalIIP;
    send(boost::make_shared<const FEvalIIP>(
        "python", FEvalIIP::Function(function), outputs,
        FEvalIIP::Data::makeClientSideData(krutil::cmddistributor::EDIDataWrapper(std::move(arguments))),
        IqmStreamID::ekIqmCmdWinStream, krutil::io::SinkTraits(), krutil::io::SinkTraits(), 1, 2, true));
}

EngineClient::Arrays EngineClient::call(const std::string& function, Arrays arguments, unsigned long outputs) {
    send(function, std::move(arguments), outputs);
    awaitAll();
    const auto reply = std::exchange(lastReply_, nullptr);
    const auto* const result = dynamic_cast<const cmddistributor::FEvalResult*>(
        dynamic_cast<const krutil::cmddistributor::IIPReply&>(*reply).getResult().get());
    if (result == nullptr) {
        throw std::runtime_error("call of " + function + ": no outputs");
    }
    return boost::get<Arrays>(result->getResults());
}

Bytes EngineClient::takeBytes() {
    return {there_.exchange(0), back_.exchange(0)};
}

void EngineClient::onReply(session::framing::StreamID /*stream*/,
                           const boost::shared_ptr<const exchange::Reply>& reply) {
    const auto& result = dynamic_cast<const krutil::cmddistributor::IIPReply&>(*reply).getResult();
    if (result && result->getException()) {
        failure_ = result->getException()->GetID();
    }
    lastReply_ = reply;
    // Whoever waits, waits for all: of many replies that come together, the last one wakes it up.
    bool all = false;
    {
        const std::lock_guard lock(mutex_);
        all = ++answered_ == sent_;
    }
    if (all) {
        changed_.notify_one();
    }
}

void EngineClient::onEvent(session::framing::StreamID /*stream*/,
                           const boost::shared_ptr<const foundation::msg_svc::eventmgr::BaseEvent>& event) {
    if (const auto* text = dynamic_cast<const krutil::io::TextBase*>(event.get())) {
        text_ += text->getText();
    }
}

void EngineClient::onEnd(const session::SessionEnd& /*end*/) {
    {
        const std::lock_guard lock(mutex_);
        over_ = true;
    }
    changed_.notify_one();
}

}  // namespace bench
