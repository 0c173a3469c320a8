#include "krutil/session/TlsRelay.hpp"

#include <arpa/inet.h>
#include <netdb.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <openssl/err.h>
#include <openssl/ssl.h>
#include <openssl/x509v3.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstddef>
#include <cstdio>
#include <optional>
#include <stdexcept>
#include <string_view>
#include <system_error>
#include <vector>

#include "foundation/core/posix/SignalsBlocked.hpp"
#include "krutil/base/ExitCode.hpp"

namespace krutil_client {
namespace {

namespace posix = foundation::core::posix;

constexpr std::string_view scheme = "tls://";
// How long what was written last may take to leave, in milliseconds.
constexpr int patienceForLast = 1000;
constexpr std::size_t bufferSize = std::size_t{256} << 10;

// Ends the relay with a reason.
class RelayFailed : public std::runtime_error {
  public:
    using std::runtime_error::runtime_error;
};

// Ends the relay because nobody uses it any more.
class RelayStopped {};

std::string systemText(int error) {
    return std::generic_category().message(error);
}

// What the library has noted in this thread, before others that follow from it.
std::string libraryText() {
    const unsigned long error = ::ERR_peek_error();
    ::ERR_clear_error();
    if (ERR_SYSTEM_ERROR(error)) {
        return systemText(ERR_GET_REASON(error));
    }
    const char* const reason = error != 0 ? ::ERR_reason_error_string(error) : nullptr;
    return reason != nullptr ? reason : "no reason is known";
}

SSL_CTX* contextOf(const std::shared_ptr<void>& context) {
    return static_cast<SSL_CTX*>(context.get());
}

[[noreturn]] void unusable(const std::string& option, const std::string& file) {
    throw Failure(ExitCode::Usage, option + ": cannot use the file '" + file + "': " + libraryText());
}

// Whoever reads the key can pass for its owner. A key of the administrator's may be there for a group.
void requirePrivate(const std::string& file) {
    struct stat status {};
    if (::stat(file.c_str(), &status) != 0) {
        return;  // to be told by whoever opens it
    }
    const mode_t open = status.st_mode & (status.st_uid == 0 ? S_IRWXO : S_IRWXG | S_IRWXO);
    if (open != 0) {
        std::array<char, 8> mode{};
        std::snprintf(mode.data(), mode.size(), "%04o", static_cast<unsigned>(status.st_mode & 07777U));
        throw Failure(ExitCode::Usage,
                      "--key: the file '" + file + "' is open to other users (mode " + mode.data() +
                          ", expected 0600); whoever reads it can pass for you, so close it: chmod 600");
    }
}

std::shared_ptr<void> makeContext(const TlsAddress& address) {
    if (address.authorities.empty()) {
        throw Failure(
            ExitCode::Usage,
            "--connect tls://HOST:PORT needs --ca FILE: the authorities that the certificate there is checked "
            "with");
    }
    requirePrivate(address.key);
    std::shared_ptr<SSL_CTX> context(::SSL_CTX_new(::TLS_client_method()), &::SSL_CTX_free);
    if (!context) {
        throw Failure(ExitCode::Stream, "cannot use TLS: " + libraryText());
    }
    SSL_CTX* const tls = context.get();
    ::SSL_CTX_set_min_proto_version(tls, TLS1_2_VERSION);
    ::SSL_CTX_set_verify(tls, SSL_VERIFY_PEER, nullptr);
    ::SSL_CTX_set_options(tls, SSL_OP_NO_RENEGOTIATION);
    ::SSL_CTX_set_mode(tls, SSL_MODE_ENABLE_PARTIAL_WRITE | SSL_MODE_ACCEPT_MOVING_WRITE_BUFFER);
    ::SSL_CTX_set_read_ahead(tls, 1);
    ::SSL_CTX_set_default_read_buffer_len(tls, bufferSize);
    // Nobody is asked: a key with a passphrase is one that cannot be used.
    ::SSL_CTX_set_default_passwd_cb(tls, [](char*, int, int, void*) { return 0; });
    if (::SSL_CTX_load_verify_file(tls, address.authorities.c_str()) != 1) {
        unusable("--ca", address.authorities);
    }
    if (!address.certificate.empty() && ::SSL_CTX_use_certificate_chain_file(tls, address.certificate.c_str()) != 1) {
        unusable("--cert", address.certificate);
    }
    if (!address.key.empty() && ::SSL_CTX_use_PrivateKey_file(tls, address.key.c_str(), SSL_FILETYPE_PEM) != 1) {
        unusable("--key", address.key);
    }
    return context;
}

// Waits for what `descriptors` are watched for. The last one is the relay's sign to stop.
void waitFor(std::vector<pollfd>& descriptors) {
    while (::poll(descriptors.data(), descriptors.size(), -1) < 0) {
        if (errno != EINTR) {
            throw RelayFailed("cannot wait: " + systemText(errno));
        }
    }
    if (descriptors.back().revents != 0) {
        throw RelayStopped();
    }
}

std::optional<posix::OwnedDescriptor> connectTo(const addrinfo& address, int stop, int& error) {
    posix::OwnedDescriptor socket(
        ::socket(address.ai_family, address.ai_socktype | SOCK_CLOEXEC | SOCK_NONBLOCK, address.ai_protocol));
    if (!socket) {
        error = errno;
        return std::nullopt;
    }
    if (::connect(socket.get(), address.ai_addr, address.ai_addrlen) != 0) {
        error = errno;
        if (error != EINPROGRESS) {
            return std::nullopt;
        }
        std::vector<pollfd> watched{{socket.get(), POLLOUT, 0}, {stop, POLLIN, 0}};
        waitFor(watched);
        socklen_t size = sizeof error;
        ::getsockopt(socket.get(), SOL_SOCKET, SO_ERROR, &error, &size);
        if (error != 0) {
            return std::nullopt;
        }
    }
    const int on = 1;
    ::setsockopt(socket.get(), IPPROTO_TCP, TCP_NODELAY, &on, sizeof on);
    return socket;
}

posix::OwnedDescriptor connectTo(const TlsAddress& address, int stop) {
    addrinfo hints{};
    hints.ai_socktype = SOCK_STREAM;
    addrinfo* found = nullptr;
    if (const int error = ::getaddrinfo(address.host.c_str(), address.port.c_str(), &hints, &found); error != 0) {
        throw RelayFailed(::gai_strerror(error));
    }
    const std::unique_ptr<addrinfo, decltype(&::freeaddrinfo)> owned(found, &::freeaddrinfo);
    int error = 0;
    for (const addrinfo* each = found; each != nullptr; each = each->ai_next) {
        if (auto socket = connectTo(*each, stop, error)) {
            return std::move(*socket);
        }
    }
    throw RelayFailed(systemText(error));
}

// Has the handshake fail when the certificate there is for another name or address.
void expectName(SSL* tls, const std::string& host) {
    std::array<unsigned char, sizeof(in6_addr)> number{};
    const bool isNumber = ::inet_pton(AF_INET, host.c_str(), number.data()) == 1 ||
                          ::inet_pton(AF_INET6, host.c_str(), number.data()) == 1;
    ::SSL_set_hostflags(tls, X509_CHECK_FLAG_NO_PARTIAL_WILDCARDS | X509_CHECK_FLAG_NEVER_CHECK_SUBJECT);
    // The name is also told to the other end, which may have several certificates: as SSL_set_tlsext_host_name() does,
    // without its C cast.
    const bool done = isNumber ? ::X509_VERIFY_PARAM_set1_ip_asc(::SSL_get0_param(tls), host.c_str()) == 1
                               : ::SSL_set1_host(tls, host.c_str()) == 1 &&
                                     ::SSL_ctrl(tls, SSL_CTRL_SET_TLSEXT_HOSTNAME, TLSEXT_NAMETYPE_host_name,
                                                const_cast<char*>(host.c_str())) == 1;
    if (!done) {
        throw RelayFailed("cannot check a certificate for '" + host + "': " + libraryText());
    }
}

}  // namespace

TlsAddress parseTlsAddress(const std::string& text) {
    const std::string rest = text.starts_with(scheme) ? text.substr(scheme.size()) : std::string();
    const auto colon = rest.rfind(':');
    std::string host = rest.substr(0, colon == std::string::npos ? 0 : colon);
    const bool bracketed = host.size() > 2 && host.front() == '[' && host.back() == ']';
    if (bracketed) {
        host = host.substr(1, host.size() - 2);
    }
    if (host.empty() || colon + 1 == rest.size() || (!bracketed && host.find_first_of(":[]") != std::string::npos)) {
        throw Failure(ExitCode::Usage, "--connect: expected tls://HOST:PORT, got " + text);
    }
    return {host, rest.substr(colon + 1)};
}

// The two directions of an established connection.
class TlsRelay::Pump {
  public:
    Pump(SSL* tls, int network, int inner, int stop) : tls_(tls), network_(network), inner_(inner), stop_(stop) {}

