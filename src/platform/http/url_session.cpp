#include "platform/http/url_session.h"

#include <curl/curl.h>

#include <algorithm>
#include <atomic>
#include <cctype>
#include <climits>
#include <condition_variable>
#include <cstdlib>
#include <cstring>
#include <deque>
#include <map>
#include <mutex>
#include <thread>
#include <unordered_map>

#include "platform/clock.h"
#include "platform/dispatch.h"
#include "platform/http/response_cache.h"
#include "platform/log.h"
#include "platform/strings.h"

namespace tavix::platform::http {
namespace {

// Idle time-outs are a property of the wire, not of the daemon's notion of time, so the transfer
// thread measures them on the monotonic clock rather than on an injected Clock.
using Steady = std::chrono::steady_clock;

URLError makeError(long code, std::string description) {
  return URLError{kURLErrorDomain, code, std::move(description)};
}

long errorCodeFor(CURLcode result) {
  switch (result) {
    case CURLE_UNSUPPORTED_PROTOCOL:
      return URLErrorUnsupportedURL;
    case CURLE_URL_MALFORMAT:
      return URLErrorBadURL;
    case CURLE_COULDNT_RESOLVE_HOST:
    case CURLE_COULDNT_RESOLVE_PROXY:
      return URLErrorCannotFindHost;
    case CURLE_COULDNT_CONNECT:
      return URLErrorCannotConnectToHost;
    case CURLE_OPERATION_TIMEDOUT:
      return URLErrorTimedOut;
    case CURLE_GOT_NOTHING:
    case CURLE_PARTIAL_FILE:
    case CURLE_SEND_ERROR:
    case CURLE_RECV_ERROR:
    case CURLE_HTTP2:
    case CURLE_HTTP2_STREAM:
      return URLErrorNetworkConnectionLost;
    case CURLE_FILESIZE_EXCEEDED:
      return URLErrorDataLengthExceedsMaximum;
    case CURLE_WEIRD_SERVER_REPLY:
    case CURLE_BAD_CONTENT_ENCODING:
    case CURLE_TOO_MANY_REDIRECTS:
      return URLErrorBadServerResponse;
    case CURLE_SSL_CONNECT_ERROR:
    case CURLE_PEER_FAILED_VERIFICATION:
    case CURLE_SSL_CERTPROBLEM:
    case CURLE_SSL_CIPHER:
    case CURLE_SSL_CACERT_BADFILE:
    case CURLE_SSL_ISSUER_ERROR:
    case CURLE_SSL_PINNEDPUBKEYNOTMATCH:
      return URLErrorSecureConnectionFailed;
    default:
      return URLErrorUnknown;
  }
}

void initialiseCurlOnce() {
  static std::once_flag once;
  std::call_once(once, [] { curl_global_init(CURL_GLOBAL_DEFAULT); });
}

std::string protocolName(long version) {
  switch (version) {
    case CURL_HTTP_VERSION_1_0:
      return "http/1.0";
    case CURL_HTTP_VERSION_1_1:
      return "http/1.1";
    case CURL_HTTP_VERSION_2_0:
      return "h2";
    case CURL_HTTP_VERSION_3:
      return "h3";
    default:
      return {};
  }
}

// The codings of an Accept-Encoding or Content-Encoding value, lower-case, without parameters.
std::vector<std::string> codings(std::string_view value) {
  std::vector<std::string> out;
  while (!value.empty()) {
    const auto comma = value.find(',');
    std::string_view item = value.substr(0, comma);
    value = comma == std::string_view::npos ? std::string_view{} : value.substr(comma + 1);
    item = item.substr(0, item.find(';'));
    item = trimmedWhitespace(item);
    if (!item.empty()) out.push_back(asciiLowercased(item));
  }
  return out;
}

}  // namespace

struct URLSessionDataTask::Impl {
  std::uint64_t identifier = 0;
  URLRequest request;
  SerialQueue* deliverOn = nullptr;
  std::weak_ptr<URLSession::Impl> session;

