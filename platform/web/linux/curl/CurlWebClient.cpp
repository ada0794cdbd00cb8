// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/web/linux/curl/CurlWebClient.h"

#include <curl/curl.h>
#include <strings.h>
#include <sys/socket.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <map>
#include <mutex>
#include <new>
#include <optional>
#include <span>
#include <string_view>
#include <utility>

#include "platform/base/UniqueFd.h"
#include "platform/runloop/RunAndWait.h"
#include "platform/web/linux/curl/ResponseHead.h"

namespace brenvik {
namespace {

using Clock = std::chrono::steady_clock;
using std::chrono::milliseconds;

constexpr const char kQueueLabel[] = "HTTP client";
// Below this rate for the whole of the stall limit, a transfer is given up.
constexpr long kStallBytesPerSecond = 200;
constexpr int kMaxRedirects = 10;
constexpr long kReceiveBufferSize = 256L * 1024;
// Wake-ups for time-outs may be put off by this much.
constexpr auto kTimerLeeway = milliseconds(1);
// Of the TLS library, which libcurl gives out as they are; see x509_vfy.h.
constexpr long kCertificateNotYetValid = 9;
constexpr long kCertificateExpired = 10;
// CURLE_TOO_LARGE, which libcurl has for a header line that is too long since 8.6; see libcurl-errors(3).
constexpr auto kTooLarge = static_cast<CURLcode>(100);

// Both handles are void to the compiler, so their owners must say what they are.
struct EasyCleanup {
  void operator()(CURL* easy) const noexcept { curl_easy_cleanup(easy); }
};
struct MultiCleanup {
  void operator()(CURLM* multi) const noexcept { (void)curl_multi_cleanup(multi); }
};
struct ListCleanup {
  void operator()(curl_slist* list) const noexcept { curl_slist_free_all(list); }
};
using Easy = std::unique_ptr<CURL, EasyCleanup>;
using Multi = std::unique_ptr<CURLM, MultiCleanup>;
using List = std::unique_ptr<curl_slist, ListCleanup>;

// The heap as libcurl uses it. It also says "out of memory" when a header line is longer than it takes;
// whether an allocation has failed on this thread tells the two apart.
struct NotingMemory {
  static thread_local bool failed;
  static void* noted(void* memory, std::size_t size) noexcept {
    if (memory == nullptr && size > 0) failed = true;
    return memory;
  }
  static void* allocate(std::size_t size) noexcept { return noted(std::malloc(size), size); }
  static void* reallocate(void* old, std::size_t size) noexcept {
    return noted(std::realloc(old, size), size);
  }
  static void* allocateZeroed(std::size_t count, std::size_t size) noexcept {
    return noted(std::calloc(count, size), std::min(count, size));
  }
  static char* copyText(const char* text) noexcept { return static_cast<char*>(noted(::strdup(text), 1)); }
};
thread_local bool NotingMemory::failed = false;

// Once a process and never undone: other parts may use the library too. A start that failed, for want of
// memory say, is tried again.
bool startLibrary() noexcept {
  static std::mutex mutex;
  static bool started = false;
  const std::lock_guard lock(mutex);
  if (!started) {
    started = curl_global_init_mem(CURL_GLOBAL_DEFAULT, &NotingMemory::allocate, &std::free,
                                   &NotingMemory::reallocate, &NotingMemory::copyText,
                                   &NotingMemory::allocateZeroed) == CURLE_OK;
  }
  return started;
}

bool isRedirect(long status) noexcept {
  return status == 301 || status == 302 || status == 303 || status == 307 || status == 308;
}

bool breaksLines(const std::string& text) noexcept {
  return text.find_first_of(std::string_view("\r\n\0", 3)) != std::string::npos;
}

}  // namespace

class CurlWebClient::Session final : public WebSession {
 public:
  void setCellularAllowed(bool allowed) noexcept override { cellularAllowed = allowed; }
  bool cellularAllowed = true;
};

// One request on its way. Set up by the request; from submit() on the driver's, on its queue.
struct CurlWebClient::Transfer {
  std::string url;
  HeaderMap headers;
  std::shared_ptr<Session> session;
  std::shared_ptr<WorkQueue> callbackQueue;
  std::shared_ptr<WebRequest::Completion> completion;  // shared beforehand: telling takes no memory
  milliseconds timeLimit{0};
  std::uint64_t largestBody = kLargestWebBody;

