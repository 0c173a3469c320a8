#include "krutil/session/TlsRelay.hpp"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <fstream>
#include <string>
#include <thread>

#include "apps/krutil/session/TlsServer.hpp"
#include "foundation/core/posix/OwnedDescriptor.hpp"
#include "krutil/base/ExitCode.hpp"
#include "support/LoopbackSocket.hpp"
#include "support/TemporaryDirectory.hpp"

namespace krutil_client {
namespace {

// What is wrong with a command line that leads to `use`.
template <class Use>
std::string usageError(const Use& use) {
    try {
        use();
    } catch (const Failure& failure) {
        EXPECT_EQ(failure.code(), ExitCode::Usage);
        return failure.what();
    }
    ADD_FAILURE() << "expected a failure";
    return {};
}

TEST(TlsAddressTest, HasAHostAndAPort) {
    EXPECT_EQ(parseTlsAddress("tls://engines.example:4433").host, "engines.example");
    EXPECT_EQ(parseTlsAddress("tls://engines.example:4433").port, "4433");
    EXPECT_EQ(parseTlsAddress("tls://[::1]:https").host, "::1");
    EXPECT_EQ(parseTlsAddress("tls://[::1]:https").port, "https");
}

TEST(TlsAddressTest, OtherTextIsRefused) {
    for (const std::string text :
         {"tls://", "tls://host", "tls://host:", "tls://:1", "tls://::1:443", "tls://[]:1", "host:1", "tls:/host:1"}) {
        EXPECT_EQ(usageError([&] { parseTlsAddress(text); }), "--connect: expected tls://HOST:PORT, got " + text);
    }
}

class TlsRelayTest : public ::testing::Test {
  protected:
    std::string file(const std::string& name, const std::string& content, mode_t mode) const {
        std::ofstream(files_.file(name)) << content;
        ::chmod(files_.file(name).c_str(), mode);
        return files_.file(name);
    }

    static std::string refusal(const TlsAddress& address) {
        return usageError([&] { const TlsRelay relay(address); });
    }

    const test_support::TemporaryDirectory files_;
};

TEST_F(TlsRelayTest, AuthoritiesAreNamed) {
    EXPECT_EQ(refusal({"localhost", "1"}),
              "--connect tls://HOST:PORT needs --ca FILE: the authorities that the certificate there is checked with");
}

TEST_F(TlsRelayTest, AKeyThatOthersMayReadIsRefused) {
    const std::string key = file("key", "not looked at", 0644);
    EXPECT_EQ(
        refusal({"localhost", "1", "certificate", key, "authorities"}),
        "--key: the file '" + key +
            "' is open to other users (mode 0644, expected 0600); whoever reads it can pass for you, so close it: "
            "chmod 600");
}

TEST_F(TlsRelayTest, FilesThatCannotBeUsedAreNamed) {
    const std::string poem = file("poem", "no certificate\n", 0600);
    EXPECT_EQ(refusal({"localhost", "1", "", "", poem}),
              "--ca: cannot use the file '" + poem + "': no certificate or crl found");
    EXPECT_EQ(refusal({"localhost", "1", "", "", "/nonexistent"}),
              "--ca: cannot use the file '/nonexistent': No such file or directory");
}

// All that comes until the stream ends.
std::string readAll(int stream) {
    std::string text;
    std::array<char, 65'536> piece{};
    for (ssize_t got = 0; (got = ::read(stream, piece.data(), piece.size())) > 0;) {
        text.append(piece.data(), static_cast<std::size_t>(got));
    }
    return text;
}

class TlsConnectionTest : public TlsRelayTest {
  protected:
    TlsAddress address(const TlsServer& server, const std::string& host = "127.0.0.1") const {
        return {host, server.port(), "", "", authority_};
    }

    // Why a connection is not made, or fails before anything came.
    static std::string failureAt(const TlsAddress& address) {
        TlsRelay relay(address);
        const foundation::core::posix::OwnedDescriptor stream(relay.takeStream());
        EXPECT_EQ(readAll(stream.get()), "");
        return relay.failure();
    }

