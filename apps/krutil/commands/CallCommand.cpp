#include "krutil/commands/CallCommand.hpp"

#include <algorithm>
#include <cstdint>
#include <utility>

#include "krutil/arrays/ArgumentLiteral.hpp"
#include "krutil/base/Text.hpp"
#include "krutil/display/Progress.hpp"
#include "krutil/io/SinkTextEvent.hpp"
#include "krutil/io/TextBaseEvent.hpp"
#include "krutil/session/FunctionCall.hpp"

namespace krutil_client {
namespace {

using foundation::korveldata::Array;
using namespace std::chrono_literals;

constexpr auto progressInterval = 100ms;

std::size_t characters(std::string_view text) {
    return static_cast<std::size_t>(std::count_if(
        text.begin(), text.end(), [](char c) { return (static_cast<unsigned char>(c) & 0xC0U) != 0x80U; }));
}

// The literal, with an arrow below the place: a part of it where it is long.
std::string pointAt(const std::string& literal, std::size_t offset) {
    constexpr std::size_t before = 60;
    constexpr std::size_t after = 20;
    std::size_t begin = offset > before ? offset - before : 0;
    std::size_t end = std::min(literal.size(), offset + after);
    const auto insideCharacter = [&](std::size_t i) {
        return i < literal.size() && (static_cast<unsigned char>(literal[i]) & 0xC0U) == 0x80U;
    };
    while (insideCharacter(begin)) {
        ++begin;
    }
    while (insideCharacter(end)) {
        ++end;
    }
    std::string shown = literal.substr(begin, end - begin);
    std::replace_if(
        shown.begin(), shown.end(), [](char c) { return static_cast<unsigned char>(c) < ' '; }, ' ');
    const std::string ellipsis = "...";
    const std::string left = begin > 0 ? ellipsis : std::string();
    return "\n  " + left + shown + (end < literal.size() ? ellipsis : std::string()) + "\n  " +
           std::string(left.size() + characters(std::string_view(shown).substr(0, offset - begin)), ' ') + "^";
}

void requireUtf8(const std::string& text, const std::string& name) {
    if (const auto offset = firstInvalidUtf8(text)) {
        throw Failure(ExitCode::Usage, name + " is not valid UTF-8 (at byte " + std::to_string(*offset) + ")");
    }
}

Array readArgument(const std::string& argument, std::size_t number) {
    const std::string name = "argument " + std::to_string(number);
    try {
        if (argument.starts_with('@')) {
            return readNpy(argument.substr(1));
        }
        if (argument.ends_with(".npy")) {
            return readNpy(argument);
        }
    } catch (const Failure& failure) {
        throw Failure(failure.code(), name + ": " + failure.what());
    }
    requireUtf8(argument, name);
    try {
        return parseLiteral(argument);
    } catch (const LiteralError& error) {
        throw Failure(ExitCode::Usage, name + ": " + error.what() + pointAt(argument, error.offset()));
    }
}

// Shows how far the arrays of a call are, as long as the object lives and `err` is a terminal with a cursor.
class TransferDisplay {
  public:
    TransferDisplay(Client& client, Output& err, std::uint64_t toSend)
        : client_(client),
          err_(err),
          progress_(client.conversation().session().traffic(), toSend, Progress::Clock::now()) {
        if (!err_.hasCursor()) {
            return;
        }
        const auto note = [this](const krutil::io::TextBase& text) {
            lineUnfinished_ = !text.getText().empty() && text.getText().back() != u'\n';
        };
        subscriptions_.push_back(client.events().subscribe<krutil::io::TextBaseEvent>(note));
        subscriptions_.push_back(client.events().subscribe<krutil::io::SinkTextEvent>(note));
        client.conversation().setPastime({progressInterval, [this] { update(); }, [this] { clear(); }});
    }
    ~TransferDisplay() {
        for (const auto subscription : subscriptions_) {
            client_.events().unsubscribe(subscription);
        }
        client_.conversation().setPastime({});
    }
    TransferDisplay(const TransferDisplay&) = delete;
    TransferDisplay& operator=(const TransferDisplay&) = delete;

  private:
    void update() {
        // The line would go over what the function has written so far.
        if (!lineUnfinished_) {
            write(progress_.update(client_.conversation().session().traffic(), Progress::Clock::now(),
                                   err_.terminalSize().columns));
        }
    }

    void clear() { write(progress_.clear()); }

    void write(const std::string& text) {
        if (!text.empty()) {
            err_.show(text);
        }
    }

    Client& client_;
    Output& err_;
    Progress progress_;
    bool lineUnfinished_ = false;
    std::vector<foundation::msg_svc::eventmgr::EventMgr::Subscription> subscriptions_;
};

// Throws Failure for another number of outputs than was asked for.
std::vector<Array> checkedOutputsOf(const krutil::cmddistributor::IIPReply& reply, std::size_t asked) {
    auto outputs = outputsOf(reply);
    if (outputs.size() != asked) {
        throw Failure(ExitCode::Violation, "the engine returned " + std::to_string(outputs.size()) +
                                               " outputs of the function; " + std::to_string(asked) +
                                               " were asked for");
    }
    return outputs;
}

}  // namespace

PreparedCall prepareCall(const CallOptions& options) {
    requireUtf8(options.function, "the function's name");
    if (options.function.empty()) {
        throw Failure(ExitCode::Usage, "the function's name is empty");
    }
    if (options.files.size() > options.outputs) {
        throw Failure(ExitCode::Usage, "--output is given " + std::to_string(options.files.size()) +
                                           " times, but --nout asks for " + std::to_string(options.outputs));
    }
    PreparedCall call;
    for (const std::string& argument : options.arguments) {
        call.arguments.push_back(readArgument(argument, call.arguments.size() + 1));
    }
    for (const std::string& file : options.files) {
        call.files.emplace_back(file);
    }
    return call;
}

ExitCode callFunction(Client& client, const CallOptions& options, PreparedCall call, Printer& printer, Output& err) {
    std::uint64_t toSend = 0;
    for (const Array& argument : call.arguments) {
        toSend += argument.sizeInBytes();
    }
    const auto iip = requestOf(client, {options.function, options.outputs, std::move(call.arguments)}, options.sink);
    Answer answer;
    {
        const TransferDisplay display(client, err, toSend);
        answer = client.request({.iip = iip, .name = options.function, .sparingly = options.sparingly});
    }
    if (answer.exitCode != ExitCode::Ok) {
        return answer.exitCode;
    }
    const auto outputs = checkedOutputsOf(*answer.reply, options.outputs);
    for (std::size_t i = 0; i < outputs.size(); ++i) {
        std::string path;
        if (i < call.files.size()) {
            call.files[i].write(outputs[i]);
            path = call.files[i].path();
        }
        printer.returned({answer.reply->getID(), i + 1, outputs.size(), outputs[i], path});
    }
    return ExitCode::Ok;
}

}  // namespace krutil_client
