#include "krutil/inspect/Lint.hpp"

#include <algorithm>
#include <map>
#include <stdexcept>
#include <string_view>

#include "common/FrameBytes.hpp"
#include "common/KrutilSession.hpp"
#include "common/Precheck.hpp"
#include "krutil/base/ExitCode.hpp"
#include "krutil/base/Text.hpp"

namespace krutil_client {
namespace {

namespace rules = foundation::msg_svc::transport::layers::session;
using UnitKind = apps::RecordedUnit::Kind;

constexpr std::string_view helloMagic = "\x89KRUTIL\n";
constexpr std::uint32_t longestBody = 65'536;
constexpr std::uint32_t layoutVersion = 1;

[[noreturn]] void broken(const std::string& what, const std::string& expected, const std::string& got) {
    throw std::runtime_error(what + ": expected " + expected + ", got " + got);
}

// The message of a part of the handshake, behind a head that ends with its length.
template <class Body>
Body bodyOf(std::string_view unit, std::size_t head, const std::string& what) {
    if (unit.size() < head) {
        broken("size of a " + what, "at least " + std::to_string(head) + " bytes", std::to_string(unit.size()));
    }
    const std::uint64_t length = apps::littleEndian(unit.substr(head - 4, 4));
    unit.remove_prefix(head);
    if (length > longestBody || length != unit.size()) {
        broken("length in a " + what, "the " + std::to_string(unit.size()) + " bytes behind it, at most 65536",
               std::to_string(length));
    }
    Body body;
    if (!body.ParseFromArray(unit.data(), static_cast<int>(unit.size()))) {
        throw std::runtime_error("body of a " + what + ": its " + std::to_string(length) +
                                 " bytes are not a message of its type");
    }
    return body;
}

std::map<std::string, std::string> featuresOf(const msg_svc::protobuf::SessionVerdict& verdict) {
    std::map<std::string, std::string> features;
    for (const auto& feature : verdict.features()) {
        features.emplace(feature.name(), feature.value());
    }
    return features;
}

}  // namespace

void Lint::takeHello(const apps::RecordedUnit& unit, End& end) {
    const std::string_view bytes = unit.bytes;
    if (!bytes.starts_with(helloMagic)) {
        broken("first message", "one that begins with \"\\x89KRUTIL\\n\"", quotedText(bytes, 32));
    }
    if (end.hello) {
        broken("first message", "one in each direction", "another one");
    }
    auto hello = bodyOf<msg_svc::protobuf::SessionHello>(bytes, 16, "first message");
    if (const std::uint64_t layout = apps::littleEndian(bytes.substr(helloMagic.size(), 4)); layout != layoutVersion) {
        broken("layout version of a first message", std::to_string(layoutVersion), std::to_string(layout));
    }
    if (!hello.has_limits()) {
        broken("limits in a first message", "those of the sender", "none");
    }
    const bool client = unit.sender == apps::RecordedUnit::Role::Client;
    if (const int role = hello.role(); role != (client ? 0 : 1)) {
        broken("role in a first message", client ? "0 (client)" : "1 (engine)", std::to_string(role));
    }
    end.hello = std::move(hello);
}

void Lint::takeVerdict(const apps::RecordedUnit& unit, Session& session, End& end) {
    if (!session.ends[0].hello || !session.ends[1].hello) {
        broken("verdict", "the first messages of both ends before it", "fewer");
    }
    end.verdict = bodyOf<msg_svc::protobuf::SessionVerdict>(unit.bytes, 4, "verdict");
}

void Lint::takeProbe(const apps::RecordedUnit& unit, Session& session, End& end) {
    for (const End& each : session.ends) {
        if (!each.verdict || !each.verdict->accepted() || !featuresOf(*each.verdict).contains("SHM")) {
            broken("probe of shared memory", "two verdicts before it that accept and list \"SHM\"", "others");
        }
    }
    if (unit.kind == UnitKind::Token) {
        end.token = true;
        return;
    }
    if (!end.token) {
        broken("answer to the probe of shared memory", "a token of its sender before it", "none");
    }
    const int answer = static_cast<unsigned char>(unit.bytes.at(0));
    if (answer > 1) {
        broken("answer to the probe of shared memory", "0 or 1", std::to_string(answer));
    }
    end.answer = true;
    end.descriptors = answer == 1;
}

// Before the first frame.
void Lint::settle(const apps::RecordedSession& recorded, Session& session) {
    const auto& [client, engine] = session.ends;
    if (!client.verdict || !engine.verdict) {
        broken("frame", "the verdicts of both ends before it", "fewer");
    }
    if (!client.verdict->accepted() || !engine.verdict->accepted()) {
        broken("frame", "two verdicts before it that accept", "one that refuses");
    }
    if (featuresOf(*client.verdict) != featuresOf(*engine.verdict)) {
        broken("features of the verdicts", "the same from both ends", "others");
    }
    const bool probed = featuresOf(*client.verdict).contains("SHM");
    if (probed && (!client.answer || !engine.answer)) {
        broken("frame", "the answers of both ends to the probe of shared memory before it", "fewer");
    }
    rules::SessionConfig config = apps::krutilSession(recorded.recorder);
    // Numbers that would end this program are a fault that it finds.
    config.check = apps::precheck(true);
    const auto features = featuresOf(*client.verdict);
    session.checker = std::make_unique<rules::SessionChecker>(
        config, rules::SessionChecker::Settled{rules::limitsFrom(client.hello->limits()),
                                               rules::limitsFrom(engine.hello->limits()),
                                               {features.begin(), features.end()},
                                               probed && client.descriptors && engine.descriptors,
                                               features.contains("KEEPALIVE")});
}

void Lint::check(const apps::RecordedUnit& unit, const apps::RecordedSession& recorded, Session& session) {
    End& end = session.ends[unit.sender == apps::RecordedUnit::Role::Client ? 0 : 1];
    switch (unit.kind) {
        case UnitKind::FirstMessage:
            takeHello(unit, end);
            return;
        case UnitKind::Verdict:
            takeVerdict(unit, session, end);
            return;
        case UnitKind::Token:
        case UnitKind::Answer:
            takeProbe(unit, session, end);
            return;
        case UnitKind::Frame:
            break;
    }
    if (!session.checker) {
        settle(recorded, session);
    }
    session.checker->take(unit.sender, unit.bytes);
}

std::optional<std::string> Lint::take(const apps::RecordedUnit& unit, const apps::RecordedSession& session) {
    if (session.repeated) {
        throw Failure(ExitCode::Usage,
                      "--lint needs a session from its beginning, which is in an earlier file than the unit at byte " +
                          std::to_string(unit.offset) + "; record without --record-size");
    }
    if (unit.missing > 0) {
        throw Failure(ExitCode::Usage, "--lint needs all bytes, but the recording has only the first " +
                                           std::to_string(unit.bytes.size()) + " of the " + std::to_string(unit.size) +
                                           " of the frame at byte " + std::to_string(unit.offset) +
                                           "; record without --record-snap");
    }
    sessions_.resize(std::max(sessions_.size(), unit.session + 1));
    Session& state = sessions_[unit.session];
    if (state.broken) {
        return std::nullopt;
    }
    try {
        check(unit, session, state);
    } catch (const std::exception& fault) {
        state.broken = true;
        return fault.what();
    }
    return std::nullopt;
}

}  // namespace krutil_client