  std::atomic<State> state{State::Suspended};
  std::atomic<bool> finished{false};
  // Response bytes so far and as announced (-1 unknown), for progress reports.
  std::atomic<std::int64_t> received{0};
  std::atomic<std::int64_t> expected{-1};

  mutable std::mutex lock;  // guards the fields below
  DataTaskCompletion completion;
  URLSessionTaskMetrics metrics;
  std::optional<std::string> proxy;
  std::map<std::string, std::any> values;

  // Transfer thread only.
  CURL* easy = nullptr;
  curl_slist* headerList = nullptr;
  std::string body;
  std::size_t maxBody = 0;  // 0: no limit
  std::vector<std::string> acceptedEncodings;
  long headStatus = 0;  // of the head being read
  std::optional<URLError> refusal;  // why the session itself ended the transfer
  HeaderFields responseHeaders;
  Steady::time_point lastProgress;
  double idleTimeout = 0;
  curl_off_t lastTransferred = 0;
  bool revalidating = false;
  HeaderFields conditionalHeaders;  // validators of a stale cached entry, sent besides the request's
  char errorBuffer[CURL_ERROR_SIZE] = {};
};

struct URLSession::Impl : std::enable_shared_from_this<URLSession::Impl> {
  using TaskImpl = URLSessionDataTask::Impl;
  struct Command {
    enum Kind { Start, Cancel } kind;
    std::shared_ptr<TaskImpl> task;
  };

  explicit Impl(URLSessionConfiguration c) : config(std::move(c)) {
    initialiseCurlOnce();
    if (!config.delegatePool) {
      ownPool = std::make_unique<DispatchPool>(1);
      config.delegatePool = ownPool.get();
    }
    delegateQueue = std::make_unique<SerialQueue>(
        *config.delegatePool,
        "com.norvel.tavixd.urlsession" + (config.identifier.empty() ? "" : "." + config.identifier));
    if (config.memoryCacheCapacity > 0) cache = std::make_unique<ResponseCache>(config.memoryCacheCapacity, config.clock);
    multi = curl_multi_init();
    curl_multi_setopt(multi, CURLMOPT_PIPELINING, config.multiplexing ? CURLPIPE_MULTIPLEX : CURLPIPE_NOTHING);
    share = curl_share_init();
    curl_share_setopt(share, CURLSHOPT_SHARE, CURL_LOCK_DATA_DNS);
    if (config.tlsSessionReuse) curl_share_setopt(share, CURLSHOPT_SHARE, CURL_LOCK_DATA_SSL_SESSION);
  }

  ~Impl() {
    shutdown();
    curl_multi_cleanup(multi);
    curl_share_cleanup(share);
  }

  // Stops the transfer thread and completes every task still open with URLErrorCancelled.
  void shutdown() {
    {
      std::lock_guard guard(lock);
      if (stopping) return;
      stopping = true;
    }
    idle.notify_one();
    curl_multi_wakeup(multi);
    if (thread.joinable()) thread.join();
    std::vector<std::shared_ptr<TaskImpl>> open;
    {
      std::lock_guard guard(lock);
      for (auto& [id, weak] : tasks) {
        if (auto task = weak.lock()) open.push_back(std::move(task));
      }
      tasks.clear();
    }
    for (auto& task : open) deliver(task, {}, std::nullopt, makeError(URLErrorCancelled, "cancelled"));
  }

  bool post(Command command) {
    {
      std::lock_guard guard(lock);
      if (stopping) return false;
      commands.push_back(std::move(command));
      startThreadIfGone();
    }
    idle.notify_one();
    curl_multi_wakeup(multi);
    return true;
  }

