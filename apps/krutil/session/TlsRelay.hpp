// A session's byte stream inside TLS.
#pragma once

#include <atomic>
#include <memory>
#include <mutex>
#include <string>
#include <thread>

#include "foundation/core/posix/EventDescriptor.hpp"
#include "foundation/core/posix/OwnedDescriptor.hpp"

namespace krutil_client {

/// Where an engine is reached through TLS, and with which files.
struct TlsAddress {
    std::string host;           ///< a name, or an address of a network; what the certificate there must be for
    std::string port;           ///< a number or a service's name
    std::string certificate{};  ///< PEM file of this end's certificate and its chain; empty for none
    std::string key{};          ///< PEM file of its key, without a passphrase; empty for none
    std::string authorities{};  ///< PEM file of the authorities that are trusted
};

/// Takes "tls://HOST:PORT" apart, with brackets around a HOST that has colons. Throws Failure (Usage) for another text.
/// The files are left empty.
TlsAddress parseTlsAddress(const std::string& text);

/// Passes bytes between a socket pair and a TLS connection, in a thread of its own. The thread connects, too, so that
/// whoever uses the stream waits for it as for a slow engine. The connection is encrypted with TLS 1.2 or later, and
/// the certificate of the other end is checked, its name included.
class TlsRelay {
  public:
    /// Reads the files. Throws Failure (Usage) for one that is missing or cannot be used, and for a key that is open to
    /// other users.
    explicit TlsRelay(const TlsAddress& address);

    /// Closes what is open. The stream must be closed by then. Waits up to a second for what was written last, and for
    /// the system's resolver if it still looks for the host.
    ~TlsRelay();
    TlsRelay(const TlsRelay&) = delete;
    TlsRelay& operator=(const TlsRelay&) = delete;

    /// The stream, which is the caller's from now on; once.
    int takeStream() noexcept { return stream_.release(); }

    /// Why the connection ended or was not made, empty while it lasts and after an end in good order. May be called
    /// from any thread.
    std::string failure() const;

  private:
    class Pump;

    void run();

    const TlsAddress address_;
    foundation::core::posix::EventDescriptor stop_;
    foundation::core::posix::EventDescriptor done_;
    std::atomic<bool> established_{false};
    foundation::core::posix::OwnedDescriptor stream_;
    foundation::core::posix::OwnedDescriptor inner_;
    std::shared_ptr<void> context_;  ///< of the TLS library
    mutable std::mutex mutex_;
    std::string failure_;
    std::thread thread_;
};

}  // namespace krutil_client
