// What a TlsRelay connects to, in a thread of the test.
#pragma once

#include <gtest/gtest.h>
#include <openssl/ec.h>
#include <openssl/pem.h>
#include <openssl/ssl.h>
#include <openssl/x509v3.h>
#include <sys/socket.h>

#include <cstdio>
#include <functional>
#include <memory>
#include <string>
#include <thread>
#include <utility>

#include "foundation/core/posix/OwnedDescriptor.hpp"
#include "support/LoopbackSocket.hpp"

namespace krutil_client {

/// Takes one connection at a port of 127.0.0.1, with a certificate that is its own authority.
class TlsServer {
  public:
    /// What is done with the connection, whose handshake succeeded. The stream is closed without a word after that.
    using Serve = std::function<void(SSL* connection)>;

    /// `name` is whom the certificate is for, such as "IP:127.0.0.1". It is written to the file `authority`. Versions
    /// of TLS above `newest` are not spoken; 0 for all that there are.
    TlsServer(const std::string& name, const std::string& authority, Serve serve, int newest = 0)
        : key_(::EVP_EC_gen("P-256"), &::EVP_PKEY_free),
          certificate_(::X509_new(), &::X509_free),
          context_(::SSL_CTX_new(::TLS_server_method()), &::SSL_CTX_free),
          serve_(std::move(serve)) {
        makeCertificate(name);
        FILE* const file = std::fopen(authority.c_str(), "w");
        EXPECT_EQ(::PEM_write_X509(file, certificate_.get()), 1);
        std::fclose(file);
        EXPECT_EQ(::SSL_CTX_use_certificate(context_.get(), certificate_.get()), 1);
        EXPECT_EQ(::SSL_CTX_use_PrivateKey(context_.get(), key_.get()), 1);
        if (newest != 0) {
            ::SSL_CTX_set_security_level(context_.get(), 0);
            ::SSL_CTX_set_max_proto_version(context_.get(), newest);
        }
        thread_ = std::thread([this] { run(); });
    }

    /// Waits until the connection has been served.
    ~TlsServer() { thread_.join(); }
    TlsServer(const TlsServer&) = delete;
    TlsServer& operator=(const TlsServer&) = delete;

    const std::string& port() const { return socket_.port(); }

  private:
    void makeCertificate(const std::string& name) {
        X509* const made = certificate_.get();
        ::X509_set_version(made, 2);
        ::ASN1_INTEGER_set(::X509_get_serialNumber(made), 1);
        constexpr long hour = 3600;
        ::X509_gmtime_adj(::X509_getm_notBefore(made), -hour);
        ::X509_gmtime_adj(::X509_getm_notAfter(made), hour);
        ::X509_set_pubkey(made, key_.get());
        X509_NAME* const subject = ::X509_get_subject_name(made);
        ::X509_NAME_add_entry_by_txt(subject, "CN", MBSTRING_ASC, reinterpret_cast<const unsigned char*>("localhost"),
                                     -1, -1, 0);
        ::X509_set_issuer_name(made, subject);
        X509_EXTENSION* const extension = ::X509V3_EXT_conf_nid(nullptr, nullptr, NID_subject_alt_name, name.c_str());
        ::X509_add_ext(made, extension, -1);
        ::X509_EXTENSION_free(extension);
        EXPECT_GT(::X509_sign(made, key_.get(), ::EVP_sha256()), 0);
    }

    void run() {
        const foundation::core::posix::OwnedDescriptor accepted(::accept(socket_.get(), nullptr, nullptr));
        const std::unique_ptr<SSL, decltype(&::SSL_free)> connection(::SSL_new(context_.get()), &::SSL_free);
        ::SSL_set_fd(connection.get(), accepted.get());
        if (::SSL_accept(connection.get()) == 1) {
            serve_(connection.get());
        }
    }

    const test_support::LoopbackSocket socket_;
    const std::unique_ptr<EVP_PKEY, decltype(&::EVP_PKEY_free)> key_;
    const std::unique_ptr<X509, decltype(&::X509_free)> certificate_;
    const std::unique_ptr<SSL_CTX, decltype(&::SSL_CTX_free)> context_;
    const Serve serve_;
    std::thread thread_;
};

}  // namespace krutil_client