  // Hands the outcome to the task's completion, once: whoever gets here first wins.
  void deliver(const std::shared_ptr<TaskImpl>& task, std::string data, std::optional<HTTPURLResponse> response,
               std::optional<URLError> error) {
    if (task->finished.exchange(true)) return;
    DataTaskCompletion completion;
    {
      std::lock_guard guard(task->lock);
      completion = std::move(task->completion);
      task->completion = nullptr;
    }
    task->state = URLSessionDataTask::State::Completed;
    {
      std::lock_guard guard(lock);
      tasks.erase(task->identifier);
    }
    if (!completion) return;
    SerialQueue& queue = task->deliverOn ? *task->deliverOn : *delegateQueue;
    queue.async([completion = std::move(completion), data = std::move(data), response = std::move(response),
                 error = std::move(error)]() mutable {
      completion(std::move(data), std::move(response), std::move(error));
    });
  }

  void resume(const std::shared_ptr<TaskImpl>& task) {
    if (cache && ResponseCache::appliesTo(task->request)) {
      if (auto hit = cache->lookup(task->request)) {
        if (hit->fresh) {
          {
            std::lock_guard guard(task->lock);
            task->metrics = URLSessionTaskMetrics{};
            task->metrics.fromCache = true;
            task->metrics.responseBodyBytes = static_cast<std::int64_t>(hit->entry.body.size());
          }
          deliver(task, std::move(hit->entry.body), std::move(hit->entry.response), std::nullopt);
          return;
        }
        task->revalidating = true;
        if (auto etag = hit->entry.response.headers.get("ETag")) task->conditionalHeaders.set("If-None-Match", *etag);
        if (auto modified = hit->entry.response.headers.get("Last-Modified")) {
          task->conditionalHeaders.set("If-Modified-Since", *modified);
        }
      }
    }
    if (!post({Command::Start, task})) deliver(task, {}, std::nullopt, makeError(URLErrorCancelled, "cancelled"));
  }

  // Under `lock`. The transfer thread runs only while there is work or shortly after; one that has
  // left set `threadRunning` false under the lock as its last act, so joining it here is immediate.
  void startThreadIfGone() {
    if (threadRunning) return;
    if (thread.joinable()) thread.join();
    threadRunning = true;
    thread = std::thread([this] { run(); });
  }

  // ---- transfer thread ----

  void run() {
    nameThisThread("tavixd-http");
    long waitMs = -1;
    for (;;) {
      std::deque<Command> pending;
      {
        std::unique_lock guard(lock);
        // Nothing on the wire and no timer of curl's due: sleep until a command comes, and leave
        // if none comes within the linger.
        if (running.empty() && waitMs < 0 &&
            !idle.wait_for(guard, config.transferThreadLinger, [this] { return stopping || !commands.empty(); })) {
          threadRunning = false;  // the next post starts a new thread
          return;
        }
        if (stopping) break;
        pending.swap(commands);
      }
      for (auto& command : pending) {
        if (command.kind == Command::Start) {
          start(command.task);
        } else {
          detach(command.task);
        }
      }
      int stillRunning = 0;
      curl_multi_perform(multi, &stillRunning);
      int queued = 0;
      while (CURLMsg* message = curl_multi_info_read(multi, &queued)) {
        if (message->msg != CURLMSG_DONE) continue;
        auto it = running.find(message->easy_handle);
        if (it == running.end()) continue;
        auto task = it->second;
        finish(task, message->data.result);
      }
      waitMs = expireIdleTasks();
      if (running.empty() && waitMs < 0) continue;
      // Bounded by curl's own timer and the tasks' idle deadlines; without either, only sockets
      // and curl_multi_wakeup() end the wait.
      curl_multi_poll(multi, nullptr, 0, waitMs < 0 ? INT_MAX : static_cast<int>(waitMs), nullptr);
    }
    // Shutting down: every transfer still on the wire ends as cancelled.
    auto open = std::move(running);
    running.clear();
    for (auto& [easy, task] : open) {
      cleanup(task);
      deliver(task, {}, std::nullopt, makeError(URLErrorCancelled, "cancelled"));
    }
  }

  static size_t onBody(char* data, size_t size, size_t count, void* user) {
    auto* task = static_cast<TaskImpl*>(user);
    if (task->maxBody > 0 && task->body.size() + size * count > task->maxBody) {
      task->refusal = makeError(URLErrorDataLengthExceedsMaximum,
                                "response body over the limit of " + std::to_string(task->maxBody) + " bytes");
      return 0;  // ends the transfer
    }
    task->body.append(data, size * count);
    task->lastProgress = Steady::now();
    return size * count;
  }