    void shakeHands() {
        for (;;) {
            begin();
            const int result = ::SSL_connect(tls_);
            if (result == 1) {
                return;
            }
            note(result);
            wait();
        }
    }

    // Returns when both ends are done with the stream, in good order.
    void run() {
        for (;;) {
            begin();
            bool moved = takeFromInner();
            moved |= giveToNetwork();
            moved |= takeFromNetwork();
            moved |= giveToInner();
            if (innerEnded_ && out_.empty()) {
                ::SSL_shutdown(tls_);
                return;
            }
            if (networkEnded_ && in_.empty()) {
                if (!failure_.empty()) {
                    throw RelayFailed(failure_);
                }
                return;
            }
            if (!moved) {
                wait();
            }
        }
    }

  private:
    struct Buffer {
        std::vector<char> bytes = std::vector<char>(bufferSize);
        std::size_t begin = 0;
        std::size_t end = 0;

        bool empty() const { return begin == end; }
        std::size_t room() const { return bytes.size() - end; }
        void take(std::size_t count) {
            begin += count;
            if (begin == end) {
                begin = end = 0;
            }
        }
    };

    void begin() {
        ::ERR_clear_error();
        forNetwork_ = 0;
        forInner_ = 0;
    }

    // What the connection waits for after a call that did nothing.
    void note(int result) {
        const int error = ::SSL_get_error(tls_, result);
        if (error == SSL_ERROR_WANT_READ) {
            forNetwork_ |= POLLIN;
        } else if (error == SSL_ERROR_WANT_WRITE) {
            forNetwork_ |= POLLOUT;
        } else if (const long checked = ::SSL_get_verify_result(tls_); checked != X509_V_OK) {
            ::ERR_clear_error();
            throw RelayFailed(std::string("the certificate there is not accepted: ") +
                              ::X509_verify_cert_error_string(checked));
        } else {
            throw RelayFailed(error == SSL_ERROR_SYSCALL && errno != 0 ? systemText(errno) : libraryText());
        }
    }

