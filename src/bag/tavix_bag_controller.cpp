#include "bag/tavix_bag_controller.h"

#include <arpa/inet.h>

#include <cctype>
#include <cmath>
#include <utility>

#include <fmt/core.h>

#include "bagview/tvx_bag.h"
#include "context/user_guid_controller.h"
#include "core/diagnostics.h"
#include "core/logging.h"
#include "core/names.h"
#include "feedback/client_session.h"
#include "feedback/tavix_feedback.h"
#include "network/retryable_request.h"
#include "network/url_request_builder.h"
#include "bagview/user_agent.h"
#include "platform/clock.h"
#include "platform/defaults.h"
#include "platform/http/url.h"
#include "platform/http/url_session.h"
#include "platform/json_value.h"
#include "platform/transactions.h"
#include "platform/strings.h"

namespace tavix {

using platform::Dictionary;
using platform::PropertyValue;

namespace {

constexpr const char* kBagURLDefaultsKey = "TVXBagURL";
constexpr const char* kExpirationKey = "__expiration";
constexpr const char* kBagURLKey = "__bagurl";
constexpr const char* kRefreshDisabledKey = "__refresh_disabled";
constexpr const char* kCacheFileName = "bag.plist";
constexpr const char* kNewsUserAgent = "news/1.0";
constexpr double kBagLifetimeSeconds = 14400;
// A bag this close to its expiry is fetched again already, so that it never serves stale.
constexpr double kRefreshMarginSeconds = 600;
constexpr int kFetchRetries = 5;
constexpr long kBagFetchErrorCode = 2;

platform::Logger& bagLog() { return TavixLogForCategory(TavixLoggingCategoryBag); }

std::string uppercased(std::string_view s) {
  std::string out(s);
  for (char& c : out) c = static_cast<char>(std::toupper(static_cast<unsigned char>(c)));
  return out;
}

bool isLoopbackHost(std::string host) {
  host = platform::asciiLowercased(host);
  if (host == "localhost") return true;
  if (host.size() > 2 && host.front() == '[' && host.back() == ']') host = host.substr(1, host.size() - 2);
  in_addr v4{};
  if (inet_pton(AF_INET, host.c_str(), &v4) == 1) return (ntohl(v4.s_addr) >> 24) == 127;
  in6_addr v6{};
  if (inet_pton(AF_INET6, host.c_str(), &v6) == 1) return IN6_IS_ADDR_LOOPBACK(&v6);
  return false;
}

// An absolute URL the daemon may fetch a bag from: HTTPS with a host, or plain HTTP to this
// machine only (development servers); the configuration must not travel in clear text.
bool isUsableBagURL(const std::string& url) {
  const auto parsed = platform::http::URL::parse(url);
  if (!parsed || parsed->host().empty()) return false;
  const std::string scheme = parsed->scheme();
  if (scheme == "https") return true;
  return scheme == "http" && isLoopbackHost(parsed->host());
}

std::string describeResponse(const std::optional<platform::http::HTTPURLResponse>& response) {
  if (!response) return "(none)";
  return fmt::format("{{status: {}, url: {}, headers: {}}}", response->statusCode, response->url,
                     response->headers.description());
}

const char* typeName(PropertyValue::Type type) {
  switch (type) {
    case PropertyValue::Type::Boolean: return "Boolean";
    case PropertyValue::Type::Integer: return "Integer";
    case PropertyValue::Type::Real: return "Real";
    case PropertyValue::Type::String: return "String";
    case PropertyValue::Type::Date: return "Date";
    case PropertyValue::Type::Data: return "Data";
    case PropertyValue::Type::Array: return "Array";
    case PropertyValue::Type::Dictionary: return "Dictionary";
  }
  return "unknown";
}

// 0 or 1 for a bag, 2 when there is none yet.
unsigned long newsAvailability(const std::shared_ptr<const TVXBag>& bag) {
  if (!bag) return 2;
  return TVXBag(bag->sharedRawBag(), kNewsUserAgent).isEnabled() ? 1 : 0;
}

// The decimal string of a version number the server sent; empty for anything that is not one.
std::optional<std::string> versionString(const PropertyValue* value) {
  if (!value) return std::nullopt;
  if (auto i = value->integer()) return std::to_string(*i);
  if (auto r = value->real()) {
    if (!std::isfinite(*r)) return std::nullopt;
    if (*r == std::trunc(*r) && std::fabs(*r) < 1e15) return fmt::format("{:.0f}", *r);
    return fmt::format("{}", *r);
  }
  if (auto s = value->string()) {
    // A number written as text still names a version; anything else does not.
    if (s->empty() || !std::isdigit(static_cast<unsigned char>(s->front()))) return std::nullopt;
    return *s;
  }
  return std::nullopt;
}

TVXBagError bagError(std::string reason) { return {kTVXErrorDomain, kBagFetchErrorCode, std::move(reason)}; }

// Event time stamps are host ticks: nanoseconds of the daemon's clock.
std::uint64_t hostTicks(platform::Clock& clock) {
  return static_cast<std::uint64_t>(
      std::chrono::duration_cast<std::chrono::nanoseconds>(clock.now().time_since_epoch()).count());
}

proto::CTStartNetworkSearchFeedback bagFetchStartRecord(const platform::http::URLRequest& request,
                                                        std::uint64_t ticks) {
  proto::CTStartNetworkSearchFeedback start;
  start.set_timestamp(ticks);
  start.set_input("");
  start.set_url(request.url);
  for (const auto& [name, value] : request.headers.all()) (*start.mutable_headers())[name] = value;
  start.set_trigger_event(proto::TriggerSearchRequestEvent::bag);
  start.set_endpoint_type(proto::EndpointType::tavix_bag);
  start.set_uuid(makeRandomUUIDString());
  return start;
}

// The end of the fetch, matched to its start by uuid; timing in milliseconds.
proto::CTEndNetworkSearchFeedback bagFetchEndRecord(const proto::CTStartNetworkSearchFeedback& start,
                                                    std::size_t responseSize, long statusCode,
                                                    const platform::http::URLSessionTaskMetrics& metrics,
                                                    std::uint64_t ticks) {
  proto::CTEndNetworkSearchFeedback end;
  end.set_timestamp(ticks);
  end.set_uuid(start.uuid());
  end.set_endpoint_type(start.endpoint_type());
  end.set_status_code(static_cast<std::int32_t>(statusCode));
  end.set_response_size(static_cast<std::uint32_t>(responseSize));
  auto& timing = *end.mutable_network_timing_data();
  timing["domain_lookup"] = metrics.domainLookupSeconds * 1000;
  timing["connect"] = metrics.connectSeconds * 1000;
  timing["secure_connection"] = metrics.secureConnectionSeconds * 1000;
  timing["first_byte"] = metrics.firstByteSeconds * 1000;
  timing["total"] = metrics.totalSeconds * 1000;
  end.set_connection_reused(metrics.reusedConnection);
  end.set_peer_address(metrics.peerAddress);
  return end;
}

}  // namespace

// The controller's clock while it lives; afterwards pauses are dropped and pending ones
// cancelled, so that a retry loop still on the wire ends quietly instead of reaching a queue, a
// pool or a clock that shutdown has taken away.
class TavixBagController::RetryClock final : public platform::Clock {
 public:
  explicit RetryClock(platform::Clock& inner) : inner_(inner), last_(inner.now()) {}