  static size_t onHeader(char* data, size_t size, size_t count, void* user) {
    auto* task = static_cast<TaskImpl*>(user);
    task->lastProgress = Steady::now();
    std::string_view line(data, size * count);
    while (!line.empty() && (line.back() == '\r' || line.back() == '\n')) line.remove_suffix(1);
    if (line.starts_with("HTTP/")) {
      // A new head (after a redirect or an interim 1xx) replaces the one before.
      task->responseHeaders = HeaderFields{};
      const auto blank = line.find(' ');
      task->headStatus = blank == std::string_view::npos ? 0 : std::atol(std::string(line.substr(blank + 1, 3)).c_str());
    } else if (const auto colon = line.find(':'); colon != std::string_view::npos) {
      std::string_view value = line.substr(colon + 1);
      while (!value.empty() && (value.front() == ' ' || value.front() == '\t')) value.remove_prefix(1);
      const std::string_view name = line.substr(0, colon);
      // Only the codings the request asked for are decoded; a body in any other (a small gzip
      // stream that inflates to gigabytes, say) is refused before a byte of it is read.
      const bool finalHead = task->headStatus >= 200 && (task->headStatus < 300 || task->headStatus >= 400);
      if (finalHead && equalsIgnoringASCIICase(name, "Content-Encoding")) {
        for (const auto& coding : codings(value)) {
          if (coding == "identity" ||
              std::find(task->acceptedEncodings.begin(), task->acceptedEncodings.end(), coding) !=
                  task->acceptedEncodings.end()) {
            continue;
          }
          task->refusal = makeError(URLErrorBadServerResponse,
                                    "response in Content-Encoding " + coding + ", which the request did not ask for");
          return 0;
        }
      }
      task->responseHeaders.add(std::string(name), std::string(value));
    }
    return size * count;
  }

  static int onProgress(void* user, curl_off_t dltotal, curl_off_t dlnow, curl_off_t, curl_off_t ulnow) {
    auto* task = static_cast<TaskImpl*>(user);
    task->received = dlnow;
    task->expected = dltotal > 0 ? dltotal : -1;
    if (dlnow + ulnow != task->lastTransferred) {
      task->lastTransferred = dlnow + ulnow;
      task->lastProgress = Steady::now();
    }
    return 0;
  }