    void wait() {
        std::vector<pollfd> watched{{forNetwork_ != 0 ? network_ : -1, forNetwork_, 0},
                                    {forInner_ != 0 ? inner_ : -1, forInner_, 0},
                                    {stop_, POLLIN, 0}};
        waitFor(watched);
    }

    bool takeFromInner() {
        if (innerEnded_ || !failure_.empty() || !out_.empty()) {
            return false;
        }
        const ssize_t got = ::recv(inner_, out_.bytes.data(), out_.bytes.size(), MSG_DONTWAIT);
        if (got > 0) {
            out_.end = static_cast<std::size_t>(got);
            return true;
        }
        innerEnded_ = got == 0 || (errno != EAGAIN && errno != EINTR);
        forInner_ |= POLLIN;
        return innerEnded_;
    }

    bool giveToNetwork() {
        if (out_.empty()) {
            return false;
        }
        std::size_t written = 0;
        const int result = ::SSL_write_ex(tls_, out_.bytes.data() + out_.begin, out_.end - out_.begin, &written);
        if (result == 1) {
            out_.take(written);
            return true;
        }
        try {
            note(result);
        } catch (const RelayFailed& failed) {
            // The other end may have said why, and more before that, so reading goes on.
            failure_ = failed.what();
            out_ = {};
        }
        return false;
    }

