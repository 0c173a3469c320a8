#include "krutil/terminal/Prompts.hpp"

#include <algorithm>
#include <utility>

#include "cmddistributor/IIPStateEvent.hpp"
#include "krutil/base/ExitCode.hpp"
#include "krutil/base/Text.hpp"
#include "krutil/terminal/Asides.hpp"
#include "krutil/terminal/PromptCommands.hpp"
#include "krutil/terminal/PythonInput.hpp"
#include "krutil/terminal/QueueCommand.hpp"

namespace krutil_client {

using cmddistributor::DebugLoopEvent;
using krutil::prompt::InputRequester;
using namespace krutil::cmddistributor::WhenToDequeue;

namespace {

// The command that stands for the end of input.
constexpr const char* endOfInputCommand = "\x04";

bool isAnswered(const Client::Sent& request) {
    return request->answer.has_value();
}

// A new value for a variable, as long as this lives.
class Set {
  public:
    Set(bool& variable, bool value) : variable_(variable), before_(std::exchange(variable, value)) {}
    ~Set() { variable_ = before_; }
    Set(const Set&) = delete;
    Set& operator=(const Set&) = delete;

  private:
    bool& variable_;
    const bool before_;
};

}  // namespace

struct Prompts::Open {
    IDType request;
    bool debugger;
    bool closed = false;
};

Prompts::Prompts(Client& client, Read input, Read commands, Output& out)
    : client_(client),
      input_(std::move(input)),
      commands_(std::move(commands)),
      out_(out),
      help_(client),
      subscriptions_{client.events().subscribe<DebugLoopEvent>([this](const DebugLoopEvent& event) { onLoop(event); }),
                     client.events().subscribe<cmddistributor::IIPStartedEvent>(
                         [this](const cmddistributor::IIPStartedEvent& event) { onStarted(event.getRequestId()); })} {}

Prompts::~Prompts() {
    for (const auto subscription : subscriptions_) {
        client_.events().unsubscribe(subscription);
    }
}

void Prompts::onLoop(const DebugLoopEvent& event) {
    if (event.getLoopState() == DebugLoopEvent::ENTER) {
        enter(event.getRequestId(), event.getWhichDebugLoop());
    } else {
        leave(event.getRequestId());
    }
}

void Prompts::enter(const IDType& request, Loop loop) {
    const auto sent = client_.requests().find(request);
    const bool runs = sent && (sent->state == SentRequest::State::Running || sent->state == SentRequest::State::HeldUp);
    const bool open = std::any_of(open_.begin(), open_.end(),
                                  [&request](const Open* each) { return each->request == request && !each->closed; });
    const bool waits = std::any_of(deferred_.begin(), deferred_.end(),
                                   [&request](const Deferred& each) { return each.request == request; });
    // Each prompt is one of a request that this program has sent, so prompts nest no deeper than the person goes.
    if (!runs || open || waits) {
        client_.violated("the engine opened a prompt of a request that does not run");
    }
    if (reading_) {
        deferred_.push_back({request, loop});
    } else {
        serve(request, loop);
    }
}

void Prompts::leave(const IDType& request) {
    if (!deferred_.empty() && deferred_.back().request == request) {
        deferred_.pop_back();
    } else if (deferred_.empty() && !open_.empty() && open_.back()->request == request && !open_.back()->closed) {
        open_.back()->closed = true;
    } else {
        client_.violated("the engine left a prompt that was not open");
    }
}

void Prompts::serve(const IDType& request, Loop loop) {
    Open open{request, loop == InputRequester::mnDEBUG_PROMPT};
    open_.push_back(&open);
    struct Pop {
        std::vector<Open*>& prompts;
        ~Pop() { prompts.pop_back(); }
    };
    const Pop pop{open_};
    switch (loop) {
        case InputRequester::mnINPUT_PROMPT:
            readAnswer(open, "", DEQUEUE_AT_PROMPT, endOfInputCommand);
            break;
        case InputRequester::mnPAUSE_PROMPT:
            // Whenever it comes, it is no line of input.
            readAnswer(open, "Paused; press Enter to go on ", DEQUEUE_AT_PAUSE, "");
            break;
        case InputRequester::mnDEBUG_PROMPT:
            readCommands(open, "debug> ");
            break;
        default:
            readCommands(open, "keyboard> ");
    }
}

void Prompts::onStarted(const IDType& request) {
    std::erase_if(leftBehind_, isAnswered);
    const auto found = std::find_if(leftBehind_.begin(), leftBehind_.end(),
                                    [&request](const Client::Sent& each) { return each->id == request; });
    if (found != leftBehind_.end()) {
        const Client::Sent started = *found;
        leftBehind_.erase(found);
        client_.say("runs now: " + started->name);
    }
}

ReadLine Prompts::readCode(const std::string& prompt, const std::function<bool()>& done) {
    return read(commands_, prompt, done);
}

ReadLine Prompts::read(const Read& reader, const std::string& prompt, const std::function<bool()>& done) {
    for (;;) {
        ReadLine line{};
        {
            const Set reading(reading_, true);
            line = reader(prompt, [this, &done] { return done() || !deferred_.empty(); });
        }
        serveDeferred();
        if (line.end != ReadLine::End::Done || done()) {
            return line;
        }
    }
}

void Prompts::serveDeferred() {
    while (!deferred_.empty()) {
        const Deferred next = deferred_.front();
        deferred_.erase(deferred_.begin());
        // An engine that has answered in spite of its prompt gets no answer to that.
        if (const auto request = client_.requests().find(next.request)) {
            // Whatever Ctrl-C does to the line that was read, at the prompt it is for the request.
            const Canceller canceller = client_.cancelling({request});
            serve(next.request, next.loop);
        }
    }
}

void Prompts::readAnswer(Open& open, const std::string& prompt, WhenToDequeue when, const std::string& endOfInput) {
    while (!open.closed) {
        const ReadLine line = read(input_, prompt, [&open] { return open.closed; });
        if (line.end == ReadLine::End::Done) {
            return;
        }
        const Client::Sent answer = send(line.end == ReadLine::End::EndOfInput ? endOfInput : line.text, "", when);
        if (!answer) {
            continue;
        }
        // Once it is answered, the engine closes the prompt; what is typed next may be meant for the next one.
        client_.wait({answer}, [&] {
            return open.closed || (isAnswered(answer) && answer->state == SentRequest::State::Discarded);
        });
        if (!isAnswered(answer)) {
            client_.withdraw(answer);
        }
    }
}

void Prompts::readCommands(Open& open, const std::string& prompt) {
    while (!open.closed) {
        evaluate(open, readPieces(open, prompt));
    }
}

std::vector<std::string> Prompts::readPieces(Open& open, const std::string& prompt) {
    const auto closed = [&open] { return open.closed; };
    ReadLine line = read(commands_, prompt, closed);
    std::string code = line.text;
    while (line.end == ReadLine::End::Newline && !isWhole(code)) {
        line = read(commands_, "... ", closed);
        code += "\n" + line.text;
    }
    switch (line.end) {
        case ReadLine::End::Newline:
            return piecesOf(code);
        case ReadLine::End::EndOfInput:
            return {":q"};
        case ReadLine::End::Done:
            break;
    }
    return {};
}

void Prompts::evaluate(Open& open, const std::vector<std::string>& pieces) {
    std::vector<Client::Sent> sent;
    Client::Sent leaving;
    for (const std::string& piece : pieces) {
        const std::string command = piece.substr(0, piece.find_last_not_of(" \t") + 1);
        const auto known = promptCommand(command, open.debugger);
        if (!known && obey(command, open.debugger)) {
            continue;
        }
        const Client::Sent request =
            send(known ? known->code : piece, nameOfCode(known ? command : piece), DEQUEUE_AT_PPE);
        if (!request) {
            break;
        }
        sent.push_back(request);
        if (known && known->leaves) {
            leaving = request;
        }
    }
    client_.wait(sent, [&] { return open.closed || std::all_of(sent.begin(), sent.end(), isAnswered); });
    if (!leaving && !open.closed) {
        client_.showPictures();
    }
    if (leaving && isAnswered(leaving) && leaving->answer->exitCode == ExitCode::Ok) {
        client_.conversation().run([&open] { return open.closed; });
    }
    for (const Client::Sent& request : sent) {
        if (!isAnswered(request)) {
            client_.say("left behind by the prompt, and waits for its turn: " + request->name);
            leftBehind_.push_back(request);
        }
    }
}

// Whether a line was for this program itself.
bool Prompts::obey(const std::string& line, bool debugger) {
    if (line[0] != ':') {
        return answerAside(
            line, [this](const std::string& name) { return help_.inspect(name); }, out_);
    }
    if (line == ":help") {
        out_.write(promptHelp(debugger));
    } else if (!obeyQueueCommand(client_, line, out_)) {
        out_.write("There is no command '" + line + "' here; :c goes on, :q quits, :queue lists requests.\n");
    }
    return true;
}

// Null for what is too large, which a person is told.
Client::Sent Prompts::send(const std::string& code, const std::string& name, WhenToDequeue when) {
    try {
        return client_.send(
            {.iip = client_.evaluation(code, cmddistributor::CodeType::CodeBlockType, {}), .name = name, .when = when});
    } catch (const Failure& failure) {
        client_.say(failure.what());
        return nullptr;
    }
}

}  // namespace krutil_client
