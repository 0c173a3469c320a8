#include "krutil/commands/ReplayCommand.hpp"

#include <algorithm>
#include <chrono>
#include <string>
#include <vector>

#include "krutil/replay/Comparison.hpp"
#include "krutil/replay/Player.hpp"
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

}  // namespace

ExitCode replayRecording(const ConnectionOptions& connection, const ReplayOptions& options, Output& out,
                         Interrupt& interrupt) {
    bool same = true;
    for (const Talk& talk : readTalks(options.file)) {
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
