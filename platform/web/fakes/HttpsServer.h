// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <arpa/inet.h>
#include <netinet/in.h>
#include <openssl/pem.h>
#include <openssl/ssl.h>
#include <openssl/x509v3.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <functional>
#include <memory>
#include <mutex>
#include <stdexcept>
#include <string>
#include <string_view>
#include <thread>
#include <utility>
#include <vector>

#include "platform/base/UniqueFd.h"

// An HTTPS server and a certificate authority for tests, both in this process. Users link OpenSSL.
namespace brenvik {

struct OpenSslFree {
  void operator()(EVP_PKEY* key) const noexcept { EVP_PKEY_free(key); }
  void operator()(X509* certificate) const noexcept { X509_free(certificate); }
  void operator()(SSL_CTX* context) const noexcept { SSL_CTX_free(context); }
  void operator()(SSL* tls) const noexcept { SSL_free(tls); }
  void operator()(X509_EXTENSION* extension) const noexcept { X509_EXTENSION_free(extension); }
  void operator()(std::FILE* file) const noexcept { std::fclose(file); }
};
template <typename T>
using OpenSslPointer = std::unique_ptr<T, OpenSslFree>;

// A key and its certificate, issued by another identity or by itself.
class Identity {
 public:
  struct Validity {
    std::chrono::seconds from = -std::chrono::hours(24);
    std::chrono::seconds until = std::chrono::hours(24);
  };

  // An authority.
  explicit Identity(const char* commonName = "Test authority") : Identity(commonName, "", {}, nullptr) {}
  // A server; `names` as in "DNS:localhost,IP:127.0.0.1", times from now.
  Identity(const Identity& issuer, const std::string& names) : Identity(issuer, names, Validity()) {}
  Identity(const Identity& issuer, const std::string& names, Validity validity)
      : Identity("Test server", names, validity, &issuer) {}

  EVP_PKEY* key() const { return key_.get(); }
  X509* certificate() const { return certificate_.get(); }
  void writeCertificate(const std::string& path) const {
    const OpenSslPointer<std::FILE> file(std::fopen(path.c_str(), "we"));
    check(file != nullptr && PEM_write_X509(file.get(), certificate_.get()) == 1);
  }
  void writeKey(const std::string& path) const {
    const OpenSslPointer<std::FILE> file(std::fopen(path.c_str(), "we"));
    check(file != nullptr &&
          PEM_write_PrivateKey(file.get(), key_.get(), nullptr, nullptr, 0, nullptr, nullptr) == 1);
  }

 private:
  static void check(bool ok) {
    if (!ok) throw std::runtime_error("OpenSSL failed");
  }
  Identity(const char* commonName, const std::string& names, Validity validity, const Identity* issuer)
      : key_(EVP_PKEY_Q_keygen(nullptr, nullptr, "EC", "P-256")), certificate_(X509_new()) {
    static std::atomic<long> serial{1};
    X509* const c = certificate_.get();
    check(key_ != nullptr && c != nullptr);
    check(X509_set_version(c, X509_VERSION_3) == 1);
    check(ASN1_INTEGER_set(X509_get_serialNumber(c), ++serial) == 1);
    check(X509_gmtime_adj(X509_getm_notBefore(c), validity.from.count()) != nullptr);
    check(X509_gmtime_adj(X509_getm_notAfter(c), validity.until.count()) != nullptr);
    check(X509_set_pubkey(c, key_.get()) == 1);
    const auto* name = reinterpret_cast<const unsigned char*>(commonName);
    check(X509_NAME_add_entry_by_txt(X509_get_subject_name(c), "CN", MBSTRING_ASC, name, -1, -1, 0) == 1);
    check(X509_set_issuer_name(c, X509_get_subject_name(issuer != nullptr ? issuer->certificate() : c)) == 1);
    addExtension(NID_basic_constraints, issuer != nullptr ? "critical,CA:FALSE" : "critical,CA:TRUE");
    if (!names.empty()) addExtension(NID_subject_alt_name, names.c_str());
    check(X509_sign(c, issuer != nullptr ? issuer->key() : key_.get(), EVP_sha256()) > 0);
  }
  void addExtension(int kind, const char* value) {
    const OpenSslPointer<X509_EXTENSION> extension(X509V3_EXT_conf_nid(nullptr, nullptr, kind, value));
    check(extension != nullptr && X509_add_ext(certificate_.get(), extension.get(), -1) == 1);
  }
  OpenSslPointer<EVP_PKEY> key_;
  OpenSslPointer<X509> certificate_;
};

// Serves each connection on a thread of its own with a script; listens on a free port of 127.0.0.1 or ::1.
class HttpsServer {
 public:
  // One connection. Every member may find the client gone; the script then runs to its end without effect.
  class Connection {
   public:
    Connection(UniqueFd fd, SSL_CTX* context)
        : fd_(std::move(fd)), tls_(context != nullptr ? SSL_new(context) : nullptr) {
      if (tls_ != nullptr) SSL_set_fd(tls_.get(), fd_.get());
    }
    bool handshake() { return tls_ == nullptr || SSL_accept(tls_.get()) == 1; }
    // The request's lines up to the empty one; empty when the client went away.
    std::string readRequest() {
      std::string request;
      char c = 0;
      while (!request.ends_with("\r\n\r\n")) {
        const auto got =
            tls_ != nullptr ? SSL_read(tls_.get(), &c, 1) : static_cast<int>(::recv(fd_.get(), &c, 1, 0));
        if (got != 1) return {};
        request += c;
      }
      return request;
    }
    bool write(std::string_view text) {
      while (!text.empty()) {
        const int size = static_cast<int>(std::min<std::size_t>(text.size(), 1 << 20));
        const auto sent = tls_ != nullptr
                              ? SSL_write(tls_.get(), text.data(), size)
                              : static_cast<int>(::send(fd_.get(), text.data(), text.size(), MSG_NOSIGNAL));
        if (sent <= 0) return false;
        text.remove_prefix(static_cast<std::size_t>(sent));
      }
      return true;
    }
    void respond(std::string_view statusAndHeaders, std::string_view body) {
      write("HTTP/1.1 " + std::string(statusAndHeaders) +
            "\r\nContent-Length: " + std::to_string(body.size()) + "\r\n\r\n");
      write(body);
    }
    // Ends TLS in good order; without it the end is a cut.
    void finishTls() {
      if (tls_ != nullptr) (void)SSL_shutdown(tls_.get());
    }
    // The client gets a reset instead of an end, when the script ends.
    void reset() {
      const linger abrupt{1, 0};
      (void)::setsockopt(fd_.get(), SOL_SOCKET, SO_LINGER, &abrupt, sizeof abrupt);
    }
    // Says nothing until the client goes or the server ends.
    void stall() {
      char c = 0;
      while (::recv(fd_.get(), &c, 1, 0) > 0) {
      }
    }
    int descriptor() const { return fd_.get(); }