    const std::string authority_ = files_.file("authority");
};

TEST_F(TlsConnectionTest, BytesTravelBothWaysAtATime) {
    // More than either end takes at once. It comes back while it is still being sent, and then the end does.
    std::string sent;
    while (sent.size() < std::size_t{4} << 20) {
        sent += std::to_string(sent.size()) + "\n";
    }
    std::size_t served = 0;
    const TlsServer server("IP:127.0.0.1", authority_, [&](SSL* connection) {
        std::array<char, 50'000> piece{};
        for (int got = 0; (got = ::SSL_read(connection, piece.data(), piece.size())) > 0;) {
            EXPECT_EQ(::SSL_write(connection, piece.data(), got), got);
            served += static_cast<std::size_t>(got);
            if (served == sent.size()) {
                ::SSL_shutdown(connection);
            }
        }
    });
    TlsRelay relay(address(server));
    const foundation::core::posix::OwnedDescriptor stream(relay.takeStream());
    std::thread sender([&] {
        for (std::size_t done = 0; done < sent.size();) {
            done += static_cast<std::size_t>(::write(stream.get(), sent.data() + done, sent.size() - done));
        }
    });
    EXPECT_TRUE(readAll(stream.get()) == sent);
    sender.join();
    EXPECT_EQ(relay.failure(), "");
}

TEST_F(TlsConnectionTest, WhatIsWrittenLastArrivesWithTheEnd) {
    std::string got;
    int ended = 0;
    {
        const TlsServer server("IP:127.0.0.1", authority_, [&](SSL* connection) {
            ::SSL_write(connection, "?", 1);
            std::array<char, 100> piece{};
            for (int count = 0; (count = ::SSL_read(connection, piece.data(), piece.size())) > 0;) {
                got.append(piece.data(), static_cast<std::size_t>(count));
            }
            ended = ::SSL_get_shutdown(connection);
        });
        TlsRelay relay(address(server));
        const foundation::core::posix::OwnedDescriptor stream(relay.takeStream());
        char byte = 0;
        EXPECT_EQ(::read(stream.get(), &byte, 1), 1);
        EXPECT_EQ(::write(stream.get(), "last words", 10), 10);
    }
    EXPECT_EQ(got, "last words");
    EXPECT_EQ(ended & SSL_RECEIVED_SHUTDOWN, SSL_RECEIVED_SHUTDOWN);
}

TEST_F(TlsConnectionTest, AnEndWithoutAWordIsAFailure) {
    const TlsServer server("IP:127.0.0.1", authority_, [](SSL*) {});
    EXPECT_EQ(failureAt(address(server)), "unexpected eof while reading");
}

TEST_F(TlsConnectionTest, ACertificateForAnotherNameIsRefused) {
    // The common name does not count.
    const TlsServer server("DNS:elsewhere.example", authority_, [](SSL*) { ADD_FAILURE(); });
    EXPECT_EQ(failureAt(address(server, "localhost")), "the certificate there is not accepted: hostname mismatch");
}

TEST_F(TlsConnectionTest, ACertificateForAnotherAddressIsRefused) {
    const TlsServer server("IP:127.0.0.2,DNS:127.0.0.1", authority_, [](SSL*) { ADD_FAILURE(); });
    EXPECT_EQ(failureAt(address(server)), "the certificate there is not accepted: IP address mismatch");
}

TEST_F(TlsConnectionTest, ACertificateOfAnotherAuthorityIsRefused) {
    const TlsServer server("IP:127.0.0.1", files_.file("other"), [](SSL*) { ADD_FAILURE(); });
    {
        // Only its certificate is wanted.
        const TlsServer trusted("IP:127.0.0.1", authority_, [](SSL*) {});
        failureAt(address(trusted));
    }
    EXPECT_EQ(failureAt(address(server)), "the certificate there is not accepted: self-signed certificate");
}

TEST_F(TlsConnectionTest, ACertificateThatHasExpiredIsRefused) {
    const TlsServer server("IP:127.0.0.1", authority_, [](SSL*) { ADD_FAILURE(); }, {.ago = 60});
    EXPECT_EQ(failureAt(address(server)), "the certificate there is not accepted: certificate has expired");
}

// What a proxy makes of a client's certificate. Nothing of the session is looked at, though it has been sent.
class TlsClientTest : public TlsConnectionTest {
  protected:
    // Why the session of a client with this certificate does not begin.
    std::string failureWith(const std::string& certificate, const std::string& key) const {
        const TlsServer server("IP:127.0.0.1", authority_, [](SSL*) { ADD_FAILURE(); }, {.clients = known_});
        TlsRelay relay({"127.0.0.1", server.port(), certificate, key, authority_});
        const foundation::core::posix::OwnedDescriptor stream(relay.takeStream());
        // The relay may have gone already.
        static_cast<void>(::send(stream.get(), "the session", 11, MSG_NOSIGNAL));
        readAll(stream.get());
        return relay.failure();
    }