  const CurlSettings* settings = nullptr;
  bool cellularAllowed = true;
  Clock::time_point deadline;
  int redirects = 0;
  std::shared_ptr<WebResponse> response = std::make_shared<WebResponse>();
  // Of the present attempt:
  List headerList;
  Easy easy;
  ResponseHead head;
  bool isOnCellular = false;
  std::optional<WebErrorKind> ownVerdict;  // why one of our callbacks stopped it

  // Tells the outcome, the first time only; somebody may be waiting for it without a limit.
  void finish(WebErrorKind kind) noexcept {
    if (response == nullptr) return;
    response->errorKind = kind;
    response->headers = std::move(head.fields);
    if (kind != WebErrorKind::none) response->body = {};
    const auto done = std::move(completion);
    const auto answer = std::move(response);
    if (callbackQueue == nullptr || done == nullptr || *done == nullptr) return;
    try {
      callbackQueue->post([done, answer] { (*done)(answer); });
    } catch (...) {
      // Its thread cannot be started, or memory is short; better told on the wrong queue than never.
      try {
        (*done)(answer);
      } catch (const std::bad_alloc&) {
        // Whoever is told copes with that, or has a time-out.
      }
    }
    callbackQueue.reset();
  }

  // How large the body of the response that is coming in may be.
  std::uint64_t limitNow() const noexcept {
    long status = 0;
    (void)curl_easy_getinfo(easy.get(), CURLINFO_RESPONSE_CODE, &status);
    return isRedirect(status) ? std::min(largestBody, kLargestRedirectBody) : largestBody;
  }

  static int onProgress(void* self, curl_off_t, curl_off_t received, curl_off_t, curl_off_t) noexcept;
  static std::size_t onHeader(char* data, std::size_t, std::size_t size, void* self) noexcept;
  static std::size_t onBody(char* data, std::size_t, std::size_t size, void* self) noexcept;
  static curl_socket_t onOpenSocket(void* self, curlsocktype purpose, curl_sockaddr* address) noexcept;
};

std::size_t CurlWebClient::Transfer::onHeader(char* data, std::size_t, std::size_t size,
                                              void* self) noexcept {
  auto& transfer = *static_cast<Transfer*>(self);
  try {
    if (!transfer.head.takeLine(std::string_view(data, size))) {
      transfer.ownVerdict = WebErrorKind::malformedResponse;
      return 0;
    }
    return size;
  } catch (...) {
    transfer.ownVerdict = WebErrorKind::outOfMemory;
    return 0;
  }
}

// The bytes of the body as they travel: an encoded body may have any number of them and decode to nothing, so
// that onBody() never hears of it.
int CurlWebClient::Transfer::onProgress(void* self, curl_off_t, curl_off_t received, curl_off_t,
                                        curl_off_t) noexcept {
  auto& transfer = *static_cast<Transfer*>(self);
  if (received <= 0 || static_cast<std::uint64_t>(received) <= transfer.limitNow()) return 0;
  transfer.ownVerdict = WebErrorKind::bodyTooLarge;
  return 1;
}

std::size_t CurlWebClient::Transfer::onBody(char* data, std::size_t, std::size_t size, void* self) noexcept {
  auto& transfer = *static_cast<Transfer*>(self);
  auto& body = transfer.response->body;
  const std::uint64_t limit = transfer.limitNow();
  if (size > limit - std::min<std::uint64_t>(limit, body.size())) {
    transfer.ownVerdict = WebErrorKind::bodyTooLarge;
    return 0;
  }
  try {
    if (!transfer.head.bodyHasBegun()) {
      transfer.head.bodyBegins();
      curl_off_t announced = 0;
      if (curl_easy_getinfo(transfer.easy.get(), CURLINFO_CONTENT_LENGTH_DOWNLOAD_T, &announced) ==
              CURLE_OK &&
          announced > 0) {
        body.reserve(std::min<std::uint64_t>(static_cast<std::uint64_t>(announced), limit));
      }
    }
    body.append(std::as_bytes(std::span(data, size)));
    return size;
  } catch (...) {
    transfer.ownVerdict = WebErrorKind::outOfMemory;
    return 0;
  }
}

// Here, and not with the request's options, because only here the address is known; binding the socket keeps
// the answer true when routes change. CURLOPT_INTERFACE would bind it anew afterwards and undo this.
curl_socket_t CurlWebClient::Transfer::onOpenSocket(void* self, curlsocktype,
                                                    curl_sockaddr* address) noexcept {
  auto& transfer = *static_cast<Transfer*>(self);
  UniqueFd fd(::socket(address->family, address->socktype | SOCK_CLOEXEC, address->protocol));
  if (!fd.isValid()) return CURL_SOCKET_BAD;
  if (!transfer.cellularAllowed) {
    const ConnectionWay way = routeTo(address->addr, transfer.settings->cellularFiles);
    if (way.kind == ConnectionWay::Kind::cellular) transfer.isOnCellular = true;
    if (way.kind != ConnectionWay::Kind::open) return CURL_SOCKET_BAD;
    if (::setsockopt(fd.get(), SOL_SOCKET, SO_BINDTODEVICE, way.interfaceName.c_str(),
                     static_cast<socklen_t>(way.interfaceName.size() + 1)) != 0) {
      return CURL_SOCKET_BAD;
    }
  }
  return fd.release();
}

// Drives libcurl's multi interface from one queue.
class CurlWebClient::Driver : public std::enable_shared_from_this<Driver> {
 public:
  Driver(std::shared_ptr<WorkQueue> queue, CurlSettings settings)
      : settings_(std::move(settings)), loop_(queue.get()), queue_(std::move(queue)) {}

