// Subscriptions: the user's video-provider subscriptions, the maker's music subscription and the
// store front, from provider interfaces, and the rule that turns them into the records sent as
// "X-Norvel-Subscriptions".
//
// Linux has no subscription services, so the daemon's providers read defaults (a user or an
// integrator writes them with `tavix_tool defaults`); tests use their own providers.
#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "platform/property_value.h"
#include "platform/time.h"

namespace tavix {

namespace platform {
class UserDefaults;
}

// One subscription as the video-subscription service reports it.
struct VideoSubscription {
  std::string sourceIdentifier;  // the provider: an app's bundle identifier or a web domain
  std::string sourceType;
  platform::TimePoint modified;
};

class VideoSubscriptionProvider {
 public:
  virtual ~VideoSubscriptionProvider() = default;
  // The active subscriptions whose source is one of `bundleIdentifiers` or `domains`. False, with
  // `error` set, when the service fails. Safe from any thread.
  virtual bool activeSubscriptions(const std::vector<std::string>& bundleIdentifiers,
                                   const std::vector<std::string>& domains, std::vector<VideoSubscription>* out,
                                   std::string* error) = 0;
};

// The music subscription's last known account status; 3 means subscribed.
class MusicSubscriptionProvider {
 public:
  virtual ~MusicSubscriptionProvider() = default;
  virtual int lastKnownAccountStatus() const = 0;
};

class StorefrontProvider {
 public:
  virtual ~StorefrontProvider() = default;
  // The device's store front identifier; empty when unknown.
  virtual std::optional<std::string> storefrontIdentifier() const = 0;
};

inline constexpr int kMusicSubscriptionStatusSubscribed = 3;

// Defaults read by the providers below, on every call.
//   "TVXVideoSubscriptions"   array of {"identifier": text, "type": text, "modified": date or
//                             seconds since 1970, "active": boolean (default true)}; entries
//                             without an identifier or a modification time are skipped, and a
//                             value that is not an array is a service failure
//   "TVXMusicSubscriptionStatus"  integer, default 0
//   "TVXStorefrontIdentifier"     text
inline constexpr const char* kTVXVideoSubscriptionsKey = "TVXVideoSubscriptions";
inline constexpr const char* kTVXMusicSubscriptionStatusKey = "TVXMusicSubscriptionStatus";
inline constexpr const char* kTVXStorefrontIdentifierKey = "TVXStorefrontIdentifier";

// `defaults` must outlive each provider. Safe from any thread.
class DefaultsVideoSubscriptionProvider final : public VideoSubscriptionProvider {
 public:
  explicit DefaultsVideoSubscriptionProvider(const platform::UserDefaults& defaults) : defaults_(defaults) {}
  bool activeSubscriptions(const std::vector<std::string>& bundleIdentifiers, const std::vector<std::string>& domains,
                           std::vector<VideoSubscription>* out, std::string* error) override;

 private:
  const platform::UserDefaults& defaults_;
};

class DefaultsMusicSubscriptionProvider final : public MusicSubscriptionProvider {
 public:
  explicit DefaultsMusicSubscriptionProvider(const platform::UserDefaults& defaults) : defaults_(defaults) {}
  int lastKnownAccountStatus() const override;

 private:
  const platform::UserDefaults& defaults_;
};

class DefaultsStorefrontProvider final : public StorefrontProvider {
 public:
  explicit DefaultsStorefrontProvider(const platform::UserDefaults& defaults) : defaults_(defaults) {}
  std::optional<std::string> storefrontIdentifier() const override;

 private:
  const platform::UserDefaults& defaults_;
};

// What the bag says about subscriptions.
struct SubscriptionBagSettings {
  std::optional<std::vector<std::string>> domainWhitelist;            // "subscription_domain_whitelist"
  std::optional<std::vector<std::string>> bundleIdentifierWhitelist;  // "subscription_bundle_id_whitelist"
  std::int64_t ttlSeconds = 0;                                        // "subscription_ttl_s"
};

// Provider key → record: {"provider", "type", "active": true} per video subscription, and
// {"provider": "tarn", "attribute": "premium", "active": true} under "tarn" for the music one.
using SubscriptionRecords = std::map<std::string, platform::Dictionary>;

// The records the bag allows now: none unless the bag has both whitelists; video subscriptions
// modified from `now` - TTL to `now` (a failing service gives none, with a log line); the music
// record when subscribed.
SubscriptionRecords collectSubscriptions(const SubscriptionBagSettings& bag, VideoSubscriptionProvider& video,
                                         const MusicSubscriptionProvider& music, platform::TimePoint now);

// The header's value: the records (in key order) as compact JSON text; empty for no records.
std::optional<std::string> subscriptionHeaderValue(const SubscriptionRecords& records);

}  // namespace tavix
