// TavixSubscriptionManager: keeps the records sent as "X-Norvel-Subscriptions" (the bag-whitelisted
// video subscriptions modified within the bag's TTL, and the music subscription) and the store
// front, and hands each change to its delegate, the request factory.
//
// Owns the serial queue "com.norvel.tavix.subscriptionsByProvider-Queue"; the records live on it
// and the delegate is called from it. Updates happen on a bag change that carries a bag, and when
// the defaults the providers read change.
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "context/subscriptions.h"
#include "platform/defaults.h"
#include "platform/dispatch.h"
#include "platform/notification_center.h"

namespace tavix {

namespace platform {
class Clock;
}

class TavixSubscriptionManagerDelegate {
 public:
  virtual ~TavixSubscriptionManagerDelegate() = default;
  // Every record now held (empty when there are none). Called on the manager's queue.
  virtual void didUpdateSubscriptionDictionaries(const SubscriptionRecords& records) = 0;
  // The device's store front; empty when unknown. Called on the manager's queue.
  virtual void didUpdateStorefrontIdentifier(const std::optional<std::string>& identifier) = 0;
};

class TavixSubscriptionManager : public std::enable_shared_from_this<TavixSubscriptionManager> {
 public:
  // The pool and clock must outlive the manager.
  struct Environment {
    platform::DispatchPool* pool = nullptr;
    platform::Clock* clock = nullptr;
    std::shared_ptr<platform::NotificationCenter> center;  // bag changes
    // What a bag-change notification says about subscriptions; none when it carries no bag.
    std::function<std::optional<SubscriptionBagSettings>(const platform::Notification&)> bagSettings;
    std::shared_ptr<VideoSubscriptionProvider> video;
    std::shared_ptr<const MusicSubscriptionProvider> music;
    std::shared_ptr<const StorefrontProvider> storefront;
    // Where the providers read; a change of their keys updates. May be null.
    std::shared_ptr<platform::UserDefaults> defaults;
  };

  // Reads the store front once and tells the delegate (held weakly).
  static std::shared_ptr<TavixSubscriptionManager> create(Environment env,
                                                          std::weak_ptr<TavixSubscriptionManagerDelegate> delegate);
  ~TavixSubscriptionManager();
  TavixSubscriptionManager(const TavixSubscriptionManager&) = delete;
  TavixSubscriptionManager& operator=(const TavixSubscriptionManager&) = delete;

  // The records held now. Synchronous on the queue.
  SubscriptionRecords subscriptions();

  // Collects the records again with the last bag's settings. Asynchronous.
  void updateSubscriptions();
  // Reads the store front again and tells the delegate. Asynchronous.
  void storefrontChanged();

 private:
  TavixSubscriptionManager(Environment env, std::weak_ptr<TavixSubscriptionManagerDelegate> delegate);
  void start();
  void update();
  void updateDelegate();

  Environment env_;
  std::weak_ptr<TavixSubscriptionManagerDelegate> delegate_;
  platform::SerialQueue queue_;
  // On queue_:
  SubscriptionRecords subscriptionsByProvider_;
  SubscriptionBagSettings bag_;  // both whitelists absent until a bag comes
  platform::NotificationCenter::Registration bagRegistration_;
  platform::UserDefaults::Subscription defaultsSubscription_;
};

}  // namespace tavix