  void start(const std::shared_ptr<TaskImpl>& task) {
    if (task->finished) return;  // cancelled before it reached the wire
    for (const auto& [name, value] : task->request.headers.all()) {
      if (isValidHeaderName(name) && isValidHeaderValue(value)) continue;
      // Sent as it stands, a CR LF in a value would end the field and begin one of the sender's.
      refuse(task, makeError(URLErrorBadURL, "header field " + name + " carries a control character"));
      return;
    }
    CURL* easy = curl_easy_init();
    if (!easy) {
      deliver(task, {}, std::nullopt, makeError(URLErrorUnknown, "cannot create a transfer"));
      return;
    }
    task->easy = easy;
    const URLRequest& request = task->request;
    curl_easy_setopt(easy, CURLOPT_PRIVATE, task.get());
    curl_easy_setopt(easy, CURLOPT_ERRORBUFFER, task->errorBuffer);
    curl_easy_setopt(easy, CURLOPT_URL, request.url.c_str());
    curl_easy_setopt(easy, CURLOPT_PROTOCOLS_STR, "http,https");
    curl_easy_setopt(easy, CURLOPT_REDIR_PROTOCOLS_STR, "http,https");
    curl_easy_setopt(easy, CURLOPT_FOLLOWLOCATION, 1L);
    curl_easy_setopt(easy, CURLOPT_MAXREDIRS, 10L);
    curl_easy_setopt(easy, CURLOPT_NOSIGNAL, 1L);
    curl_easy_setopt(easy, CURLOPT_HTTP_VERSION, static_cast<long>(CURL_HTTP_VERSION_2TLS));
    // Waiting for a connection that may multiplex pays only where the TLS handshake (ALPN) says
    // soon whether it will. Over plain HTTP it is said by the first response, so one slow or hung
    // answer would hold every other request to its host.
    const bool tls = request.url.size() >= 8 && equalsIgnoringASCIICase(std::string_view(request.url).substr(0, 8), "https://");
    curl_easy_setopt(easy, CURLOPT_PIPEWAIT, config.multiplexing && tls ? 1L : 0L);
    if (auto asked = request.headers.get("Accept-Encoding"); asked && !asked->empty()) {
      // curl sends the field from this option and decodes what it names.
      curl_easy_setopt(easy, CURLOPT_ACCEPT_ENCODING, asked->c_str());
      task->acceptedEncodings = codings(*asked);
    }
    task->maxBody = config.maximumResponseBodySize;
    if (task->maxBody > 0) {
      // A body announced larger than the limit is refused on its head alone.
      curl_easy_setopt(easy, CURLOPT_MAXFILESIZE_LARGE, static_cast<curl_off_t>(task->maxBody));
    }
    curl_easy_setopt(easy, CURLOPT_SSL_VERIFYPEER, 1L);
    curl_easy_setopt(easy, CURLOPT_SSL_VERIFYHOST, 2L);
    if (!config.trustedCertificatesFile.empty()) {
      curl_easy_setopt(easy, CURLOPT_CAINFO, config.trustedCertificatesFile.c_str());
    }
    curl_easy_setopt(easy, CURLOPT_TCP_FASTOPEN, config.tcpFastOpen ? 1L : 0L);
    curl_easy_setopt(easy, CURLOPT_SSL_SESSIONID_CACHE, config.tlsSessionReuse ? 1L : 0L);
    curl_easy_setopt(easy, CURLOPT_SHARE, share);
    curl_easy_setopt(easy, CURLOPT_MAXAGE_CONN, static_cast<long>(config.connectionIdleTimeout.count()));
    {
      std::lock_guard guard(task->lock);
      // An empty proxy string turns off the proxy variables of the environment as well.
      curl_easy_setopt(easy, CURLOPT_PROXY, task->proxy ? task->proxy->c_str() : "");
    }

    if (request.method == "GET") {
      curl_easy_setopt(easy, CURLOPT_HTTPGET, 1L);
    } else if (request.method == "HEAD") {
      curl_easy_setopt(easy, CURLOPT_NOBODY, 1L);
    } else {
      if (request.method == "POST") {
        curl_easy_setopt(easy, CURLOPT_POST, 1L);
      } else {
        curl_easy_setopt(easy, CURLOPT_CUSTOMREQUEST, request.method.c_str());
      }
      if (request.method == "POST" || !request.body.empty()) {
        curl_easy_setopt(easy, CURLOPT_POSTFIELDSIZE_LARGE, static_cast<curl_off_t>(request.body.size()));
        curl_easy_setopt(easy, CURLOPT_POSTFIELDS, request.body.data());
      }
    }
    for (const HeaderFields* fields : {&request.headers, static_cast<const HeaderFields*>(&task->conditionalHeaders)}) {
      for (const auto& [name, value] : fields->all()) {
        if (equalsIgnoringASCIICase(name, "Accept-Encoding")) continue;  // set above
        // "Name;" is curl's way to send a header with an empty value.
        const std::string line = value.empty() ? name + ";" : name + ": " + value;
        task->headerList = curl_slist_append(task->headerList, line.c_str());
      }
    }
    task->headerList = curl_slist_append(task->headerList, "Expect:");
    curl_easy_setopt(easy, CURLOPT_HTTPHEADER, task->headerList);

    curl_easy_setopt(easy, CURLOPT_WRITEFUNCTION, &Impl::onBody);
    curl_easy_setopt(easy, CURLOPT_WRITEDATA, task.get());
    curl_easy_setopt(easy, CURLOPT_HEADERFUNCTION, &Impl::onHeader);
    curl_easy_setopt(easy, CURLOPT_HEADERDATA, task.get());
    curl_easy_setopt(easy, CURLOPT_XFERINFOFUNCTION, &Impl::onProgress);
    curl_easy_setopt(easy, CURLOPT_XFERINFODATA, task.get());
    curl_easy_setopt(easy, CURLOPT_NOPROGRESS, 0L);

    task->idleTimeout = config.timeoutIntervalForRequest > 0 ? config.timeoutIntervalForRequest : request.timeoutInterval;
    if (task->idleTimeout > 0) {
      curl_easy_setopt(easy, CURLOPT_CONNECTTIMEOUT_MS, static_cast<long>(task->idleTimeout * 1000));
    }
    double total = config.timeoutIntervalForResource;
    if (config.requestTimeoutIsDeadline && request.timeoutInterval > 0) {
      total = total > 0 ? std::min(total, request.timeoutInterval) : request.timeoutInterval;
    }
    if (total > 0) curl_easy_setopt(easy, CURLOPT_TIMEOUT_MS, std::max(1L, static_cast<long>(total * 1000)));
    task->lastProgress = Steady::now();

    if (curl_multi_add_handle(multi, easy) != CURLM_OK) {
      cleanup(task);
      deliver(task, {}, std::nullopt, makeError(URLErrorUnknown, "cannot start the transfer"));
      return;
    }
    running.emplace(easy, task);
  }

