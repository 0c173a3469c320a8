// What a person is asked while a request is held up.
#pragma once

#include <functional>
#include <string>
#include <vector>

#include "cmddistributor/DebugLoopEvent.hpp"
#include "krutil/prompt/InputRequester.hpp"
#include "krutil/session/Client.hpp"
#include "krutil/terminal/LineReader.hpp"

namespace krutil_client {

/// Answers the engine's prompts as long as it lives. At an input prompt a line is read and sent as it is. At a debug or
/// keyboard prompt code is read and evaluated, until one of its lines leaves the prompt: ":c" goes on, ":q" and Ctrl-D
/// quit. At a pause a line goes on. A prompt that the engine closes ends the reading. Main thread only.
class Prompts {
  public:
    /// Reads a line as LineReader::read() does.
    using Read = std::function<ReadLine(const std::string& prompt, const std::function<bool()>& done)>;

    /// `input` reads the lines of running code, `commands` those of prompts. `client` must outlive the object.
    Prompts(Client& client, Read input, Read commands);
    ~Prompts();
    Prompts(const Prompts&) = delete;
    Prompts& operator=(const Prompts&) = delete;

  private:
    struct Open;

    void onLoop(const cmddistributor::DebugLoopEvent& event);
    void serve(Open& open, krutil::prompt::InputRequester loop);
    void readInput(Open& open);
    void readPause(Open& open);
    void readCommands(Open& open, const std::string& prompt);
    void answer(const std::string& command);

    Client& client_;
    const Read input_;
    const Read commands_;
    std::vector<Open*> open_;  ///< the innermost one last
    foundation::msg_svc::eventmgr::EventMgr::Subscription subscription_;
};

}  // namespace krutil_client
