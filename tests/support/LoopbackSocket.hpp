// A place that others connect to over TCP.
#pragma once

#include <netinet/in.h>
#include <sys/socket.h>

#include <cerrno>
#include <string>
#include <system_error>

#include "foundation/core/posix/OwnedDescriptor.hpp"

namespace test_support {

/// A socket that listens at a port of 127.0.0.1 that nobody else has.
class LoopbackSocket {
  public:
    /// Throws std::system_error.
    LoopbackSocket() : socket_(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
        sockaddr_in address{};
        address.sin_family = AF_INET;
        address.sin_addr.s_addr = ::htonl(INADDR_LOOPBACK);
        socklen_t size = sizeof(address);
        if (::bind(socket_.get(), reinterpret_cast<const sockaddr*>(&address), size) != 0 ||
            ::listen(socket_.get(), 1) != 0 ||
            ::getsockname(socket_.get(), reinterpret_cast<sockaddr*>(&address), &size) != 0) {
            throw std::system_error(errno, std::generic_category(), "a socket at 127.0.0.1");
        }
        port_ = std::to_string(::ntohs(address.sin_port));
    }

    int get() const noexcept { return socket_.get(); }
    const std::string& port() const noexcept { return port_; }

  private:
    const foundation::core::posix::OwnedDescriptor socket_;
    std::string port_;
};

}  // namespace test_support