  // Fails a task that the session will not send.
  void refuse(const std::shared_ptr<TaskImpl>& task, URLError error) {
    if (config.logger) config.logger->error("refused {}: {}", task->request.url, error.description);
    deliver(task, {}, std::nullopt, std::move(error));
  }

  // Takes a cancelled task off the wire; its completion has been delivered already.
  void detach(const std::shared_ptr<TaskImpl>& task) {
    if (!task->easy || !running.count(task->easy)) return;
    running.erase(task->easy);
    cleanup(task);
  }

  void cleanup(const std::shared_ptr<TaskImpl>& task) {
    if (task->easy) {
      curl_multi_remove_handle(multi, task->easy);
      curl_easy_cleanup(task->easy);
      task->easy = nullptr;
    }
    if (task->headerList) {
      curl_slist_free_all(task->headerList);
      task->headerList = nullptr;
    }
  }

  // Fails tasks that made no progress for their idle time-out; returns how long the loop may
  // wait before it has to look again, or -1 when nothing is due.
  long expireIdleTasks() {
    long waitMs = -1;
    curl_multi_timeout(multi, &waitMs);
    const auto now = Steady::now();
    std::vector<std::shared_ptr<TaskImpl>> expired;
    for (auto& [easy, task] : running) {
      if (task->idleTimeout <= 0) continue;
      const auto deadline = task->lastProgress + std::chrono::duration_cast<Steady::duration>(
                                                      std::chrono::duration<double>(task->idleTimeout));
      if (deadline <= now) {
        expired.push_back(task);
      } else {
        const long left = static_cast<long>(
            std::chrono::duration_cast<std::chrono::milliseconds>(deadline - now).count() + 1);
        waitMs = waitMs < 0 ? left : std::min(waitMs, left);
      }
    }
    for (auto& task : expired) {
      recordMetrics(task);
      running.erase(task->easy);
      cleanup(task);
      deliver(task, {}, std::nullopt, makeError(URLErrorTimedOut, "The request timed out."));
    }
    return expired.empty() ? waitMs : 0;
  }