  // Any thread.
  void submit(std::shared_ptr<Transfer> transfer) {
    transfer->settings = &settings_;
    transfer->cellularAllowed = transfer->session == nullptr || transfer->session->cellularAllowed;
    milliseconds limit =
        settings_.wholeLimit + milliseconds(transfer->largestBody * 1000 / settings_.slowestBytesPerSecond);
    if (transfer->timeLimit > milliseconds::zero()) limit = std::min(limit, transfer->timeLimit);
    transfer->deadline = Clock::now() + limit;
    auto kind = WebErrorKind::cancelled;
    {
      const std::lock_guard lock(mutex_);
      if (!closed_) {
        try {
          queue_->post([self = shared_from_this(), transfer] { self->start(transfer); });
          used_ = true;
          return;
        } catch (...) {  // no memory, or no thread for our queue
          kind = WebErrorKind::clientUnavailable;
        }
      }
    }
    transfer->finish(kind);
  }

  // Any thread.
  void cancel(const std::shared_ptr<Transfer>& transfer) noexcept {
    const std::lock_guard lock(mutex_);
    if (closed_) return;
    try {
      queue_->post([self = shared_from_this(), transfer] { self->abandon(transfer); });
    } catch (const std::bad_alloc&) {
      // It goes on to its own limit.
    }
  }

  // Completes what is under way as cancelled and ends the queue. Not on the queue.
  void shutDown() noexcept {
    std::shared_ptr<WorkQueue> queue;
    bool used = false;
    {
      const std::lock_guard lock(mutex_);
      closed_ = true;
      queue = std::move(queue_);
      used = used_;
    }
    if (queue == nullptr || !used) return;
    if (queue->isCurrent()) {
      abandonAll(WebErrorKind::cancelled);
      return;
    }
    // Callers wait until this has run, so it must run even if memory is short for a while.
    runAndWait(*queue, [this] { abandonAll(WebErrorKind::cancelled); });
  }

 private:
  // ---- all below: on the queue ----

  void start(const std::shared_ptr<Transfer>& transfer) {
    try {
      if (multi_ == nullptr && !makeMulti()) return transfer->finish(WebErrorKind::outOfMemory);
      attempt(transfer);
    } catch (...) {
      transfer->finish(WebErrorKind::outOfMemory);
    }
    giveUpIfAsked();
  }

  bool makeMulti() {
    multi_.reset(curl_multi_init());
    if (multi_ == nullptr) return false;
    curl_multi_setopt(multi_.get(), CURLMOPT_SOCKETFUNCTION, &Driver::onSocket);
    curl_multi_setopt(multi_.get(), CURLMOPT_SOCKETDATA, this);
    curl_multi_setopt(multi_.get(), CURLMOPT_TIMERFUNCTION, &Driver::onTimer);
    curl_multi_setopt(multi_.get(), CURLMOPT_TIMERDATA, this);
    return true;
  }

