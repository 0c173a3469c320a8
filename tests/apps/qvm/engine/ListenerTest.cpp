// An engine on a Unix socket.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <iomanip>
#include <sstream>

#include "apps/qvm/fixture/EngineFixture.hpp"
#include "support/TemporaryDirectory.hpp"

namespace qvm_test {
namespace {

using testing::HasSubstr;

class ListenerTest : public testing::Test {
  protected:
    // Starts an engine on the socket and waits until it serves.
    void serve(std::vector<std::string> more = {}) {
        more.insert(more.begin(), {"--listen", path_});
        engine_ = std::make_unique<EngineProcess>(more);
        engine_->awaitStderr("krutil-qvm: serving " + path_ + "\n");
    }

    // What an engine says that cannot serve the path.
    std::string refusal(const std::string& path) {
        EngineProcess engine({"--listen", path});
        EXPECT_EQ(engine.wait(), 3);
        return engine.stderrText();
    }

    mode_t modeOf(const std::string& path) {
        struct stat status {};
        EXPECT_EQ(::lstat(path.c_str(), &status), 0) << path;
        return status.st_mode & 07777U;
    }

    test_support::TemporaryDirectory directory_;
    std::string path_ = directory_.file("private/socket");
    std::unique_ptr<EngineProcess> engine_;
};

TEST_F(ListenerTest, DirectoryAndSocketArePrivate) {
    serve();
    EXPECT_EQ(modeOf(directory_.file("private")), 0700U);
    EXPECT_EQ(modeOf(path_), 0600U);
}

TEST_F(ListenerTest, SessionsAreProcessesOfTheirOwn) {
    serve();
    EngineClient first(connectTo(path_));
    EngineClient second(connectTo(path_));
    first.eval("x = 1");
    EXPECT_EQ(second.eval("x").errorId(), "NameError");
    const std::string pids =
        first.eval("import os\nos.getpid()").shown() + second.eval("import os\nos.getpid()").shown();
    EXPECT_EQ(pids.find(std::to_string(engine_->pid()) + "\n"), std::string::npos);
    EXPECT_EQ(first.goodbye().reason, session::SessionEnd::Reason::Finished);
    EXPECT_EQ(second.eval("1").shown(), "1\n");
}

TEST_F(ListenerTest, SessionThatAbortsLeavesTheOthers) {
    serve();
    EngineClient first(connectTo(path_));
    EngineClient second(connectTo(path_));
    second.eval("x = 1");
    first.enqueue("import os\nos.abort()");
    EXPECT_EQ(first.awaitEnd().reason, session::SessionEnd::Reason::Lost);
    EXPECT_EQ(second.eval("x").shown(), "1\n");
    engine_->awaitStderr("was ended by signal 6 (Aborted)\n");
    EngineClient third(connectTo(path_));
    EXPECT_EQ(third.eval("2").shown(), "2\n");
}

TEST_F(ListenerTest, SessionHasPlainStandardDescriptors) {
    serve();
    EngineClient client(connectTo(path_));
    EXPECT_EQ(client.eval("import os\nprint(os.readlink('/proc/self/fd/0'))").output(), "/dev/null\n");
    client.eval("os.write(1, b'plain\\n')");
    EXPECT_THAT(client.backgroundText(), HasSubstr("plain\n"));
    // Neither the listening socket nor what watches signals is left.
    EXPECT_EQ(client
                  .eval("print(sum('socket' in os.readlink(f'/proc/self/fd/{n}') for n in os.listdir('/proc/self/fd')"
                        " if os.path.exists(f'/proc/self/fd/{n}')))")
                  .output(),
              "2\n");
    EXPECT_EQ(client.eval("import signal\nprint(signal.pthread_sigmask(signal.SIG_BLOCK, []))").output(), "set()\n");
}

TEST_F(ListenerTest, SocketThatNobodyAnswersOnIsReplaced) {
    serve();
    engine_->signal(SIGKILL);
    engine_->wait();
    EXPECT_EQ(modeOf(path_), 0600U);
    serve();
    EngineClient client(connectTo(path_));
    EXPECT_EQ(client.eval("1").shown(), "1\n");
}

TEST_F(ListenerTest, SocketThatSomebodyAnswersOnIsLeftAlone) {
    serve();
    EXPECT_EQ(refusal(path_), "krutil-qvm: Another engine serves \"" + path_ + "\" already.\n");
    EngineClient client(connectTo(path_));
    EXPECT_EQ(client.eval("1").shown(), "1\n");
}

TEST_F(ListenerTest, FileThatIsNoSocketIsLeftAlone) {
    ::mkdir(directory_.file("private").c_str(), 0700);
    std::ofstream(path_) << "precious";
    EXPECT_EQ(refusal(path_), "krutil-qvm: \"" + path_ + "\" exists and is not a socket.\n");
    EXPECT_EQ(contentsOf(path_), "precious");
}

TEST_F(ListenerTest, LinkInThePlaceOfTheSocketIsLeftAlone) {
    serve();
    const std::string link = directory_.file("private/link");
    // To a socket that is served, to a file, and to nothing.
    for (const std::string& target : {path_, directory_.file("file"), directory_.file("private/nothing")}) {
        std::ofstream(directory_.file("file")) << "precious";
        ASSERT_EQ(::symlink(target.c_str(), link.c_str()), 0);
        EXPECT_EQ(refusal(link), "krutil-qvm: \"" + link + "\" exists and is not a socket.\n");
        EXPECT_EQ(std::filesystem::read_symlink(link), target);
        ::unlink(link.c_str());
    }
    EXPECT_EQ(contentsOf(directory_.file("file")), "precious");
    EXPECT_FALSE(std::filesystem::exists(directory_.file("private/nothing")));
}

TEST_F(ListenerTest, DirectoryThatIsOpenToOthersIsRefused) {
    const std::string open = directory_.file("open");
    ::mkdir(open.c_str(), 0700);
    for (const mode_t mode : {0750U, 0701U, 0770U, 01777U}) {
        ::chmod(open.c_str(), mode);
        std::ostringstream digits;
        digits << std::oct << std::setfill('0') << std::setw(4) << mode;
        EXPECT_EQ(refusal(open + "/socket"), "krutil-qvm: The directory \"" + open +
                                                 "\" is open to other users (mode " + digits.str() +
                                                 ", expected 0700): put the socket into a directory of your own.\n");
        EXPECT_TRUE(std::filesystem::is_empty(open));
    }
}

TEST_F(ListenerTest, ItsFilesMayNotBeAnotherUsers) {
    std::ofstream(directory_.file("other")) << "precious";
    std::filesystem::create_hard_link(directory_.file("other"), directory_.file("log"));
    EngineProcess engine({"--listen", path_, "--log", directory_.file("log")});
    EXPECT_EQ(engine.wait(), 3);
    EXPECT_EQ(engine.stderrText(), "krutil-qvm: Cannot append to \"" + directory_.file("log") +
                                       "\": the file has 2 names; name a file of your own\n");
    EXPECT_EQ(contentsOf(directory_.file("other")), "precious");
}

TEST_F(ListenerTest, DirectoryThatIsALinkIsRefused) {
    const std::string link = directory_.file("link");
    ::mkdir(directory_.file("real").c_str(), 0700);
    EXPECT_EQ(::symlink(directory_.file("real").c_str(), link.c_str()), 0);
    EXPECT_THAT(refusal(link + "/socket"), HasSubstr("Cannot open the directory \"" + link + "\""));
}

TEST_F(ListenerTest, DirectoryOfAnotherUserIsRefused) {
    if (::geteuid() != 0) {
        GTEST_SKIP() << "needs a directory of another user";
    }
    const std::string theirs = directory_.file("theirs");
    ::mkdir(theirs.c_str(), 0700);
    ASSERT_EQ(::chown(theirs.c_str(), 65534, 65534), 0);
    EXPECT_THAT(refusal(theirs + "/socket"), HasSubstr("belongs to user 65534, not to 0"));
}

TEST_F(ListenerTest, ClientOfAnotherUserIsRefused) {
    if (::geteuid() != 0) {
        GTEST_SKIP() << "needs to become another user";
    }
    serve();
    // As if the permissions had failed, so that only the check of the peer is left.
    ::chmod(directory_.path().c_str(), 0755);
    ::chmod(directory_.file("private").c_str(), 0755);
    ::chmod(path_.c_str(), 0666);
    const pid_t child = ::fork();
    if (child == 0) {
        if (::setresuid(65534, 65534, 65534) != 0) {
            ::_exit(1);
        }
        sockaddr_un address{};
        address.sun_family = AF_UNIX;
        path_.copy(address.sun_path, sizeof(address.sun_path) - 1);
        const int connection = ::socket(AF_UNIX, SOCK_STREAM, 0);
        if (::connect(connection, reinterpret_cast<const sockaddr*>(&address), sizeof(address)) != 0) {
            ::_exit(2);
        }
        // Whoever began to read it would say that this is no session. It may come too late.
        static_cast<void>(::send(connection, "GET /", 5, MSG_NOSIGNAL));
        char byte = 0;
        ::_exit(::read(connection, &byte, 1) <= 0 ? 0 : 3);
    }
    int status = 0;
    ASSERT_EQ(::waitpid(child, &status, 0), child);
    EXPECT_EQ(WEXITSTATUS(status), 0);
    const std::string refused = "krutil-qvm: refused a client of user 65534, since this engine serves user 0 only\n";
    EXPECT_EQ(engine_->awaitStderr(refused), "krutil-qvm: serving " + path_ + "\n" + refused);
}

// Whether a process of the user `user` that connects is answered.
bool answers(const std::string& path, uid_t user) {
    const pid_t child = ::fork();
    if (child == 0) {
        sockaddr_un address{};
        address.sun_family = AF_UNIX;
        path.copy(address.sun_path, sizeof(address.sun_path) - 1);
        const int connection = ::socket(AF_UNIX, SOCK_STREAM, 0);
        if (::setresuid(user, user, user) != 0 ||
            ::connect(connection, reinterpret_cast<const sockaddr*>(&address), sizeof(address)) != 0) {
            ::_exit(2);
        }
        char byte = 0;
        ::_exit(::read(connection, &byte, 1) == 1 ? 0 : 1);
    }
    int status = 0;
    EXPECT_EQ(::waitpid(child, &status, 0), child);
    EXPECT_NE(WEXITSTATUS(status), 2);
    return WEXITSTATUS(status) == 0;
}

TEST_F(ListenerTest, ClientOfAUserWhoIsAllowedIsServed) {
    serve({"--allow-user", "nobody"});
    EXPECT_EQ(modeOf(directory_.file("private")), 0711U);
    EXPECT_EQ(modeOf(path_), 0666U);
    EngineClient client(connectTo(path_));
    EXPECT_EQ(client.eval("1").shown(), "1\n");
    if (::geteuid() == 0) {
        ::chmod(directory_.path().c_str(), 0711);
        EXPECT_TRUE(answers(path_, 65534));
        EXPECT_FALSE(answers(path_, 65533));
        engine_->awaitStderr("refused a client of user 65533, since this engine serves users 0, 65534 only\n");
    }
}

TEST_F(ListenerTest, DirectoryThatOthersWriteToIsRefusedToAllowedUsersToo) {
    const std::string open = directory_.file("open");
    ::mkdir(open.c_str(), 0700);
    ::chmod(open.c_str(), 0731);
    EngineProcess engine({"--listen", open + "/socket", "--allow-user", "nobody"});
    EXPECT_EQ(engine.wait(), 3);
    EXPECT_EQ(engine.stderrText(), "krutil-qvm: The directory \"" + open +
                                       "\" is open to other users (mode 0731, expected 0711): put the socket into a "
                                       "directory of your own.\n");
}

TEST_F(ListenerTest, UserWhoIsNotThereIsNotAllowed) {
    EngineProcess engine({"--listen", path_, "--allow-user", "no-such-user"});
    EXPECT_EQ(engine.wait(), 3);
    EXPECT_EQ(engine.stderrText(), "krutil-qvm: --allow-user: there is no user \"no-such-user\" on this machine.\n");
}

TEST_F(ListenerTest, ClientsThatSayNothingAreCounted) {
    serve();
    const std::string line = "a client connected and left without a word, as health checks do";
    for (int i = 0; i < 3; ++i) {
        ::close(connectTo(path_));
    }
    engine_->awaitStderr(line + "\n");
    EngineClient client(connectTo(path_));
    client.enqueue("import os\nos.abort()");
    const std::string text = engine_->awaitStderr("was ended by signal 6 (Aborted)\n");
    EXPECT_EQ(text.find(line, text.find(line) + 1), std::string::npos) << text;
    EXPECT_EQ(text.find("closed the stream"), std::string::npos) << text;
}

TEST_F(ListenerTest, TooLongPathIsRefused) {
    EXPECT_THAT(refusal("/tmp/" + std::string(200, 'x')), HasSubstr("has 205 bytes; the system allows 107.\n"));
}

TEST_F(ListenerTest, SessionBeyondTheirNumberIsRefused) {
    serve({"--max-sessions", "1"});
    EngineClient first(connectTo(path_));
    first.eval("1");
    try {
        EngineClient second(connectTo(path_));
        ADD_FAILURE() << "a second session has begun";
    } catch (const session::HandshakeRefused& refused) {
        EXPECT_STREQ(
            refused.what(),
            "the session is refused by the engine: it has 1 session and may have no more (--max-sessions); try "
            "again when one has ended");
    }
    engine_->awaitStderr("refused a client: 1 sessions are open (--max-sessions)\n");
    EXPECT_EQ(first.eval("1").shown(), "1\n");
}

TEST_F(ListenerTest, ClientsWaitWhileThereIsNoDescriptorForThem) {
#if defined(KRUTIL_SANITIZED)
    GTEST_SKIP() << "the undefined-behaviour sanitizer needs a descriptor of the engine's to look at an object's type";
#endif
    serve();
    const std::string descriptors = "/proc/" + std::to_string(engine_->pid()) + "/fd/";
    rlim_t free = 0;
    while (std::filesystem::is_symlink(descriptors + std::to_string(free))) {
        ++free;
    }
    EngineClient first(connectTo(path_));
    first.eval("1");

    rlimit before{};
    ASSERT_EQ(::prlimit(engine_->pid(), RLIMIT_NOFILE, nullptr, &before), 0);
    const rlimit none{free, before.rlim_max};
    ASSERT_EQ(::prlimit(engine_->pid(), RLIMIT_NOFILE, &none, nullptr), 0);
    const auto begin = std::chrono::steady_clock::now();
    const int waiting = connectTo(path_);
    const std::string said = "cannot accept a client: Too many open files; clients wait meanwhile\n";
    engine_->awaitStderr(said);
    ASSERT_EQ(::prlimit(engine_->pid(), RLIMIT_NOFILE, &before, nullptr), 0);
    EXPECT_EQ(first.goodbye().reason, session::SessionEnd::Reason::Finished);
    EngineClient second(waiting);
    EXPECT_EQ(second.eval("2").shown(), "2\n");

    const std::string again = "clients are accepted again after ";
    const std::string text = engine_->awaitStderr(again);
    EXPECT_EQ(text.find(said, text.find(said) + 1), std::string::npos) << text;
    // An attempt a second and one for the end of the session.
    const auto seconds =
        std::chrono::duration_cast<std::chrono::seconds>(std::chrono::steady_clock::now() - begin).count();
    EXPECT_LE(std::stol(text.substr(text.find(again) + again.size())), seconds + 3) << text;
}

TEST_F(ListenerTest, EndRemovesTheSocketAndEndsTheSessions) {
    for (const int signal : {SIGTERM, SIGINT}) {
        serve();
        EngineClient client(connectTo(path_));
        const IDType id = client.enqueue("print('on')\nwhile True: pass");
        client.awaitText("on");
        engine_->signal(signal);
        EXPECT_EQ(engine_->wait(), 0);
        EXPECT_EQ(client.awaitEnd().reason, session::SessionEnd::Reason::Lost);
        EXPECT_THROW(client.await(id), std::runtime_error);
        struct stat status {};
        EXPECT_NE(::lstat(path_.c_str(), &status), 0);
    }
}

TEST_F(ListenerTest, SessionThatIgnoresItsEndIsKilled) {
    serve();
    EngineClient client(connectTo(path_));
    client.eval("import signal\nsignal.signal(signal.SIGTERM, signal.SIG_IGN)");
    engine_->signal(SIGTERM);
    EXPECT_EQ(engine_->wait(), 0);
    EXPECT_EQ(client.awaitEnd().reason, session::SessionEnd::Reason::Lost);
}

}  // namespace
}  // namespace qvm_test
