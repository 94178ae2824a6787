// TVXBag: the read-only view of the raw bag dictionary that one user agent sees.
//
// The client name of the user agent selects an override dictionary under "clients"; each of its
// keys replaces the top-level key of that name for this view. A key of the wrong JSON type counts
// as absent, and each property then answers its documented default (docs/bag.md).
// Raw keys ("download_resources_list", the resource URLs it names, and the bag controller's "__"
// bookkeeping) are read from the dictionary itself, without overrides.
//
// Immutable after construction; safe to share across threads. The raw dictionary is shared, not
// copied, between the views made from it.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/property_value.h"

namespace tavix {

namespace platform {
struct Notification;
}

class TVXBag;

// "TVXBagChangeNotification" has no sender and carries the new bag as its user info's "bag": the
// raw dictionary, bookkeeping keys included, which each observer views with its own user agent.
platform::Dictionary bagChangeUserInfo(const TVXBag& bag);
// The bag of such a notification, as `userAgent` sees it; none when it carries no bag.
std::shared_ptr<const TVXBag> bagOfNotification(const platform::Notification& notification,
                                                std::string userAgent = {});

// The bag in memory, read without waiting for the network. The bag controller answers it; the
// layers below the controller (feedback) see the controller only through this.
class TVXInMemoryBagSource {
 public:
  virtual ~TVXInMemoryBagSource() = default;
  virtual std::shared_ptr<const TVXBag> inMemoryBag() = 0;
};

class TVXBag {
 public:
  TVXBag(std::shared_ptr<const platform::Dictionary> rawBag, std::string userAgent);
  TVXBag(platform::Dictionary rawBag, std::string userAgent);

  // The dictionary as cached, bookkeeping keys included.
  const platform::Dictionary& rawBag() const { return *raw_; }
  const std::shared_ptr<const platform::Dictionary>& sharedRawBag() const { return raw_; }
  const std::string& userAgent() const { return userAgent_; }
  // The client name of the user agent; empty when it names no known client.
  const std::optional<std::string>& clientName() const { return clientName_; }

  // The value this view sees for `key` (the client's override first); null when absent.
  const platform::PropertyValue* valueForKey(std::string_view key) const;
  // The top-level value, without overrides; null when absent.
  const platform::PropertyValue* rawValueForKey(std::string_view key) const;

  std::optional<std::string> version() const;
  bool isEnabled() const;
  bool feedbackEnabled() const;

  std::optional<std::string> warmURL() const;
  std::optional<std::string> searchURL() const;
  std::optional<std::string> moreResultsURL() const;
  std::optional<std::string> cardURL() const;
  std::optional<std::string> flightURL() const;
  std::optional<std::string> feedbackURL() const;
  std::optional<std::string> crowdsourcingURL() const;

  std::int64_t minimumQueryLength() const;
  std::int64_t searchRenderTimeout() const;  // milliseconds
  double timeoutIntervalForRequest() const;  // seconds

  bool sendGeoEnvironmentHeader() const;
  // The location sources that may be sent: "all" expands to gps, wifi, cell and unknown; other
  // names are kept as the bag gives them. Empty: no location at all.
  std::vector<std::string> supportedGeoLocationSources() const;
  std::optional<platform::Dictionary> marvolaConfiguration() const;

  bool smartHistoryEnabled() const;
  std::int64_t smartHistoryMaxRows() const;
  std::int64_t smartHistoryMinimumQueryLength() const;
  std::int64_t smartHistoryCompletionReturnCount() const;
  std::int64_t smartHistoryTimeout() const;  // milliseconds
  double smartHistorySampleThreshold() const;
  bool smartHistoryFeatureFeedbackEnabled() const;

  double brovaneLast1hour() const;
  double brovaneLast1day() const;
  double brovaneLast1week() const;
  double brovaneLast1month() const;
  double brovaneAll() const;
  double brovaneMostRecent() const;
  double minThresholdToSend() const;

  std::int64_t subscriptionTTL() const;  // seconds
  std::optional<std::vector<std::string>> subscriptionProviderBundleIdentifierWhitelist() const;
  std::optional<std::vector<std::string>> subscriptionProviderDomainWhitelist() const;

  // The byte limit for a custom-feedback type; 0 when the bag names none.
  std::int64_t maximumSizeForFeedbackType(std::string_view type) const;
  // The image map; empty when absent.
  platform::Dictionary resources() const;

  // Raw: the identifiers of "download_resources_list" (non-strings skipped) and the URL string
  // that the bag gives under each identifier as a top-level key.
  std::vector<std::string> downloadResourcesList() const;
  std::optional<std::string> urlForResource(std::string_view identifier) const;

  // Raw bookkeeping of the bag controller.
  std::optional<double> expiration() const;  // "__expiration", seconds since 1970
  std::optional<std::string> bagURL() const;  // "__bagurl"
  bool refreshDisabled() const;              // "__refresh_disabled" present, any value

 private:
  std::optional<std::string> stringValue(std::string_view key) const;
  std::optional<bool> boolValue(std::string_view key) const;
  std::optional<std::int64_t> integerValue(std::string_view key) const;
  std::optional<double> numberValue(std::string_view key) const;
  std::optional<std::vector<std::string>> stringArray(std::string_view key) const;

  std::shared_ptr<const platform::Dictionary> raw_;
  std::string userAgent_;
  std::optional<std::string> clientName_;
  const platform::Dictionary* overrides_ = nullptr;  // inside raw_
};

}  // namespace tavix