    std::string write(const TlsCertificate& certificate, const std::string& name) const {
        certificate.write(files_.file(name + ".pem"));
        certificate.writeKey(files_.file(name + ".key"));
        return files_.file(name);
    }

    const std::string alice_ = write(TlsCertificate("DNS:alice"), "alice");
    const std::string known_ = alice_ + ".pem";
};

TEST_F(TlsClientTest, TheOneThatIsKnownIsServed) {
    std::string got(11, '\0');
    {
        const TlsServer server(
            "IP:127.0.0.1", authority_,
            [&got](SSL* connection) { ::SSL_read(connection, got.data(), static_cast<int>(got.size())); },
            {.clients = known_});
        TlsRelay relay({"127.0.0.1", server.port(), alice_ + ".pem", alice_ + ".key", authority_});
        const foundation::core::posix::OwnedDescriptor stream(relay.takeStream());
        EXPECT_EQ(::write(stream.get(), "the session", 11), 11);
        readAll(stream.get());
    }
    EXPECT_EQ(got, "the session");
}

TEST_F(TlsClientTest, NoneIsRefused) {
    EXPECT_EQ(failureWith("", ""), "tlsv13 alert certificate required");
}

TEST_F(TlsClientTest, OneOfAnotherAuthorityIsRefused) {
    const std::string mallory = write(TlsCertificate("DNS:alice"), "mallory");
    EXPECT_EQ(failureWith(mallory + ".pem", mallory + ".key"), "tlsv1 alert unknown ca");
}

TEST_F(TlsClientTest, OneThatHasExpiredIsRefused) {
    const TlsCertificate expired("DNS:alice", 60);
    // It would be known.
    write(expired, "alice");
    EXPECT_EQ(failureWith(alice_ + ".pem", alice_ + ".key"), "sslv3 alert certificate expired");
}

TEST_F(TlsClientTest, AKeyOfAnotherCertificateIsRefused) {
    const std::string mallory = write(TlsCertificate("DNS:alice"), "mallory");
    EXPECT_EQ(refusal({"localhost", "1", alice_ + ".pem", mallory + ".key", known_}),
              "--key: cannot use the file '" + mallory + ".key': key values mismatch");
}

TEST_F(TlsConnectionTest, OldVersionsAreRefused) {
    const TlsServer server("IP:127.0.0.1", authority_, [](SSL*) { ADD_FAILURE(); }, {.newest = TLS1_1_VERSION});
    EXPECT_EQ(failureAt(address(server)), "tlsv1 alert protocol version");
}

TEST_F(TlsConnectionTest, AHostThatIsNotThereIsAFailure) {
    std::string port;
    {
        const TlsServer gone("IP:127.0.0.1", authority_, [](SSL*) {});
        port = gone.port();
        failureAt(address(gone));
    }
    EXPECT_EQ(failureAt({"127.0.0.1", port, "", "", authority_}), "Connection refused");
}

TEST_F(TlsConnectionTest, ItEndsWhereTheOtherEndSaysNothing) {
    const test_support::LoopbackSocket silent;
    {
        const TlsServer server("IP:127.0.0.1", authority_, [](SSL*) {});
        failureAt(address(server));
    }
    TlsRelay relay({"127.0.0.1", silent.port(), "", "", authority_});
    ::close(relay.takeStream());
}

}  // namespace
}  // namespace krutil_client
