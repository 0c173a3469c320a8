// What a person is asked while a request is held up.
#pragma once

#include <functional>
#include <string>
#include <vector>

#include "cmddistributor/DebugLoopEvent.hpp"
#include "krutil/prompt/InputRequester.hpp"
#include "krutil/session/Client.hpp"
#include "krutil/terminal/EngineHelp.hpp"
#include "krutil/terminal/LineReader.hpp"

namespace krutil_client {

/// Answers the engine's prompts as long as it lives. At an input prompt a line is read and sent as it is. At a debug or
/// keyboard prompt code is read and evaluated, until one of its lines leaves the prompt: ":c" goes on, ":q" and Ctrl-D
/// quit; promptCommand() knows more commands. The statements of several lines, which were pasted, are sent at once;
/// what the prompt leaves behind of them waits in the engine's queue, and the person is told, also when it runs. At a
/// pause a line goes on. A prompt that the engine closes ends the reading; an answer that comes too late is taken back.
/// Main thread only.
class Prompts {
  public:
    /// Reads a line as LineReader::read() does.
    using Read = std::function<ReadLine(const std::string& prompt, const std::function<bool()>& done)>;

    /// `input` reads the lines of running code, `commands` those of prompts. What commands show goes to `out`. `client`
    /// and `out` must outlive the object.
    Prompts(Client& client, Read input, Read commands, Output& out);
    ~Prompts();
    Prompts(const Prompts&) = delete;
    Prompts& operator=(const Prompts&) = delete;

    /// Reads a line of code that no prompt of the engine asks for. A prompt that opens meanwhile, of a request that was
    /// left behind, comes first: the line is dropped, and read anew after it.
    ReadLine readCode(const std::string& prompt, const std::function<bool()>& done);

  private:
    struct Open;
    using IDType = foundation::msg_svc::exchange::IDType;
    using Loop = krutil::prompt::InputRequester;

    void onLoop(const cmddistributor::DebugLoopEvent& event);
    void enter(const IDType& request, Loop loop);
    void leave(const IDType& request);
    void serve(const IDType& request, Loop loop);
    void onStarted(const IDType& request);

    ReadLine read(const Read& reader, const std::string& prompt, const std::function<bool()>& done);
    void serveDeferred();
    void readAnswer(Open& open, const std::string& prompt, krutil::cmddistributor::WhenToDequeue::WhenToDequeue when,
                    const std::string& endOfInput);
    void readCommands(Open& open, const std::string& prompt);
    std::vector<std::string> readPieces(Open& open, const std::string& prompt);
    void evaluate(Open& open, const std::vector<std::string>& pieces);
    bool obey(const std::string& line, bool debugger);
    Client::Sent send(const std::string& code, const std::string& name,
                      krutil::cmddistributor::WhenToDequeue::WhenToDequeue when);

    // A prompt that opened while a line was read: it is served when the reader has returned.
    struct Deferred {
        IDType request;
        Loop loop;
    };

    Client& client_;
    const Read input_;
    const Read commands_;
    Output& out_;
    EngineHelp help_;
    std::vector<Open*> open_;  ///< the innermost one last
    bool reading_ = false;
    std::vector<Deferred> deferred_;  ///< the innermost one last
    std::vector<Client::Sent> leftBehind_;
    std::vector<foundation::msg_svc::eventmgr::EventMgr::Subscription> subscriptions_;
};

}  // namespace krutil_client