  // Sends the request to the transfer's present URL.
  void attempt(const std::shared_ptr<Transfer>& transfer) {
    const auto url = parseUrl(transfer->url);
    if (!url)
      return transfer->finish(WebErrorKind::malformedResponse);  // of a redirect; requests are checked
    if (!transfer->cellularAllowed && needsLookUp(url->host) &&
        !mayLookUpName(url->host, settings_.cellularFiles)) {
      return transfer->finish(WebErrorKind::cellularNotAllowed);
    }
    const auto left = std::chrono::ceil<milliseconds>(transfer->deadline - Clock::now());
    if (left <= milliseconds::zero()) return transfer->finish(WebErrorKind::timedOut);

    transfer->response->body = settings_.bodiesForAnotherProcess ? WebBody::forAnotherProcess() : WebBody();
    transfer->head = ResponseHead();
    transfer->isOnCellular = false;
    transfer->ownVerdict.reset();
    transfer->easy.reset(curl_easy_init());
    if (transfer->easy == nullptr || !setUp(*transfer, left))
      return transfer->finish(WebErrorKind::outOfMemory);
    active_.emplace(transfer->easy.get(), transfer);
    if (curl_multi_add_handle(multi_.get(), transfer->easy.get()) != CURLM_OK) {
      active_.erase(transfer->easy.get());
      transfer->easy.reset();
      transfer->finish(WebErrorKind::outOfMemory);
    }
  }

  bool setUp(Transfer& transfer, milliseconds left) {
    CURL* const easy = transfer.easy.get();
    List list;
    std::string acceptEncoding;
    for (const auto& [name, value] : transfer.headers) {
      if (breaksLines(name) || breaksLines(value) || name.empty()) continue;
      if (::strcasecmp(name.c_str(), "Accept-Encoding") == 0) {
        acceptEncoding = value;
        continue;
      }
      curl_slist* const longer = curl_slist_append(list.get(), (name + ": " + value).c_str());
      if (longer == nullptr) return false;
      (void)list.release();
      list.reset(longer);
    }
    transfer.headerList = std::move(list);

    bool ok = true;
    const auto set = [&](CURLoption option, auto value) {
      ok &= curl_easy_setopt(easy, option, value) == CURLE_OK;
    };
    set(CURLOPT_URL, transfer.url.c_str());
    set(CURLOPT_HTTPHEADER, transfer.headerList.get());
    if (!acceptEncoding.empty()) set(CURLOPT_ACCEPT_ENCODING, acceptEncoding.c_str());
    set(CURLOPT_NOSIGNAL, 1L);
    set(CURLOPT_PROTOCOLS_STR, "https");
    set(CURLOPT_FOLLOWLOCATION, 0L);  // followed here, so that each name passes the rule on look-ups
    set(CURLOPT_PROXY, "");           // none, whatever the environment says
    set(CURLOPT_SSLVERSION, static_cast<long>(CURL_SSLVERSION_TLSv1_2));
    set(CURLOPT_SSL_VERIFYPEER, 1L);
    set(CURLOPT_SSL_VERIFYHOST, 2L);
    if (!settings_.certificateAuthorities.empty()) {
      set(CURLOPT_CAINFO, settings_.certificateAuthorities.c_str());
      set(CURLOPT_CAPATH, static_cast<const char*>(nullptr));
    }
    // One transfer, one connection: a connection that another session opened may be a cellular one.
    set(CURLOPT_FRESH_CONNECT, 1L);
    set(CURLOPT_FORBID_REUSE, 1L);
    set(CURLOPT_HTTP_VERSION, static_cast<long>(CURL_HTTP_VERSION_1_1));
    set(CURLOPT_CONNECTTIMEOUT_MS, static_cast<long>(settings_.connectLimit.count()));
    set(CURLOPT_TIMEOUT_MS, static_cast<long>(left.count()));
    set(CURLOPT_LOW_SPEED_LIMIT, kStallBytesPerSecond);
    set(CURLOPT_LOW_SPEED_TIME, static_cast<long>(settings_.stallLimit.count()));
    set(CURLOPT_QUICK_EXIT, 1L);  // else a dead name server outlasts every limit
    set(CURLOPT_BUFFERSIZE, kReceiveBufferSize);
    // What is announced is checked here, what comes in onBody() and onProgress().
    set(CURLOPT_MAXFILESIZE_LARGE, static_cast<curl_off_t>(transfer.largestBody));
    set(CURLOPT_NOPROGRESS, 0L);
    set(CURLOPT_XFERINFOFUNCTION, &Transfer::onProgress);
    set(CURLOPT_XFERINFODATA, &transfer);
    set(CURLOPT_HEADERFUNCTION, &Transfer::onHeader);
    set(CURLOPT_HEADERDATA, &transfer);
    set(CURLOPT_WRITEFUNCTION, &Transfer::onBody);
    set(CURLOPT_WRITEDATA, &transfer);
    set(CURLOPT_OPENSOCKETFUNCTION, &Transfer::onOpenSocket);
    set(CURLOPT_OPENSOCKETDATA, &transfer);
    return ok;
  }

