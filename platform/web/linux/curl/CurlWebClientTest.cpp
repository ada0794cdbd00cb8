// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/web/linux/curl/CurlWebClient.h"

#include <gtest/gtest.h>

#include <array>
#include <atomic>
#include <csignal>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <future>
#include <optional>
#include <set>
#include <stdexcept>
#include <system_error>

#include "platform/base/fakes/FailingAllocations.h"
#include "platform/gzip/fakes/GzipOf.h"
#include "platform/net/fakes/PrivateNetwork.h"
#include "platform/runloop/RunAndWait.h"
#include "platform/runloop/linux/SystemQueues.h"
#include "platform/web/fakes/HttpsServer.h"

namespace brenvik {
namespace {

using namespace std::chrono_literals;
using Connection = HttpsServer::Connection;

const char kLocalNames[] = "DNS:localhost,IP:127.0.0.1";

std::string textOf(const WebBody& body) { return {reinterpret_cast<const char*>(body.data()), body.size()}; }
std::string textOf(const WebResponse& response) { return textOf(response.body); }

// A queue of a system that runs short: it works, and refuses to watch sockets or to time as it is told. It
// can also time without leeway, and notes what it watches sockets for.
class ShortQueue final : public WorkQueue {
 public:
  struct Refusals {
    std::atomic<bool> descriptors{false};
    std::atomic<bool> timers{false};
    std::atomic<bool> tasks{false};
    std::atomic<bool> leeway{false};
    std::atomic<bool> singleEvents{false};  // a socket that is ready comes as readable and writable
    std::array<bool, 4> interests{};        // by Interest; noted on the queue
  };
  ShortQueue(std::shared_ptr<WorkQueue> real, Refusals& refusals)
      : real_(std::move(real)), refusals_(refusals) {}
  const std::string& label() const noexcept override { return real_->label(); }
  void post(Task task) override {
    if (refusals_.tasks) throw std::system_error(EAGAIN, std::generic_category(), "thread");
    real_->post(std::move(task));
  }
  void postAfter(std::chrono::nanoseconds delay, Task task) override {
    real_->postAfter(delay, std::move(task));
  }
  std::unique_ptr<Timer> makeTimer(std::chrono::nanoseconds first, std::chrono::nanoseconds interval,
                                   std::chrono::nanoseconds leeway, Task handler) override {
    if (refusals_.timers) return std::make_unique<DeadTimer>();
    return real_->makeTimer(first, interval, refusals_.leeway ? 0ns : leeway, std::move(handler));
  }
  bool isCurrent() const noexcept override { return real_->isCurrent(); }
  std::unique_ptr<DescriptorSource> watchDescriptor(int fd, Interest interest,
                                                    RunLoop::DescriptorHandler handler) override {
    if (refusals_.descriptors) return nullptr;
    refusals_.interests.at(static_cast<std::size_t>(interest)) = true;
    auto source = real_->watchDescriptor(fd, interest, [this, handler = std::move(handler)](Readiness ready) {
      if (refusals_.singleEvents) ready.isReadable = ready.isWritable = true;
      handler(ready);
    });
    return source != nullptr ? std::make_unique<NotedSource>(std::move(source), refusals_) : nullptr;
  }

 private:
  class NotedSource final : public DescriptorSource {
   public:
    NotedSource(std::unique_ptr<DescriptorSource> real, Refusals& refusals)
        : real_(std::move(real)), refusals_(refusals) {}
    void invalidate() noexcept override { real_->invalidate(); }
    bool setInterest(Interest interest) noexcept override {
      refusals_.interests.at(static_cast<std::size_t>(interest)) = true;
      return real_->setInterest(interest);
    }

   private:
    const std::unique_ptr<DescriptorSource> real_;
    Refusals& refusals_;
  };
  class DeadTimer final : public Timer {
   public:
    bool activate() override { return false; }
    void cancel() noexcept override {}
  };
  const std::shared_ptr<WorkQueue> real_;
  Refusals& refusals_;
};

class ShortQueues final : public WorkQueues {
 public:
  explicit ShortQueues(WorkQueues& real) : real_(real) {}
  WorkQueue& main() noexcept override { return real_.main(); }
  WorkQueue& global() noexcept override { return real_.global(); }
  std::shared_ptr<WorkQueue> makeSerial(std::string label, QualityOfService qualityOfService) override {
    latest = real_.makeSerial(std::move(label), qualityOfService);
    return std::make_shared<ShortQueue>(latest, refusals);
  }
  std::unique_ptr<ProcessExitSource> makeProcessExitSource(pid_t pid, std::uint32_t startTime,
                                                           WorkQueue::Task onExit,
                                                           WorkQueue::Task onCancel) override {
    return real_.makeProcessExitSource(pid, startTime, std::move(onExit), std::move(onCancel));
  }
  ShortQueue::Refusals refusals;
  std::shared_ptr<WorkQueue> latest;  // the real one

 private:
  WorkQueues& real_;
};

class CurlWebClientTest : public testing::Test {
 protected:
  CurlWebClientTest() {
    std::signal(SIGPIPE, SIG_IGN);  // the server's TLS library writes to clients that have gone
    std::string pattern = testing::TempDir() + "webclientXXXXXX";
    EXPECT_NE(::mkdtemp(pattern.data()), nullptr);
    folder = pattern;
    settings.certificateAuthorities = folder / "authority.pem";
    authority.writeCertificate(settings.certificateAuthorities);
    settings.connectLimit = 60s;
    settings.stallLimit = 60s;
  }
  ~CurlWebClientTest() override {
    client.reset();
    callbackQueue.reset();
    std::filesystem::remove_all(folder);
  }

  void makeClient() {
    client = CurlWebClient::make(queues, settings);
    ASSERT_NE(client, nullptr);
  }

  struct Options {
    HeaderMap headers = {};
    bool cellularAllowed = true;
    std::chrono::milliseconds timeLimit = 0ms;
    std::uint64_t largestBody = kLargestWebBody;
  };
  // Sends a request; the future has its response. A second completion fails the test.
  std::future<std::shared_ptr<WebResponse>> start(const std::string& url, const Options& options) {
    if (client == nullptr) makeClient();
    const auto session = client->makeSession();
    session->setCellularAllowed(options.cellularAllowed);
    const auto request = client->makeRequest(WebRequestType::get, url, options.headers, session);
    auto promise = std::make_shared<std::promise<std::shared_ptr<WebResponse>>>();
    auto future = promise->get_future();
    if (request == nullptr) {
      ADD_FAILURE() << "no request for " << url;
      promise->set_value(nullptr);
      return future;
    }
    request->setCallbackQueue(callbackQueue);
    request->setTimeLimit(options.timeLimit);
    request->setLargestBody(options.largestBody);
    request->setCompletion(
        [this, promise, count = std::make_shared<int>(0)](std::shared_ptr<WebResponse> response) {
          EXPECT_TRUE(callbackQueue->isCurrent());
          ASSERT_EQ(++*count, 1) << "completed twice";
          promise->set_value(std::move(response));
        });
    request->send({});
    request->send({});  // to no effect
    return future;
  }
  std::shared_ptr<WebResponse> fetch(const std::string& url, const Options& options) {
    auto response = start(url, options).get();
    EXPECT_NE(response, nullptr);
    return response != nullptr ? response : std::make_shared<WebResponse>();
  }
  std::shared_ptr<WebResponse> fetch(const std::string& url) { return fetch(url, Options()); }
  void expectKind(WebErrorKind kind, const std::shared_ptr<WebResponse>& response) {
    EXPECT_STREQ(textOfErrorKind(response->errorKind), textOfErrorKind(kind));
    EXPECT_TRUE(kind == WebErrorKind::none || response->body.empty());
  }