   private:
    UniqueFd fd_;
    OpenSslPointer<SSL> tls_;
  };
  using Script = std::function<void(Connection&)>;

  enum class Wire { tls, plain };
  enum class Address { v4, v6 };

  HttpsServer(const Identity& identity, Script script, Address address = Address::v4)
      : HttpsServer(&identity, std::move(script), Wire::tls, address) {}
  // Speaks this version of TLS (TLS1_1_VERSION ...) and no other, however old it is.
  HttpsServer(const Identity& identity, Script script, int onlyVersion)
      : HttpsServer(&identity, std::move(script), Wire::tls) {
    SSL_CTX_set_security_level(context_.get(), 0);
    SSL_CTX_set_min_proto_version(context_.get(), onlyVersion);
    SSL_CTX_set_max_proto_version(context_.get(), onlyVersion);
  }
  // Without TLS, whatever the client expects.
  HttpsServer(Script script, Wire wire) : HttpsServer(nullptr, std::move(script), wire) {}
  HttpsServer(const HttpsServer&) = delete;
  HttpsServer& operator=(const HttpsServer&) = delete;
  ~HttpsServer() {
    ending_ = true;
    ::shutdown(listener_.get(), SHUT_RDWR);
    acceptor_.join();
    {
      const std::lock_guard lock(mutex_);
      for (const int fd : open_) ::shutdown(fd, SHUT_RDWR);
    }
    for (auto& thread : threads_) thread.join();
  }

  std::uint16_t port() const { return port_; }
  std::string url(const std::string& path = "/", const std::string& host = "localhost") const {
    return "https://" + host + ":" + std::to_string(port_) + path;
  }
  int connections() const { return connections_; }

 private:
  HttpsServer(const Identity* identity, Script script, Wire wire, Address address = Address::v4)
      : script_(std::move(script)) {
    if (wire == Wire::tls) {
      context_.reset(SSL_CTX_new(TLS_server_method()));
      SSL_CTX_use_certificate(context_.get(), identity->certificate());
      SSL_CTX_use_PrivateKey(context_.get(), identity->key());
    }
    const bool isV6 = address == Address::v6;
    listener_.reset(::socket(isV6 ? AF_INET6 : AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
    sockaddr_in6 self{};  // its port stands where that of a sockaddr_in does
    socklen_t size = isV6 ? sizeof self : sizeof(sockaddr_in);
    self.sin6_family = AF_INET6;
    self.sin6_addr = in6addr_loopback;
    if (!isV6) {
      sockaddr_in v4{};
      v4.sin_family = AF_INET;
      v4.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
      std::memcpy(&self, &v4, sizeof v4);
    }
    if (::bind(listener_.get(), reinterpret_cast<sockaddr*>(&self), size) != 0 ||
        ::listen(listener_.get(), 64) != 0 ||
        ::getsockname(listener_.get(), reinterpret_cast<sockaddr*>(&self), &size) != 0) {
      throw std::runtime_error("cannot listen");
    }
    port_ = ntohs(self.sin6_port);
    acceptor_ = std::thread([this] { acceptAll(); });
  }
  void acceptAll() {
    for (;;) {
      UniqueFd fd(::accept4(listener_.get(), nullptr, nullptr, SOCK_CLOEXEC));
      if (!fd.isValid() || ending_) return;
      ++connections_;
      const std::lock_guard lock(mutex_);
      open_.push_back(fd.get());
      threads_.emplace_back([this, raw = fd.release()] { serve(UniqueFd(raw)); });
    }
  }
  void serve(UniqueFd fd) {
    const int number = fd.get();
    Connection connection(std::move(fd), context_.get());
    if (connection.handshake()) script_(connection);
    const std::lock_guard lock(mutex_);  // so that a number in use again is never shut down
    std::erase(open_, number);
    connection = Connection(UniqueFd(), nullptr);
  }

  const Script script_;
  OpenSslPointer<SSL_CTX> context_;
  UniqueFd listener_;
  std::uint16_t port_ = 0;
  std::atomic<bool> ending_{false};
  std::atomic<int> connections_{0};
  std::mutex mutex_;
  std::vector<int> open_;
  std::vector<std::thread> threads_;
  std::thread acceptor_;
};

}  // namespace brenvik
