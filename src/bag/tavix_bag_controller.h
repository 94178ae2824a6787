// TavixBagController: owns the bag, the server's configuration document.
//
// It decides which URL to fetch, fetches it (one fetch at a time, with retries), keeps the result
// in memory and as the binary property list "bag.plist" in the daemon's caches folder, treats it
// as stale four hours after the fetch, refetches when it is stale, when the server asks for a
// newer version or when the locale or country changes, and posts "TVXBagChangeNotification"
// (no sender; user info {"bag": the new raw bag}) each time the bag is replaced. Every
// fetch is written as a feedback session of its own: its start, its end and any failure.
//
// Threading: every public operation is safe from any thread. The in-memory bag sits behind a
// reader/writer queue; the change notification is posted from inside its write, so observers
// must not call back into the controller synchronously.
#pragma once

#include <atomic>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <system_error>

#include "bagview/tvx_bag.h"
#include "core/names.h"
#include "feedback/client_session.h"
#include "network/request_factory.h"
#include "platform/dispatch.h"
#include "platform/files.h"
#include "platform/notification_center.h"
#include "platform/property_value.h"
#include "platform/transactions.h"

namespace tavix {

namespace platform::http {
class URLSession;
}

class TVXBag;
namespace proto {
class CTTavixFeedback;
}
}  // namespace tavix
namespace google::protobuf {
class Message;
}
namespace tavix {

// News availability, posted on the daemon's notification centre when a fetched bag turns the
// news reader's feature on or off.
inline constexpr const char* kTVXNotifyEnabled = "com.norvel.tavix.news.enabled";
inline constexpr const char* kTVXNotifyDisabled = "com.norvel.tavix.news.disabled";

// The default endpoints; "TVXBagURL" in the defaults overrides both.
inline constexpr const char* kTVXDefaultBagURL = "https://bag.tavix.norvel.com/bag";
inline constexpr const char* kTVXDefaultBagURLForCN = "https://bag.tavix.norvel.cn/bag";

// A failure of a bag fetch: the domain ("kTVXErrorDomain" for the daemon's own, code 2; the
// transport's otherwise), the code and the "reason".
struct TVXBagError {
  std::string domain;
  long code = 0;
  std::string reason;
};

// Version ordering: runs of digits compare by value ("9" < "12"), everything else byte by byte.
// Negative, zero or positive.
int compareNumericStrings(std::string_view a, std::string_view b);

class TavixBagController final : public TVXBagURLSource,
                                 public TVXInMemoryBagSource,
                                 public std::enable_shared_from_this<TavixBagController> {
 public:
  using Completion = std::function<void(std::shared_ptr<const TVXBag>, std::optional<TVXBagError>)>;

  struct Environment {
    // Fetches are recorded as sessions of their own; the pool, clock and defaults are also the
    // controller's, and the GUID controller (may be null) stamps the fetch records.
    FeedbackEnvironment feedback;
    platform::TransactionTracker* transactions = nullptr;  // may be null
    std::shared_ptr<platform::NotificationCenter> center;
    std::shared_ptr<TVXNetworkRequestFactory> requestFactory;
    // The bag's own session. Its owner cancels what is still on the wire before the services a
    // completion reaches go.
    std::shared_ptr<platform::http::URLSession> session;
    platform::fs::path cacheHome;     // the user's caches directory; made when missing
    platform::fs::path cachesFolder;  // the daemon's folder in it, where the bag is kept
  };
  // The pool and clock must outlive the controller. Loads the disk bag (installing it, and
  // starting a fetch when it needs a refresh) and listens for the factory's refresh requests.
  static std::shared_ptr<TavixBagController> create(Environment env);
  ~TavixBagController() override;
  TavixBagController(const TavixBagController&) = delete;
  TavixBagController& operator=(const TavixBagController&) = delete;

  // The bag endpoint: "TVXBagURL" when it is a usable URL, else the default for the country.
  std::string bagFetchURLWithCountry(std::string_view countryCode) override;

  // The in-memory bag; never waits on the network. None: a fetch starts. Stale: it is returned
  // and a fetch starts in the background.
  std::shared_ptr<const TVXBag> currentBag();
  // The server asks for a newer bag: `dictionary`'s "bag" entry is the version it has.
  void forceFetchBag(const platform::Dictionary& dictionary);
  std::optional<std::string> warmURL();

  // Adds "__expiration" and "__bagurl" to a freshly fetched bag and writes it to disk.
  platform::Dictionary cacheBagDictionary(const platform::Dictionary& dictionary);
  // Installs a new in-memory bag; null is ignored.
  void cacheBagState(std::shared_ptr<const TVXBag> bag, bool fromDisk);
  std::shared_ptr<const TVXBag> cachedBagState();
  std::optional<platform::Dictionary> diskCachedBagDictionary();

  // Starts a fetch unless one is running: the trigger is then merged into it, whatever version it
  // asked for, and false is returned (`completion` is not called). Otherwise `completion`, if
  // any, hears the new bag or the failure once the fetch has ended.
  bool fetchBagStateWithVersion(std::optional<std::string> version, Completion completion = nullptr);
  // Whether a cached raw bag should be fetched again.
  bool isRefreshRequiredForCachedBag(const platform::Dictionary& rawBag);

  // From now on no fetch starts and a fetch still in flight completes without touching the
  // daemon's services: for shutdown, before those services go. Waits for a completion running now.
  void invalidate();

  std::shared_ptr<const TVXBag> inMemoryBag() override;
  void setInMemoryBag(std::shared_ptr<const TVXBag> bag);

  const std::optional<std::string>& userAgent() const { return userAgent_; }
  bool fetchInProgress() const { return fetchInProgress_.load(); }

  // Where the bag lives on disk; empty with `error` set when the folder cannot be made.
  std::optional<platform::fs::path> pathToCachedBag(std::error_code* error);

 private:
  explicit TavixBagController(Environment env);
  void start();

  void runFetch(std::optional<std::string> version, Completion completion);
  void handleRefreshNotification();
  std::optional<std::string> currentBagCacheURL();
  // One of the fetch's feedback records, wrapped with query id 0, the current user GUID and the
  // controller's user agent.
  std::shared_ptr<proto::CTTavixFeedback> wrapFetchRecord(const google::protobuf::Message& record);

  Environment env_;
  platform::ReaderWriterQueue inMemoryBagCacheAccessQueue_;
  class RetryClock;
  // Pauses between retries of a fetch run here, timed by the retry clock. A retry loop may
  // outlive the controller (the bag session is shared with its owner); once the controller is invalidated
  // or gone the clock drops every pause, so the loop ends without touching the queue.
  platform::SerialQueue retryQueue_;
  std::shared_ptr<RetryClock> retryClock_;
  std::optional<std::string> userAgent_;
  std::shared_ptr<const TVXBag> inMemoryBag_;  // guarded by inMemoryBagCacheAccessQueue_
  std::atomic<bool> fetchInProgress_{false};
  // Held by a fetch's completion while it runs, so that invalidate() can wait for it.
  std::mutex completionLock_;
  std::atomic<bool> invalidated_{false};
  // The running fetch's keep-alive; guarded by completionLock_.
  std::unique_ptr<platform::TransactionTracker::Transaction> fetchTransaction_;
  platform::NotificationCenter::Registration refreshRegistration_;
};

}  // namespace tavix
