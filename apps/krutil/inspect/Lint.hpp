// Whether recorded sessions keep to the rules.
#pragma once

#include <array>
#include <cstddef>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "common/RecordingReader.hpp"
#include "foundation/msg_svc/transport/layers/session/SessionChecker.hpp"
#include "msg_svc.protobuf.SessionHandshake.pb.h"

namespace krutil_client {

/// Checks units in the order of their recording: the handshake here, all that follows with the session's own rules. A
/// session is checked up to its first fault. Not synchronised.
class Lint {
  public:
    /// Checks the next unit; `session` is what it belongs to. Returns the rule that it breaks, in a sentence. Throws
    /// Failure (Usage) for a unit of which bytes were not recorded.
    std::optional<std::string> take(const apps::RecordedUnit& unit, const apps::RecordedSession& session);

  private:
    // What one end has said of its handshake.
    struct End {
        std::optional<msg_svc::protobuf::SessionHello> hello;
        std::optional<msg_svc::protobuf::SessionVerdict> verdict;
        bool token = false;
        bool answer = false;
        bool descriptors = false;  // arrived, it says
    };
    struct Session {
        std::array<End, 2> ends;  // client, engine
        std::unique_ptr<foundation::msg_svc::transport::layers::session::SessionChecker> checker;
        bool broken = false;
    };

    void check(const apps::RecordedUnit& unit, const apps::RecordedSession& recorded, Session& session);
    static void takeHello(const apps::RecordedUnit& unit, End& end);
    static void takeVerdict(const apps::RecordedUnit& unit, Session& session, End& end);
    static void takeProbe(const apps::RecordedUnit& unit, Session& session, End& end);
    static void settle(const apps::RecordedSession& recorded, Session& session);

    std::vector<Session> sessions_;
};

}  // namespace krutil_client
