// What the subscription manager tells the request factory, as it shows in the requests it builds.
#include <gtest/gtest.h>

#include "bagview/tvx_bag.h"
#include "context/subscription_manager.h"
#include "core/names.h"
#include "network/request_factory.h"
#include "platform/json_value.h"
#include "support/test_assembly.h"

namespace tavix {
namespace {

using platform::Dictionary;
using platform::PropertyValue;

struct FakeVideo final : VideoSubscriptionProvider {
  std::vector<VideoSubscription> subscriptions;
  bool activeSubscriptions(const std::vector<std::string>&, const std::vector<std::string>&,
                           std::vector<VideoSubscription>* out, std::string*) override {
    *out = subscriptions;
    return true;
  }
};
struct FakeMusic final : MusicSubscriptionProvider {
  int lastKnownAccountStatus() const override { return kMusicSubscriptionStatusSubscribed; }
};
struct FakeStorefront final : StorefrontProvider {
  std::optional<std::string> storefrontIdentifier() const override { return "143441-1,29"; }
};

class SubscriptionHeadersTest : public ::testing::Test, protected testing::TestAssembly {
 protected:
  SubscriptionHeadersTest() {
    factory = makeRequestFactory();
    TavixSubscriptionManager::Environment env{&pool, &clock, center, [](const platform::Notification& n) {
      auto bag = bagOfNotification(n);
      return bag ? std::optional<SubscriptionBagSettings>({bag->subscriptionProviderDomainWhitelist(),
                                                           bag->subscriptionProviderBundleIdentifierWhitelist(),
                                                           bag->subscriptionTTL()})
                 : std::nullopt;
    }, video, std::make_shared<FakeMusic>(), std::make_shared<FakeStorefront>(), nullptr};
    manager = TavixSubscriptionManager::create(std::move(env), factory);
  }
  ~SubscriptionHeadersTest() override {
    manager.reset();
    factory.reset();
    pool.drain();
  }

  void postBag(Dictionary bag) {
    bag["search_url"] = "https://s.example/search";
    center->post(kTVXBagChangeNotification, nullptr, {}, {{kTVXNotificationBagKey, PropertyValue(std::move(bag))}});
    manager->subscriptions();  // the update has run, and with it the call to the factory
  }
  // The subscriptions header and the store front of a search built now.
  std::pair<std::optional<std::string>, std::string> sent() {
    TVXSearchRequest request;
    request.queryString = "news";
    auto built = factory->searchRequest(request, TVXBag(Dictionary{{"search_url", "https://s.example/search"}}, "Seekara/1"),
                                        "GUID");
    EXPECT_TRUE(built);
    const auto storefront = built->url.find("storefront=143441-1%2C29") != std::string::npos ? "143441-1,29" : "";
    return {built->headers.get(TavixHTTPHeaderNameSubscriptions), storefront};
  }

  std::shared_ptr<FakeVideo> video = std::make_shared<FakeVideo>();
  std::shared_ptr<TVXNetworkRequestFactory> factory;
  std::shared_ptr<TavixSubscriptionManager> manager;
};

TEST_F(SubscriptionHeadersTest, WhitelistedRecentSubscriptionsAreSentUntilABagDropsAWhitelist) {
  const auto now = clock.now();
  video->subscriptions = {{"com.example.tv", "app", platform::addSeconds(now, -3600)},
                          {"tv.example.com", "web", platform::addSeconds(now, -3601)}};
  const Dictionary whitelisted{{"subscription_bundle_id_whitelist", PropertyValue::Array{"com.example.tv"}},
                               {"subscription_domain_whitelist", PropertyValue::Array{"tv.example.com"}},
                               {"subscription_ttl_s", 3600}};
  postBag(whitelisted);
  // The web subscription changed one second before the TTL's reach: it is not reported.
  auto [header, storefront] = sent();
  ASSERT_TRUE(header);
  EXPECT_EQ(platform::parseJson(*header),
            platform::parseJson(R"([{"provider":"com.example.tv","type":"app","active":true},
                                    {"provider":"tarn","attribute":"premium","active":true}])"));
  EXPECT_EQ(storefront, "143441-1,29");

  Dictionary noDomains = whitelisted;
  noDomains.erase("subscription_domain_whitelist");
  postBag(noDomains);
  EXPECT_FALSE(sent().first);
  EXPECT_TRUE(manager->subscriptions().empty());
}

}  // namespace
}  // namespace tavix
