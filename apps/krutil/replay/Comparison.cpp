#include "krutil/replay/Comparison.hpp"

#include <google/protobuf/descriptor.h>
#include <google/protobuf/message.h>
#include <google/protobuf/stubs/strutil.h>
#include <google/protobuf/util/message_differencer.h>

#include <algorithm>
#include <array>
#include <map>
#include <string_view>
#include <utility>

#include "common/MessageWalk.hpp"
#include "krutil.protobuf.TextBaseEvent.pb.h"

namespace krutil_client {
namespace {

using google::protobuf::Message;

constexpr std::size_t longestSentence = 600;
constexpr std::size_t shownDifferences = 10;
constexpr std::size_t shortestAddress = 6;

// When a warning was issued; the number by which a client calls itself.
constexpr std::array ignoredFields{"krutil.protobuf.Warning.datenum", "krutil.protobuf.FEvalIIP.clientQvmID"};

// Both events of texts have the same fields.
using Text = krutil::protobuf::TextBaseEvent;

Text eventOf(const Said& said) {
    Text text;
    // What cannot be read is compared as far as it can.
    static_cast<void>(text.ParseFromString(said.frames.back().content));
    return text;
}

// Pieces of one text have the tag, the request and the sink in common.
bool goesOn(const Said& before, const Said& said) {
    if (!before.isText() || before.tag() != said.tag()) {
        return false;
    }
    const Text left = eventOf(before);
    const Text right = eventOf(said);
    return left.stream() == right.stream() && left.id().hi() == right.id().hi() && left.id().lo() == right.id().lo();
}

// The parser takes the last of several fields, so texts are put together by hand. Each is joined once.
std::vector<Said> withTextsJoined(const std::vector<const Said*>& all) {
    std::vector<Said> joined;
    for (std::size_t i = 0; i < all.size();) {
        joined.push_back(*all[i]);
        const Said& first = *all[i++];
        if (!first.isText()) {
            continue;
        }
        Text text = eventOf(first);
        for (; i < all.size() && goesOn(first, *all[i]); ++i) {
            text.mutable_text()->append(eventOf(*all[i]).text());
        }
        joined.back().frames.back().content = text.SerializeAsString();
    }
    return joined;
}

// Text of no request comes when its descriptor is read; so each sink has an order of its own.
void orderBySink(std::vector<const Said*>& all) {
    const auto sink = [](const Said* said) {
        return said->isText() ? std::pair(std::string(said->tag()), static_cast<int>(eventOf(*said).stream()))
                              : std::pair(std::string(), 0);
    };
    std::stable_sort(all.begin(), all.end(),
                     [&sink](const Said* left, const Said* right) { return sink(left) < sink(right); });
}

std::string withoutAddresses(const std::string& text) {
    std::string scrubbed;
    std::size_t at = 0;
    for (std::size_t found = text.find("0x"); found != std::string::npos; found = text.find("0x", at)) {
        const std::size_t digits = found + 2;
        const std::size_t end = std::min(text.find_first_not_of("0123456789abcdefABCDEF", digits), text.size());
        scrubbed.append(text, at, digits - at);
        scrubbed += end - digits >= shortestAddress ? "..." : text.substr(digits, end - digits);
        at = end;
    }
    return scrubbed.append(text, at, std::string::npos);
}

std::string differenceOfBytes(const std::string& before, const std::string& now) {
    if (before == now) {
        return {};
    }
    if (before.size() != now.size()) {
        return "expected " + std::to_string(before.size()) + " bytes, got " + std::to_string(now.size());
    }
    const auto at = std::mismatch(before.begin(), before.end(), now.begin()).first - before.begin();
    return "its " + std::to_string(before.size()) + " bytes differ from byte " + std::to_string(at) + " on";
}

std::string differenceOfMessages(Message& before, Message& now, Addresses addresses) {
    if (addresses == Addresses::MayDiffer) {
        const auto remove = [](std::string& text) { text = withoutAddresses(text); };
        apps::forEachText(before, remove);
        apps::forEachText(now, remove);
    }
    google::protobuf::util::MessageDifferencer differencer;
    for (const char* name : ignoredFields) {
        differencer.IgnoreField(google::protobuf::DescriptorPool::generated_pool()->FindFieldByName(name));
    }
    differencer.set_report_ignores(false);
    std::string report;
    differencer.ReportDifferencesToString(&report);
    if (differencer.Compare(before, now)) {
        return {};
    }
    while (!report.empty() && report.back() == '\n') {
        report.pop_back();
    }
    for (std::size_t at = report.find('\n'); at != std::string::npos; at = report.find('\n', at)) {
        report.replace(at, 1, "; ");
    }
    return report.substr(0, longestSentence) + (report.size() > longestSentence ? "..." : "");
}

std::string difference(const SaidFrame& before, const SaidFrame& now, Addresses addresses) {
    const auto name = [](const SaidFrame& frame) {
        return frame.tagged ? google::protobuf::CEscape(frame.tag) : std::string("data");
    };
    if (before.tagged != now.tagged || before.tag != now.tag || before.type != now.type) {
        return "expected " + name(before) + " of type " + std::to_string(before.type) + ", got " + name(now) +
               " of type " + std::to_string(now.type);
    }
    if (before.content == now.content) {
        return {};
    }
    const auto left = before.tagged ? apps::parsedMessage(before.tag, before.content) : nullptr;
    const auto right = now.tagged ? apps::parsedMessage(now.tag, now.content) : nullptr;
    return left && right ? differenceOfMessages(*left, *right, addresses)
                         : differenceOfBytes(before.content, now.content);
}

// An engine may go on where the recording ends early.
std::vector<std::string> differences(const std::vector<Said>& before, const std::vector<Said>& now, bool early) {
    std::vector<std::string> found;
    for (std::size_t i = 0; i < std::max(before.size(), now.size()) && found.size() < shownDifferences; ++i) {
        if (i >= now.size()) {
            found.push_back("message " + std::to_string(i + 1) + " (byte " + std::to_string(before[i].offset) +
                            "): expected " + nameOf(before[i]) + ", got no more");
            break;
        }
        if (i >= before.size() && early) {
            break;
        }
        if (i >= before.size()) {
            found.push_back("message " + std::to_string(i + 1) + ": expected no more, got " + nameOf(now[i]));
            break;
        }
        const std::string where = "message " + std::to_string(i + 1) + ", " + nameOf(before[i]) + " (byte " +
                                  std::to_string(before[i].offset) + ")";
        if (before[i].tag() != now[i].tag()) {
            // What follows is not compared with what it was.
            found.push_back(where + ": got " + nameOf(now[i]));
            break;
        }
        for (const std::string& text : compareFrames(before[i], now[i], Addresses::MayDiffer)) {
            found.push_back(where + text);
        }
    }
    return found;
}

using Sequences = std::map<std::size_t, std::vector<const Said*>>;

// What an engine said, by request; 0 stands for none. The requests on a stream follow each other.
Sequences byRequest(const Talk& talk, const std::vector<Said>& said) {
    std::map<std::uint32_t, std::vector<std::size_t>> requests;
    for (std::size_t i = talk.client.size(); i > 0; --i) {
        requests[talk.client[i - 1].said.stream].push_back(i);
    }
    Sequences sequences;
    for (const Said& each : said) {
        if (each.kind != Said::Kind::Message) {
            continue;
        }
        auto& waiting = requests[each.stream];
        const bool belongs = each.stream != 0 && !waiting.empty();
        sequences[belongs ? waiting.back() : 0].push_back(&each);
        if (belongs && each.endsExchange()) {
            waiting.pop_back();
        }
    }
    return sequences;
}

}  // namespace

std::string nameOf(const Said& said) {
    switch (said.kind) {
        case Said::Kind::Goodbye:
            return "goodbye";
        case Said::Kind::Abort:
            return "abort";
        case Said::Kind::Message:
            break;
    }
    return google::protobuf::CEscape(std::string(said.tag()));
}

std::vector<std::string> compareFrames(const Said& before, const Said& now, Addresses addresses) {
    if (before.frames.size() != now.frames.size()) {
        return {": expected " + std::to_string(before.frames.size()) + " frames, got " +
                std::to_string(now.frames.size())};
    }
    std::vector<std::string> found;
    for (std::size_t i = 0; i < before.frames.size(); ++i) {
        if (const auto text = difference(before.frames[i], now.frames[i], addresses); !text.empty()) {
            found.push_back(", frame " + std::to_string(i + 1) + ": " + text);
        }
    }
    return found;
}

bool endsInGoodOrder(const Talk& talk) {
    return std::any_of(talk.engine.begin(), talk.engine.end(),
                       [](const Said& said) { return said.tag() == "krutil:QVMShutdownEvent"; });
}

std::vector<Compared> compare(const Talk& talk, const std::vector<Said>& now) {
    Sequences before = byRequest(talk, talk.engine);
    Sequences after = byRequest(talk, now);
    const bool early = !endsInGoodOrder(talk);
    std::vector<Compared> all;
    std::size_t number = 0;
    for (std::size_t i = 0; i < talk.client.size(); ++i) {
        const Said& said = talk.client[i].said;
        if (said.kind != Said::Kind::Message || said.stream == 0) {
            continue;
        }
        all.push_back({"request " + std::to_string(++number) + " on stream " + std::to_string(said.stream) + " (" +
                           nameOf(said) + ")",
                       differences(withTextsJoined(before[i + 1]), withTextsJoined(after[i + 1]), early)});
    }
    orderBySink(before[0]);
    orderBySink(after[0]);
    all.push_back(
        {"messages of no request", differences(withTextsJoined(before[0]), withTextsJoined(after[0]), early)});
    return all;
}

}  // namespace krutil_client
