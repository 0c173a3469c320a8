// What Ctrl-C does while requests are under way.
#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "cmddistributor/IIPCancelReply.hpp"
#include "foundation/msg_svc/exchange/IDType.hpp"
#include "krutil/base/Interrupt.hpp"
#include "krutil/session/Conversation.hpp"
#include "krutil/session/EngineProcess.hpp"

namespace krutil_client {

/// While an object lives, the first Ctrl-C asks the engine to cancel requests, even those that run, and a second one
/// within two seconds ends the engine: a child is killed, a connection is closed, which ends the process that serves
/// it. Objects nest, for requests within requests; the innermost counts. Main thread only.
class Canceller {
  public:
    /// Shows a sentence to the person.
    using Say = std::function<void(const std::string& sentence)>;

    /// How long after the first Ctrl-C another one is the second.
    static constexpr std::chrono::milliseconds again{2'000};

    /// How long an engine that was told to stop may take, to answer and then to stop, before the person is told that it
    /// has not.
    static constexpr std::chrono::milliseconds patience{1'500};

    /// The requests that a Ctrl-C is about, in the order in which they were sent; asked when it comes.
    using Requests = std::function<std::vector<foundation::msg_svc::exchange::IDType>()>;

    /// All must outlive the object.
    Canceller(Conversation& conversation, EngineProcess& engine, Interrupt& interrupt, Requests requests, Say say);
    ~Canceller();
    Canceller(const Canceller&) = delete;
    Canceller& operator=(const Canceller&) = delete;

    /// Delivers until `done` returns true, as Conversation::run() does, and tells the person when an engine that was
    /// told to stop takes its time, or says nothing at all: that, and how to end it. Throws what run() throws, and
    /// Failure when the second Ctrl-C has ended the engine.
    void run(const std::function<bool()>& done);

  private:
    void interrupted();
    void answered(cmddistributor::IIPCancelReply::CancelStatus status);

    Conversation& conversation_;
    EngineProcess& engine_;
    Interrupt& interrupt_;
    const Requests requests_;
    const Say say_;
    std::function<void()> actionBefore_;
    std::optional<Conversation::Clock::time_point> asked_;
    std::optional<Conversation::Clock::time_point> impatientAt_;
    std::size_t unanswered_ = 0;  ///< cancels
    std::uint64_t heard_ = 0;     ///< of the conversation, when the time began
    bool stopping_ = false;       ///< the engine has said so since the last Ctrl-C
    // Replies to cancels may come when the object has gone.
    std::shared_ptr<bool> alive_ = std::make_shared<bool>(true);
};

}  // namespace krutil_client
