// What a TlsRelay connects to, in a thread of the test.
#pragma once

#include <gtest/gtest.h>
#include <openssl/ec.h>
#include <openssl/pem.h>
#include <openssl/ssl.h>
#include <openssl/x509v3.h>
#include <sys/socket.h>
#include <sys/stat.h>

#include <cstdio>
#include <functional>
#include <memory>
#include <string>
#include <thread>
#include <utility>

#include "foundation/core/posix/OwnedDescriptor.hpp"
#include "support/LoopbackSocket.hpp"

namespace krutil_client {

/// A certificate that is its own authority, and its key.
class TlsCertificate {
  public:
    /// `name` is whom it is for, such as "IP:127.0.0.1". It holds for an hour, unless it ended `ago` seconds ago.
    explicit TlsCertificate(const std::string& name, long ago = 0)
        : key_(::EVP_EC_gen("P-256"), &::EVP_PKEY_free), certificate_(::X509_new(), &::X509_free) {
        X509* const made = certificate_.get();
        ::X509_set_version(made, 2);
        ::ASN1_INTEGER_set(::X509_get_serialNumber(made), 1);
        constexpr long hour = 3600;
        ::X509_gmtime_adj(::X509_getm_notBefore(made), -hour - ago);
        ::X509_gmtime_adj(::X509_getm_notAfter(made), ago != 0 ? -ago : hour);
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

    /// Writes the certificate to a file.
    void write(const std::string& file) const {
        writeTo(file, [this](FILE* out) { return ::PEM_write_X509(out, certificate_.get()); });
    }

    /// Writes the key to a file for this user alone.
    void writeKey(const std::string& file) const {
        writeTo(file, [this](FILE* out) {
            return ::PEM_write_PrivateKey(out, key_.get(), nullptr, nullptr, 0, nullptr, nullptr);
        });
        ::chmod(file.c_str(), S_IRUSR | S_IWUSR);
    }

    void useIn(SSL_CTX* context) const {
        EXPECT_EQ(::SSL_CTX_use_certificate(context, certificate_.get()), 1);
        EXPECT_EQ(::SSL_CTX_use_PrivateKey(context, key_.get()), 1);
    }

  private:
    template <class Write>
    static void writeTo(const std::string& file, const Write& write) {
        FILE* const out = std::fopen(file.c_str(), "w");
        EXPECT_EQ(write(out), 1);
        std::fclose(out);
    }

    const std::unique_ptr<EVP_PKEY, decltype(&::EVP_PKEY_free)> key_;
    const std::unique_ptr<X509, decltype(&::X509_free)> certificate_;
};

/// Takes one connection at a port of 127.0.0.1, with a certificate that is its own authority.
class TlsServer {
  public:
    /// What is done with the connection, whose handshake succeeded. The stream is closed without a word after that.
    using Serve = std::function<void(SSL* connection)>;

    struct Options {
        int newest = 0;         ///< version of TLS that is spoken; 0 for all that there are
        long ago = 0;           ///< when the certificate ended, as in TlsCertificate
        std::string clients{};  ///< file with the certificates that clients may have; empty when they need none
    };

    /// The certificate is for `name`, and is written to the file `authority`.
    TlsServer(const std::string& name, const std::string& authority, Serve serve)
        : TlsServer(name, authority, std::move(serve), Options{}) {}
    TlsServer(const std::string& name, const std::string& authority, Serve serve, const Options& options)
        : context_(::SSL_CTX_new(::TLS_server_method()), &::SSL_CTX_free), serve_(std::move(serve)) {
        const TlsCertificate certificate(name, options.ago);
        certificate.write(authority);
        certificate.useIn(context_.get());
        if (options.newest != 0) {
            ::SSL_CTX_set_security_level(context_.get(), 0);
            ::SSL_CTX_set_max_proto_version(context_.get(), options.newest);
        }
        if (!options.clients.empty()) {
            ::SSL_CTX_set_verify(context_.get(), SSL_VERIFY_PEER | SSL_VERIFY_FAIL_IF_NO_PEER_CERT, nullptr);
            EXPECT_EQ(::SSL_CTX_load_verify_file(context_.get(), options.clients.c_str()), 1);
        }
        thread_ = std::thread([this] { run(); });
    }

    /// Waits until the connection has been served.
    ~TlsServer() { thread_.join(); }
    TlsServer(const TlsServer&) = delete;
    TlsServer& operator=(const TlsServer&) = delete;

    const std::string& port() const { return socket_.port(); }

  private:
    void run() {
        const foundation::core::posix::OwnedDescriptor accepted(::accept(socket_.get(), nullptr, nullptr));
        const std::unique_ptr<SSL, decltype(&::SSL_free)> connection(::SSL_new(context_.get()), &::SSL_free);
        ::SSL_set_fd(connection.get(), accepted.get());
        if (::SSL_accept(connection.get()) == 1) {
            serve_(connection.get());
        }
    }

    const test_support::LoopbackSocket socket_;
    const std::unique_ptr<SSL_CTX, decltype(&::SSL_CTX_free)> context_;
    const Serve serve_;
    std::thread thread_;
};

}  // namespace krutil_client
