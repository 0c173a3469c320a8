#include "krutil/terminal/Prompts.hpp"

#include <boost/make_shared.hpp>
#include <utility>

#include "cmddistributor/EvalIIP.hpp"
#include "krutil/terminal/PythonInput.hpp"
#include "msg_svc/protobuf/ustring.hpp"

namespace krutil_client {

using cmddistributor::DebugLoopEvent;
using krutil::prompt::InputRequester;

namespace {

// The command that stands for the end of input.
constexpr const char* endOfInput = "\x04";
constexpr const char* goOn = "__import__('qvm').dbcont()";
constexpr const char* quit = "__import__('qvm').dbquit()";

}  // namespace

struct Prompts::Open {
    foundation::msg_svc::exchange::IDType request;
    bool closed = false;
};

Prompts::Prompts(Client& client, Read input, Read commands)
    : client_(client),
      input_(std::move(input)),
      commands_(std::move(commands)),
      subscription_(client.events().subscribe<DebugLoopEvent>([this](const DebugLoopEvent& event) { onLoop(event); })) {
}

Prompts::~Prompts() {
    client_.events().unsubscribe(subscription_);
}

void Prompts::onLoop(const DebugLoopEvent& event) {
    const bool open = !open_.empty() && open_.back()->request == event.getRequestId() && !open_.back()->closed;
    if (event.getLoopState() == DebugLoopEvent::EXIT) {
        if (!open) {
            client_.violated("the engine left a prompt that was not open");
        }
        open_.back()->closed = true;
        return;
    }
    // Each prompt is one of a request that this program has sent, so prompts nest no deeper than the person goes.
    if (open || client_.unanswered().empty() || client_.unanswered().back() != event.getRequestId()) {
        client_.violated("the engine opened a prompt of a request that does not run");
    }
    Open prompt{event.getRequestId()};
    open_.push_back(&prompt);
    struct Pop {
        std::vector<Open*>& open;
        ~Pop() { open.pop_back(); }
    };
    const Pop pop{open_};
    serve(prompt, event.getWhichDebugLoop());
}

void Prompts::serve(Open& open, InputRequester loop) {
    switch (loop) {
        case InputRequester::mnINPUT_PROMPT:
            readInput(open);
            break;
        case InputRequester::mnPAUSE_PROMPT:
            readPause(open);
            break;
        case InputRequester::mnDEBUG_PROMPT:
            readCommands(open, "debug> ");
            break;
        default:
            readCommands(open, "keyboard> ");
    }
    // Once it is answered, the engine closes it; what is typed next may be meant for the next one.
    client_.conversation().run([&open] { return open.closed; });
}

void Prompts::readInput(Open& open) {
    const ReadLine line = input_("", [&open] { return open.closed; });
    if (line.end != ReadLine::End::Done) {
        answer(line.end == ReadLine::End::EndOfInput ? endOfInput : line.text);
    }
}

void Prompts::readPause(Open& open) {
    const ReadLine line = input_("Paused; press Enter to go on ", [&open] { return open.closed; });
    if (line.end != ReadLine::End::Done) {
        answer(line.text);
    }
}

void Prompts::readCommands(Open& open, const std::string& prompt) {
    const auto closed = [&open] { return open.closed; };
    while (!open.closed) {
        ReadLine line = commands_(prompt, closed);
        std::string code = line.text;
        while (line.end == ReadLine::End::Newline && needsMoreLines(code)) {
            line = commands_("... ", closed);
            code += "\n" + line.text;
        }
        if (line.end == ReadLine::End::Done) {
            return;
        }
        if (line.end == ReadLine::End::EndOfInput || code == ":q") {
            answer(quit);
            return;
        }
        if (code == ":c") {
            answer(goOn);
            return;
        }
        if (code.find_first_not_of(" \t") != std::string::npos) {
            answer(code);
        }
    }
}

void Prompts::answer(const std::string& command) {
    const auto iip = boost::make_shared<const cmddistributor::EvalIIP>(
        "python", cmddistributor::IqmStreamID::ekIqmCmdWinStream, nullptr, client_.outTraits({}), client_.errTraits({}),
        msg_svc::protobuf::utf8_to_ustring(command), cmddistributor::CodeType::CodeBlockType);
    const auto when = krutil::cmddistributor::WhenToDequeue::DEQUEUE_AT_PROMPT;
    client_.request(iip, when, "", false);
}

}  // namespace krutil_client
