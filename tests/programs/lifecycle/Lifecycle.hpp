// Sessions of real programs that something happens to, at each of their stages.
//
// A stage is a point of a session where both ends stand still or repeat themselves, so that whatever is done to one of
// them happens exactly there. What can be done is the same at every stage; what comes of it is in the table of stages.
//
//     reach(stageNamed("DebugPrompt"), Link::Child);
//     signalOne(engine(), SIGKILL);
//     expectLostEngine("was killed by signal 9 (Killed)");
#pragma once

#include <gtest/gtest.h>
#include <sys/types.h>

#include <map>
#include <memory>
#include <optional>
#include <ostream>
#include <string>
#include <vector>

#include "programs/lifecycle/Processes.hpp"
#include "programs/support/Program.hpp"
#include "programs/support/Relay.hpp"
#include "support/TemporaryDirectory.hpp"

namespace programs_test {

class LifecycleTest;

/// What is between the client and the engine.
enum class Link {
    Child,     ///< the client has started the engine
    Listener,  ///< the client has connected to an engine that listens
    Network,   ///< the same, through a relay of the test
};

std::string nameOf(Link link);

/// One row of the table. What the ends say is plain text, or, where that is said, a regular expression.
struct Stage {
    using Step = void (*)(LifecycleTest& test);

    std::string name;
    std::vector<Link> links;             ///< those that make a difference
    std::vector<std::string> arguments;  ///< of the client

    /// What is set up before the client starts, what happens then until the stage is reached, and what the client has
    /// said by then on its standard error.
    Step prepare = nullptr;
    Step reach = nullptr;
    std::string said{};

    /// What the person at the client does next, without having to see anything for it, and what happens then until the
    /// session ends, how, and with which words. Without an answer the stage is one that only force leads out of.
    Step answer = nullptr;
    Step finish = nullptr;
    int exitCode = 0;
    std::string end{};

    /// Where the stream ends for each end that loses the other one (regular expressions), how the client's sentence
    /// goes on, and its exit code then.
    std::string clientLost = "the stream ended between two messages, before the engine's shutdown event";
    std::string engineLost = "the stream ended between two messages, without the client's goodbye";
    std::string when = " before it answered";
    int lostExitCode = 3;

    /// What the person does to leave before pressing Ctrl-C again and again, and whether the session is running then,
    /// so that the second Ctrl-C ends it.
    Step leave = nullptr;
    bool running = true;
};

std::ostream& operator<<(std::ostream& out, const Stage& stage);

/// The table.
const std::vector<Stage>& stages();
const Stage& stageNamed(const std::string& name);

/// A regular expression that only `text` matches.
std::string plain(const std::string& text);

/// A client in its terminal, its engine and what is between them. At the end of a test nothing may be left of all that:
/// no process, no descriptor of an engine that listens, no file in the directory of its socket.
class LifecycleTest : public ::testing::Test {
  public:
    LifecycleTest();

    // For the steps of the table.

    Program& client() { return *client_; }
    Relay& relay() { return *relay_; }
    std::string file(const std::string& name) const { return files_.file(name); }
    void addArgument(const std::string& argument) { arguments_.push_back(argument); }

  protected:
    void TearDown() override;

    /// Starts an engine that listens, by the words of `before` if it is given.
    void listen(const std::vector<std::string>& before = {});
    Program& listener() { return *listener_; }
    std::string socket() const { return sockets_.file("engine"); }

    /// Makes a network between the clients that come and the engine that listens.
    void makeNetwork();

    /// Brings a client and its engine to the stage, starting what is missing.
    void reach(const Stage& stage, Link link);
    const Stage& stage() const { return *stage_; }
    pid_t engine() const { return engine_; }

    /// From the stage to the end of the session in good order.
    void finish();

    /// Does what the stage has for leaving, and presses Ctrl-C again and again until the client has gone, as a person
    /// does who does not know how often.
    void leave();

    /// The client has lost its engine, and says so; one that it had started itself "was killed ...", as `how` says.
    void expectLostEngine(const std::string& how);

    /// The client has been ended by signal `number`; its engine says so and goes.
    void expectLostClient(int number);

    /// The session's process goes. An engine that listens says about that what the regular expression tells.
    void expectEngineGone(const std::string& said);

    /// The engine that listens says this as well by its end (a regular expression).
    void expectListenerSays(const std::string& said) { log_ += said; }

    /// The engine that listens has no session any more, nor a descriptor of one.
    void expectNoSessions();

    /// The engine that listens ends in good order, and leaves no file.
    void expectListenerGone();

    /// Sets this client aside, which is at its stage, for the next one.
    struct Apart {
        const Stage* stage;
        pid_t engine;
        std::unique_ptr<Program> client;
    };
    Apart setApart();
    void takeBack(Apart&& apart);

    /// What an end says, as a regular expression, behind the sentence about a stream that it was writing to.
    static constexpr const char* writing = "(; writing to it had failed: (Broken pipe|Connection reset by peer))?";

  private:
    test_support::TemporaryDirectory files_;
    test_support::TemporaryDirectory sockets_;
    std::optional<Program> listener_;
    std::map<int, std::string> descriptors_;  ///< of the listener, before its first session
    std::string log_;                         ///< a regular expression for what the listener has said
    std::optional<Relay> relay_;
    std::vector<std::string> arguments_;
    std::unique_ptr<Program> client_;
    Link link_ = Link::Child;
    const Stage* stage_ = nullptr;
    pid_t engine_ = -1;
};

}  // namespace programs_test
