#include "context/subscriptions.h"

#include <gtest/gtest.h>

#include "platform/log.h"

namespace tavix {
namespace {

using platform::fromUnixSeconds;

struct FakeVideo final : VideoSubscriptionProvider {
  std::vector<VideoSubscription> subscriptions;
  bool fails = false;
  int calls = 0;
  std::vector<std::string> askedBundles, askedDomains;
  bool activeSubscriptions(const std::vector<std::string>& bundles, const std::vector<std::string>& domains,
                           std::vector<VideoSubscription>* out, std::string* error) override {
    ++calls;
    askedBundles = bundles;
    askedDomains = domains;
    if (fails) *error = "service gone";
    else *out = subscriptions;
    return !fails;
  }
};

struct FakeMusic final : MusicSubscriptionProvider {
  int status = 0;
  int lastKnownAccountStatus() const override { return status; }
};

const platform::TimePoint kNow = fromUnixSeconds(1767225600);

SubscriptionBagSettings bag() { return {{{"tv.example.com"}}, {{"com.example.tv"}}, 3600}; }

TEST(Subscriptions, OnlySubscriptionsModifiedWithinTheTTLAreReported) {
  FakeVideo video;
  FakeMusic music;
  video.subscriptions = {{"com.example.tv", "app", fromUnixSeconds(1767225600 - 3600)},   // at the edge: kept
                         {"tv.example.com", "web", fromUnixSeconds(1767225600 - 3601)},   // too old
                         {"late.example", "app", fromUnixSeconds(1767225600 + 1)}};       // in the future
  const SubscriptionRecords records = collectSubscriptions(bag(), video, music, kNow);
  EXPECT_EQ(video.askedBundles, std::vector<std::string>{"com.example.tv"});
  EXPECT_EQ(video.askedDomains, std::vector<std::string>{"tv.example.com"});
  EXPECT_EQ(subscriptionHeaderValue(records), R"([{"active":true,"provider":"com.example.tv","type":"app"}])");
}

TEST(Subscriptions, ABagWithoutEitherWhitelistReportsNothing) {
  FakeVideo video;
  FakeMusic music;
  music.status = kMusicSubscriptionStatusSubscribed;
  video.subscriptions = {{"com.example.tv", "app", kNow}};
  // Without the domain list it is the daemon's context test; here, without the bundle list.
  SubscriptionBagSettings noBundles = bag();
  noBundles.bundleIdentifierWhitelist.reset();
  EXPECT_FALSE(subscriptionHeaderValue(collectSubscriptions(noBundles, video, music, kNow)));
  EXPECT_EQ(video.calls, 0);
  // A failing service still lets the music subscription through.
  platform::LogCapture capture;
  video.fails = true;
  const SubscriptionRecords records = collectSubscriptions(bag(), video, music, kNow);
  EXPECT_EQ(records.size(), 1u);
  EXPECT_TRUE(records.count("tarn"));
  EXPECT_TRUE(capture.contains("Error fetching third party subscription information from daemon: service gone"));
}

}  // namespace
}  // namespace tavix
