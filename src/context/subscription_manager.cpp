#include "context/subscription_manager.h"

#include "core/logging.h"
#include "core/names.h"
#include "platform/clock.h"

namespace tavix {

std::shared_ptr<TavixSubscriptionManager> TavixSubscriptionManager::create(
    Environment env, std::weak_ptr<TavixSubscriptionManagerDelegate> delegate) {
  std::shared_ptr<TavixSubscriptionManager> manager(new TavixSubscriptionManager(std::move(env), std::move(delegate)));
  manager->start();
  return manager;
}

TavixSubscriptionManager::TavixSubscriptionManager(Environment env,
                                                   std::weak_ptr<TavixSubscriptionManagerDelegate> delegate)
    : env_(std::move(env)),
      delegate_(std::move(delegate)),
      queue_(*env_.pool, "com.norvel.tavix.subscriptionsByProvider-Queue") {}

TavixSubscriptionManager::~TavixSubscriptionManager() {
  bagRegistration_.reset();
  defaultsSubscription_.reset();
}

void TavixSubscriptionManager::start() {
  std::weak_ptr<TavixSubscriptionManager> weak = weak_from_this();
  bagRegistration_ = env_.center->addObserver(
      kTVXBagChangeNotification, nullptr, nullptr, [weak](const platform::Notification& n) {
        auto self = weak.lock();
        if (!self) return;
        auto settings = self->env_.bagSettings(n);
        if (!settings) return;
        self->queue_.async([weak, settings = std::move(*settings)] {
          auto inner = weak.lock();
          if (!inner) return;
          inner->bag_ = settings;
          inner->update();
        });
      });
  if (env_.defaults) {
    defaultsSubscription_ = env_.defaults->addObserver([weak](const std::string& key) {
      auto self = weak.lock();
      if (!self) return;
      if (key == kTVXStorefrontIdentifierKey) {
        self->storefrontChanged();
      } else if (key == kTVXVideoSubscriptionsKey || key == kTVXMusicSubscriptionStatusKey) {
        self->updateSubscriptions();
      }
    });
  }
  storefrontChanged();
}

SubscriptionRecords TavixSubscriptionManager::subscriptions() {
  SubscriptionRecords out;
  queue_.sync([&] { out = subscriptionsByProvider_; });
  return out;
}

void TavixSubscriptionManager::updateSubscriptions() {
  std::weak_ptr<TavixSubscriptionManager> weak = weak_from_this();
  queue_.async([weak] {
    if (auto self = weak.lock()) self->update();
  });
}

void TavixSubscriptionManager::storefrontChanged() {
  std::weak_ptr<TavixSubscriptionManager> weak = weak_from_this();
  queue_.async([weak] {
    auto self = weak.lock();
    if (!self) return;
    auto identifier = self->env_.storefront->storefrontIdentifier();
    if (auto delegate = self->delegate_.lock()) delegate->didUpdateStorefrontIdentifier(identifier);
  });
}

void TavixSubscriptionManager::update() {
  queue_.assertCurrent("TavixSubscriptionManager::update");
  SubscriptionRecords records = collectSubscriptions(bag_, *env_.video, *env_.music, env_.clock->now());
  // Without both whitelists the delegate always hears, so the header goes even if nothing was held.
  const bool whitelisted = bag_.domainWhitelist && bag_.bundleIdentifierWhitelist;
  if (whitelisted && records == subscriptionsByProvider_) return;
  subscriptionsByProvider_ = std::move(records);
  updateDelegate();
}

void TavixSubscriptionManager::updateDelegate() {
  if (auto delegate = delegate_.lock()) delegate->didUpdateSubscriptionDictionaries(subscriptionsByProvider_);
  TavixLogForCategory(TavixLoggingCategorySubscription).debug("{} subscription records passed on", subscriptionsByProvider_.size());
}

}  // namespace tavix
