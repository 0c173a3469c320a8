#include "foundation/msg_svc/transport/layers/session/Exchanges.hpp"

#include <algorithm>
#include <array>

namespace foundation::msg_svc::transport::layers::session {
namespace {

// Which stream IDs something may have.
enum class Streams {
    Any,         // it belongs to no stream
    New,         // not 0, and not in use; in use from now on
    Open,        // in use; free from now on
    ZeroOrOpen,  // 0, or in use
    // The same to whoever receives it. The sender has 0 only: the reply may be on its way, and with it the end of the
    // exchange.
    ZeroOrOpenOnArrival,
};

// What may be said at all, and the phase that follows. An empty phase: it may not be said any more.
struct Rule {
    Role speaker;
    Saying saying;
    Streams streams;
    std::array<std::optional<Phase>, 4> next;  // by phase
};

using enum Phase;
constexpr std::nullopt_t no = std::nullopt;

// clang-format off
constexpr std::array<Rule, 7> rules{{
    // speaker     saying               stream ID                      Talking     ClientDone  EngineDone  BothDone
    {Role::Client, Saying::Message,     Streams::New,                 {Talking,    no,         EngineDone, no}},
    {Role::Client, Saying::SharedEvent, Streams::ZeroOrOpenOnArrival, {Talking,    no,         EngineDone, no}},
    {Role::Client, Saying::Goodbye,     Streams::Any,                 {ClientDone, no,         BothDone,   no}},
    {Role::Engine, Saying::Reply,       Streams::Open,                {Talking,    ClientDone, no,         no}},
    {Role::Engine, Saying::Event,       Streams::ZeroOrOpen,          {Talking,    ClientDone, no,         no}},
    {Role::Engine, Saying::SharedEvent, Streams::ZeroOrOpen,          {Talking,    ClientDone, no,         no}},
    {Role::Engine, Saying::Shutdown,    Streams::ZeroOrOpen,          {EngineDone, BothDone,   no,         no}},
}};
// clang-format on

Refusal afterLastWordOf(Role speaker) {
    return speaker == Role::Client ? Refusal::AfterGoodbye : Refusal::AfterShutdown;
}

}  // namespace

Saying sayingOfEvent(std::type_index event, const SessionConfig& config) {
    if (event == config.shutdownEvent) {
        return Saying::Shutdown;
    }
    const bool shared =
        std::find(config.clientEvents.begin(), config.clientEvents.end(), event) != config.clientEvents.end();
    return shared ? Saying::SharedEvent : Saying::Event;
}

bool Exchanges::isDone(Role role) const noexcept {
    return std::none_of(rules.begin(), rules.end(), [this, role](const Rule& rule) {
        return rule.speaker == role && rule.next[static_cast<std::size_t>(phase_)].has_value();
    });
}

std::optional<Refusal> Exchanges::sayAnything(Role speaker) const noexcept {
    return isDone(speaker) ? std::optional(afterLastWordOf(speaker)) : std::nullopt;
}

framing::StreamID Exchanges::newStreamID() noexcept {
    do {
        ++lastStream_;
    } while (lastStream_ == 0 || open_.contains(lastStream_));
    return lastStream_;
}

std::optional<Refusal> Exchanges::say(Role speaker, Saying saying, framing::StreamID stream) {
    const auto* const rule = std::find_if(rules.begin(), rules.end(), [speaker, saying](const Rule& candidate) {
        return candidate.speaker == speaker && candidate.saying == saying;
    });
    if (rule == rules.end()) {
        return Refusal::WrongSpeaker;
    }
    const std::optional<Phase> next = rule->next[static_cast<std::size_t>(phase_)];
    if (!next) {
        return afterLastWordOf(speaker);
    }
    switch (rule->streams) {
        case Streams::Any:
            break;
        case Streams::New:
            if (stream == 0 || !open_.insert(stream).second) {
                return Refusal::StreamNotNew;
            }
            break;
        case Streams::Open:
            if (open_.erase(stream) == 0) {
                return Refusal::StreamNotOpen;
            }
            break;
        case Streams::ZeroOrOpenOnArrival:
            if (speaker == own_ && stream != 0) {
                return Refusal::StreamNotZero;
            }
            [[fallthrough]];
        case Streams::ZeroOrOpen:
            if (stream != 0 && !open_.contains(stream)) {
                return Refusal::StreamNotZeroOrOpen;
            }
            break;
    }
    phase_ = *next;
    return std::nullopt;
}

}  // namespace foundation::msg_svc::transport::layers::session