  void recordMetrics(const std::shared_ptr<TaskImpl>& task) {
    CURL* easy = task->easy;
    URLSessionTaskMetrics m;
    auto seconds = [easy](CURLINFO info) {
      curl_off_t micros = 0;
      curl_easy_getinfo(easy, info, &micros);
      return static_cast<double>(micros) / 1e6;
    };
    m.domainLookupSeconds = seconds(CURLINFO_NAMELOOKUP_TIME_T);
    m.connectSeconds = seconds(CURLINFO_CONNECT_TIME_T);
    m.secureConnectionSeconds = seconds(CURLINFO_APPCONNECT_TIME_T);
    m.firstByteSeconds = seconds(CURLINFO_STARTTRANSFER_TIME_T);
    m.totalSeconds = seconds(CURLINFO_TOTAL_TIME_T);
    long connects = 0;
    curl_easy_getinfo(easy, CURLINFO_NUM_CONNECTS, &connects);
    long status = 0;
    curl_easy_getinfo(easy, CURLINFO_RESPONSE_CODE, &status);
    m.reusedConnection = connects == 0 && status != 0;
    char* ip = nullptr;
    if (curl_easy_getinfo(easy, CURLINFO_PRIMARY_IP, &ip) == CURLE_OK && ip) m.peerAddress = ip;
    curl_easy_getinfo(easy, CURLINFO_PRIMARY_PORT, &m.peerPort);
    long version = 0;
    curl_easy_getinfo(easy, CURLINFO_HTTP_VERSION, &version);
    m.protocol = protocolName(version);
    curl_off_t uploaded = 0, downloaded = 0;
    curl_easy_getinfo(easy, CURLINFO_SIZE_UPLOAD_T, &uploaded);
    curl_easy_getinfo(easy, CURLINFO_SIZE_DOWNLOAD_T, &downloaded);
    m.requestBodyBytes = uploaded;
    m.responseBodyBytes = downloaded;
    std::lock_guard guard(task->lock);
    task->metrics = std::move(m);
  }

  void finish(const std::shared_ptr<TaskImpl>& task, CURLcode result) {
    recordMetrics(task);
    CURL* easy = task->easy;
    std::optional<HTTPURLResponse> response;
    std::optional<URLError> error;
    long status = 0;
    curl_easy_getinfo(easy, CURLINFO_RESPONSE_CODE, &status);
    if (result == CURLE_FILESIZE_EXCEEDED && !task->refusal) {
      task->refusal = makeError(URLErrorDataLengthExceedsMaximum, "response body announced over the limit of " +
                                                                       std::to_string(task->maxBody) + " bytes");
    }
    if (task->refusal) {
      error = task->refusal;
      if (config.logger) config.logger->error("cancelled {}: {}", task->request.url, error->description);
    } else if (result != CURLE_OK) {
      const std::string text = task->errorBuffer[0] ? task->errorBuffer : curl_easy_strerror(result);
      error = makeError(errorCodeFor(result), text);
    } else if (status == 0) {
      error = makeError(URLErrorBadServerResponse, "no HTTP response");
    } else {
      response.emplace();
      response->statusCode = status;
      char* url = nullptr;
      if (curl_easy_getinfo(easy, CURLINFO_EFFECTIVE_URL, &url) == CURLE_OK && url) response->url = url;
      response->headers = std::move(task->responseHeaders);
      curl_off_t length = -1;
      curl_easy_getinfo(easy, CURLINFO_CONTENT_LENGTH_DOWNLOAD_T, &length);
      response->expectedContentLength = length;
    }
    running.erase(easy);
    cleanup(task);

    std::string body = error ? std::string{} : std::move(task->body);
    if (response && cache) {
      if (task->revalidating && response->statusCode == 304) {
        if (auto entry = cache->revalidated(task->request, *response)) {
          response = std::move(entry->response);
          body = std::move(entry->body);
        }
      } else {
        cache->store(task->request, *response, body);
      }
    }
    deliver(task, std::move(body), std::move(response), std::move(error));
  }

  URLSessionConfiguration config;
  std::unique_ptr<DispatchPool> ownPool;
  std::unique_ptr<SerialQueue> delegateQueue;
  std::unique_ptr<ResponseCache> cache;
  CURLM* multi = nullptr;
  CURLSH* share = nullptr;
  std::thread thread;
  bool threadRunning = false;  // under `lock`
  std::atomic<std::uint64_t> nextIdentifier{1};

