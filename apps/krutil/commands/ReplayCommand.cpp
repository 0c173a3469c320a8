#include "krutil/commands/ReplayCommand.hpp"

#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <string>
#include <vector>

#include "krutil/replay/Comparison.hpp"
#include "krutil/replay/Player.hpp"
#include "krutil/replay/Server.hpp"
#include "krutil/replay/Talk.hpp"
#include "krutil/session/Client.hpp"

namespace krutil_client {
namespace {

// How long an engine may take to end after its stream did.
constexpr std::chrono::seconds patienceForChild{2};

// Returns whether all is as in the recording.
bool show(const std::vector<Compared>& all, Output& out) {
    std::string text;
    std::size_t same = 0;
    for (const Compared& compared : all) {
        same += compared.differences.empty() ? 1U : 0U;
        text += compared.differences.empty() ? "" : compared.what + "\n";
        for (const std::string& difference : compared.differences) {
            text += "  " + difference + "\n";
        }
    }
    // The last one is no request.
    const std::size_t requests = all.size() - 1;
    const std::size_t answered = same - (all.back().differences.empty() ? 1U : 0U);
    out.write(text + std::to_string(answered) + " of " + std::to_string(requests) +
              (requests == 1 ? " request" : " requests") + " answered as in the recording\n");
    return same == all.size();
}

// The session that can be said to a client.
Talk onlyTalk(const std::string& file, Interrupt& interrupt) {
    std::vector<Talk> talks = readTalks(file, interrupt);
    const auto refuse = [&file](const std::string& reason) {
        throw Failure(ExitCode::Usage, "cannot replay '" + file + "' to a client: " + reason);
    };
    if (talks.size() != 1) {
        refuse("expected one session, got " + std::to_string(talks.size()));
    }
    if (!talks.front().wholeFromBeginning) {
        refuse("expected a session from its beginning, got the later part of one; record with a larger --record-size");
    }
    if (!talks.front().verdict.accepted()) {
        refuse("expected a session that both ends have accepted, got one without");
    }
    return std::move(talks.front());
}

}  // namespace

ExitCode serveRecording(const ConnectionOptions& connection, const ReplayOptions& options, Output& err,
                        Interrupt& interrupt) {
    if (options.file == "-" || ::isatty(STDIN_FILENO) == 1 || ::isatty(STDOUT_FILENO) == 1) {
        throw Failure(ExitCode::Usage,
                      "with --serve, standard input and output carry the session with a client: expected a file with a "
                      "name, in a command that a client starts as its engine");
    }
    const Talk talk = onlyTalk(options.file, interrupt);
    const Served served = serve(posix::OwnedDescriptor(STDIN_FILENO), posix::OwnedDescriptor(STDOUT_FILENO), talk,
                                connection.handshakeTimeout, options.patience, interrupt,
                                [&err](const std::string& sentence) { err.write(sentence + "\n"); });
    return served.gone ? ExitCode::Stream : served.differs ? ExitCode::CodeError : ExitCode::Ok;
}

ExitCode replayRecording(const ConnectionOptions& connection, const ReplayOptions& options, Output& out,
                         Interrupt& interrupt) {
    bool same = true;
    for (const Talk& talk : readTalks(options.file, interrupt)) {
        EngineProcess engine = findEngine(connection);
        const Played played = play(engine.takeStream(), talk, connection.handshakeTimeout, options.patience, interrupt,
                                   [&engine] { engine.takeTerminalBack(); });
        same = show(compare(talk, played.engine), out) && same;
        if (!played.end.empty() && endsInGoodOrder(talk)) {
            throw Failure(ExitCode::Stream, played.end);
        }
        engine.waitForEnd(patienceForChild);
    }
    return same ? ExitCode::Ok : ExitCode::CodeError;
}

}  // namespace krutil_client
