#include "bagview/tvx_bag.h"

#include <cmath>

#include <fmt/core.h>

#include "core/names.h"
#include "bagview/user_agent.h"
#include "platform/notification_center.h"

namespace tavix {

using platform::Dictionary;
using platform::PropertyValue;

namespace {

const PropertyValue* find(const Dictionary& d, std::string_view key) {
  auto it = d.find(std::string(key));
  return it == d.end() ? nullptr : &it->second;
}

// Integers may arrive as integral reals from writers that know only doubles.
std::optional<std::int64_t> integral(const PropertyValue& v) {
  if (auto i = v.integer()) return *i;
  if (auto r = v.real()) {
    if (std::isfinite(*r) && std::trunc(*r) == *r && std::fabs(*r) < 9.2e18) return static_cast<std::int64_t>(*r);
  }
  return std::nullopt;
}

}  // namespace

TVXBag::TVXBag(platform::Dictionary rawBag, std::string userAgent)
    : TVXBag(std::make_shared<const Dictionary>(std::move(rawBag)), std::move(userAgent)) {}

TVXBag::TVXBag(std::shared_ptr<const platform::Dictionary> rawBag, std::string userAgent)
    : raw_(rawBag ? std::move(rawBag) : std::make_shared<const Dictionary>()), userAgent_(std::move(userAgent)) {
  clientName_ = extractClientNameFromString(userAgent_);
  if (!clientName_) return;
  const PropertyValue* clients = find(*raw_, "clients");
  if (!clients || !clients->dictionary()) return;
  const PropertyValue* mine = find(*clients->dictionary(), *clientName_);
  if (mine) overrides_ = mine->dictionary();
}

const PropertyValue* TVXBag::valueForKey(std::string_view key) const {
  if (overrides_) {
    if (const PropertyValue* v = find(*overrides_, key)) return v;
  }
  return find(*raw_, key);
}

const PropertyValue* TVXBag::rawValueForKey(std::string_view key) const { return find(*raw_, key); }

std::optional<std::string> TVXBag::stringValue(std::string_view key) const {
  const PropertyValue* v = valueForKey(key);
  if (v && v->string()) return *v->string();
  return std::nullopt;
}

std::optional<bool> TVXBag::boolValue(std::string_view key) const {
  const PropertyValue* v = valueForKey(key);
  if (v && v->boolean()) return *v->boolean();
  return std::nullopt;
}

std::optional<std::int64_t> TVXBag::integerValue(std::string_view key) const {
  const PropertyValue* v = valueForKey(key);
  return v ? integral(*v) : std::nullopt;
}

std::optional<double> TVXBag::numberValue(std::string_view key) const {
  const PropertyValue* v = valueForKey(key);
  if (!v) return std::nullopt;
  if (auto r = v->real()) return *r;
  if (auto i = v->integer()) return static_cast<double>(*i);
  return std::nullopt;
}

std::optional<std::vector<std::string>> TVXBag::stringArray(std::string_view key) const {
  const PropertyValue* v = valueForKey(key);
  if (!v || !v->array()) return std::nullopt;
  std::vector<std::string> out;
  for (const auto& element : *v->array()) {
    if (element.string()) out.push_back(*element.string());
  }
  return out;
}

std::optional<std::string> TVXBag::version() const {
  const PropertyValue* v = valueForKey("version");
  if (!v) return std::nullopt;
  if (v->string()) return *v->string();
  if (auto i = integral(*v)) return std::to_string(*i);
  if (auto r = v->real()) return fmt::format("{}", *r);
  return std::nullopt;
}

bool TVXBag::isEnabled() const { return boolValue("enabled").value_or(true); }
bool TVXBag::feedbackEnabled() const { return boolValue("feedback_enabled").value_or(false); }

std::optional<std::string> TVXBag::warmURL() const { return stringValue("warm_url"); }
std::optional<std::string> TVXBag::searchURL() const { return stringValue("search_url"); }
std::optional<std::string> TVXBag::moreResultsURL() const { return stringValue("more_results_url"); }
std::optional<std::string> TVXBag::cardURL() const { return stringValue("card_url"); }
std::optional<std::string> TVXBag::flightURL() const { return stringValue("flight_url"); }
std::optional<std::string> TVXBag::feedbackURL() const { return stringValue("feedback_url"); }
std::optional<std::string> TVXBag::crowdsourcingURL() const { return stringValue("crowdsourcing_url"); }

std::int64_t TVXBag::minimumQueryLength() const { return integerValue("min_query_length").value_or(0); }
std::int64_t TVXBag::searchRenderTimeout() const { return integerValue("search_render_timeout_ms").value_or(2000); }
double TVXBag::timeoutIntervalForRequest() const { return numberValue("request_timeout_s").value_or(10); }

bool TVXBag::sendGeoEnvironmentHeader() const { return boolValue("send_geo_environment_header").value_or(false); }

std::vector<std::string> TVXBag::supportedGeoLocationSources() const {
  const PropertyValue* v = valueForKey("supported_geo_location_sources");
  if (!v) return {};
  if (v->string()) {
    if (*v->string() == "all") return {"gps", "wifi", "cell", "unknown"};
    return {};
  }
  return stringArray("supported_geo_location_sources").value_or(std::vector<std::string>{});
}

std::optional<Dictionary> TVXBag::marvolaConfiguration() const {
  const PropertyValue* v = valueForKey("marvola_configuration");
  if (v && v->dictionary()) return *v->dictionary();
  return std::nullopt;
}

bool TVXBag::smartHistoryEnabled() const { return boolValue("smart_history_enabled").value_or(false); }
std::int64_t TVXBag::smartHistoryMaxRows() const { return integerValue("smart_history_max_rows").value_or(10000); }
std::int64_t TVXBag::smartHistoryMinimumQueryLength() const {
  return integerValue("smart_history_min_query_length").value_or(0);
}
std::int64_t TVXBag::smartHistoryCompletionReturnCount() const {
  return integerValue("smart_history_completion_return_count").value_or(0);
}
std::int64_t TVXBag::smartHistoryTimeout() const { return integerValue("smart_history_timeout_ms").value_or(5); }
double TVXBag::smartHistorySampleThreshold() const {
  return numberValue("smart_history_sample_threshold").value_or(0);
}
bool TVXBag::smartHistoryFeatureFeedbackEnabled() const {
  return boolValue("smart_history_feature_feedback_enabled").value_or(false);
}

double TVXBag::brovaneLast1hour() const { return numberValue("brovane_last_1hour").value_or(10.0); }
double TVXBag::brovaneLast1day() const { return numberValue("brovane_last_1day").value_or(1.0); }
double TVXBag::brovaneLast1week() const { return numberValue("brovane_last_1week").value_or(0.1); }
double TVXBag::brovaneLast1month() const { return numberValue("brovane_last_1month").value_or(0.01); }
double TVXBag::brovaneAll() const { return numberValue("brovane_all").value_or(0.001); }
double TVXBag::brovaneMostRecent() const { return numberValue("brovane_most_recent").value_or(1.0); }
double TVXBag::minThresholdToSend() const { return numberValue("min_threshold_to_send").value_or(0.0); }

std::int64_t TVXBag::subscriptionTTL() const { return integerValue("subscription_ttl_s").value_or(0); }
std::optional<std::vector<std::string>> TVXBag::subscriptionProviderBundleIdentifierWhitelist() const {
  return stringArray("subscription_bundle_id_whitelist");
}
std::optional<std::vector<std::string>> TVXBag::subscriptionProviderDomainWhitelist() const {
  return stringArray("subscription_domain_whitelist");
}

std::int64_t TVXBag::maximumSizeForFeedbackType(std::string_view type) const {
  const PropertyValue* v = valueForKey("custom_feedback_max_bytes");
  if (!v || !v->dictionary()) return 0;
  const PropertyValue* limit = find(*v->dictionary(), type);
  return limit ? integral(*limit).value_or(0) : 0;
}

Dictionary TVXBag::resources() const {
  const PropertyValue* v = valueForKey("resources");
  if (v && v->dictionary()) return *v->dictionary();
  return {};
}

std::vector<std::string> TVXBag::downloadResourcesList() const {
  const PropertyValue* v = rawValueForKey("download_resources_list");
  std::vector<std::string> out;
  if (!v || !v->array()) return out;
  for (const auto& element : *v->array()) {
    if (element.string()) out.push_back(*element.string());
  }
  return out;
}

std::optional<std::string> TVXBag::urlForResource(std::string_view identifier) const {
  const PropertyValue* v = rawValueForKey(identifier);
  if (v && v->string()) return *v->string();
  return std::nullopt;
}

std::optional<double> TVXBag::expiration() const {
  const PropertyValue* v = rawValueForKey("__expiration");
  if (!v) return std::nullopt;
  if (auto r = v->real()) return *r;
  if (auto i = v->integer()) return static_cast<double>(*i);
  return std::nullopt;
}

std::optional<std::string> TVXBag::bagURL() const {
  const PropertyValue* v = rawValueForKey("__bagurl");
  if (v && v->string()) return *v->string();
  return std::nullopt;
}

bool TVXBag::refreshDisabled() const { return rawValueForKey("__refresh_disabled") != nullptr; }

platform::Dictionary bagChangeUserInfo(const TVXBag& bag) {
  return {{kTVXNotificationBagKey, PropertyValue(bag.rawBag())}};
}

std::shared_ptr<const TVXBag> bagOfNotification(const platform::Notification& notification, std::string userAgent) {
  const auto it = notification.userInfo.find(kTVXNotificationBagKey);
  if (it == notification.userInfo.end() || !it->second.dictionary()) return nullptr;
  return std::make_shared<const TVXBag>(*it->second.dictionary(), std::move(userAgent));
}

}  // namespace tavix
