#include "foundation/msg_svc/transport/layers/session/Handshake.hpp"

#include <sys/socket.h>

#include <algorithm>
#include <array>
#include <map>
#include <set>
#include <stdexcept>
#include <string_view>
#include <vector>

#include "foundation/korveldata/Array.hpp"
#include "foundation/msg_svc/transport/layers/session/HandshakeStream.hpp"
#include "foundation/msg_svc/transport/layers/session/LittleEndian.hpp"
#include "foundation/msg_svc/transport/layers/session/PrintableText.hpp"
#include "foundation/msg_svc/transport/layers/session/SessionError.hpp"
#include "foundation/msg_svc/transport/layers/session/lending/DescriptorPassing.hpp"
#include "foundation/msg_svc/transport/layers/session/lending/Probe.hpp"
#include "msg_svc.protobuf.SessionHandshake.pb.h"

namespace foundation::msg_svc::transport::layers::session {
namespace {

using ::msg_svc::protobuf::SessionFeature;
using ::msg_svc::protobuf::SessionHello;
using ::msg_svc::protobuf::SessionVerdict;

// Everything from here to the end of the verdict stays as it is whatever the layout version: it is how two versions
// tell each other that they differ.
constexpr std::string_view magic("\x89KRUTIL\n", 8);
constexpr std::uint32_t layoutVersion = 1;
constexpr std::size_t longestBody = 65'536;

// The session's own features, beside those of the protocol. The first is settled only where descriptors can be passed
// at all, the second where the client asks for it.
constexpr const char* sharedMemory = "SHM";
constexpr const char* asDescriptors = "descriptors";
constexpr const char* keepAlive = "KEEPALIVE";
constexpr const char* asFrames = "frames";

// Texts for a person, so that none of them makes a hello or a verdict too long.
constexpr std::size_t longestBuild = 1024;
constexpr std::size_t longestRefusal = 16'384;

// How long an end that refuses waits to hear the same from its peer.
constexpr std::chrono::milliseconds refusalPatience{1'000};

// What both ends compute from the two hellos.
struct Agreement {
    std::map<std::string, std::string> features;
    std::vector<std::string> mismatches;  // sentences
    std::set<std::string> unsettled;      // names of features among the mismatches
};

// One end as both see it.
struct End {
    std::string name;
    std::uint32_t layout;
    const SessionHello* hello;
};

// Why the process cannot work with a value of a feature; null for one that it can work with.
const UnusableFeature* unusable(const SessionConfig& config, const std::string& name, const std::string& value) {
    const auto found =
        std::find_if(config.unusableFeatures.begin(), config.unusableFeatures.end(),
                     [&](const UnusableFeature& feature) { return feature.name == name && feature.value == value; });
    return found == config.unusableFeatures.end() ? nullptr : &*found;
}

SessionHello ownHello(const SessionConfig& config, const std::vector<FeatureRequest>& features) {
    SessionHello hello;
    hello.set_role(config.role == Role::Client ? SessionHello::CLIENT : SessionHello::ENGINE);
    hello.set_protocol(config.protocol);
    hello.set_versionmajor(config.version.first);
    hello.set_versionminor(config.version.second);
    for (const FeatureRequest& request : features) {
        const UnusableFeature* const useless = unusable(config, request.name(), request.value());
        if (useless == nullptr || useless->offered) {
            SessionFeature& feature = *hello.add_features();
            feature.set_name(request.name());
            feature.set_value(request.value());
            feature.set_handling(static_cast<int>(request.handling()));
        }
    }
    hello.mutable_limits()->set_tag(config.limits.tag);
    hello.mutable_limits()->set_taggedframe(config.limits.taggedFrame);
    hello.mutable_limits()->set_arraymessage(config.limits.arrayMessage);
    hello.mutable_limits()->set_message(config.limits.message);
    hello.mutable_limits()->set_frames(config.limits.frames);
    hello.mutable_limits()->set_parts(config.limits.parts);
    for (const auto capability : config.capabilities.getEnabledCapabilitySequence()) {
        hello.add_capabilities(static_cast<std::uint64_t>(capability));
    }
    hello.set_build(sentence(config.build, longestBuild));
    return hello;
}

std::string packHello(const SessionHello& hello) {
    const std::string body = hello.SerializeAsString();
    if (body.size() > longestBody) {
        throw std::length_error("Session::open: expected a hello of at most 65536 bytes, got " +
                                std::to_string(body.size()));
    }
    std::array<char, 8> numbers{};
    storeLittleEndian(numbers.data(), layoutVersion);
    storeLittleEndian(numbers.data() + 4, static_cast<std::uint32_t>(body.size()));
    return std::string(magic) + std::string(numbers.data(), numbers.size()) + body;
}

std::string packVerdict(const SessionVerdict& verdict) {
    const std::string body = verdict.SerializeAsString();
    std::array<char, 4> length{};
    storeLittleEndian(length.data(), static_cast<std::uint32_t>(body.size()));
    return std::string(length.data(), length.size()) + body;
}

template <class ProtoMessage>
void receiveBody(HandshakeStream& stream, std::uint32_t size, const std::string& what, ProtoMessage& message) {
    if (size > longestBody) {
        throw ProtocolViolation("length of " + what + ": expected at most 65536 bytes, got " + std::to_string(size));
    }
    std::string body(size, '\0');
    stream.receive(body.data(), body.size(), what);
    stream.endUnit();
    if (!message.ParseFromString(body)) {
        throw ProtocolViolation(what + ": its " + std::to_string(size) + " bytes are not a message of its type");
    }
}

std::uint32_t readHello(HandshakeStream& stream, SessionHello& hello) {
    std::array<char, magic.size() + 8> head{};
    stream.receive(head.data(), head.size(), "the peer's first message", [&](std::size_t have) {
        const std::string_view got(head.data(), std::min(have, magic.size()));
        if (got != magic.substr(0, got.size())) {
            const std::string all = std::string(head.data(), have) + stream.takeAvailable(256);
            const std::string text = quoted(all.substr(0, all.find(magic)), 200);
            throw StrayText("the peer does not speak this protocol: expected a first message that begins with " +
                                quoted(magic) + ", got " + text,
                            text);
        }
    });
    receiveBody(stream, loadLittleEndian<std::uint32_t>(head.data() + magic.size() + 4), "the peer's hello", hello);
    if (!hello.has_limits()) {
        throw ProtocolViolation("the peer's hello: expected the limits of the peer, got none");
    }
    return loadLittleEndian<std::uint32_t>(head.data() + magic.size());
}

// Values of one feature at one end, in the order of its hello.
struct Offer {
    std::vector<std::string> values;
    bool required = false;
};

struct Offers {
    std::vector<std::string> names;
    std::map<std::string, Offer> byName;
};

Offers offersOf(const SessionHello& hello) {
    Offers offers;
    for (const SessionFeature& feature : hello.features()) {
        if (feature.handling() == static_cast<int>(FeatureHandling::Ignore)) {
            continue;
        }
        const auto [found, fresh] = offers.byName.try_emplace(feature.name());
        if (fresh) {
            offers.names.push_back(feature.name());
        }
        found->second.values.push_back(feature.value());
        found->second.required |= feature.handling() == static_cast<int>(FeatureHandling::Required);
    }
    return offers;
}

std::string valuesText(const Offer& offer) {
    constexpr std::size_t most = 8;
    std::string text;
    for (std::size_t i = 0; i < std::min(offer.values.size(), most); ++i) {
        text += (i == 0 ? "" : ", ") + quoted(offer.values[i]);
    }
    return offer.values.empty() ? "no value" : offer.values.size() > most ? text + ", ..." : text;
}

// The client's order decides.
void settleFeatures(const End& client, const End& engine, Agreement& agreement) {
    const Offers clientOffers = offersOf(*client.hello);
    const Offers engineOffers = offersOf(*engine.hello);
    std::vector<std::string> names = clientOffers.names;
    std::copy_if(engineOffers.names.begin(), engineOffers.names.end(), std::back_inserter(names),
                 [&](const std::string& name) { return !clientOffers.byName.contains(name); });
    static const Offer nothing;
    const auto offer = [](const Offers& offers, const std::string& name) -> const Offer& {
        const auto found = offers.byName.find(name);
        return found == offers.byName.end() ? nothing : found->second;
    };
    for (const std::string& name : names) {
        const Offer& wanted = offer(clientOffers, name);
        const Offer& possible = offer(engineOffers, name);
        const std::set<std::string_view> accepted(possible.values.begin(), possible.values.end());
        const auto common = std::find_if(wanted.values.begin(), wanted.values.end(),
                                         [&](const std::string& value) { return accepted.contains(value); });
        if (common != wanted.values.end()) {
            agreement.features.emplace(name, *common);
        } else if (wanted.required || possible.required) {
            agreement.mismatches.push_back("feature " + quoted(name) + ": " + client.name + " accepts " +
                                           valuesText(wanted) + ", " + engine.name + " " + valuesText(possible));
            agreement.unsettled.insert(name);
        }
    }
}

std::string protocolText(const SessionHello& hello) {
    return quoted(hello.protocol());
}

std::string versionText(const SessionHello& hello) {
    return "(" + std::to_string(hello.versionmajor()) + ", " + std::to_string(hello.versionminor()) + ")";
}

std::string roleText(const SessionHello& hello) {
    const int role = hello.role();
    return role == SessionHello::CLIENT   ? "a client"
           : role == SessionHello::ENGINE ? "an engine"
                                          : "unknown (" + std::to_string(role) + ")";
}

// Both ends run this over the same two hellos and come to the same result.
void settle(const End& client, const End& engine, Agreement& agreement) {
    const auto compare = [&](const std::string& what, const std::string& atClient, const std::string& atEngine) {
        if (atClient != atEngine) {
            agreement.mismatches.push_back(what + ": " + client.name + " has " + atClient + ", " + engine.name + " " +
                                           atEngine);
        }
    };
    compare("layout version", std::to_string(client.layout), std::to_string(engine.layout));
    compare("protocol", protocolText(*client.hello), protocolText(*engine.hello));
    compare("protocol version", versionText(*client.hello), versionText(*engine.hello));
    settleFeatures(client, engine, agreement);
}

// What only this end knows: a value that the process cannot work with is settled, or was missing in the offer.
void checkUsable(const SessionConfig& config, const std::vector<FeatureRequest>& listed, const std::string& ownName,
                 Agreement& agreement) {
    for (const FeatureRequest& request : listed) {
        const UnusableFeature* const useless = unusable(config, request.name(), request.value());
        if (useless == nullptr) {
            continue;
        }
        const auto settled = agreement.features.find(request.name());
        if (settled != agreement.features.end() && settled->second == request.value()) {
            agreement.mismatches.push_back("feature " + quoted(request.name()) + ": " + quoted(request.value()) +
                                           " is all that both ends accept, but " + ownName + " " + useless->reason);
        } else if (!useless->offered && agreement.unsettled.contains(request.name())) {
            agreement.mismatches.push_back(useless->reason + " for " + ownName + ", so it does not accept " +
                                           quoted(request.value()) + " for " + quoted(request.name()));
        }
    }
}

std::string join(const std::vector<std::string>& mismatches) {
    std::string text;
    for (const std::string& mismatch : mismatches) {
        text += (text.empty() ? "" : "; ") + mismatch;
    }
    return text;
}

Peer peerOf(const SessionHello& hello) {
    Peer peer;
    peer.build = sentence(hello.build(), longestBuild);
    peer.limits = limitsFrom(hello.limits());
    for (const std::uint64_t number : hello.capabilities()) {
        // Capabilities that this end has no bit for are none that it could use.
        if (number <= 63) {
            peer.capabilities |= static_cast<::capabilities::Capability>(number);
        }
    }
    return peer;
}

std::shared_ptr<const serialization::Registry> setUp(const ProtocolRegistry::Protocol& protocol,
                                                     const SessionConfig& config, const std::string& ownName,
                                                     const std::unordered_map<std::string, std::string>& features,
                                                     std::vector<std::string>& mismatches) {
    auto registry = std::make_shared<serialization::Registry>();
    try {
        if (protocol.initialize(registry, config.version, features) != config.version) {
            mismatches.push_back("protocol version: " + ownName + " cannot set up version (" +
                                 std::to_string(config.version.first) + ", " + std::to_string(config.version.second) +
                                 ") of " + quoted(config.protocol));
        }
    } catch (const std::exception& error) {
        mismatches.push_back("protocol " + quoted(config.protocol) + ": " + ownName +
                             " cannot set it up: " + error.what());
    }
    return registry;
}

// Tag of the frames to which the limit of array messages applies; empty for a protocol without arrays.
std::string tagOfArrays(const serialization::Registry& registry) {
    try {
        return registry.find(std::type_index(typeid(korveldata::Array)))->name();
    } catch (const std::out_of_range&) {
        return {};
    }
}

SessionVerdict refusingVerdict(const std::string& refusal) {
    SessionVerdict verdict;
    verdict.set_accepted(false);
    verdict.set_refusal(sentence(refusal, longestRefusal));
    return verdict;
}

SessionVerdict makeVerdict(const Agreement& agreement) {
    if (!agreement.mismatches.empty()) {
        return refusingVerdict(join(agreement.mismatches));
    }
    SessionVerdict verdict;
    verdict.set_accepted(true);
    for (const auto& [name, value] : agreement.features) {
        SessionFeature& feature = *verdict.add_features();
        feature.set_name(name);
        feature.set_value(value);
    }
    return verdict;
}

SessionVerdict receiveVerdict(HandshakeStream& stream) {
    std::array<char, 4> length{};
    stream.receive(length.data(), length.size(), "the peer's verdict");
    SessionVerdict verdict;
    receiveBody(stream, loadLittleEndian<std::uint32_t>(length.data()), "the peer's verdict", verdict);
    return verdict;
}

// A peer that is too late is told so.
std::uint32_t receiveHello(HandshakeStream& stream, SessionHello& hello) {
    try {
        return readHello(stream, hello);
    } catch (const TimedOut& error) {
        stream.sendNow(packVerdict(refusingVerdict(error.what())));
        throw;
    }
}

// Ends the handshake of an end that refuses: the peer is told, and its own list is added where it knows more.
[[noreturn]] void refuse(HandshakeStream& stream, const std::string& refusal, const std::string& peerName) {
    std::string text = "the session is refused: " + refusal;
    try {
        stream.limitTo(refusalPatience);
        const SessionVerdict verdict = receiveVerdict(stream);
        stream.flush();
        if (!verdict.accepted() && verdict.refusal() != refusal) {
            text += "; " + peerName + " says: " + sentence(verdict.refusal(), longestRefusal);
        }
    } catch (const SessionError&) {
        // The peer has gone or sends something else; what this end found is reason enough.
    }
    throw HandshakeRefused(text);
}

}  // namespace

void refuseUnheard(core::posix::OwnedDescriptor socket, const SessionConfig& config, const std::string& refusal) {
    const ProtocolRegistry::Protocol protocol = ProtocolRegistry::getRegistry()->find(config.protocol);
    const std::string bytes =
        packHello(ownHello(config, protocol.configuration())) + packVerdict(refusingVerdict(refusal));
    // The stream is new and takes so little at once; a peer that has gone needs no answer.
    static_cast<void>(::send(socket.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL | MSG_DONTWAIT));
}

Settlement shakeHands(int in, int out, const SessionConfig& config) {
    const ProtocolRegistry::Protocol protocol = ProtocolRegistry::getRegistry()->find(config.protocol);
    std::vector<FeatureRequest> features = protocol.configuration();
    if (config.sharedMemory && lending::passesDescriptors(in) && lending::passesDescriptors(out)) {
        features.emplace_back(sharedMemory, asDescriptors, FeatureHandling::Optional);
    }
    // An engine does what its client wants.
    if (config.role == Role::Engine || config.keepAlive.count() > 0) {
        features.emplace_back(keepAlive, asFrames, FeatureHandling::Optional);
    }
    const SessionHello own = ownHello(config, features);

    HandshakeStream stream(in, out, config.handshakeTimeout, config.recorder);
    stream.send(packHello(own));
    SessionHello peer;
    bool judged = false;
    stream.watch(config.admission.word, [&] {
        if (const std::string refusal = config.admission.refusal(); !refusal.empty()) {
            if (!judged) {
                stream.sendNow(packVerdict(refusingVerdict(refusal)));
            }
            throw HandshakeRefused("the session is refused: " + sentence(refusal, longestRefusal));
        }
    });
    const std::uint32_t peerLayout = receiveHello(stream, peer);

    Agreement agreement;
    End ownEnd{"this end", layoutVersion, &own};
    End peerEnd{"the other end", peerLayout, &peer};
    const int rolePair = own.role() + peer.role();
    if (own.role() == peer.role() || rolePair != SessionHello::CLIENT + SessionHello::ENGINE) {
        agreement.mismatches.push_back("role: a session needs a client and an engine, this end is " + roleText(own) +
                                       ", the other end is " + roleText(peer));
    } else {
        ownEnd.name = config.role == Role::Client ? "the client" : "the engine";
        peerEnd.name = config.role == Role::Client ? "the engine" : "the client";
    }
    const bool ownIsClient = config.role == Role::Client;
    settle(ownIsClient ? ownEnd : peerEnd, ownIsClient ? peerEnd : ownEnd, agreement);
    checkUsable(config, features, ownEnd.name, agreement);
    Settlement settlement{peerOf(peer), {agreement.features.begin(), agreement.features.end()}, nullptr, {}};
    // Of the session, not of the protocol, and not settled before it has been tried.
    settlement.features.erase(sharedMemory);
    settlement.features.erase(keepAlive);
    if (agreement.mismatches.empty()) {
        settlement.registry = setUp(protocol, config, ownEnd.name, settlement.features, agreement.mismatches);
        settlement.arrayTag = tagOfArrays(*settlement.registry);
    }
    if (agreement.mismatches.empty() && config.admission.refusal) {
        if (std::string refusal = config.admission.refusal(); !refusal.empty()) {
            agreement.mismatches.push_back(std::move(refusal));
        }
    }

    const SessionVerdict verdict = makeVerdict(agreement);
    judged = true;
    stream.send(packVerdict(verdict));
    if (!verdict.accepted()) {
        refuse(stream, verdict.refusal(), peerEnd.name);
    }
    const SessionVerdict peerVerdict = receiveVerdict(stream);
    if (!peerVerdict.accepted()) {
        throw HandshakeRefused("the session is refused by " + peerEnd.name + ": " +
                               sentence(peerVerdict.refusal(), longestRefusal));
    }
    std::map<std::string, std::string> peerSettled;
    for (const SessionFeature& feature : peerVerdict.features()) {
        peerSettled.emplace(feature.name(), feature.value());
    }
    if (peerSettled != agreement.features) {
        throw HandshakeRefused("the session is refused: " + peerEnd.name + " settled on other feature values than " +
                               ownEnd.name);
    }
    stream.flush();
    if (agreement.features.contains(sharedMemory) && lending::probeSharedMemory(stream)) {
        settlement.sharedMemory = true;
        settlement.features.emplace(sharedMemory, asDescriptors);
    }
    if (agreement.features.contains(keepAlive)) {
        settlement.keepAlive = true;
        settlement.features.emplace(keepAlive, asFrames);
    }
    return settlement;
}

}  // namespace foundation::msg_svc::transport::layers::session