  static int onSocket(CURL*, curl_socket_t fd, int what, void* self, void*) noexcept {
    auto& driver = *static_cast<Driver*>(self);
    try {
      if (what == CURL_POLL_REMOVE) {
        driver.sockets_.erase(fd);
        return 0;
      }
      const Interest interest = interestIn((what & CURL_POLL_IN) != 0, (what & CURL_POLL_OUT) != 0);
      auto& source = driver.sockets_[fd];
      if (source != nullptr && source->setInterest(interest)) return 0;
      if (source == nullptr) {
        source = driver.loop_->watchDescriptor(fd, interest, [&driver, fd](Readiness ready) {
          int mask = 0;
          if (ready.isReadable || ready.hasHungUp) mask |= CURL_CSELECT_IN;
          if (ready.isWritable) mask |= CURL_CSELECT_OUT;
          if (ready.hasFailed) mask |= CURL_CSELECT_ERR;
          driver.act(fd, mask);
        });
        if (source != nullptr) return 0;
      }
    } catch (...) {  // as below
    }
    driver.giveUpSoon();
    return -1;
  }

  static int onTimer(CURLM*, long delay, void* self) noexcept {
    static_cast<Driver*>(self)->setTimer(delay);
    return 0;
  }

  // libcurl moves its time-out with nearly every piece of data. An armed timer that is too early is left
  // alone: when it fires it finds that out, which is cheaper than arming anew each time.
  void setTimer(long delay) noexcept {
    if (delay < 0) {
      due_.reset();
      return;
    }
    due_ = Clock::now() + milliseconds(delay);
    if (timer_ == nullptr || *due_ < armedFor_) arm();
  }

  void arm() noexcept {
    try {
      armedFor_ = *due_;
      const auto delay = std::max(Clock::duration::zero(), armedFor_ - Clock::now());
      timer_ =
          loop_->makeTimer(delay, std::chrono::nanoseconds::zero(), kTimerLeeway, [this] { timerFired(); });
      if (timer_ != nullptr && timer_->activate()) return;
    } catch (...) {  // as below
    }
    timer_.reset();
    giveUpSoon();
  }

  // The loop cannot watch a socket or time a wait, for want of descriptors or memory. libcurl does not end
  // what it waits for in vain, so that is done here, once it has returned: whoever calls it says so below.
  void giveUpSoon() noexcept { givingUp_ = true; }
  void giveUpIfAsked() noexcept {
    if (givingUp_) abandonAll(WebErrorKind::clientUnavailable);
  }

  void timerFired() {
    const auto fired = std::move(timer_);
    if (!due_) return;
    if (Clock::now() < *due_) {
      arm();
    } else {
      due_.reset();
      act(CURL_SOCKET_TIMEOUT, 0);
      // libcurl tells of a time-out only when it has changed; one it saw as not quite due has not.
      long delay = -1;
      if (!due_ && multi_ != nullptr && curl_multi_timeout(multi_.get(), &delay) == CURLM_OK) {
        setTimer(delay);
      }
    }
    giveUpIfAsked();
  }

  void act(curl_socket_t fd, int mask) {
    int running = 0;
    NotingMemory::failed = false;
    // What failed of a transfer shows in the messages. Otherwise it lacked memory for its own books, and
    // libcurl 7.88 crashes when it goes on with them, as it does after a callback of ours refused.
    if (curl_multi_socket_action(multi_.get(), fd, mask, &running) != CURLM_OK) giveUpSoon();
    if (givingUp_) return giveUpIfAsked();
    int left = 0;
    while (const CURLMsg* const message = curl_multi_info_read(multi_.get(), &left)) {
      if (message->msg != CURLMSG_DONE) continue;
      const CURLcode code = message->data.result;
      const auto found = active_.find(message->easy_handle);
      if (found == active_.end()) continue;
      const std::shared_ptr<Transfer> transfer = found->second;
      active_.erase(found);
      (void)curl_multi_remove_handle(multi_.get(), transfer->easy.get());
      try {
        ended(transfer, code);
      } catch (...) {
        transfer->finish(WebErrorKind::outOfMemory);
      }
    }
    if (active_.empty()) {
      due_.reset();
      timer_.reset();
    }
    giveUpIfAsked();
  }

