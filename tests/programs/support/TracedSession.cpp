#include "programs/support/TracedSession.hpp"

#include <algorithm>
#include <array>
#include <charconv>
#include <fstream>
#include <iterator>
#include <map>
#include <string_view>

#include "programs/support/RequestLife.hpp"

namespace programs_test {
namespace {

// The last frame of a message, as far as a line of the trace names it.
struct Root {
    bool outgoing;
    unsigned long stream;
    std::string name;  ///< the tag without what stands before the last colon
};

// What stands between `text` and the next space; empty without `text`.
std::string_view wordAfter(std::string_view line, std::string_view text) {
    const auto begin = line.find(text);
    if (begin == std::string_view::npos) {
        return {};
    }
    line.remove_prefix(begin + text.size());
    return line.substr(0, line.find(' '));
}

std::optional<Root> rootOf(std::string_view line) {
    const std::string_view head = line.substr(0, line.find(" bytes"));
    const std::string_view stream = wordAfter(head, " stream ");
    const std::string_view type = wordAfter(head, " last type ");
    if (type.empty()) {
        return std::nullopt;
    }
    const std::string_view tag = wordAfter(head, " last type " + std::string(type) + " ");
    Root root{head.starts_with("-->"), 0, std::string(tag.substr(tag.rfind(':') + 1))};
    std::from_chars(stream.data(), stream.data() + stream.size(), root.stream);
    return root;
}

// All exchanges of a session. A stream ID may have several, one after the other.
class Exchanges {
  public:
    void take(const Root& root) {
        if (root.outgoing) {
            if (root.name == "IIPEnqueueMessage") {
                begin(root.stream, RequestLife());
            } else if (root.name == "IIPCancelMessage") {
                begin(root.stream, std::nullopt);
            }
        } else if (root.stream != 0) {
            receive(root);
        }
    }

    void end() {
        for (const auto& [stream, life] : open_) {
            if (life) {
                note(stream, life->whatIsMissing());
            }
        }
    }

    const std::string& wrong() const { return wrong_; }

  private:
    using Life = std::optional<RequestLife>;  // none for a cancel

    void begin(unsigned long stream, Life life) {
        const auto found = open_.find(stream);
        if (found != open_.end() && found->second) {
            note(stream, found->second->whatIsMissing());
        }
        open_.insert_or_assign(stream, std::move(life));
    }

    void receive(const Root& root) {
        const auto found = open_.find(root.stream);
        if (found == open_.end()) {
            note(root.stream, "\"" + root.name + "\" belongs to no exchange");
        } else if (found->second) {
            note(root.stream, found->second->next(root.name));
        } else if (root.name != "IIPCancelReply") {
            note(root.stream, "\"" + root.name + "\" is no answer to a cancel");
        }
    }

    void note(unsigned long stream, const std::string& what) {
        if (!what.empty()) {
            wrong_ += "stream " + std::to_string(stream) + ": " + what + "\n";
        }
    }

    std::map<unsigned long, Life> open_;
    std::string wrong_;
};

TraceEnd endOf(int exitCode, const std::string& said) {
    constexpr int refused = 4;
    constexpr std::array inOrder{0, 1, 6};  // no error, an error of the code, cancelled
    if (exitCode == refused) {
        return TraceEnd::Refused;
    }
    const bool given =
        said.find(" was killed") != std::string::npos || said.find("; the connection was closed") != std::string::npos;
    return !given && std::find(inOrder.begin(), inOrder.end(), exitCode) != inOrder.end() ? TraceEnd::InOrder
                                                                                          : TraceEnd::Early;
}

}  // namespace

std::string wrongLives(std::istream& trace, TraceEnd end) {
    std::vector<Root> roots;
    bool empty = true;
    std::string line;
    // A program that was killed may have left a piece of a line, which has no newline.
    while (std::getline(trace, line) && !trace.eof()) {
        empty = false;
        if (auto root = rootOf(line)) {
            roots.push_back(std::move(*root));
        }
    }
    if (end == TraceEnd::InOrder && roots.empty() && !empty) {
        return "no line of the trace tells the last frame of a message\n";
    }
    if (end == TraceEnd::Refused) {
        const auto last = std::find_if(roots.rbegin(), roots.rend(), [](const Root& root) { return !root.outgoing; });
        if (last != roots.rend()) {
            roots.erase(std::next(last).base());
        }
    }
    Exchanges exchanges;
    for (const Root& root : roots) {
        exchanges.take(root);
    }
    if (end == TraceEnd::InOrder) {
        exchanges.end();
    }
    return exchanges.wrong();
}

TracedSession::TracedSession(std::vector<std::string>& command) {
    constexpr std::array subcommands{"eval", "call", "run", "repl"};
    const auto traced = [&] { return std::find(command.begin(), command.end(), "--trace-to") != command.end(); };
    if (command.size() < 2 || command[0] != KRUTIL_CLIENT || traced() ||
        std::find(subcommands.begin(), subcommands.end(), command[1]) == subcommands.end()) {
        return;
    }
    directory_.emplace();
    command.insert(command.begin() + 2, {"--trace-to", directory_->file("trace")});
}

std::string TracedSession::whatIsWrong(int exitCode, const std::string& said) const {
    if (!directory_) {
        return {};
    }
    std::ifstream trace(directory_->file("trace"), std::ios::binary);
    return wrongLives(trace, endOf(exitCode, said));
}

}  // namespace programs_test
