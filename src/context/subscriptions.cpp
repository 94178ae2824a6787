#include "context/subscriptions.h"

#include <algorithm>

#include "core/logging.h"
#include "platform/defaults.h"
#include "platform/json_value.h"

namespace tavix {

namespace {

platform::Logger& log() { return TavixLogForCategory(TavixLoggingCategorySubscription); }

bool contains(const std::vector<std::string>& list, const std::string& value) {
  return std::find(list.begin(), list.end(), value) != list.end();
}

std::optional<platform::TimePoint> modificationTime(const platform::PropertyValue& value) {
  if (auto* date = value.date()) return date->time;
  if (auto seconds = value.asReal(); seconds && !value.string() && !value.boolean()) return platform::fromUnixSeconds(*seconds);
  return std::nullopt;
}

}  // namespace

bool DefaultsVideoSubscriptionProvider::activeSubscriptions(const std::vector<std::string>& bundleIdentifiers,
                                                            const std::vector<std::string>& domains,
                                                            std::vector<VideoSubscription>* out, std::string* error) {
  out->clear();
  auto value = defaults_.objectForKey(kTVXVideoSubscriptionsKey);
  if (!value) return true;
  const platform::PropertyValue::Array* entries = value->array();
  if (!entries) {
    *error = std::string(kTVXVideoSubscriptionsKey) + " is not an array";
    return false;
  }
  for (const platform::PropertyValue& entry : *entries) {
    const platform::Dictionary* fields = entry.dictionary();
    if (!fields) continue;
    auto field = [&](const char* key) -> const platform::PropertyValue* {
      auto it = fields->find(key);
      return it == fields->end() ? nullptr : &it->second;
    };
    const platform::PropertyValue* identifier = field("identifier");
    const platform::PropertyValue* modified = field("modified");
    const platform::PropertyValue* active = field("active");
    const platform::PropertyValue* type = field("type");
    if (!identifier || !identifier->string() || identifier->string()->empty() || !modified) continue;
    if (active && !active->asBool().value_or(false)) continue;
    auto time = modificationTime(*modified);
    if (!time) continue;
    const std::string& id = *identifier->string();
    if (!contains(bundleIdentifiers, id) && !contains(domains, id)) continue;
    out->push_back({id, type && type->string() ? *type->string() : std::string(), *time});
  }
  return true;
}

int DefaultsMusicSubscriptionProvider::lastKnownAccountStatus() const {
  return static_cast<int>(defaults_.integerForKey(kTVXMusicSubscriptionStatusKey));
}

std::optional<std::string> DefaultsStorefrontProvider::storefrontIdentifier() const {
  auto value = defaults_.stringForKey(kTVXStorefrontIdentifierKey);
  if (!value || value->empty()) return std::nullopt;
  return value;
}

SubscriptionRecords collectSubscriptions(const SubscriptionBagSettings& bag, VideoSubscriptionProvider& video,
                                         const MusicSubscriptionProvider& music, platform::TimePoint now) {
  log().notice("updating subscription info");
  SubscriptionRecords records;
  if (!bag.domainWhitelist || !bag.bundleIdentifierWhitelist) return records;

  const bool musicSubscribed = music.lastKnownAccountStatus() == kMusicSubscriptionStatusSubscribed;
  std::vector<VideoSubscription> subscriptions;
  std::string error;
  if (video.activeSubscriptions(*bag.bundleIdentifierWhitelist, *bag.domainWhitelist, &subscriptions, &error)) {
    const platform::TimePoint earliest = platform::addSeconds(now, -static_cast<double>(bag.ttlSeconds));
    for (const VideoSubscription& s : subscriptions) {
      if (s.modified < earliest || s.modified > now) continue;
      records[s.sourceIdentifier] = {{"provider", s.sourceIdentifier}, {"type", s.sourceType}, {"active", true}};
    }
  } else {
    log().notice("Error fetching third party subscription information from daemon: {}", error);
  }
  if (musicSubscribed) records["tarn"] = {{"provider", "tarn"}, {"attribute", "premium"}, {"active", true}};
  return records;
}

std::optional<std::string> subscriptionHeaderValue(const SubscriptionRecords& records) {
  if (records.empty()) return std::nullopt;
  platform::PropertyValue::Array array;
  array.reserve(records.size());
  for (const auto& entry : records) array.emplace_back(entry.second);
  return platform::toJson(platform::PropertyValue(std::move(array)));
}

}  // namespace tavix
