#include "EngineFixture.hpp"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <boost/core/demangle.hpp>
#include <boost/smart_ptr/make_shared.hpp>
#include <cerrno>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <stdexcept>
#include <system_error>
#include <thread>

#include "KrutilProtocol.hpp"
#include "cmddistributor/EvalIIP.hpp"
#include "cmddistributor/IIPCancelMessage.hpp"
#include "cmddistributor/IIPEnqueueMessage.hpp"
#include "cmddistributor/IIPStateEvent.hpp"
#include "krutil/capabilities_api/CapabilitiesChanged.hpp"
#include "krutil/eventmgr/QVMShutdownEvent.hpp"
#include "krutil/io/SinkTextEvent.hpp"
#include "krutil/io/TextBaseEvent.hpp"
#include "msg_svc/protobuf/ustring.hpp"

extern char** environ;

namespace qvm_test {
namespace {

using msg_svc::protobuf::ustring_to_utf8;
using msg_svc::protobuf::utf8_to_ustring;

[[noreturn]] void failWithErrno(const std::string& what) {
    throw std::system_error(errno, std::generic_category(), what);
}

// Type name without namespace; the state events are named after what they tell.
std::string kindOf(const BaseEvent& event) {
    using namespace cmddistributor;
    const std::type_info& type = typeid(event);
    const std::vector<std::pair<const std::type_info*, const char*>> stateEvents{
        {&typeid(IIPStartedEvent), "IIPStartedEvent"},     {&typeid(IIPSuspendedEvent), "IIPSuspendedEvent"},
        {&typeid(IIPResumedEvent), "IIPResumedEvent"},     {&typeid(IIPDiscardedEvent), "IIPDiscardedEvent"},
        {&typeid(IIPRequeuedEvent), "IIPRequeuedEvent"},   {&typeid(IIPReactivatedEvent), "IIPReactivatedEvent"},
        {&typeid(IIPCompletedEvent), "IIPCompletedEvent"}, {&typeid(LastIIPEvent), "LastIIPEvent"}};
    for (const auto& [known, name] : stateEvents) {
        if (*known == type) {
            return name;
        }
    }
    const std::string name = boost::core::demangle(type.name());
    return name.substr(name.rfind(':') + 1);
}

Happening happening(const boost::shared_ptr<const BaseEvent>& event) {
    Happening result;
    result.event = event;
    result.kind = kindOf(*event);
    if (const auto* request = dynamic_cast<const cmddistributor::RequestIdAdapter*>(event.get())) {
        result.id = request->getRequestId();
    }
    if (const auto* text = dynamic_cast<const krutil::io::TextBase*>(event.get())) {
        result.type = text->getStreamType();
        result.text = ustring_to_utf8(text->getText());
    }
    return result;
}

}  // namespace

EngineProcess::EngineProcess(const std::vector<std::string>& arguments) {
    std::array<int, 2> pair{};
    std::array<int, 2> errors{};
    if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair.data()) != 0 ||
        ::pipe2(errors.data(), O_CLOEXEC) != 0) {
        failWithErrno("socketpair or pipe");
    }
    connection_ = pair[0];
    stderr_ = errors[0];

    std::vector<std::string> words{KRUTIL_QVM};
    words.insert(words.end(), arguments.begin(), arguments.end());
    std::vector<char*> argv;
    for (std::string& word : words) {
        argv.push_back(word.data());
    }
    argv.push_back(nullptr);

    posix_spawn_file_actions_t actions;
    ::posix_spawn_file_actions_init(&actions);
    ::posix_spawn_file_actions_adddup2(&actions, pair[1], STDIN_FILENO);
    ::posix_spawn_file_actions_adddup2(&actions, pair[1], STDOUT_FILENO);
    ::posix_spawn_file_actions_adddup2(&actions, errors[1], STDERR_FILENO);
    // Whatever else the test runner left open is not the engine's.
    ::posix_spawn_file_actions_addclosefrom_np(&actions, 3);
    const int error = ::posix_spawn(&pid_, KRUTIL_QVM, &actions, nullptr, argv.data(), environ);
    ::posix_spawn_file_actions_destroy(&actions);
    ::close(pair[1]);
    ::close(errors[1]);
    if (error != 0) {
        throw std::system_error(error, std::generic_category(), "Cannot start " KRUTIL_QVM);
    }
}