  platform::TimePoint now() const override {
    std::lock_guard hold(lock_);
    if (!off_) last_ = inner_.now();
    return last_;
  }
  platform::TimerHandle after(platform::Duration delay, platform::SerialQueue& queue, platform::Task task) override {
    std::lock_guard hold(lock_);
    if (off_) return {};
    std::erase_if(pending_, [](const platform::TimerHandle& h) { return h.isCancelled(); });
    auto handle = inner_.after(delay, queue, std::move(task));
    pending_.push_back(handle);
    return handle;
  }
  bool waitFor(std::unique_lock<std::mutex>& lock, std::condition_variable& signal, platform::Duration timeout,
               const std::function<bool()>& ready) override {
    return inner_.waitFor(lock, signal, timeout, ready);
  }
  void shutdown() {
    std::lock_guard hold(lock_);
    off_ = true;
    for (auto& handle : pending_) handle.cancel();
    pending_.clear();
  }

 private:
  platform::Clock& inner_;
  mutable std::mutex lock_;
  mutable platform::TimePoint last_;
  bool off_ = false;
  std::vector<platform::TimerHandle> pending_;
};

int compareNumericStrings(std::string_view a, std::string_view b) {
  std::size_t i = 0, j = 0;
  while (i < a.size() && j < b.size()) {
    const bool da = std::isdigit(static_cast<unsigned char>(a[i]));
    const bool db = std::isdigit(static_cast<unsigned char>(b[j]));
    if (da && db) {
      std::size_t ei = i, ej = j;
      while (ei < a.size() && std::isdigit(static_cast<unsigned char>(a[ei]))) ++ei;
      while (ej < b.size() && std::isdigit(static_cast<unsigned char>(b[ej]))) ++ej;
      // Leading zeros do not make a number bigger.
      std::size_t si = i, sj = j;
      while (si + 1 < ei && a[si] == '0') ++si;
      while (sj + 1 < ej && b[sj] == '0') ++sj;
      const std::size_t li = ei - si, lj = ej - sj;
      if (li != lj) return li < lj ? -1 : 1;
      if (int c = a.substr(si, li).compare(b.substr(sj, lj)); c != 0) return c < 0 ? -1 : 1;
      i = ei;
      j = ej;
      continue;
    }
    if (a[i] != b[j]) return static_cast<unsigned char>(a[i]) < static_cast<unsigned char>(b[j]) ? -1 : 1;
    ++i;
    ++j;
  }
  if (i < a.size()) return 1;
  if (j < b.size()) return -1;
  return 0;
}

std::shared_ptr<TavixBagController> TavixBagController::create(Environment env) {
  std::shared_ptr<TavixBagController> controller(new TavixBagController(std::move(env)));
  controller->start();
  return controller;
}

TavixBagController::TavixBagController(Environment env)
    : env_(std::move(env)),
      inMemoryBagCacheAccessQueue_(*env_.feedback.pool, "com.norvel.tavixd.bagcontroller.cacheaccess"),
      retryQueue_(*env_.feedback.pool, "com.norvel.tavixd.bagcontroller.retry"),
      retryClock_(std::make_shared<RetryClock>(*env_.feedback.clock)) {
  DeviceInformation device(env_.feedback.defaults.get());
  userAgent_ = createUserAgentString(std::nullopt, device);
}

TavixBagController::~TavixBagController() {
  refreshRegistration_.reset();
  invalidate();
}

void TavixBagController::start() {
  if (auto dictionary = diskCachedBagDictionary()) {
    cacheBagState(std::make_shared<const TVXBag>(std::move(*dictionary), userAgent_.value_or("")), true);
  }
  std::weak_ptr<TavixBagController> weak = weak_from_this();
  refreshRegistration_ = env_.center->addObserver(
      kTVXBagRefreshRequiredNotification, env_.requestFactory.get(), nullptr,
      [weak](const platform::Notification&) {
        if (auto self = weak.lock()) self->handleRefreshNotification();
      });
}

std::string TavixBagController::bagFetchURLWithCountry(std::string_view countryCode) {
  const auto configured = env_.feedback.defaults->stringForKey(kBagURLDefaultsKey);
  if (configured && !configured->empty()) {
    if (isUsableBagURL(*configured)) return *configured;
    bagLog().error("Malformed tavix bag URL in user defaults key {}", kBagURLDefaultsKey);
  }
  return uppercased(countryCode) == "CN" ? kTVXDefaultBagURLForCN : kTVXDefaultBagURL;
}

std::optional<std::string> TavixBagController::currentBagCacheURL() {
  auto request = env_.requestFactory->bagCacheRequest(*this, userAgent_, std::nullopt);
  if (!request) return std::nullopt;
  return request->url;
}

bool TavixBagController::isRefreshRequiredForCachedBag(const Dictionary& rawBag) {
  if (rawBag.count(kRefreshDisabledKey)) {
    bagLog().info("Bag refresh is disabled.");
    return false;
  }
  double expiration = 0;
  if (auto it = rawBag.find(kExpirationKey); it != rawBag.end()) expiration = it->second.asReal().value_or(0);
  const double remaining = expiration - platform::toUnixSeconds(env_.feedback.clock->now());
  if (remaining < kRefreshMarginSeconds) {
    bagLog().info("bag expired: {:f}", remaining);
    TavixDiagnosticDataReporter::addValue(1, "com.norvel.tavixd.bag.expired");
    return true;
  }
  const auto cached = rawBag.find(kBagURLKey);
  if (cached == rawBag.end()) {
    bagLog().info("no bag URL found in cache");
    return true;
  }
  const std::string cachedURL = cached->second.string() ? *cached->second.string() : std::string();
  const std::string currentURL = currentBagCacheURL().value_or("");
  if (cachedURL != currentURL) {
    bagLog().info("bag url changed from: {} to {}", cachedURL, currentURL);
    return true;
  }
  return false;
}

std::shared_ptr<const TVXBag> TavixBagController::inMemoryBag() {
  std::shared_ptr<const TVXBag> bag;
  inMemoryBagCacheAccessQueue_.read([&] { bag = inMemoryBag_; });
  return bag;
}

void TavixBagController::setInMemoryBag(std::shared_ptr<const TVXBag> bag) {
  inMemoryBagCacheAccessQueue_.writeSync([&] { inMemoryBag_ = std::move(bag); });
}

std::shared_ptr<const TVXBag> TavixBagController::cachedBagState() {
  std::shared_ptr<const TVXBag> bag;
  bool refresh = false;
  inMemoryBagCacheAccessQueue_.read([&] {
    bag = inMemoryBag_;
    refresh = bag && isRefreshRequiredForCachedBag(bag->rawBag());
  });
  if (refresh) {
    // Not from inside the read: a fetch's completion takes the write side.
    std::weak_ptr<TavixBagController> weak = weak_from_this();
    env_.feedback.pool->post([weak] {
      if (auto self = weak.lock()) self->fetchBagStateWithVersion(std::nullopt);
    });
  }
  return bag;
}

std::shared_ptr<const TVXBag> TavixBagController::currentBag() {
  auto bag = cachedBagState();
  if (!bag) fetchBagStateWithVersion(std::nullopt);
  return bag;
}

std::optional<std::string> TavixBagController::warmURL() {
  auto bag = currentBag();
  if (!bag) return std::nullopt;
  return bag->warmURL();
}

void TavixBagController::forceFetchBag(const Dictionary& dictionary) {
  std::optional<std::string> current;
  if (auto bag = inMemoryBag()) current = bag->version();
  const auto it = dictionary.find("bag");
  const auto requested = versionString(it == dictionary.end() ? nullptr : &it->second);
  if (requested && current && compareNumericStrings(*current, *requested) < 0) fetchBagStateWithVersion(requested);
}

void TavixBagController::handleRefreshNotification() {
  bagLog().debug("something significant changed (locale, geo). checking to see if bag needs update");
  auto bag = inMemoryBag();
  if (bag && isRefreshRequiredForCachedBag(bag->rawBag())) fetchBagStateWithVersion(std::nullopt);
}

void TavixBagController::invalidate() {
  std::lock_guard hold(completionLock_);
  invalidated_.store(true);
  retryClock_->shutdown();
  fetchTransaction_.reset();
}

bool TavixBagController::fetchBagStateWithVersion(std::optional<std::string> version, Completion completion) {
  if (invalidated_.load() || fetchInProgress_.exchange(true)) return false;
  runFetch(std::move(version), std::move(completion));
  return true;
}

void TavixBagController::runFetch(std::optional<std::string> version, Completion completion) {
  if (env_.transactions) {
    std::lock_guard hold(completionLock_);
    fetchTransaction_ = std::make_unique<platform::TransactionTracker::Transaction>(env_.transactions->begin("bagFetch"));
  }

  auto request = env_.requestFactory->bagFetchRequest(*this, userAgent_, version);
  if (!request) {
    // Only a URL that does not parse gets here; the endpoint logic falls back before that.
    bagLog().error("Error fetching bag: {}", "no request for the bag URL");
    TavixDiagnosticDataReporter::addValue(1, "com.norvel.tavixd.bag.fetchesfailed");
    {
      std::lock_guard hold(completionLock_);
      fetchTransaction_.reset();
    }
    if (completion) completion(nullptr, bagError("no request"));
    fetchInProgress_.store(false);
    return;
  }
  TavixLogForCategory(TavixLoggingCategoryProtocol)
      .notice("Initiating bag fetch attempt with request {} header {}", request->url, request->headers.description());

  // The fetch is a feedback session of its own: start, end and, on failure, the error.
  const auto start = bagFetchStartRecord(*request, hostTicks(*env_.feedback.clock));
  auto session = ClientSession::open(env_.feedback, wrapFetchRecord(start));

  // Through the network-service proxy when the last bag asked for one, on every attempt.
  auto retryable = std::make_shared<const TVXRetryableNetworkRequest>(*request, std::nullopt, true,
                                                                      env_.requestFactory->proxyURL());
  std::weak_ptr<TavixBagController> weak = weak_from_this();
  auto retryClock = retryClock_;
  auto task = dataTaskWithRetryableRequest(
      env_.session, retryable, 1, kFetchRetries, *retryClock, retryQueue_,
      [weak, retryClock, session, start, completion = std::move(completion)](
          std::string data, std::optional<platform::http::HTTPURLResponse> response,
          std::optional<platform::http::URLError> error, const platform::http::URLSessionTaskMetrics& metrics) {
        bagLog().debug("resp: {}", describeResponse(response));
        auto self = weak.lock();
        if (!self) {
          bagLog().error("Error fetching bag, bag fetch task completed after BagFetchController was cleaned up");
          return;
        }
        std::unique_lock hold(self->completionLock_);
        if (self->invalidated_.load()) return;
        const auto end = bagFetchEndRecord(start, data.size(), response ? response->statusCode : 0, metrics,
                                           hostTicks(*self->env_.feedback.clock));
        session->addFeedback(self->wrapFetchRecord(end));
        std::shared_ptr<const TVXBag> bag;
        std::optional<TVXBagError> outcome;
        if (error) {
          bagLog().error("Error fetching bag: {} ({} {})", error->description, error->domain, error->code);
          outcome = TVXBagError{error->domain, error->code, error->description};
        } else if (!response) {
          bagLog().error("Error fetching bag: returned data was not of the expected type.");
          outcome = bagError("no data");
        } else if (response->statusCode != 200) {
          bagLog().error("Error fetching bag status code: {}", response->statusCode);
          outcome = bagError(fmt::format("statusCode {}", response->statusCode));
        } else {
          auto parsed = platform::parseJson(data);
          if (!parsed || !parsed->dictionary()) {
            bagLog().error("Error fetching bag: returned data was not of the expected type.");
            outcome = bagError("not JSON object");
          } else {
            bagLog().notice("Got bag: {}", data);
            Dictionary augmented = self->cacheBagDictionary(*parsed->dictionary());
            bag = std::make_shared<const TVXBag>(std::move(augmented), self->userAgent_.value_or(""));
            self->cacheBagState(bag, false);
          }
        }
        if (outcome) {
          proto::CTErrorFeedback failure;
          failure.set_timestamp(hostTicks(*self->env_.feedback.clock));
          failure.set_domain(outcome->domain);
          failure.set_code(static_cast<std::int32_t>(outcome->code));
          failure.set_reason(outcome->reason);
          session->addFeedback(self->wrapFetchRecord(failure));
        }
        TavixDiagnosticDataReporter::addValue(
            1, outcome ? "com.norvel.tavixd.bag.fetchesfailed" : "com.norvel.tavixd.bag.fetches");
        session->sessionComplete();
        self->fetchTransaction_.reset();
        hold.unlock();
        // The caller may start the next fetch from here; it merges until the flag is down.
        if (completion) completion(outcome ? nullptr : bag, outcome);
        self->fetchInProgress_.store(false);
      });
  task->resume();
}

FeedbackRef TavixBagController::wrapFetchRecord(const google::protobuf::Message& record) {
  const std::string guid = env_.feedback.guid ? env_.feedback.guid->currentUserGUID() : std::string();
  return makeTavixFeedbackWithCodable(record, 0, guid, userAgent_.value_or(""));
}

Dictionary TavixBagController::cacheBagDictionary(const Dictionary& dictionary) {
  Dictionary augmented = dictionary;
  augmented[kExpirationKey] = PropertyValue(platform::toUnixSeconds(env_.feedback.clock->now()) + kBagLifetimeSeconds);
  if (auto url = currentBagCacheURL()) augmented[kBagURLKey] = PropertyValue(*url);

  std::error_code ec;
  auto path = pathToCachedBag(&ec);
  if (!path) {
    bagLog().fault("Couldn't get path to cache bag.  Error: {}.", ec.message());
    return augmented;
  }
  const PropertyValue bag(augmented);
  if (!platform::plistCanHold(bag)) {
    // Cutting the string short would store a bag the server never sent.
    bagLog().error("Error writing bag to persistent cache: {}.", "a string holds U+0000");
    return augmented;
  }
  const std::string bytes = platform::toBinaryPlist(bag);
  if (bytes.empty()) bagLog().error("Error writing bag to persistent cache: {}.", "empty property list");
  if (auto werr = platform::writeFileAtomically(*path, bytes, 0600)) {
    bagLog().error("Could not write to {}", path->string());
  }
  return augmented;
}

std::optional<platform::fs::path> TavixBagController::pathToCachedBag(std::error_code* error) {
  std::error_code ec = platform::createDirectory(env_.cacheHome, true, 0700);
  if (ec) {
    bagLog().fault("error getting cache directory {}", ec.message());
    if (error) *error = ec;
    return std::nullopt;
  }
  const auto folder = env_.cachesFolder;
  ec = platform::createDirectory(folder, true, 0700);
  if (ec) {
    bagLog().fault("error creating agent-specific cache directory {}", ec.message());
    if (error) *error = ec;
    return std::nullopt;
  }
  return folder / kCacheFileName;
}

std::optional<Dictionary> TavixBagController::diskCachedBagDictionary() {
  auto path = pathToCachedBag(nullptr);
  if (!path) return std::nullopt;
  std::string bytes;
  if (auto ec = platform::readFile(*path, &bytes)) {
    // No bag yet is the normal first start.
    if (ec != std::errc::no_such_file_or_directory) bagLog().fault("Error reading from bag cache: {}.", ec.message());
    return std::nullopt;
  }
  auto value = platform::parsePlist(bytes);
  if (!value) {
    bagLog().fault("Error reading from bag cache: {}.", "not a property list");
    return std::nullopt;
  }
  if (!value->dictionary()) {
    bagLog().fault("Unexpected class deserialized from bag cache: {}.", typeName(value->type()));
    return std::nullopt;
  }
  Dictionary dictionary = std::move(*value->dictionary());
  if (isRefreshRequiredForCachedBag(dictionary)) {
    // The stale bag still serves until the new one arrives.
    std::weak_ptr<TavixBagController> weak = weak_from_this();
    env_.feedback.pool->post([weak] {
      if (auto self = weak.lock()) self->fetchBagStateWithVersion(std::nullopt);
    });
  }
  return dictionary;
}

void TavixBagController::cacheBagState(std::shared_ptr<const TVXBag> bag, bool fromDisk) {
  if (!bag) return;
  inMemoryBagCacheAccessQueue_.writeSync([&] {
    const unsigned long oldNews = newsAvailability(inMemoryBag_);
    const unsigned long newNews = newsAvailability(bag);
    inMemoryBag_ = bag;
    auto& center = *env_.center;
    center.post(kTVXBagChangeNotification, nullptr, {}, bagChangeUserInfo(*bag));
    if (oldNews != newNews && !fromDisk) {
      bagLog().notice("setting Tavix News Available status to {}", newNews);
      center.post(newNews == 1 ? kTVXNotifyEnabled : kTVXNotifyDisabled, this);
    }
  });
}

}  // namespace tavix