  std::mutex lock;  // guards commands, stopping, tasks and the transfer thread's start
  std::condition_variable idle;  // the transfer thread waits here while nothing is in flight
  std::deque<Command> commands;
  bool stopping = false;
  std::unordered_map<std::uint64_t, std::weak_ptr<TaskImpl>> tasks;  // every task not yet completed

  std::unordered_map<CURL*, std::shared_ptr<TaskImpl>> running;  // transfer thread only
};

// ---- URLSessionDataTask ----

URLSessionDataTask::~URLSessionDataTask() = default;

void URLSessionDataTask::resume() {
  auto expected = State::Suspended;
  if (!impl_->state.compare_exchange_strong(expected, State::Running)) return;
  if (auto session = impl_->session.lock()) {
    session->resume(impl_);
    return;
  }
  // The session is gone; it completed every task it knew of, so nothing else will.
  impl_->finished = true;
  impl_->state = State::Completed;
}

void URLSessionDataTask::cancel() {
  if (impl_->finished) return;
  if (auto session = impl_->session.lock()) {
    session->deliver(impl_, {}, std::nullopt, makeError(URLErrorCancelled, "cancelled"));
    if (impl_->state != State::Suspended) session->post({URLSession::Impl::Command::Cancel, impl_});
  }
}

std::uint64_t URLSessionDataTask::taskIdentifier() const { return impl_->identifier; }

const URLRequest& URLSessionDataTask::originalRequest() const { return impl_->request; }

URLSessionDataTask::State URLSessionDataTask::state() const { return impl_->state; }

std::int64_t URLSessionDataTask::countOfBytesReceived() const { return impl_->received; }

std::int64_t URLSessionDataTask::countOfBytesExpectedToReceive() const { return impl_->expected; }

URLSessionTaskMetrics URLSessionDataTask::metrics() const {
  std::lock_guard guard(impl_->lock);
  return impl_->metrics;
}

void URLSessionDataTask::setProxy(std::optional<std::string> proxyURL) {
  std::lock_guard guard(impl_->lock);
  impl_->proxy = std::move(proxyURL);
}

void URLSessionDataTask::setValue(const std::string& key, std::any value) {
  std::lock_guard guard(impl_->lock);
  if (value.has_value()) {
    impl_->values[key] = std::move(value);
  } else {
    impl_->values.erase(key);
  }
}

std::any URLSessionDataTask::value(const std::string& key) const {
  std::lock_guard guard(impl_->lock);
  const auto it = impl_->values.find(key);
  return it == impl_->values.end() ? std::any{} : it->second;
}

// ---- URLSession ----

URLSession::URLSession(URLSessionConfiguration configuration)
    : impl_(std::make_shared<Impl>(std::move(configuration))) {}

URLSession::~URLSession() { impl_->shutdown(); }

void URLSession::invalidateAndCancel() { impl_->shutdown(); }

std::shared_ptr<URLSessionDataTask> URLSession::dataTask(URLRequest request, DataTaskCompletion completion,
                                                         SerialQueue* deliverOn) {
  auto task = std::make_shared<URLSessionDataTask::Impl>();
  task->identifier = impl_->nextIdentifier++;
  task->request = std::move(request);
  task->completion = std::move(completion);
  task->deliverOn = deliverOn;
  task->session = impl_;
  {
    std::lock_guard guard(impl_->lock);
    if (!impl_->stopping) {
      // Tasks dropped without ever being resumed leave dead entries; sweep them now and then.
      if (impl_->tasks.size() >= 256) std::erase_if(impl_->tasks, [](const auto& e) { return e.second.expired(); });
      impl_->tasks.emplace(task->identifier, task);
    }
  }
  return std::shared_ptr<URLSessionDataTask>(new URLSessionDataTask(std::move(task)));
}

const URLSessionConfiguration& URLSession::configuration() const { return impl_->config; }

std::size_t URLSession::memoryCacheUsage() const { return impl_->cache ? impl_->cache->usage() : 0; }

void URLSession::purgeMemoryCache() {
  if (impl_->cache) impl_->cache->purge();
}

}  // namespace tavix::platform::http