EngineProcess::~EngineProcess() {
    if (!exitCode_) {
        ::kill(pid_, SIGKILL);
        ::waitpid(pid_, nullptr, 0);
    }
    if (connection_ >= 0) {
        ::close(connection_);
    }
    ::close(stderr_);
}

int EngineProcess::connection() {
    return std::exchange(connection_, -1);
}

int EngineProcess::wait() {
    if (!exitCode_) {
        int status = 0;
        while (::waitpid(pid_, &status, 0) < 0) {
            if (errno != EINTR) {
                failWithErrno("waitpid");
            }
        }
        exitCode_ = WIFEXITED(status) ? WEXITSTATUS(status) : -WTERMSIG(status);
    }
    return *exitCode_;
}

void EngineProcess::signal(int number) {
    ::kill(pid_, number);
}

void EngineProcess::readStderr(int timeoutMilliseconds) {
    pollfd watched{stderr_, POLLIN, 0};
    if (::poll(&watched, 1, timeoutMilliseconds) <= 0) {
        return;
    }
    std::array<char, 4096> bytes{};
    const ssize_t count = ::read(stderr_, bytes.data(), bytes.size());
    if (count > 0) {
        stderrText_.append(bytes.data(), static_cast<std::size_t>(count));
    }
}

std::string EngineProcess::awaitStderr(const std::string& text) {
    const auto deadline = std::chrono::steady_clock::now() + kPatience;
    while (stderrText_.find(text) == std::string::npos) {
        if (std::chrono::steady_clock::now() > deadline) {
            throw std::runtime_error("\"" + text + "\" never came; standard error holds: " + stderrText_);
        }
        readStderr(1000);
    }
    return stderrText_;
}

std::string EngineProcess::stderrText() {
    std::size_t before = 0;
    do {
        before = stderrText_.size();
        readStderr(0);
    } while (stderrText_.size() > before);
    return stderrText_;
}

int connectTo(const std::string& path) {
    const int connection = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    path.copy(address.sun_path, sizeof(address.sun_path) - 1);
    if (connection < 0 || ::connect(connection, reinterpret_cast<const sockaddr*>(&address), sizeof(address)) != 0) {
        failWithErrno("Cannot connect to " + path);
    }
    return connection;
}

std::string Evaluation::text(const std::string& kind, StreamTypeEnum type) const {
    std::string joined;
    for (const Happening& each : events) {
        if (each.kind == kind && each.type == type) {
            joined += each.text;
        }
    }
    return joined;
}

std::vector<std::string> Evaluation::kinds() const {
    std::vector<std::string> result;
    const Happening* before = nullptr;
    for (const Happening& each : events) {
        const bool furtherPiece =
            before != nullptr && each.kind == "TextBaseEvent" && before->kind == each.kind && before->type == each.type;
        if (!furtherPiece) {
            result.push_back(each.kind);
        }
        before = &each;
    }
    return result;
}

bool Evaluation::discarded() const {
    return std::any_of(events.begin(), events.end(),
                       [](const Happening& each) { return each.kind == "IIPDiscardedEvent"; });
}

std::string Evaluation::errorText() const {
    return error ? ustring_to_utf8(error->GetUnicodeMessageTxt()) : std::string();
}

EngineClient::EngineClient(int connection, const session::Limits& limits,
                           const capabilities::CapabilityList& capabilities) {
    krutil::protobuf::KrutilProtocol::init();
    session::SessionConfig config;
    config.role = session::Role::Client;
    config.build = "engine test";
    config.limits = limits;
    config.capabilities = capabilities;
    config.handshakeTimeout = std::chrono::duration_cast<std::chrono::milliseconds>(kPatience);
    config.trace = [this](const session::FrameTrace& trace) { patch(trace); };
    session_ = session::Session::open(connection, connection, std::move(config));
    session_->start(*this);
}

EngineClient::~EngineClient() {
    readOn();
    session_.reset();
}

// Before a frame is written, its bytes are still those that the serializer allocated.
void EngineClient::patch(const session::FrameTrace& trace) const {
    const auto* const tagged = dynamic_cast<const session::framing::TaggedFrame*>(&trace.frame);
    if (!trace.outgoing || streamNumber_ == 1000 || tagged == nullptr || tagged->tag() != "krutil:EvalIIP") {
        return;
    }
    const std::string_view thousand("\xE8\x07", 2);
    const std::size_t place = std::string_view(tagged->data(), tagged->size()).find(thousand);
    if (place != std::string_view::npos) {
        char* const bytes = const_cast<char*>(tagged->data()) + place;
        bytes[0] = static_cast<char>(0x80 | (streamNumber_ & 0x7F));
        bytes[1] = static_cast<char>(streamNumber_ >> 7);
    }
}