  std::filesystem::path folder;
  Identity authority;
  Identity identity{authority, kLocalNames};
  CurlSettings settings;
  std::unique_ptr<SystemRunLoop> loop = SystemRunLoop::make();
  SystemQueues queues{*loop};
  std::shared_ptr<WorkQueue> callbackQueue = queues.makeSerial("callbacks", QualityOfService::standard);
  std::unique_ptr<CurlWebClient> client;
};

// ---- what is sent and what comes back ----

TEST_F(CurlWebClientTest, AResponseArrivesWholeOnTheGivenQueueExactlyOnce) {
  const std::string big(3'000'000, 'b');
  HttpsServer server(identity, [&](Connection& connection) {
    connection.readRequest();
    connection.respond(
        "200 OK\r\nContent-Type: application/x-gzip\r\nX-One: first\r\nx-one:  second \r\nEmpty:", big);
  });
  const auto response = fetch(server.url());
  expectKind(WebErrorKind::none, response);
  EXPECT_EQ(response->statusCode, 200);
  EXPECT_TRUE(textOf(*response) == big);
  EXPECT_EQ(response->headers["content-type"], "application/x-gzip");
  EXPECT_EQ(response->headers["X-ONE"], "first, second");
  EXPECT_EQ(response->headers["Empty"], "");
}

TEST_F(CurlWebClientTest, TheRequestCarriesItsHeadersAndNothingOfOurOwnInvention) {
  std::promise<std::string> seen;
  HttpsServer server(identity, [&](Connection& connection) {
    seen.set_value(connection.readRequest());
    connection.respond("200 OK", "x");
  });
  Options options;
  options.headers = {{"Accept-Encoding", "gzip"}, {"User-Agent", "tester/1"}, {"Evil", "a\r\nInjected: yes"}};
  fetch(server.url("/1/v3/a%20b?q=1"), options);
  const std::string request = seen.get_future().get();
  EXPECT_TRUE(request.starts_with("GET /1/v3/a%20b?q=1 HTTP/1.1\r\n")) << request;
  EXPECT_NE(request.find("\r\nAccept-Encoding: gzip\r\n"), std::string::npos);
  EXPECT_NE(request.find("\r\nUser-Agent: tester/1\r\n"), std::string::npos);
  EXPECT_EQ(request.find("Injected"), std::string::npos);
  EXPECT_EQ(request.find("Evil"), std::string::npos);
}

TEST_F(CurlWebClientTest, AHeaderThatWouldBreakTheRequestsLinesIsLeftOut) {
  std::promise<std::string> seen;
  HttpsServer server(identity, [&](Connection& connection) {
    seen.set_value(connection.readRequest());
    connection.respond("200 OK", "x");
  });
  const auto with = [](char c) { return std::string("a") + c + "Injected: yes"; };
  Options options;
  options.headers = {{"Return", with('\r')}, {"Feed", with('\n')}, {"Nul", with('\0')}, {with('\r'), "name"},
                     {with('\n'), "name"},   {with('\0'), "name"}, {"", "nameless"},    {"Good", "good"}};
  expectKind(WebErrorKind::none, fetch(server.url(), options));
  const std::string request = seen.get_future().get();
  EXPECT_NE(request.find("\r\nGood: good\r\n"), std::string::npos);
  for (const char* text : {"Return", "Feed", "Nul", "Injected", "name", "\r\na", "\r\n:"})
    EXPECT_EQ(request.find(text), std::string::npos) << text << " in " << request;
}

TEST_F(CurlWebClientTest, AProxyOfTheEnvironmentIsNotUsed) {
  HttpsServer server(identity, [](Connection& connection) {
    connection.readRequest();
    connection.respond("200 OK", "x");
  });
  HttpsServer proxy([](Connection&) {}, HttpsServer::Wire::plain);
  const std::string url = "http://127.0.0.1:" + std::to_string(proxy.port()) + "/";
  for (const char* name : {"https_proxy", "ALL_PROXY"}) ASSERT_EQ(::setenv(name, url.c_str(), 1), 0);
  expectKind(WebErrorKind::none, fetch(server.url()));
  client.reset();
  for (const char* name : {"https_proxy", "ALL_PROXY"}) ::unsetenv(name);
  EXPECT_EQ(proxy.connections(), 0);
}

TEST_F(CurlWebClientTest, AConnectionServesOneRequestAndEndsWithIt) {
  std::promise<std::string> afterwards;
  HttpsServer server(identity, [&](Connection& connection) {
    const bool isFirst = connection.readRequest().starts_with("GET /first ");
    connection.respond("200 OK", "x");
    const std::string next = connection.readRequest();
    if (isFirst) afterwards.set_value(next);
  });
  expectKind(WebErrorKind::none, fetch(server.url("/first")));
  auto next = afterwards.get_future();
  const bool hasEnded = next.wait_for(20s) == std::future_status::ready;
  EXPECT_TRUE(hasEnded) << "and not with the client";
  expectKind(WebErrorKind::none, fetch(server.url("/second")));
  client.reset();
  EXPECT_EQ(next.get(), "");
  EXPECT_EQ(server.connections(), 2);
}

TEST_F(CurlWebClientTest, WithoutAuthoritiesNoServerIsTrusted) {
  HttpsServer server(identity, [](Connection& connection) { connection.respond("200 OK", "secret"); });
  std::ofstream(folder / "empty.pem").flush();
  for (const char* file : {"missing.pem", "empty.pem"}) {
    SCOPED_TRACE(file);
    client.reset();
    settings.certificateAuthorities = folder / file;
    expectKind(WebErrorKind::certificateRefused, fetch(server.url()));
  }
}

TEST_F(CurlWebClientTest, WithoutAUserAgentNoneIsSent) {
  std::promise<std::string> seen;
  HttpsServer server(identity, [&](Connection& connection) {
    seen.set_value(connection.readRequest());
    connection.respond("200 OK", "x");
  });
  fetch(server.url());
  const std::string request = seen.get_future().get();
  EXPECT_EQ(request.find("User-Agent"), std::string::npos);
  EXPECT_EQ(request.find("Accept-Encoding"), std::string::npos);
}

TEST_F(CurlWebClientTest, EveryStatusIsAResponse) {
  int status = 0;
  HttpsServer server(identity, [&](Connection& connection) {
    connection.readRequest();
    connection.respond(std::to_string(status) + " Something", status == 304 ? "" : "text");
  });
  for (const int each : {204, 304, 404, 500, 302}) {  // the redirect names no place
    status = each;
    const auto response = fetch(server.url());
    expectKind(WebErrorKind::none, response);
    EXPECT_EQ(response->statusCode, each);
  }
}

TEST_F(CurlWebClientTest, HeadersOfAnInterimResponseAndTrailersDoNotCount) {
  HttpsServer server(identity, [&](Connection& connection) {
    connection.readRequest();
    connection.write("HTTP/1.1 103 Early Hints\r\nEarly: yes\r\n\r\n");
    connection.write(
        "HTTP/1.1 200 OK\r\nTransfer-Encoding: chunked\r\nContent-Type: a\r\n\r\n3\r\nabc\r\n0\r\n");
    connection.write("Content-Type: b\r\nHTTP/like: yes\r\nLate: yes\r\n\r\n");
  });
  const auto response = fetch(server.url());
  expectKind(WebErrorKind::none, response);
  EXPECT_EQ(textOf(*response), "abc");
  EXPECT_FALSE(response->headers.contains("Early"));
  EXPECT_FALSE(response->headers.contains("Late"));
  EXPECT_EQ(response->headers["Content-Type"], "a");
}

TEST_F(CurlWebClientTest, ContentEncodingIsDecodedAndContentTypeIsNot) {
  const std::string packed = gzipOf("unpacked");
  HttpsServer server(identity, [&](Connection& connection) {
    const auto request = connection.readRequest();
    const bool encoded = request.find("/encoded") != std::string::npos;
    connection.respond(std::string("200 OK\r\nContent-Type: application/gzip") +
                           (encoded ? "\r\nContent-Encoding: gzip" : ""),
                       packed);
  });
  Options options;
  options.headers = {{"accept-encoding", "gzip"}};
  EXPECT_EQ(textOf(*fetch(server.url("/encoded"), options)), "unpacked");
  const auto plain = fetch(server.url("/plain"), options);
  EXPECT_EQ(textOf(*plain), packed);
  EXPECT_EQ(plain->headers["Content-Type"], "application/gzip");
  EXPECT_EQ(textOf(*fetch(server.url("/encoded"))), packed) << "not asked for, so not decoded";
}

TEST_F(CurlWebClientTest, UrlsThatCannotBeUsedMakeNoRequest) {
  makeClient();
  const auto session = client->makeSession();
  for (const std::string& url :
       {std::string(), std::string("nonsense"), std::string("http://localhost/"),
        std::string("ftp://localhost/"), std::string("file:///etc/passwd"), std::string("https://"),
        std::string("https://local host/"), std::string("https://localhost/a b"),
        std::string("https://localhost/\n"), std::string("https://localhost:99999/"),
        std::string("https://localhost/\0x", 20)}) {
    EXPECT_EQ(client->makeRequest(WebRequestType::get, url, {}, session), nullptr) << url;
  }
  EXPECT_NE(client->makeRequest(WebRequestType::get, "HTTPS://localhost/", {}, session), nullptr);
  EXPECT_NE(client->makeRequest(WebRequestType::get, "https://[::1]:8443", {}, session), nullptr);
}

// ---- failures: the completion always comes ----

TEST_F(CurlWebClientTest, ARefusedConnectionIsTold) {
  // Bound, so that nobody else can listen there, and not listening.
  const UniqueFd taken(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
  sockaddr_in self{};
  self.sin_family = AF_INET;
  self.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t size = sizeof self;
  ASSERT_EQ(::bind(taken.get(), reinterpret_cast<sockaddr*>(&self), size), 0);
  ASSERT_EQ(::getsockname(taken.get(), reinterpret_cast<sockaddr*>(&self), &size), 0);
  const auto response = fetch("https://127.0.0.1:" + std::to_string(ntohs(self.sin_port)) + "/");
  expectKind(WebErrorKind::cannotConnect, response);
  EXPECT_EQ(response->statusCode, 0);
}

TEST_F(CurlWebClientTest, AServerThatSaysNothingIsGivenUp) {
  settings.connectLimit = 200ms;
  HttpsServer server([](Connection& connection) { connection.stall(); }, HttpsServer::Wire::plain);
  expectKind(WebErrorKind::timedOut, fetch(server.url()));
}

TEST_F(CurlWebClientTest, ATransferThatStallsIsGivenUp) {
  settings.stallLimit = 2s;
  HttpsServer server(identity, [](Connection& connection) {
    if (connection.readRequest().find("/body") != std::string::npos) {
      connection.write("HTTP/1.1 200 OK\r\nContent-Length: 100000\r\n\r\nbeginning");
    }
    connection.stall();
  });
  auto first = start(server.url("/headers"), {});
  auto second = start(server.url("/body"), {});
  expectKind(WebErrorKind::timedOut, first.get());
  expectKind(WebErrorKind::timedOut, second.get());
}

TEST_F(CurlWebClientTest, TheRequestsOwnLimitEndsASteadyTransferAndCountsRedirects) {
  HttpsServer server(identity, [](Connection& connection) {
    connection.readRequest();
    connection.write("HTTP/1.1 200 OK\r\nContent-Length: 500000000\r\n\r\n");
    const std::string piece(10'000, 'x');
    while (connection.write(piece)) std::this_thread::yield();
  });
  HttpsServer redirecting(identity, [&](Connection& connection) {
    connection.readRequest();
    connection.respond("302 Found\r\nLocation: " + server.url(), "");
  });
  Options options;
  options.timeLimit = 150ms;
  const auto before = std::chrono::steady_clock::now();
  expectKind(WebErrorKind::timedOut, fetch(redirecting.url(), options));
  EXPECT_GE(std::chrono::steady_clock::now() - before, 149ms);  // libcurl counts whole milliseconds
}

TEST_F(CurlWebClientTest, ARequestAsAWholeHasTheTimeThatItsLargestBodyTakes) {
  settings.wholeLimit = 100ms;
  settings.slowestBytesPerSecond = 1'000'000;
  HttpsServer server(identity, [](Connection& connection) {
    connection.readRequest();
    connection.write("HTTP/1.1 200 OK\r\nContent-Length: 100\r\n\r\n");
    connection.stall();
  });
  Options options;
  options.largestBody = 200'000;
  const auto before = std::chrono::steady_clock::now();
  expectKind(WebErrorKind::timedOut, fetch(server.url(), options));
  const auto taken = std::chrono::steady_clock::now() - before;
  EXPECT_GE(taken, 299ms);  // libcurl counts whole milliseconds
  EXPECT_LT(taken, 30s) << "that was the limit on stalling";
}

TEST_F(CurlWebClientTest, ASteadyTransferThatExceedsTheTimeOfTheWholeIsGivenUpWithoutALimitOfItsOwn) {
  settings.wholeLimit = 150ms;
  settings.slowestBytesPerSecond = ~std::uint64_t{0};
  HttpsServer server(identity, [](Connection& connection) {
    connection.readRequest();
    connection.write("HTTP/1.1 200 OK\r\nTransfer-Encoding: chunked\r\n\r\n");
    const auto end = std::chrono::steady_clock::now() + 20s;
    while (std::chrono::steady_clock::now() < end && connection.write("1\r\nx\r\n"))
      std::this_thread::yield();
    connection.write("0\r\n\r\n");
  });
  expectKind(WebErrorKind::timedOut, fetch(server.url()));
}

TEST_F(CurlWebClientTest, AConnectionResetOrCutIsTold) {
  HttpsServer server(identity, [](Connection& connection) {
    const auto request = connection.readRequest();
    if (request.find("/nothing") != std::string::npos) return connection.finishTls();
    connection.write("HTTP/1.1 200 OK\r\nContent-Length: 100000\r\n\r\nbeginning");
    if (request.find("/reset") != std::string::npos) return connection.reset();
    if (request.find("/short") != std::string::npos) connection.finishTls();
  });
  for (const char* path : {"/nothing", "/reset", "/short", "/cut"}) {
    SCOPED_TRACE(path);
    expectKind(WebErrorKind::connectionLost, fetch(server.url(path)));
  }
}

TEST_F(CurlWebClientTest, ABodyWithoutLengthEndsWithTheConnection) {
  HttpsServer server(identity, [](Connection& connection) {
    connection.readRequest();
    connection.write("HTTP/1.1 200 OK\r\nConnection: close\r\n\r\nall there is");
    connection.finishTls();
  });
  EXPECT_EQ(textOf(*fetch(server.url())), "all there is");
}

TEST_F(CurlWebClientTest, ACertificateThatIsNotTrustedIsRefused) {
  const Identity stranger("Somebody else");
  const Identity untrusted(stranger, kLocalNames);
  HttpsServer server(untrusted, [](Connection& connection) { connection.respond("200 OK", "secret"); });
  expectKind(WebErrorKind::certificateRefused, fetch(server.url()));
}

TEST_F(CurlWebClientTest, ACertificateSignedInTheAuthoritysNameByAnotherKeyIsRefused) {
  const Identity impostor;  // of the same name as the trusted one
  const Identity forged(impostor, kLocalNames);
  HttpsServer server(forged, [](Connection& connection) { connection.respond("200 OK", "secret"); });
  const auto response = fetch(server.url());
  EXPECT_NE(response->errorKind, WebErrorKind::none);
  EXPECT_EQ(response->statusCode, 0);
  EXPECT_TRUE(response->body.empty());
}

TEST_F(CurlWebClientTest, ACertificateOfAnotherNameIsRefused) {
  const Identity other(authority, "DNS:other.example");
  HttpsServer server(other, [](Connection& connection) { connection.respond("200 OK", "secret"); });
  expectKind(WebErrorKind::certificateRefused, fetch(server.url()));
}

TEST_F(CurlWebClientTest, ACertificateOutsideItsTimePointsAtTheClock) {
  const Identity expired(authority, kLocalNames, {-48h, -24h});
  const Identity future(authority, kLocalNames, {24h, 48h});
  for (const Identity* each : {&expired, &future}) {
    HttpsServer server(*each, [](Connection& connection) { connection.respond("200 OK", "x"); });
    expectKind(WebErrorKind::certificateClock, fetch(server.url()));
  }
}

TEST_F(CurlWebClientTest, AServerWithoutTlsIsNoSecureConnection) {
  HttpsServer server([](Connection& connection) { connection.respond("200 OK", "plain"); },
                     HttpsServer::Wire::plain);
  expectKind(WebErrorKind::secureConnection, fetch(server.url()));
}

TEST_F(CurlWebClientTest, Tls11IsRefusedEvenWhereTheSystemAllowsIt) {
  // The system's own configuration refuses it as well, so the test has one that does not. It is read once a
  // process.
  const std::string lenient = folder / "openssl.cnf";
  std::ofstream(lenient) << "openssl_conf = all\n[all]\nssl_conf = ssl\n[ssl]\nsystem_default = lenient\n"
                            "[lenient]\nMinProtocol = TLSv1\nCipherString = DEFAULT@SECLEVEL=0\n";
  ASSERT_EQ(::setenv("OPENSSL_CONF", lenient.c_str(), 1), 0);
  testing::FLAGS_gtest_death_test_style = "threadsafe";
  const auto kindWith = [&](int version) {
    HttpsServer server(
        identity,
        [](Connection& connection) {
          connection.readRequest();
          connection.respond("200 OK", "x");
        },
        version);
    return static_cast<int>(fetch(server.url())->errorKind);
  };
  EXPECT_EXIT(std::_Exit(100 + kindWith(TLS1_1_VERSION)),
              testing::ExitedWithCode(100 + static_cast<int>(WebErrorKind::secureConnection)), "");
  EXPECT_EXIT(std::_Exit(100 + kindWith(TLS1_2_VERSION)),
              testing::ExitedWithCode(100 + static_cast<int>(WebErrorKind::none)), "");
  ::unsetenv("OPENSSL_CONF");
}

TEST_F(CurlWebClientTest, WithoutCellularTheConnectionIsBoundToTheInterfaceThatWasApproved) {
  std::promise<void> reached;
  HttpsServer server(identity, [&](Connection& connection) {
    connection.readRequest();
    reached.set_value();
    connection.stall();
  });
  // The interface that this process's connections to the server are bound to.
  const auto boundTo = [&] {
    std::vector<std::string> names;
    for (int fd = 0; fd < 1024; ++fd) {
      sockaddr_in peer{};
      socklen_t size = sizeof peer;
      if (::getpeername(fd, reinterpret_cast<sockaddr*>(&peer), &size) != 0) continue;
      if (peer.sin_family != AF_INET || ntohs(peer.sin_port) != server.port()) continue;
      std::array<char, 64> name{};
      size = name.size();
      EXPECT_EQ(::getsockopt(fd, SOL_SOCKET, SO_BINDTODEVICE, name.data(), &size), 0);
      names.emplace_back(name.data());
    }
    return names;
  };
  Options options;
  options.cellularAllowed = false;
  auto answer = start(server.url("/", "127.0.0.1"), options);
  reached.get_future().wait();
  EXPECT_EQ(boundTo(), std::vector<std::string>{"lo"});
  client.reset();
  expectKind(WebErrorKind::cancelled, answer.get());
}

TEST_F(CurlWebClientTest, WhatIsNotHttpIsMalformed) {
  HttpsServer server(identity, [](Connection& connection) {
    connection.readRequest();
    connection.write("SSH-2.0-something\r\nand more of it\r\n");
    connection.finishTls();
  });
  expectKind(WebErrorKind::malformedResponse, fetch(server.url()));
}

TEST_F(CurlWebClientTest, HeadersWithoutEndAreMalformed) {
  HttpsServer server(identity, [](Connection& connection) {
    connection.readRequest();
    connection.write("HTTP/1.1 200 OK\r\n");
    const std::string line = "X-Filler: " + std::string(1000, 'x') + "\r\n";
    for (int i = 0; i < 1000 && connection.write(line); ++i) {
    }
  });
  expectKind(WebErrorKind::malformedResponse, fetch(server.url()));
}

TEST_F(CurlWebClientTest, AHeaderLineThatIsTooLongIsMalformedAndNoLackOfMemory) {
  HttpsServer server(identity, [](Connection& connection) {
    connection.readRequest();
    connection.write("HTTP/1.1 200 OK\r\nX-Filler: " + std::string(150'000, 'x') +
                     "\r\nContent-Length: 1\r\n\r\nx");
    connection.finishTls();
  });
  expectKind(WebErrorKind::malformedResponse, fetch(server.url()));
}

TEST_F(CurlWebClientTest, AFoldedHeaderIsOneField) {
  HttpsServer server(identity, [](Connection& connection) {
    connection.readRequest();
    connection.write("HTTP/1.1 200 OK\r\nContent-Type: application/x-tar;\r\n  a: gzip \r\n\tb\r\n");
    connection.write(
        "Empty:\r\n \r\n\tnot quite\r\nTwice: 1\r\nTwice: 2\r\n more\r\nContent-Length: 1\r\n\r\nx");
  });
  const auto response = fetch(server.url());
  expectKind(WebErrorKind::none, response);
  EXPECT_EQ(response->headers, (HeaderMap{{"Content-Type", "application/x-tar; a: gzip b"},
                                          {"Empty", "not quite"},
                                          {"Twice", "1, 2 more"},
                                          {"Content-Length", "1"}}));
}

TEST_F(CurlWebClientTest, ABodyBeyondTheLimitIsRefusedAnnouncedOrNot) {
  HttpsServer server(identity, [](Connection& connection) {
    const auto request = connection.readRequest();
    if (request.find("/announced") != std::string::npos) {
      connection.write("HTTP/1.1 200 OK\r\nContent-Length: 1000001\r\n\r\n");
    } else {
      connection.write("HTTP/1.1 200 OK\r\nConnection: close\r\n\r\n");
    }
    connection.write(std::string(request.find("/exact") != std::string::npos ? 1'000'000 : 1'000'001, 'x'));
    connection.finishTls();
  });
  Options options;
  options.largestBody = 1'000'000;
  expectKind(WebErrorKind::bodyTooLarge, fetch(server.url("/announced"), options));
  expectKind(WebErrorKind::bodyTooLarge, fetch(server.url("/streamed"), options));
  EXPECT_EQ(fetch(server.url("/exact"), options)->body.size(), 1'000'000U);
}

TEST_F(CurlWebClientTest, TheLimitCannotBeRaisedAboveTheClientsOwn) {
  HttpsServer server(identity, [](Connection& connection) {
    connection.readRequest();
    connection.write("HTTP/1.1 200 OK\r\nContent-Length: 536870913\r\n\r\n");
  });
  Options options;
  options.largestBody = ~std::uint64_t{0};
  expectKind(WebErrorKind::bodyTooLarge, fetch(server.url(), options));
}

TEST_F(CurlWebClientTest, TheLimitCountsDecodedBytes) {
  const std::string bomb = gzipOf(std::string(20'000'000, '\0'));
  HttpsServer server(identity, [&](Connection& connection) {
    connection.readRequest();
    connection.respond("200 OK\r\nContent-Encoding: gzip", bomb);
  });
  Options options;
  options.headers = {{"Accept-Encoding", "gzip"}};
  options.largestBody = 1'000'000;
  expectKind(WebErrorKind::bodyTooLarge, fetch(server.url(), options));
}

TEST_F(CurlWebClientTest, TheLimitCountsEncodedBytesTooSoThatABodyWithoutOutputEnds) {
  // A gzip stream of empty blocks: it is well formed, never ends, and decodes to nothing.
  const std::string header = gzipOf("").substr(0, 10);
  std::string empty;
  for (int i = 0; i < 20'000; ++i) empty += std::string("\0\0\0\xFF\xFF", 5);
  HttpsServer server(identity, [&](Connection& connection) {
    connection.readRequest();
    connection.write("HTTP/1.1 200 OK\r\nContent-Encoding: gzip\r\nConnection: close\r\n\r\n" + header);
    for (int i = 0; i < 100 && connection.write(empty); ++i) {
    }
    connection.finishTls();
  });
  Options options;
  options.headers = {{"Accept-Encoding", "gzip"}};
  options.largestBody = 1'000'000;
  expectKind(WebErrorKind::bodyTooLarge, fetch(server.url(), options));
}

TEST_F(CurlWebClientTest, ContentThatDoesNotDecodeIsMalformed) {
  HttpsServer server(identity, [&](Connection& connection) {
    connection.readRequest();
    connection.respond("200 OK\r\nContent-Encoding: gzip", "this is not gzip at all");
  });
  Options options;
  options.headers = {{"Accept-Encoding", "gzip"}};
  expectKind(WebErrorKind::malformedResponse, fetch(server.url(), options));
}

// ---- redirects ----

TEST_F(CurlWebClientTest, ARedirectToHttpsIsFollowedAbsoluteOrRelative) {
  HttpsServer target(identity, [](Connection& connection) {
    connection.readRequest();
    connection.respond("200 OK\r\nX-At: target", "arrived");
  });
  HttpsServer server(identity, [&](Connection& connection) {
    const auto request = connection.readRequest();
    if (request.starts_with("GET /here/there ")) return connection.respond("200 OK", "relative");
    const bool relative = request.find("/here") != std::string::npos;
    connection.respond("302 Found\r\nX-At: first\r\nLocation: " + (relative ? "there" : target.url()),
                       "moved");
  });
  const auto response = fetch(server.url("/away"));
  expectKind(WebErrorKind::none, response);
  EXPECT_EQ(textOf(*response), "arrived");
  EXPECT_EQ(response->headers["X-At"], "target");
  EXPECT_EQ(textOf(*fetch(server.url("/here/from"))), "relative");
}

TEST_F(CurlWebClientTest, FiveStatusesAreRedirectsAndNoOtherIs) {
  HttpsServer server(identity, [](Connection& connection) {
    const auto request = connection.readRequest();
    if (request.starts_with("GET /target ")) return connection.respond("200 OK", "arrived");
    connection.respond(request.substr(sizeof "GET /" - 1, 3) + " Status\r\nLocation: /target", "stayed");
  });
  for (const int status : {300, 301, 302, 303, 305, 306, 307, 308, 309}) {
    const bool isRedirect = status == 301 || status == 302 || status == 303 || status == 307 || status == 308;
    const auto response = fetch(server.url("/" + std::to_string(status)));
    expectKind(WebErrorKind::none, response);
    EXPECT_EQ(textOf(*response), isRedirect ? "arrived" : "stayed") << status;
    EXPECT_EQ(response->statusCode, isRedirect ? 200 : status);
  }
}

TEST_F(CurlWebClientTest, ARedirectToHttpIsRefusedAndNobodyIsAsked) {
  HttpsServer plain([](Connection& connection) { connection.respond("200 OK", "plain"); },
                    HttpsServer::Wire::plain);
  HttpsServer server(identity, [&](Connection& connection) {
    connection.readRequest();
    connection.respond("301 Moved\r\nLocation: http://localhost:" + std::to_string(plain.port()) + "/",
                       "moved");
  });
  const auto response = fetch(server.url());
  expectKind(WebErrorKind::redirectRefused, response);
  EXPECT_EQ(response->statusCode, 301);
  EXPECT_EQ(plain.connections(), 0);
}

TEST_F(CurlWebClientTest, TheBodyOfARedirectIsReadUpTo64KiB) {
  HttpsServer server(identity, [](Connection& connection) {
    const auto request = connection.readRequest();
    if (request.starts_with("GET /target ")) return connection.respond("200 OK", "arrived");
    const bool exact = request.find("/exact") != std::string::npos;
    connection.respond("302 Found\r\nLocation: /target", std::string((64 << 10) + (exact ? 0 : 1), 'x'));
  });
  EXPECT_EQ(textOf(*fetch(server.url("/exact"))), "arrived");
  expectKind(WebErrorKind::bodyTooLarge, fetch(server.url("/more")));
}

TEST_F(CurlWebClientTest, TheBodyOfARedirectIsLimitedAsItTravelsAndDecoded) {
  std::string empty = gzipOf("").substr(0, 10);  // a body that decodes to nothing, of empty blocks
  while (empty.size() <= 64 << 10) empty += std::string("\0\0\0\xFF\xFF", 5);
  const std::string packed = gzipOf(std::string((64 << 10) + 1, 'x'));
  HttpsServer server(identity, [&](Connection& connection) {
    const auto request = connection.readRequest();
    if (request.starts_with("GET /target ")) return connection.respond("200 OK", "arrived");
    connection.respond("302 Found\r\nLocation: /target\r\nContent-Encoding: gzip",
                       request.starts_with("GET /empty ") ? empty : packed);
  });
  Options options;
  options.headers = {{"Accept-Encoding", "gzip"}};
  expectKind(WebErrorKind::bodyTooLarge, fetch(server.url("/empty"), options));
  expectKind(WebErrorKind::bodyTooLarge, fetch(server.url("/packed"), options));
}

TEST_F(CurlWebClientTest, RedirectsThatDoNotEndAreGivenUp) {
  HttpsServer server(identity, [](Connection& connection) {
    connection.readRequest();
    connection.respond("307 Again\r\nLocation: /", "");
  });
  expectKind(WebErrorKind::tooManyRedirects, fetch(server.url()));
  EXPECT_EQ(server.connections(), 11);
}

// ---- the client's own life ----

TEST_F(CurlWebClientTest, ManyRequestsAtOnceEachCompleteOnce) {
  HttpsServer server(identity, [](Connection& connection) {
    const auto request = connection.readRequest();
    if (request.empty()) return;
    if (request.find("/reset") != std::string::npos) return connection.reset();
    connection.respond("200 OK", request.substr(4, request.find(' ', 4) - 4));
  });
  std::vector<std::future<std::shared_ptr<WebResponse>>> answers;
  for (int i = 0; i < 40; ++i)
    answers.push_back(start(server.url((i % 2 ? "/reset" : "/n") + std::to_string(i)), {}));
  for (int i = 0; i < 40; ++i) {
    const auto response = answers[static_cast<std::size_t>(i)].get();
    if (i % 2) {
      EXPECT_NE(response->errorKind, WebErrorKind::none);
    } else {
      EXPECT_EQ(textOf(*response), "/n" + std::to_string(i));
    }
  }
}

TEST_F(CurlWebClientTest, WhatIsUnderWayWhenTheClientIsDestroyedCompletesAsCancelled) {
  std::promise<void> reached;
  HttpsServer server(identity, [&](Connection& connection) {
    connection.readRequest();
    reached.set_value();
    connection.stall();
  });
  auto answer = start(server.url(), {});
  reached.get_future().wait();
  const auto late = client->makeRequest(WebRequestType::get, server.url(), {}, client->makeSession());
  std::promise<std::shared_ptr<WebResponse>> lateAnswer;
  late->setCallbackQueue(callbackQueue);
  late->setCompletion(
      [&](std::shared_ptr<WebResponse> response) { lateAnswer.set_value(std::move(response)); });
  client.reset();
  expectKind(WebErrorKind::cancelled, answer.get());
  late->send({});
  expectKind(WebErrorKind::cancelled, lateAnswer.get_future().get());
}

TEST_F(CurlWebClientTest, ARequestThatIsCancelledCompletesAndOthersGoOn) {
  std::promise<void> reached;
  HttpsServer server(identity, [&](Connection& connection) {
    if (connection.readRequest().starts_with("GET /other ")) return connection.respond("200 OK", "other");
    reached.set_value();
    connection.stall();
  });
  makeClient();
  std::promise<std::shared_ptr<WebResponse>> answer;
  const auto request = client->makeRequest(WebRequestType::get, server.url(), {}, client->makeSession());
  request->setCallbackQueue(callbackQueue);
  request->setCompletion(
      [&](std::shared_ptr<WebResponse> response) { answer.set_value(std::move(response)); });
  request->cancel();  // to no effect: it has not been sent
  request->send({});
  reached.get_future().wait();
  request->cancel();
  expectKind(WebErrorKind::cancelled, answer.get_future().get());
  EXPECT_EQ(textOf(*fetch(server.url("/other"))), "other");
  request->cancel();  // to no effect: it has completed
  EXPECT_EQ(textOf(*fetch(server.url("/other"))), "other");
}

TEST_F(CurlWebClientTest, BodiesForAnotherProcessAreWrittenIntoMemoryThatCanBeSealed) {
  const std::string body(3'000'000, 'b');
  HttpsServer server(identity, [&](Connection& connection) {
    if (connection.readRequest().starts_with("GET /moved "))
      return connection.respond("302 Found\r\nLocation: /here", "a body that nobody reads");
    connection.respond("200 OK", body);
  });
  settings.bodiesForAnotherProcess = true;
  const auto response = fetch(server.url("/moved"));
  expectKind(WebErrorKind::none, response);
  ASSERT_EQ(response->body.size(), body.size());
  const auto read = WebBody::ofSealedMemory(response->body.takeSealed(), body.size());
  ASSERT_TRUE(read);
  EXPECT_TRUE(textOf(*read) == body);
}

TEST_F(CurlWebClientTest, WithoutDescriptorsOrTimersToWorkWithRequestsCompleteAndLaterOnesWork) {
  HttpsServer server(identity, [](Connection& connection) {
    connection.readRequest();
    connection.respond("200 OK", "x");
  });
  ShortQueues shortQueues(queues);
  client = CurlWebClient::make(shortQueues, settings);
  for (std::atomic<bool>* refused : {&shortQueues.refusals.descriptors, &shortQueues.refusals.timers}) {
    *refused = true;
    auto first = start(server.url(), {});
    auto second = start(server.url("/second", "127.0.0.1"), {});
    expectKind(WebErrorKind::clientUnavailable, first.get());
    expectKind(WebErrorKind::clientUnavailable, second.get());
    *refused = false;
    EXPECT_EQ(textOf(*fetch(server.url())), "x");
  }
  client.reset();
}

TEST_F(CurlWebClientTest, WithoutAThreadForItsOwnOrTheCallersQueueTheCompletionStillComes) {
  HttpsServer server(identity, [](Connection& connection) {
    connection.readRequest();
    connection.respond("200 OK", "x");
  });
  ShortQueues shortQueues(queues);
  client = CurlWebClient::make(shortQueues, settings);
  shortQueues.refusals.tasks = true;
  expectKind(WebErrorKind::clientUnavailable, fetch(server.url()));
  shortQueues.refusals.tasks = false;

  ShortQueue::Refusals refused;
  refused.tasks = true;
  const auto request = client->makeRequest(WebRequestType::get, server.url(), {}, client->makeSession());
  request->setCallbackQueue(std::make_shared<ShortQueue>(callbackQueue, refused));
  std::promise<std::shared_ptr<WebResponse>> answer;
  request->setCompletion(
      [&](std::shared_ptr<WebResponse> response) { answer.set_value(std::move(response)); });
  request->send({});
  EXPECT_EQ(textOf(*answer.get_future().get()), "x");
  client.reset();
}

TEST_F(CurlWebClientTest, ARequestNobodyWaitsForIsHarmless) {
  makeClient();
  HttpsServer server(identity, [](Connection& connection) {
    connection.readRequest();
    connection.respond("200 OK", "x");
  });
  bool isTold = false;
  enum class Completion { none, empty, whole };
  for (const auto completion : {Completion::none, Completion::empty, Completion::whole}) {
    for (const auto& queue : {std::shared_ptr<WorkQueue>(), callbackQueue}) {
      if (completion == Completion::whole && queue != nullptr) continue;  // that one is told
      const auto request = client->makeRequest(WebRequestType::get, server.url(), {}, client->makeSession());
      request->setCallbackQueue(queue);
      if (completion == Completion::empty) request->setCompletion({});
      if (completion == Completion::whole)
        request->setCompletion([&isTold](const std::shared_ptr<WebResponse>&) { isTold = true; });
      request->send({});
    }
  }
  EXPECT_EQ(fetch(server.url())->statusCode, 200);
  client.reset();
  runAndWait(*callbackQueue, [] {});
  EXPECT_FALSE(isTold) << "on no queue";
}

TEST_F(CurlWebClientTest, WhileTheServerIsSilentASocketIsWatchedForReadingOnly) {
  HttpsServer server(identity, [](Connection& connection) {
    connection.readRequest();
    connection.respond("200 OK", "x");
  });
  ShortQueues shortQueues(queues);
  client = CurlWebClient::make(shortQueues, settings);
  EXPECT_EQ(textOf(*fetch(server.url())), "x");
  client.reset();
  const auto& noted = shortQueues.refusals.interests;
  EXPECT_TRUE(noted[static_cast<std::size_t>(Interest::writing)]) << "to connect";
  EXPECT_TRUE(noted[static_cast<std::size_t>(Interest::reading)]);
}

TEST_F(CurlWebClientTest, ASocketThatIsReadableAndWritableAtOnceIsReadAndWritten) {
  std::promise<std::size_t> seen;
  HttpsServer server(identity, [&](Connection& connection) {
    seen.set_value(connection.readRequest().size());
    connection.respond("200 OK", "x");
  });
  ShortQueues shortQueues(queues);
  shortQueues.refusals.singleEvents = true;
  client = CurlWebClient::make(shortQueues, settings);
  Options options;
  options.headers = {{"X-Long", std::string(100'000, 'x')}};  // more than libcurl sends at once
  options.timeLimit = 20s;
  EXPECT_EQ(textOf(*fetch(server.url(), options)), "x");
  client.reset();
  EXPECT_GT(seen.get_future().get(), 100'000U);
}

// libcurl counts whole milliseconds and may find that a time-out which it asked for is not quite due.
TEST_F(CurlWebClientTest, ATimeOutThatTheTimerTellsToTheNanosecondIsNotLost) {
  settings.connectLimit = 5ms;
  HttpsServer server([](Connection& connection) { connection.stall(); }, HttpsServer::Wire::plain);
  ShortQueues shortQueues(queues);
  shortQueues.refusals.leeway = true;
  for (int i = 0; i < 30; ++i) {
    client = CurlWebClient::make(shortQueues, settings);
    auto answer = start(server.url("/", "127.0.0.1"), {});
    const bool isTold = answer.wait_for(20s) == std::future_status::ready;
    client.reset();
    ASSERT_TRUE(isTold) << i;
    expectKind(WebErrorKind::timedOut, answer.get());
  }
}

TEST_F(CurlWebClientTest, WhicheverAllocationOfTheClientFailsTheCompletionComesAndNoBodyIsShort) {
  if (!FailingAllocations::kWork) GTEST_SKIP() << "nothing fails under this sanitizer";
  const std::string value = "a value that no string holds by itself";
  HttpsServer server(identity, [&](Connection& connection) {
    if (connection.readRequest().starts_with("GET /moved "))
      return connection.respond("302 Found\r\nLocation: /a/place/with/a/name/of/some/length", "");
    connection.respond("200 OK\r\nX-Field-With-A-Long-Name: " + value, "x");
  });
  settings.bodiesForAnotherProcess = true;
  std::set<WebErrorKind> kinds;
  bool hasFailed = true;
  for (long number = 0; hasFailed; ++number) {
    SCOPED_TRACE("allocation " + std::to_string(number));
    ShortQueues shortQueues(queues);
    client = CurlWebClient::make(shortQueues, settings);
    std::optional<FailingAllocations> failing;
    runAndWait(*shortQueues.latest, [&] { failing.emplace(number, FailingAllocations::HowMany::one); });
    const auto request = client->makeRequest(WebRequestType::get, server.url("/moved"),
                                             {{"X-Header-With-A-Long-Name", value}}, client->makeSession());
    auto answer = std::make_shared<std::promise<std::shared_ptr<WebResponse>>>();
    auto future = answer->get_future();
    request->setCallbackQueue(callbackQueue);
    request->setCompletion([promise = std::move(answer)](std::shared_ptr<WebResponse> response) {
      promise->set_value(std::move(response));
    });
    request->send({});
    const auto response = future.get();  // throws if the completion went away without a call
    runAndWait(*shortQueues.latest, [&] {
      hasFailed = FailingAllocations::failures() > 0;
      failing.reset();
    });
    client.reset();
    kinds.insert(response->errorKind);
    if (response->errorKind != WebErrorKind::none) {
      EXPECT_TRUE(hasFailed);
      EXPECT_TRUE(response->body.empty());
      continue;
    }
    EXPECT_EQ(response->statusCode, 200);
    EXPECT_EQ(response->headers["X-Field-With-A-Long-Name"], value);
    const auto read = WebBody::ofSealedMemory(response->body.takeSealed(), 1);
    ASSERT_TRUE(read);
    EXPECT_EQ(textOf(*read), "x");
  }
  EXPECT_EQ(kinds,
            (std::set{WebErrorKind::none, WebErrorKind::clientUnavailable, WebErrorKind::outOfMemory}));
}

// ---- names and cellular, in networks of our own ----

class CurlWebClientNetworkTest : public CurlWebClientTest {
 protected:
  void SetUp() override {
    if (!ours.isMade() || !theirs.isMade()) GTEST_SKIP() << "no permission to make a network namespace";
    ASSERT_TRUE(ours.ip("link set lo up"));
    settings.cellularFiles.nameServers = folder / "resolv.conf";
    settings.cellularFiles.hosts = folder / "hosts";
    std::ofstream(settings.cellularFiles.nameServers) << "nameserver 203.0.113.53\n";
  }
  // `name` here, 10.7.N.1, joined to farN there, 10.7.N.2.
  void join(const std::string& name, int number) {
    const std::string n = std::to_string(number);
    ASSERT_TRUE(ours.ip("link add " + name + " type veth peer name far" + n + " netns " + theirs.name()));
    ASSERT_TRUE(ours.ip("address add 10.7." + n + ".1/24 dev " + name));
    ASSERT_TRUE(ours.ip("link set " + name + " up"));
    ASSERT_TRUE(theirs.ip("address add 10.7." + n + ".2/24 dev far" + n));
    ASSERT_TRUE(theirs.ip("link set far" + n + " up"));
    ASSERT_TRUE(ours.waitUntilUp(name) && theirs.waitUntilUp("far" + n));
    theirs.run([&] { taps.push_back(std::make_unique<PacketTap>(("far" + n).c_str())); });
    ASSERT_TRUE(taps.back()->isMade());
  }
  // The client and its threads live in our network.
  WebErrorKind outcome(const std::string& url, bool cellularAllowed) {
    WebErrorKind kind{};
    ours.run([&] {
      client.reset();
      Options options;
      options.cellularAllowed = cellularAllowed;
      kind = fetch(url, options)->errorKind;
    });
    return kind;
  }
  std::size_t arrived(std::size_t tap, std::size_t atLeast = 0) {
    return taps.at(tap)->packets(atLeast, atLeast > 0 ? 2000ms : 0ms).size();
  }

  PrivateNetwork ours;
  PrivateNetwork theirs;
  std::vector<std::unique_ptr<PacketTap>> taps;
};

TEST_F(CurlWebClientNetworkTest, WhereOnlyCellularLeadsOutNothingLeavesLookUpsIncluded) {
  join("pdp_ip0", 1);
  ASSERT_TRUE(ours.ip("route add default via 10.7.1.2"));
  EXPECT_EQ(outcome("https://10.7.1.2/", false), WebErrorKind::cellularNotAllowed);
  EXPECT_EQ(outcome("https://203.0.113.9/", false), WebErrorKind::cellularNotAllowed);
  EXPECT_EQ(outcome("https://lasd.example/", false), WebErrorKind::cellularNotAllowed);
  EXPECT_EQ(arrived(0), 0U);
  EXPECT_EQ(outcome("https://10.7.1.2/", true), WebErrorKind::cannotConnect) << "allowed, and nobody listens";
  EXPECT_GE(arrived(0, 1), 1U);
}

TEST_F(CurlWebClientNetworkTest, ANameThatARedirectLeadsToIsNotLookedUpOverCellularEither) {
  join("pdp_ip0", 1);
  ASSERT_TRUE(ours.ip("route add default via 10.7.1.2"));
  settings.connectLimit = 2s;
  std::unique_ptr<HttpsServer> server;
  ours.run([&] {
    server = std::make_unique<HttpsServer>(identity, [](Connection& connection) {
      connection.readRequest();
      connection.respond("302 Found\r\nLocation: https://lasd.example/", "");
    });
  });
  EXPECT_EQ(outcome(server->url(), false), WebErrorKind::cellularNotAllowed);
  EXPECT_EQ(server->connections(), 1);
  EXPECT_EQ(arrived(0), 0U);
}

TEST_F(CurlWebClientNetworkTest, WithAnotherWayTheConnectionTakesItAndCellularStaysSilent) {
  join("pdp_ip0", 1);
  join("wifi0", 2);
  ASSERT_TRUE(ours.ip("route add default via 10.7.1.2"));
  EXPECT_EQ(outcome("https://10.7.2.2/", false), WebErrorKind::cannotConnect);
  EXPECT_GE(arrived(1, 1), 1U);
  EXPECT_EQ(outcome("https://203.0.113.9/", false), WebErrorKind::cellularNotAllowed);
  EXPECT_EQ(outcome("https://lasd.example/", false), WebErrorKind::cellularNotAllowed)
      << "its name server is there";
  EXPECT_EQ(arrived(0), 0U);
}

TEST_F(CurlWebClientNetworkTest, ThisMachineItselfIsReachedWithoutANetwork) {
  join("pdp_ip0", 1);
  ASSERT_TRUE(ours.ip("route add default via 10.7.1.2"));
  std::unique_ptr<HttpsServer> server;
  ours.run([&] {
    server = std::make_unique<HttpsServer>(identity, [](Connection& connection) {
      connection.readRequest();
      connection.respond("200 OK", "near");
    });
  });
  EXPECT_EQ(outcome(server->url("/", "localhost"), false), WebErrorKind::none);
  EXPECT_EQ(outcome(server->url("/", "127.0.0.1"), false), WebErrorKind::none);
  EXPECT_EQ(arrived(0), 0U);
}

TEST_F(CurlWebClientNetworkTest, WhatAnEarlierHopTriedOverCellularSaysNothingOfALaterOne) {
  join("pdp_ip0", 1);
  // The IPv4 address of "localhost" leads out over cellular, the IPv6 address does not.
  ASSERT_TRUE(ours.ip("address del 127.0.0.1/8 dev lo") && ours.ip("route add 127.0.0.1/32 dev pdp_ip0"));
  std::unique_ptr<HttpsServer> server;
  try {
    ours.run([&] {
      server = std::make_unique<HttpsServer>(
          identity,
          [](Connection& connection) {
            connection.readRequest();
            connection.respond("302 Found\r\nLocation: https://[::1]:1/", "");
          },
          HttpsServer::Address::v6);
    });
  } catch (const std::runtime_error&) {
    GTEST_SKIP() << "no IPv6";
  }
  EXPECT_EQ(outcome("https://127.0.0.1:1/", false), WebErrorKind::cellularNotAllowed);
  EXPECT_EQ(outcome(server->url("/", "localhost"), false), WebErrorKind::cannotConnect)
      << "nobody listens on the way that is open";
  EXPECT_EQ(server->connections(), 1);
  EXPECT_EQ(arrived(0), 0U);
}

TEST_F(CurlWebClientNetworkTest, ARedirectLeadsNowhereThatARequestMayNotGoLookUpsIncluded) {
  settings.connectLimit = 300ms;
  join("pdp_ip0", 1);
  ASSERT_TRUE(ours.ip("route add default via 10.7.1.2"));
  std::string target;
  std::unique_ptr<HttpsServer> server;
  ours.run([&] {
    server = std::make_unique<HttpsServer>(identity, [&target](Connection& connection) {
      connection.readRequest();
      connection.respond("302 Found\r\nLocation: " + target, "moved");
    });
  });
  for (const char* const away : {"https://lasd.example/", "https://203.0.113.9/", "https://10.7.1.2/"}) {
    target = away;
    EXPECT_EQ(outcome(server->url("/", "127.0.0.1"), false), WebErrorKind::cellularNotAllowed) << away;
  }
  EXPECT_EQ(arrived(0), 0U);
}

TEST_F(CurlWebClientNetworkTest, WithoutARouteThereIsNoConnection) {
  EXPECT_EQ(outcome("https://203.0.113.9/", false), WebErrorKind::cannotConnect);
  EXPECT_EQ(outcome("https://203.0.113.9/", true), WebErrorKind::cannotConnect);
}

TEST_F(CurlWebClientNetworkTest, ANameServerThatIsDeadOrOutOfReachDoesNotHoldTheCompletion) {
  settings.connectLimit = 300ms;
  const auto unreachable = outcome("https://lasd.example/", false);
  EXPECT_TRUE(unreachable == WebErrorKind::hostNotFound || unreachable == WebErrorKind::timedOut);
  join("wifi0", 2);
  // Nobody has the neighbour's address, so the name server of this machine's own configuration never answers.
  ASSERT_TRUE(ours.ip("neighbour add 10.7.2.9 lladdr 02:00:00:00:00:09 dev wifi0 nud permanent"));
  ASSERT_TRUE(ours.ip("route add default via 10.7.2.9"));
  const auto before = std::chrono::steady_clock::now();
  EXPECT_EQ(outcome("https://lasd.example/", false), WebErrorKind::timedOut);
  EXPECT_LT(std::chrono::steady_clock::now() - before, 8s) << "the look-up itself takes ten";
}

}  // namespace
}  // namespace brenvik
