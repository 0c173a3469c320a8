// How far the end of a session has come.
//
// Two threads end a session, in either order: the one that runs code is done with its work, and the session's I/O
// thread finds that the stream is over. Each waits for the other for a while.
#pragma once

namespace qvm {

enum class SessionPhase {
    Serving,   ///< requests are taken and answered
    ShutDown,  ///< the shutdown event has been sent, and nothing may follow it
    Left,      ///< the thread that runs code has finished too
    Lost,      ///< the stream is over, and that thread is still at work
    Done,      ///< the stream is over, and that thread has finished
};

enum class SessionStep {
    ShutDown,  ///< the shutdown event is sent
    Leave,     ///< the thread that runs code finishes
    End,       ///< the stream is over
};

/// The phase that follows `phase` by `step`.
constexpr SessionPhase next(SessionPhase phase, SessionStep step) noexcept {
    const bool over = phase == SessionPhase::Lost || phase == SessionPhase::Done;
    const bool left = phase == SessionPhase::Left || phase == SessionPhase::Done;
    switch (step) {
        case SessionStep::ShutDown:
            return over || left ? phase : SessionPhase::ShutDown;
        case SessionStep::Leave:
            return over ? SessionPhase::Done : SessionPhase::Left;
        case SessionStep::End:
            return left ? SessionPhase::Done : SessionPhase::Lost;
    }
    return phase;
}

}  // namespace qvm