IDType EngineClient::enqueue(const std::string& code, const EvalOptions& options) {
    return enqueue(
        boost::make_shared<const cmddistributor::EvalIIP>(options.pluginType, options.streams, nullptr, options.out,
                                                          options.err, utf8_to_ustring(code), options.codeType),
        options);
}

IDType EngineClient::enqueue(const boost::shared_ptr<const cmddistributor::IIP>& iip, const EvalOptions& options) {
    const IDType id = IDType::random();
    const session::framing::StreamID stream = session_->newStreamID();
    {
        std::lock_guard lock(mutex_);
        exchanges_[stream].id = id;
        streams_[id] = stream;
    }
    const boost::shared_ptr<const foundation::msg_svc::exchange::Message> message =
        boost::make_shared<const cmddistributor::IIPEnqueueMessage>(
            iip, id, 0, boost::none, nullptr, options.mode, u"", options.capabilities, nullptr, options.flushSparingly);
    session_->send(stream, message);
    return id;
}

template <class Ready>
void EngineClient::waitUntil(std::unique_lock<std::mutex>& lock, const std::string& what, Ready ready) {
    if (!changed_.wait_for(lock, kPatience, [&] { return ready() || end_; })) {
        throw std::runtime_error("No " + what + " within the patience of a test");
    }
    if (!ready()) {
        throw std::runtime_error("No " + what + ", the session is over: " + end_->text);
    }
}

Evaluation EngineClient::await(const IDType& id) {
    Evaluation result;
    {
        std::unique_lock lock(mutex_);
        const Exchange& exchange = exchanges_.at(streams_.at(id));
        waitUntil(lock, "reply", [&] { return exchange.reply != nullptr; });
        result.id = id;
        result.events = exchange.events;
        result.reply = exchange.reply;
    }
    EXPECT_EQ(result.reply->getID(), id);
    EXPECT_NE(result.reply->getResult(), nullptr);
    if (result.reply->getResult()) {
        EXPECT_EQ(result.reply->getResult()->id, id);
        result.error = result.reply->getResult()->getException();
    }
    return result;
}

session::framing::StreamID EngineClient::startCancel(const IDType& id, bool evenIfRunning) {
    const session::framing::StreamID stream = session_->newStreamID();
    {
        std::lock_guard lock(mutex_);
        exchanges_[stream].id = id;
    }
    const boost::shared_ptr<const foundation::msg_svc::exchange::Message> message =
        boost::make_shared<const cmddistributor::IIPCancelMessage>(id, evenIfRunning);
    session_->send(stream, message);
    return stream;
}

cmddistributor::IIPCancelReply::CancelStatus EngineClient::awaitCancel(session::framing::StreamID cancel) {
    std::unique_lock lock(mutex_);
    const Exchange& exchange = exchanges_.at(cancel);
    waitUntil(lock, "reply to a cancel", [&] { return exchange.cancelReply != nullptr; });
    EXPECT_TRUE(exchange.events.empty());
    return exchange.cancelReply->getStatus();
}

void EngineClient::changeCapabilities(const capabilities::CapabilityList& capabilities) {
    const boost::shared_ptr<const BaseEvent> event =
        boost::make_shared<const krutil::capabilities_api::CapabilitiesChanged>(
            capabilities::CapabilityList(), capabilities::CapabilityList(), capabilities,
            capabilities::CapabilityList());
    session_->send(0, event);
}

void EngineClient::awaitLoop(const IDType& id, cmddistributor::DebugLoopEvent::State state) {
    awaitEvent([&](const Happening& each) {
        const auto* const loop = dynamic_cast<const cmddistributor::DebugLoopEvent*>(each.event.get());
        return each.id == id && loop != nullptr && loop->getLoopState() == state;
    });
}

void EngineClient::awaitKind(const IDType& id, const std::string& kind) {
    awaitEvent([&](const Happening& each) { return each.id == id && each.kind == kind; });
}

void EngineClient::stopReading() {
    std::lock_guard lock(mutex_);
    reading_ = false;
}

void EngineClient::readOn() {
    {
        std::lock_guard lock(mutex_);
        reading_ = true;
    }
    changed_.notify_all();
}