    bool takeFromNetwork() {
        bool moved = false;
        while (!networkEnded_ && in_.room() > 0) {
            std::size_t got = 0;
            const int result = ::SSL_read_ex(tls_, in_.bytes.data() + in_.end, in_.room(), &got);
            if (result == 1) {
                in_.end += got;
                moved = true;
            } else if (::SSL_get_error(tls_, result) == SSL_ERROR_ZERO_RETURN) {
                networkEnded_ = true;
                moved = true;
            } else {
                try {
                    note(result);
                    break;
                } catch (const RelayFailed& failed) {
                    // What came before is still to be delivered.
                    failure_ = failed.what();
                    networkEnded_ = true;
                    moved = true;
                }
            }
        }
        return moved;
    }

    bool giveToInner() {
        if (in_.empty()) {
            return false;
        }
        const ssize_t put =
            ::send(inner_, in_.bytes.data() + in_.begin, in_.end - in_.begin, MSG_DONTWAIT | MSG_NOSIGNAL);
        if (put < 0 && errno != EAGAIN && errno != EINTR) {
            throw RelayStopped();
        }
        if (put <= 0) {
            forInner_ |= POLLOUT;
            return false;
        }
        in_.take(static_cast<std::size_t>(put));
        return true;
    }

    SSL* const tls_;
    const int network_;
    const int inner_;
    const int stop_;
    Buffer out_;
    Buffer in_;
    bool innerEnded_ = false;
    bool networkEnded_ = false;
    std::string failure_;
    short forNetwork_ = 0;
    short forInner_ = 0;
};

TlsRelay::TlsRelay(const TlsAddress& address)
    : address_(address), stop_("A TLS connection"), done_("A TLS connection"), context_(makeContext(address)) {
    std::array<int, 2> ends{};
    if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends.data()) != 0) {
        throw Failure(ExitCode::Stream, "cannot make a socket pair: " + systemText(errno));
    }
    stream_.reset(ends[0]);
    inner_.reset(ends[1]);
    const posix::SignalsBlocked blocked;
    thread_ = std::thread([this] { run(); });
}

TlsRelay::~TlsRelay() {
    if (established_) {
        // The stream is closed by now, so what was written to it is all that is left to be passed on.
        pollfd watched{done_.get(), POLLIN, 0};
        ::poll(&watched, 1, patienceForLast);
    }
    stop_.raise();
    thread_.join();
}

std::string TlsRelay::failure() const {
    const std::lock_guard lock(mutex_);
    return failure_;
}

void TlsRelay::run() {
    try {
        const posix::OwnedDescriptor network = connectTo(address_, stop_.get());
        const std::unique_ptr<SSL, decltype(&::SSL_free)> tls(::SSL_new(contextOf(context_)), &::SSL_free);
        if (!tls || ::SSL_set_fd(tls.get(), network.get()) != 1) {
            throw RelayFailed(libraryText());
        }
        expectName(tls.get(), address_.host);
        Pump pump(tls.get(), network.get(), inner_.get(), stop_.get());
        pump.shakeHands();
        established_ = true;
        pump.run();
    } catch (const RelayStopped&) {
        // Nobody is left who wants to know.
    } catch (const std::exception& error) {
        const std::lock_guard lock(mutex_);
        failure_ = error.what();
    }
    // After the reason is known: whoever uses the stream asks for it then.
    inner_.reset();
    done_.raise();
}

}  // namespace krutil_client