  void ended(const std::shared_ptr<Transfer>& transfer, CURLcode code) {
    long status = 0;
    (void)curl_easy_getinfo(transfer->easy.get(), CURLINFO_RESPONSE_CODE, &status);
    transfer->response->statusCode = static_cast<int>(status);
    if (code == CURLE_OK && isRedirect(status)) {
      const char* location = nullptr;
      (void)curl_easy_getinfo(transfer->easy.get(), CURLINFO_REDIRECT_URL, &location);
      if (location != nullptr) return follow(transfer, location);
    }
    const WebErrorKind kind = verdict(*transfer, code);
    transfer->easy.reset();
    transfer->finish(kind);
  }

  void follow(const std::shared_ptr<Transfer>& transfer, const std::string& location) {
    const auto url = parseUrl(location);
    if (!url || url->scheme != "https") return transfer->finish(WebErrorKind::redirectRefused);
    if (++transfer->redirects > kMaxRedirects) return transfer->finish(WebErrorKind::tooManyRedirects);
    transfer->url = location;
    attempt(transfer);
  }

  static WebErrorKind verdict(const Transfer& transfer, CURLcode code) {
    if (transfer.ownVerdict && code != CURLE_OK) return *transfer.ownVerdict;
    if (code == kTooLarge) return WebErrorKind::malformedResponse;
    switch (code) {
      case CURLE_OK:
        return WebErrorKind::none;
      case CURLE_COULDNT_RESOLVE_HOST:
        return WebErrorKind::hostNotFound;
      case CURLE_COULDNT_CONNECT:
        return transfer.isOnCellular ? WebErrorKind::cellularNotAllowed : WebErrorKind::cannotConnect;
      case CURLE_OPERATION_TIMEDOUT:
        return WebErrorKind::timedOut;
      case CURLE_GOT_NOTHING:
      case CURLE_SEND_ERROR:
      case CURLE_RECV_ERROR:
      case CURLE_PARTIAL_FILE:
        return WebErrorKind::connectionLost;
      case CURLE_PEER_FAILED_VERIFICATION: {
        long reason = 0;
        (void)curl_easy_getinfo(transfer.easy.get(), CURLINFO_SSL_VERIFYRESULT, &reason);
        return reason == kCertificateNotYetValid || reason == kCertificateExpired
                   ? WebErrorKind::certificateClock
                   : WebErrorKind::certificateRefused;
      }
      case CURLE_SSL_CACERT_BADFILE:
        return WebErrorKind::certificateRefused;
      case CURLE_SSL_CONNECT_ERROR:
      case CURLE_SSL_ENGINE_NOTFOUND:
      case CURLE_SSL_CIPHER:
        return WebErrorKind::secureConnection;
      case CURLE_FILESIZE_EXCEEDED:
        return WebErrorKind::bodyTooLarge;
      case CURLE_BAD_CONTENT_ENCODING:
      case CURLE_WEIRD_SERVER_REPLY:
      case CURLE_UNSUPPORTED_PROTOCOL:
        return WebErrorKind::malformedResponse;
      case CURLE_OUT_OF_MEMORY: {
        // Before TLS is set up it may be that library which lacks memory, and its heap is not noted.
        curl_off_t tlsIsUpAfter = 0;
        (void)curl_easy_getinfo(transfer.easy.get(), CURLINFO_APPCONNECT_TIME_T, &tlsIsUpAfter);
        return NotingMemory::failed || tlsIsUpAfter == 0 ? WebErrorKind::outOfMemory
                                                         : WebErrorKind::malformedResponse;
      }
      case CURLE_ABORTED_BY_CALLBACK:
        return WebErrorKind::clientUnavailable;  // see giveUpSoon()
      default:
        return WebErrorKind::unknown;
    }
  }