Happening EngineClient::awaitEvent(const std::function<bool(const Happening&)>& isMeant) {
    std::unique_lock lock(mutex_);
    std::size_t seen = 0;
    Happening found;
    waitUntil(lock, "event of the kind that the test waits for", [&] {
        for (; seen < all_.size(); ++seen) {
            if (isMeant(all_[seen])) {
                found = all_[seen];
                return true;
            }
        }
        return found.event != nullptr;
    });
    return found;
}

Happening EngineClient::awaitText(const std::string& part) {
    return awaitEvent([&](const Happening& each) { return each.text.find(part) != std::string::npos; });
}

std::vector<Happening> EngineClient::background() {
    std::lock_guard lock(mutex_);
    return background_;
}

std::string EngineClient::backgroundText() {
    std::string joined;
    for (const Happening& each : background()) {
        joined += each.text;
    }
    return joined;
}

session::SessionEnd EngineClient::awaitEnd() {
    std::unique_lock lock(mutex_);
    if (!changed_.wait_for(lock, kPatience, [&] { return end_.has_value(); })) {
        throw std::runtime_error("The session did not end within the patience of a test");
    }
    return *end_;
}

session::SessionEnd EngineClient::goodbye() {
    session_->sayGoodbye();
    return awaitEnd();
}

void EngineClient::onReply(session::framing::StreamID stream, const boost::shared_ptr<const Reply>& reply) {
    {
        std::lock_guard lock(mutex_);
        Exchange& exchange = exchanges_[stream];
        exchange.reply = boost::dynamic_pointer_cast<const krutil::cmddistributor::IIPReply>(reply);
        exchange.cancelReply = boost::dynamic_pointer_cast<const cmddistributor::IIPCancelReply>(reply);
        if (!exchange.cancelReply) {
            EXPECT_EQ(exchange.life.next("IIPReply"), "") << "on stream " << stream;
        }
    }
    changed_.notify_all();
}

void EngineClient::onEvent(session::framing::StreamID stream, const boost::shared_ptr<const BaseEvent>& event) {
    std::this_thread::sleep_for(slowness_.load());
    {
        std::unique_lock lock(mutex_);
        changed_.wait(lock, [this] { return reading_; });
        Happening each = happening(event);
        all_.push_back(each);
        if (stream == 0) {
            background_.push_back(std::move(each));
        } else {
            Exchange& exchange = exchanges_[stream];
            EXPECT_EQ(exchange.life.next(each.kind), "") << "on stream " << stream;
            EXPECT_EQ(each.id, exchange.id) << each.kind << " on stream " << stream;
            exchange.events.push_back(std::move(each));
        }
    }
    changed_.notify_all();
}

void EngineClient::onEnd(const session::SessionEnd& end) {
    {
        std::lock_guard lock(mutex_);
        if (end.reason == session::SessionEnd::Reason::Finished) {
            for (const auto& [id, stream] : streams_) {
                EXPECT_EQ(exchanges_[stream].life.whatIsMissing(), "") << "on stream " << stream;
            }
        }
        end_ = end;
    }
    changed_.notify_all();
}

TemporaryDirectory::TemporaryDirectory() {
    std::string pattern = std::filesystem::temp_directory_path().string() + "/krutil-test-XXXXXX";
    if (::mkdtemp(pattern.data()) == nullptr) {
        failWithErrno("mkdtemp");
    }
    path_ = pattern;
}

TemporaryDirectory::~TemporaryDirectory() {
    std::error_code ignored;
    std::filesystem::remove_all(path_, ignored);
}

Gate::Gate() : path_(directory_.file("gate")) {
    if (::mkfifo(path_.c_str(), 0600) != 0) {
        failWithErrno("mkfifo");
    }
}

void Gate::open() {
    // Opening waits for the reader; closing is the end of its file.
    std::ofstream out(path_);
}

std::string contentsOf(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    return {std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>()};
}

namespace {

std::vector<std::string> withStdio(std::vector<std::string> arguments) {
    arguments.insert(arguments.begin(), "--stdio");
    return arguments;
}

}  // namespace

EngineSession::EngineSession(std::vector<std::string> arguments, const session::Limits& limits,
                             const capabilities::CapabilityList& capabilities)
    : process(withStdio(std::move(arguments))), client(process.connection(), limits, capabilities) {}

}  // namespace qvm_test
