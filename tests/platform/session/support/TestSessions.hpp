// Sessions in one process, and a handler that remembers what it was told.
#pragma once

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <condition_variable>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "foundation/msg_svc/transport/layers/session/Session.hpp"
#include "platform/session/support/ByteEnd.hpp"
#include "platform/session/support/TestProtocol.hpp"

namespace testing_sessions {

using namespace testing_protocol;
using session::Role;
using session::Session;
using session::SessionConfig;
using session::SessionEnd;
using Reason = session::SessionEnd::Reason;
using Questions = boost::shared_ptr<const exchange::Message>;

/// Keeps one line for each call, in order. Tests wait for lines; nothing is timed.
class Recorder : public session::SessionHandler {
  public:
    void onMessage(framing::StreamID stream, const boost::shared_ptr<const exchange::Message>& message) override;
    void onReply(framing::StreamID stream, const boost::shared_ptr<const exchange::Reply>& reply) override;
    void onEvent(framing::StreamID stream, const boost::shared_ptr<const eventmgr::BaseEvent>& event) override;
    void onGoodbye() override;
    void onEnd(const SessionEnd& end) override;

    /// Has `answer` called for each question from now on, after its line was kept.
    void answerWith(std::function<void(framing::StreamID, const Question&)> answer);

    /// All lines so far.
    std::vector<std::string> lines() const;
    /// Returns once there are `count` lines, or fails the test after half a minute.
    std::vector<std::string> waitForLines(std::size_t count);
    /// The end of the session; waits for it.
    SessionEnd waitForEnd();
    /// The latest question; keeps its data frames alive.
    boost::shared_ptr<const Question> lastQuestion() const;

  protected:
    void keep(const std::string& line);

  private:
    mutable std::mutex mutex_;
    std::condition_variable changed_;
    std::vector<std::string> lines_;
    std::optional<SessionEnd> end_;
    boost::shared_ptr<const Question> lastQuestion_;
    std::function<void(framing::StreamID, const Question&)> answer_;
};

/// Two connected descriptors each for two ends: {in, out} of the one, {in, out} of the other.
struct Ends {
    int in;
    int out;
    int otherIn;
    int otherOut;
};
Ends socketPair();
Ends pipes();

SessionConfig configOf(Role role);

/// Matches the end of a session for this reason, with this text.
inline auto isEnd(Reason reason, const std::string& text) {
    return testing::AllOf(testing::Field("reason", &SessionEnd::reason, reason),
                          testing::Field("text", &SessionEnd::text, text));
}

boost::shared_ptr<const exchange::Message> question(const std::string& text,
                                                    std::vector<std::shared_ptr<Bulk>> bulks = {});
/// Bulk bytes of this number.
std::shared_ptr<Bulk> bulkOf(std::size_t size);
boost::shared_ptr<const exchange::Reply> answer(const std::string& text);
boost::shared_ptr<const eventmgr::BaseEvent> notice(const std::string& text);
boost::shared_ptr<const eventmgr::BaseEvent> shutdownEvent();
boost::shared_ptr<const eventmgr::BaseEvent> capabilityChange();

/// The text of the exception that `call` throws as an `Error`; fails the test if it throws none.
template <class Error, class Call>
std::string textOf(Call call) {
    try {
        call();
    } catch (const Error& error) {
        return error.what();
    } catch (const std::exception& error) {
        ADD_FAILURE() << "another exception: " << error.what();
        return {};
    }
    ADD_FAILURE() << "no exception";
    return {};
}

/// A client and an engine that have settled and not started.
struct OpenedPair {
    std::unique_ptr<Session> client;
    std::unique_ptr<Session> engine;
};
OpenedPair openPair(const SessionConfig& clientConfig, const SessionConfig& engineConfig, Ends ends = socketPair());

/// A client and an engine that have settled and started.
class SessionPair {
  public:
    explicit SessionPair(SessionConfig clientConfig = configOf(Role::Client),
                         SessionConfig engineConfig = configOf(Role::Engine), Ends ends = socketPair());

    Recorder clientSaw;
    Recorder engineSaw;
    std::unique_ptr<Session> client;
    std::unique_ptr<Session> engine;
};

/// One real end that has settled and not started; `peer`, the other one, has shaken hands with it.
std::unique_ptr<Session> openWith(wire::ByteEnd& peer, const Ends& ends, const SessionConfig& config);

/// One real end, and the other played by the test; the handshake is done and the real end started.
class SessionWithBytes {
  public:
    explicit SessionWithBytes(SessionConfig config, Ends ends = socketPair());

    Recorder saw;
    std::unique_ptr<wire::ByteEnd> peer;
    std::unique_ptr<Session> session;
};

}  // namespace testing_sessions
