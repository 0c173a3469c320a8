#include "krutil/inspect/MessagePage.hpp"

#include <openssl/evp.h>

#include <array>
#include <map>
#include <stdexcept>
#include <utility>

#include "krutil/base/Text.hpp"
#include "krutil/inspect/MessageText.hpp"
#include "krutil/inspect/PageTemplate.hpp"
#include "krutil/inspect/Summary.hpp"

namespace krutil_client {
namespace {

// A tag may have 65,535 bytes in a recording, whatever sessions accept.
constexpr std::size_t longestType = 128;

// Text that HTML shows as it is, between tags and in attributes.
std::string asHtml(std::string_view text) {
    std::string html;
    for (const char c : text) {
        switch (c) {
            case '&':
                html += "&amp;";
                break;
            case '<':
                html += "&lt;";
                break;
            case '>':
                html += "&gt;";
                break;
            case '"':
                html += "&quot;";
                break;
            case '\'':
                html += "&#39;";
                break;
            default:
                html += c;
        }
    }
    return html;
}

std::string cell(std::string_view text) {
    return "<td>" + asHtml(text) + "</td>";
}

std::string_view between(std::string_view text, std::string_view begin, std::string_view end) {
    const std::size_t first = text.find(begin) + begin.size();
    return text.substr(first, text.find(end, first) - first);
}

// How a policy names the text of an element, which it allows by that.
std::string policySource(std::string_view text) {
    std::array<unsigned char, EVP_MAX_MD_SIZE> hash{};
    unsigned size = 0;
    if (EVP_Digest(text.data(), text.size(), hash.data(), &size, EVP_sha256(), nullptr) != 1) {
        throw std::runtime_error("cannot compute a hash with OpenSSL");
    }
    std::array<unsigned char, EVP_MAX_MD_SIZE * 2> base64{};
    EVP_EncodeBlock(base64.data(), hash.data(), static_cast<int>(size));
    return "'sha256-" + std::string(reinterpret_cast<const char*>(base64.data())) + "'";
}

std::string policy() {
    return "default-src 'none'; base-uri 'none'; form-action 'none'; style-src " +
           policySource(between(pageTemplate, "<style>", "</style>")) + "; script-src " +
           policySource(between(pageTemplate, "<script>", "</script>"));
}

// The page with each value in the place of the comment that is its name. Values are not looked through for comments.
std::string filled(std::string_view page, const std::map<std::string_view, std::string>& values) {
    constexpr std::string_view opening = "<!--";
    constexpr std::string_view closing = "-->";
    std::string text;
    while (true) {
        const std::size_t begin = page.find(opening);
        text += page.substr(0, begin);
        if (begin == std::string_view::npos) {
            return text;
        }
        page.remove_prefix(begin + opening.size());
        const std::string_view name = page.substr(0, page.find(closing));
        const auto value = values.find(name);
        if (value == values.end()) {
            text += opening;
        } else {
            text += value->second;
            page.remove_prefix(name.size() + closing.size());
        }
    }
}

}  // namespace

std::size_t MessagePage::laneOf(const InspectedMessage& message, const std::string& key) {
    const auto [found, fresh] = laneNumbers_.try_emplace(key, lanes_.size());
    if (fresh) {
        Lane lane;
        lane.session = message.first().session;
        lane.request = message.request;
        if (const auto opened = open_.find(key); opened != open_.end()) {
            lane.beginning = opened->second;
        }
        lanes_.push_back(std::move(lane));
    }
    return found->second;
}

void MessagePage::add(const InspectedMessage& message, std::uint64_t begin, const std::string& key,
                      const std::string& gist) {
    const std::uint64_t time = message.first().nanoseconds;
    if (messages_ == mostMessages) {
        firstLeftOut_ = leftOut_ == 0 ? time : firstLeftOut_;
        lastLeftOut_ = time;
        ++leftOut_;
        return;
    }
    const std::size_t number = laneOf(message, key);
    Lane& lane = lanes_[number];
    std::string type = printableName(message.type());
    if (type.size() > longestType) {
        type = type.substr(0, longestType) + "...";
    }
    ++messages_;
    ++lane.messages;
    lane.bytes += message.size();
    messageRows_ += "<tr data-lane=\"" + std::to_string(number) + "\">" + cell(secondsText(time, begin)) +
                    cell(message.first().sender == apps::RecordedUnit::Role::Client ? "client" : "engine") +
                    cell(message.request.substr(0, 8)) + cell(message.complete ? type : type + ", not complete") +
                    cell(lane.beginning ? secondsText(time, lane.beginning->nanoseconds) : "") +
                    cell(std::to_string(message.size())) + cell(gist) + "</tr>\n";
}

void MessagePage::take(const InspectedMessage& message, std::uint64_t begin, bool wanted) {
    begin_ = begin;
    const std::string type = message.request.empty() ? std::string() : message.type();
    const bool begins = type == "IIPEnqueueMessage";
    const bool ends = type == "IIPReply";
    if (!wanted && !begins && !ends) {
        return;
    }
    const std::string key = std::to_string(message.first().session) + " " + message.request;
    const std::string gist = summaryOf(message);
    if (begins) {
        open_.insert_or_assign(key, Beginning{message.first().nanoseconds, gist});
    }
    if (wanted) {
        add(message, begin, key, gist);
    }
    if (ends) {
        open_.erase(key);
        if (const auto found = laneNumbers_.find(key); found != laneNumbers_.end()) {
            Lane& lane = lanes_[found->second];
            lane.answered = lane.beginning ? secondsText(message.first().nanoseconds, lane.beginning->nanoseconds) : "";
            lane.outcome = gist;
        }
    }
}

std::string MessagePage::laneRows(const std::vector<apps::RecordedSession>& sessions) const {
    std::string rows;
    for (const Lane& lane : lanes_) {
        const std::string session = std::to_string(lane.session);
        const apps::RecordedSession& recorded = sessions[lane.session];
        const std::string what = lane.beginning         ? lane.beginning->gist
                                 : lane.request.empty() ? "recorded by " + quotedText(recorded.process, 40) + ", " +
                                                              quotedText(recorded.program, 80)
                                                        : std::string();
        rows += "<tr>" + cell(lane.request.empty() ? "session " + session : lane.request) + cell(session) +
                cell(lane.beginning ? secondsText(lane.beginning->nanoseconds, begin_) : "") + cell(lane.answered) +
                cell(std::to_string(lane.messages)) + cell(std::to_string(lane.bytes)) +
                cell(lane.request.empty() || !lane.outcome.empty() ? lane.outcome : "no reply") + cell(what) +
                "</tr>\n";
    }
    return rows;
}

std::string MessagePage::html(const std::vector<apps::RecordedSession>& sessions, std::string_view file,
                              std::vector<std::string> notes) const {
    if (leftOut_ > 0) {
        notes.push_back("This page has the first " + std::to_string(mostMessages) + " messages. It leaves out " +
                        std::to_string(leftOut_) + " later ones, from " + secondsText(firstLeftOut_, begin_) + " to " +
                        secondsText(lastLeftOut_, begin_) +
                        " seconds: choose others with --since, --until, --request, --type or --from.");
    }
    if (messages_ == 0) {
        notes.emplace_back("There is no message to show.");
    }
    std::string paragraphs;
    for (const std::string& note : notes) {
        paragraphs += "<p class=\"note\">" + asHtml(note) + "</p>\n";
    }
    return filled(pageTemplate, {{"policy", policy()},
                                 {"file", asHtml(quotedText(file, 200))},
                                 {"notes", paragraphs},
                                 {"requests", laneRows(sessions)},
                                 {"messages", messageRows_}});
}

}  // namespace krutil_client