  void abandon(const std::shared_ptr<Transfer>& transfer) noexcept {
    if (transfer->easy == nullptr || active_.erase(transfer->easy.get()) == 0) return;
    (void)curl_multi_remove_handle(multi_.get(), transfer->easy.get());
    transfer->easy.reset();
    transfer->finish(WebErrorKind::cancelled);
    if (active_.empty()) {
      due_.reset();
      timer_.reset();
    }
    giveUpIfAsked();
  }

  void abandonAll(WebErrorKind kind) noexcept {
    givingUp_ = true;  // what the loop still refuses below does not matter any more
    const auto abandoned = std::exchange(active_, {});
    for (const auto& [easy, transfer] : abandoned) {
      (void)curl_multi_remove_handle(multi_.get(), easy);
      transfer->easy.reset();
      transfer->finish(kind);
    }
    multi_.reset();  // while its sockets can still be taken out of the loop
    sockets_.clear();
    timer_.reset();
    due_.reset();
    givingUp_ = false;
  }

  const CurlSettings settings_;
  WorkQueue* const loop_;  // what queue_ owns, for use on it
  std::mutex mutex_;       // guards the next three
  bool closed_ = false;
  bool used_ = false;  // something has been submitted, so its thread runs
  std::shared_ptr<WorkQueue> queue_;

  std::map<curl_socket_t, std::unique_ptr<DescriptorSource>> sockets_;
  std::unique_ptr<WorkQueue::Timer> timer_;
  Clock::time_point armedFor_;
  std::optional<Clock::time_point> due_;
  bool givingUp_ = false;
  Multi multi_;
  std::map<CURL*, std::shared_ptr<Transfer>> active_;
};

class CurlWebClient::Request final : public WebRequest {
 public:
  Request(std::shared_ptr<Driver> driver, std::shared_ptr<Transfer> transfer)
      : driver_(std::move(driver)), transfer_(std::move(transfer)) {}

  void setCallbackQueue(std::shared_ptr<WorkQueue> queue) override {
    if (transfer_ != nullptr) transfer_->callbackQueue = std::move(queue);
  }
  void setCompletion(Completion completion) override {
    if (transfer_ == nullptr) return;
    transfer_->completion = std::make_shared<Completion>(std::move(completion));
  }
  void setTimeLimit(milliseconds limit) noexcept override {
    if (transfer_ != nullptr) transfer_->timeLimit = limit;
  }
  void setLargestBody(std::uint64_t bytes) noexcept override {
    if (transfer_ != nullptr) transfer_->largestBody = std::min(bytes, kLargestWebBody);
  }
  void send(std::vector<std::byte>) override {
    if (transfer_ == nullptr) return;
    sent_ = transfer_;
    driver_->submit(std::exchange(transfer_, nullptr));
  }
  void cancel() noexcept override {
    if (const auto transfer = sent_.lock()) driver_->cancel(transfer);
  }

 private:
  const std::shared_ptr<Driver> driver_;
  std::shared_ptr<Transfer> transfer_;  // until it is sent
  std::weak_ptr<Transfer> sent_;
};

CurlWebClient::CurlWebClient(std::shared_ptr<Driver> driver) : driver_(std::move(driver)) {}

std::unique_ptr<CurlWebClient> CurlWebClient::make(WorkQueues& queues, CurlSettings settings) {
  if (!startLibrary()) return nullptr;
  auto queue = queues.makeSerial(kQueueLabel, QualityOfService::standard);
  return std::unique_ptr<CurlWebClient>(
      new CurlWebClient(std::make_shared<Driver>(std::move(queue), std::move(settings))));
}

CurlWebClient::~CurlWebClient() { driver_->shutDown(); }

std::shared_ptr<WebSession> CurlWebClient::makeSession() { return std::make_shared<Session>(); }

std::shared_ptr<WebRequest> CurlWebClient::makeRequest(WebRequestType type, const std::string& url,
                                                       const HeaderMap& headers,
                                                       std::shared_ptr<WebSession> session) {
  const auto parsed = parseUrl(url);
  if (type != WebRequestType::get || !parsed || parsed->scheme != "https") return nullptr;
  auto transfer = std::make_shared<Transfer>();
  transfer->url = url;
  transfer->headers = headers;
  transfer->session = std::static_pointer_cast<Session>(session);
  return std::make_shared<Request>(driver_, std::move(transfer));
}

}  // namespace brenvik
